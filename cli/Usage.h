// Wrong arguments. Relies on CLI11's own description of the arguments. Promises: the answer says what was
// wrong, what comes nearest to it and what would have been right.
#pragma once

#include <CLI/CLI.hpp>
#include <string>
#include <vector>

#include "Answer.h"

namespace tavo::cli {

// The help of a command, for the terminal that it is read at.
std::string HelpText(const CLI::App& app);

// What to tell a user whose arguments could not be read.
Reply ExplainUsage(const CLI::App& app, int argc, const char* const* argv, const CLI::ParseError& error);

// The word of rgszWords that szWord was most likely meant to be; empty when none is near.
std::string Nearest(const std::string& szWord, const std::vector<std::string>& rgszWords);

std::string Join(const std::vector<std::string>& rgszWords);

// Check of an option whose value is one of these words.
CLI::Validator OneOf(std::vector<std::string> rgszWords);
// Check of an option whose value is a whole number from nFirst to nLast.
CLI::Validator NumberBetween(int nFirst, int nLast);

}  // namespace tavo::cli
