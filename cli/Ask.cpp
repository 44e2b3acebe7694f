// Asks and reads a line. Relies on iostream and Table's wrapping. Promises: see Ask.h.
#include "Ask.h"

#include <unistd.h>

#include <iostream>

#include "Table.h"

namespace tavo::cli {

bool IsAnybodyThere() {
    return isatty(STDIN_FILENO) != 0;
}

std::string AskLine(const std::string& szQuestion) {
    // What is typed stands behind the blanks at the end, which go when lines are broken.
    const size_t nEnd = szQuestion.find_last_not_of(' ') + 1;
    std::cerr << Wrap(std::string_view(szQuestion).substr(0, nEnd), WidthOf(STDERR_FILENO)) << szQuestion.substr(nEnd)
              << std::flush;
    std::string szAnswer;
    std::getline(std::cin, szAnswer);
    return szAnswer;
}

bool Confirm(const std::string& szQuestion) {
    const std::string szAnswer = AskLine(szQuestion + " [y/N] ");
    return !szAnswer.empty() && (szAnswer[0] == 'y' || szAnswer[0] == 'Y');
}

}  // namespace tavo::cli
