// Asks and reads a line. Relies on iostream. Promises: see Ask.h.
#include "Ask.h"

#include <unistd.h>

#include <iostream>

namespace tavo::cli {

bool IsAnybodyThere() {
    return isatty(STDIN_FILENO) != 0;
}

std::string AskLine(const std::string& szQuestion) {
    std::cerr << szQuestion << std::flush;
    std::string szAnswer;
    std::getline(std::cin, szAnswer);
    return szAnswer;
}

bool Confirm(const std::string& szQuestion) {
    const std::string szAnswer = AskLine(szQuestion + " [y/N] ");
    return !szAnswer.empty() && (szAnswer[0] == 'y' || szAnswer[0] == 'Y');
}

}  // namespace tavo::cli
