// Reads passwords. Relies on termios and streams. Promises: see Secret.h.
#include "Secret.h"

#include <termios.h>
#include <unistd.h>

#include <fstream>
#include <iostream>

#include "Answer.h"
#include "OnSignal.h"

namespace tavo::cli {

namespace {

// Switches the echo of standard input off for as long as it lives.
class NoEcho {
public:
    NoEcho() : mBlChanged(tcgetattr(STDIN_FILENO, &mOld) == 0) {
        termios quiet = mOld;
        quiet.c_lflag &= ~static_cast<tcflag_t>(ECHO);
        mBlChanged = mBlChanged && tcsetattr(STDIN_FILENO, TCSAFLUSH, &quiet) == 0;
    }
    ~NoEcho() { Restore(); }
    NoEcho(const NoEcho&) = delete;
    NoEcho& operator=(const NoEcho&) = delete;
    bool IsOff() const { return mBlChanged; }
    void Restore() const {
        if (mBlChanged) {
            tcsetattr(STDIN_FILENO, TCSAFLUSH, &mOld);
        }
    }

private:
    termios mOld = {};
    bool mBlChanged;
};

std::optional<std::string> FirstLine(std::istream& stream) {
    std::string szLine;
    if (!std::getline(stream, szLine)) {
        return std::nullopt;
    }
    if (szLine.ends_with('\r')) {
        szLine.pop_back();
    }
    return szLine;
}

}  // namespace

std::optional<std::string> ReadSecret(const std::string& szPath) {
    if (szPath == "-") {
        return FirstLine(std::cin);
    }
    std::ifstream stream(szPath);
    return FirstLine(stream);
}

std::optional<std::string> AskSecret(const std::string& szQuestion) {
    const NoEcho noEcho;
    if (!noEcho.IsOff()) {
        return std::nullopt;
    }
    const OnSignal signals([&noEcho] {
        noEcho.Restore();
        Tell("\n");
        return static_cast<int>(kFailed);
    });
    std::cerr << szQuestion << std::flush;
    const auto szSecret = FirstLine(std::cin);
    std::cerr << std::endl;
    return szSecret;
}

}  // namespace tavo::cli
