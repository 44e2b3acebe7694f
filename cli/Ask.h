// Questions at the terminal. Relies on standard input and standard error. Promises: nobody is asked who cannot answer.
#pragma once

#include <string>

namespace tavo::cli {

// Somebody sits at the other end of standard input.
bool IsAnybodyThere();
// Asks a question that is answered with yes or no; whatever does not begin with "y" is no.
bool Confirm(const std::string& szQuestion);
// Asks for a line of text; empty also at the end of the input.
std::string AskLine(const std::string& szQuestion);

}  // namespace tavo::cli
