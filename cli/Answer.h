// What a command answers and how it is shown. Relies on jsoncpp and fmt. Promises: one answer per run, and
// with --json exactly one document on standard output; no text that came from a router or a file reaches
// a terminal with its control characters; escape sequences only on a terminal, whose width the text keeps to.
#pragma once

#include <json/json.h>

#include <string>
#include <string_view>
#include <vector>

namespace tavo::cli {

enum Exit : int { kOk = 0, kFailed = 1, kUsage = 2, kBusy = 3, kRefused = 4, kTooMany = 5, kAway = 6 };

struct Reply {
    Exit enExit = kOk;
    std::string szMessage = {};  // the verdict: standard output when all is well, else standard error
    std::string szBody = {};     // what was asked for, always standard output; not shown with --json
    std::vector<std::string> rgszWarnings = {};
    Json::Value jsAnswer = Json::objectValue;
};

// Shows the reply; the exit code of the program. A reply that cannot be written is a failure.
int Print(const Reply& reply, bool blJson);

// On standard error, whether or not anybody reads it there: never an exception, which would end what is told of.
void Tell(const std::string& szText);

// szText with everything that could drive a terminal, reorder its line or break its encoding shown as
// an escape such as \x1b.
std::string Clean(std::string_view szText);

// "1 rule", "no rules"; never a negative number.
template <typename Number>
std::string Count(Number nCount, const std::string& szWhat) {
    return (nCount > 0 ? std::to_string(nCount) : "no") + " " + szWhat + (nCount == 1 ? "" : "s");
}

enum class Ink { kBold, kRed, kYellow };
// Whether escape sequences may be written to this descriptor at all.
bool IsSmartTerminal(int fd);
// szText in this colour where fd takes colour and NO_COLOR is not set.
std::string Paint(Ink enInk, const std::string& szText, int fd);

// "label    value" lines with the values one below the other, for standard output; lines without a value are left
// out.
std::string Columns(const std::vector<std::pair<std::string, std::string>>& rgLines);

}  // namespace tavo::cli
