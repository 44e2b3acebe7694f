// "status": whether the ports are open, and what of it is not, at one look or for as long as one looks. Relies on
// Situation and Judgement. Promises: takes no lock and changes nothing; "in force" and exit code 0 only when everything
// that was asked for is; --watch ends by Ctrl-C with the code of what it saw last.
#include <arpa/inet.h>
#include <fmt/format.h>
#include <poll.h>
#include <signal.h>
#include <sys/inotify.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <iterator>

#include "Commands.h"
#include "StatusView.h"
#include "Table.h"
#include "tavo/net.h"

namespace tavo::cli {

namespace {

constexpr int kPollSeconds = 2;
constexpr int kLookSeconds = 60;          // that a daemon is late is told by the clock alone
constexpr int kLiveSeconds = 30;          // a router is not to be asked all the time
constexpr int kSettleMilliseconds = 100;  // a change seldom comes alone
constexpr const char* kWatched[] = {kPublishedDirectory, "/etc/portforward", "/etc"};

struct Wish {
    bool blLive = false;
    bool blWatch = false;
};

struct Look {
    Situation situation;
    Judgement judgement;
};

Look TakeLook(bool blLive) {
    Look look{.situation = LookAround(blLive), .judgement = {}};
    look.judgement = Judge(look.situation);
    return look;
}

Reply ReplyOf(const Look& look) {
    return {.enExit = look.judgement.ExitCode(),
            .szMessage = look.judgement.szMessage,
            .szBody = ToText(look.situation, look.judgement, true),
            .rgszWarnings = look.judgement.rgszWarnings,
            .jsAnswer = ToJson(look.situation, look.judgement)};
}

// ---- --watch --------------------------------------------------------------------------------------------------

// Waits for something to happen to what a look would see.
class Watcher {
public:
    Watcher() {
        sigset_t set;
        sigemptyset(&set);
        for (const int nSignal : {SIGINT, SIGTERM, SIGHUP}) {
            sigaddset(&set, nSignal);
        }
        sigprocmask(SIG_BLOCK, &set, nullptr);
        mFdSignals = signalfd(-1, &set, SFD_CLOEXEC);
        mFdEvents = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
        Watch();
    }
    ~Watcher() {
        close(mFdSignals);
        close(mFdEvents);
    }
    Watcher(const Watcher&) = delete;
    Watcher& operator=(const Watcher&) = delete;

    // Until something has happened, or nMost seconds are over. False: the user has had enough.
    bool Wait(int nMost) {
        const std::string szPulse = Pulse();
        for (int nWaited = 0; nWaited < nMost && Pulse() == szPulse; nWaited += kPollSeconds) {
            pollfd rgFds[] = {{mFdSignals, POLLIN, 0}, {mFdEvents, POLLIN, 0}};
            poll(rgFds, std::size(rgFds), kPollSeconds * 1000);
            if (rgFds[0].revents != 0) {
                return false;
            }
            if (rgFds[1].revents != 0) {
                poll(rgFds, 1, kSettleMilliseconds);
                alignas(inotify_event) char rgEvents[4096];
                while (read(mFdEvents, rgEvents, sizeof(rgEvents)) > 0) {
                }
                break;
            }
        }
        Watch();
        return true;
    }

private:
    // Again each time: the directory of the published state comes with the first daemon.
    void Watch() const {
        for (const char* szPath : kWatched) {
            inotify_add_watch(mFdEvents, szPath, IN_CLOSE_WRITE | IN_MOVED_TO | IN_DELETE);
        }
    }

    // What no file tells of: a daemon that died, a route that went, an operation that began.
    static std::string Pulse() {
        char szGateway[INET_ADDRSTRLEN] = {};
        TAVONetDefaultGatewayGet(szGateway, sizeof(szGateway));
        return fmt::format("{} {} {} {}", szGateway, UpnpDaemon().IsAlive(), NatpmpDaemon().IsAlive(),
                           WhatRuns().szWord);
    }

    int mFdSignals = -1;
    int mFdEvents = -1;
};

// What was shown last, and what of a new look is worth showing.
class Screen {
public:
    explicit Screen(bool blJson) : mBlJson(blJson), mBlTerminal(!blJson && IsSmartTerminal(STDOUT_FILENO)) {}

    // False when nobody reads it any more.
    bool Show(const Look& look) {
        const std::string szText = mBlJson ? JsonLine(look) : mBlTerminal ? Page(look) : NewLines(look);
        if (szText.empty()) {
            return true;
        }
        return std::fwrite(szText.data(), szText.size(), 1, stdout) == 1 && std::fflush(stdout) == 0;
    }

private:
    // The whole, where it is another one than before.
    std::string Page(const Look& look) {
        std::string szPage = ToText(look.situation, look.judgement, false) + "\n";
        for (const std::string& szWarning : look.judgement.rgszWarnings) {
            szPage += Wrap("warning: " + szWarning, WidthOf(STDOUT_FILENO)) + "\n";
        }
        szPage += Wrap(look.judgement.szMessage, WidthOf(STDOUT_FILENO)) + "\n";
        const bool blSame = szPage == mSzLast;
        mSzLast = szPage;
        return blSame ? "" : "\x1b[H\x1b[2J" + szPage;
    }

    // A document on one line whenever anything but the time has changed.
    std::string JsonLine(const Look& look) {
        Json::Value js = ToJson(look.situation, look.judgement);
        js["message"] = look.judgement.szMessage;
        js["ok"] = look.judgement.ExitCode() == kOk;
        js["warnings"] = Json::arrayValue;
        for (const std::string& szWarning : look.judgement.rgszWarnings) {
            js["warnings"].append(szWarning);
        }
        Json::StreamWriterBuilder builder;
        builder["indentation"] = "";
        Json::Value jsStill = js;
        jsStill.removeMember("at");
        if (jsStill["last_look"].isObject()) {
            jsStill["last_look"].removeMember("at");
            jsStill["last_look"].removeMember("next");
        }
        const std::string szStill = Json::writeString(builder, jsStill);
        const bool blSame = szStill == mSzLast;
        mSzLast = szStill;
        return blSame ? "" : Json::writeString(builder, js) + "\n";
    }

    // The lines that were not there before, each with its time.
    std::string NewLines(const Look& look) {
        const std::vector<std::string> rgszLines = ToLines(look.situation, look.judgement);
        std::string szNew;
        for (const std::string& szLine : rgszLines) {
            if (std::find(mRgszLines.begin(), mRgszLines.end(), szLine) == mRgszLines.end()) {
                szNew += Moment(look.situation.nNow, 0) + " " + szLine + "\n";
            }
        }
        mRgszLines = rgszLines;
        return szNew;
    }

    bool mBlJson;
    bool mBlTerminal;
    std::string mSzLast;
    std::vector<std::string> mRgszLines;
};

[[noreturn]] void Follow(const Wish& wish, bool blJson) {
    Watcher watcher;
    Screen screen(blJson);
    while (true) {
        const Look look = TakeLook(wish.blLive);
        if (!screen.Show(look) || !watcher.Wait(wish.blLive ? kLiveSeconds : kLookSeconds)) {
            _exit(look.judgement.ExitCode());  // all of it has been shown
        }
    }
}

Reply Status(const Wish& wish, bool blJson) {
    if (wish.blWatch) {
        Follow(wish, blJson);
    }
    return ReplyOf(TakeLook(wish.blLive));
}

}  // namespace

void OfferStatus(CLI::App& app, Request& request) {
    const auto pWish = std::make_shared<Wish>();
    CLI::App* pStatus = AddCommand(app, "status", "whether the ports are open on the router, and if not, why");
    pStatus->add_flag("--live", pWish->blLive, "ask the router now what it has (UPnP)");
    pStatus->add_flag("--watch", pWish->blWatch, "go on and tell what changes; Ctrl-C ends it");
    pStatus->footer(
        "Exit code: 0 everything that was asked for is in force (or nothing is asked for, or it is switched off); 4 "
        "some rule is not, or the router still has what no rule asks for; 6 nothing is kept: router, network or daemon "
        "is away; 1 it cannot be told.\n");
    pStatus->callback(
        [pWish, &request] { request.fnCommand = [pWish, &request] { return Status(*pWish, request.blJson); }; });
}

}  // namespace tavo::cli
