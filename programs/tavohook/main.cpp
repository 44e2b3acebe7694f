// tavohook: runs the administrator's hooks, one after another, for the daemons or for somebody who tries them.
// Relies on Hooks, and on a socket as standard input on which each message is one notice. Promises: see --help;
// ends soon after the daemon that started it, and with the hook that runs when it is told to.
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <set>
#include <string>
#include <string_view>

#include "ground/SysLog.h"
#include "programs/common/HookQueue.h"
#include "programs/common/SignalQueue.h"
#include "programs/tavohook/Hooks.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr char kHelp[] =
    "Usage: tavohook --try [NAME=VALUE...]\n"
    "Runs the hooks in /etc/tavo/hooks.d once, with TAVO_EVENT=test and what is given in their environment,\n"
    "and says what became of each. upnpd and natpmpd run them for what has changed at the router.\n"
    "\n"
    "  --try   run the hooks and say what became of them\n"
    "  --help  this text\n";
constexpr int kExitUsage = 2;
constexpr int kExitFailed = 1;
constexpr auto kHookLimit = std::chrono::seconds(30);
constexpr auto kAfterlife = std::chrono::seconds(60);  // for what is still waiting when the daemon has ended

class Runner {
public:
    // 0: every hook has ended well.
    int RunAll(const std::vector<std::string>& rgFacts);
    int Follow();

private:
    bool IsTooLate();

    tavo::SignalQueue mSignals;
    bool mBlFollow = false;
    std::set<std::string> mSetRefused;  // said once
    Clock::time_point mEnd = Clock::time_point::max();
};

int Runner::RunAll(const std::vector<std::string>& rgFacts) {
    std::vector<std::string> rgszRefused;
    const std::vector<std::string> rgszHooks = tavo::FindHooks(tavo::kHookDirectory, rgszRefused);
    for (const std::string& szRefused : rgszRefused) {
        if (mSetRefused.insert(szRefused).second) {
            tavo::SysLog(LOG_WARNING, "not run: %s", szRefused.c_str());
        }
    }
    int nFailed = 0;
    for (const std::string& szName : rgszHooks) {
        if (IsTooLate()) {
            return 1;
        }
        const tavo::HookEnd end = tavo::RunHook(std::string(tavo::kHookDirectory) + "/" + szName, rgFacts, kHookLimit,
                                                [this] { return mSignals.IsStop(); });
        if (mSignals.IsStop()) {
            tavo::SysLog(LOG_WARNING, "hook %s: ended because tavohook was told to end", szName.c_str());
        } else if (!end.blStarted) {
            tavo::SysLog(LOG_ERR, "hook %s: it could not be started", szName.c_str());
        } else if (!end.blInTime) {
            tavo::SysLog(LOG_WARNING, "hook %s: ended because it took longer than 30 seconds", szName.c_str());
        } else if (end.nStatus != 0) {
            tavo::SysLog(LOG_WARNING, "hook %s: ended with %d: %s", szName.c_str(), end.nStatus, end.szOutput.c_str());
        } else {
            tavo::SysLog(LOG_DEBUG, "hook %s: done", szName.c_str());
            continue;
        }
        ++nFailed;
    }
    return nFailed == 0 && rgszRefused.empty() ? 0 : 1;
}

// Once the daemon has ended, there is not much time left.
bool Runner::IsTooLate() {
    pollfd waiting = {STDIN_FILENO, POLLRDHUP, 0};
    if (mBlFollow && mEnd == Clock::time_point::max() && poll(&waiting, 1, 0) > 0) {
        mEnd = Clock::now() + kAfterlife;
    }
    return mSignals.IsStop() || Clock::now() > mEnd;
}

// Each message is one notice; none comes any more when the daemon has ended.
int Runner::Follow() {
    mBlFollow = true;
    std::array<char, tavo::kMaxHookFacts> rgBytes;
    ssize_t nSize = 0;
    pollfd rgWaiting[] = {mSignals.Waiting(), {STDIN_FILENO, POLLIN, 0}};
    while (!IsTooLate()) {
        mSignals.Wait(rgWaiting, -1);
        nSize = recv(STDIN_FILENO, rgBytes.data(), rgBytes.size(), MSG_DONTWAIT);
        if (nSize < 0 && errno == EAGAIN) {
            continue;
        }
        if (nSize <= 0) {
            break;
        }
        std::vector<std::string> rgFacts;
        for (std::string_view szLeft(rgBytes.data(), static_cast<size_t>(nSize)); !szLeft.empty();) {
            const size_t nEnd = std::min(szLeft.find('\0'), szLeft.size() - 1);
            rgFacts.emplace_back(szLeft.substr(0, nEnd));
            szLeft.remove_prefix(nEnd + 1);
        }
        RunAll(rgFacts);
    }
    return 0;
}

// What is given, and what every hook may count on.
std::vector<std::string> TryFacts(std::vector<std::string> rgFacts) {
    for (const std::string szFact : {"TAVO_EVENT=test", "TAVO_TEXT=This is only a test."}) {
        const std::string szName = szFact.substr(0, szFact.find('=') + 1);
        if (std::none_of(rgFacts.begin(), rgFacts.end(),
                         [&](const std::string& szGiven) { return szGiven.starts_with(szName); })) {
            rgFacts.push_back(szFact);
        }
    }
    return rgFacts;
}

bool IsFact(const std::string& szText) {
    return szText.find('=') != std::string::npos && !szText.starts_with('=');
}

// For somebody who wants to see them run: that none was run is no success.
int Try(const std::vector<std::string>& rgFacts) {
    if (!std::all_of(rgFacts.begin(), rgFacts.end(), IsFact)) {
        std::fputs(kHelp, stderr);
        return kExitUsage;
    }
    if (geteuid() != 0) {
        std::fputs("tavohook: this needs root: run it with sudo\n", stderr);
        return kExitFailed;
    }
    openlog("tavohook", LOG_PERROR, LOG_DAEMON);
    std::vector<std::string> rgszRefused;
    if (tavo::FindHooks(tavo::kHookDirectory, rgszRefused).empty() && rgszRefused.empty()) {
        std::fprintf(stderr,
                     "tavohook: nothing was run: there is no hook in %s. A hook's name has letters, digits, \"_\" and "
                     "\"-\" alone; of other files, such as README.txt or NAME.sh, none is run\n",
                     tavo::kHookDirectory);
        return kExitFailed;
    }
    return Runner().RunAll(TryFacts(rgFacts));
}

}  // namespace

int main(int argc, char** argv) {
    const std::string_view szVerb = argc > 1 ? argv[1] : "";
    umask(022);
    if (szVerb == "--follow" && argc == 2) {
        openlog("tavohook", LOG_PID, LOG_DAEMON);
        return Runner().Follow();
    }
    if (szVerb == "--try") {
        return Try({argv + 2, argv + argc});
    }
    std::fputs(kHelp, szVerb == "--help" ? stdout : stderr);
    return szVerb == "--help" ? 0 : kExitUsage;
}
