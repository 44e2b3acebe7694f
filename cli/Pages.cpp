// Asks the program that writes into a router's pages. Relies on Child. Promises: see Pages.h.
#include "Pages.h"

#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <ctime>
#include <filesystem>

#include "Child.h"
#include "Usage.h"

namespace tavo::cli {

namespace {

constexpr char kProgram[] = "/usr/tavo/bin/tavoportforward";
constexpr char kName[] = "tavoportforward";
// The second one is of an earlier version, and taken over by the program.
constexpr const char* kRecords[] = {"/var/lib/tavo/pages_made.conf", "/var/lib/tavo/manual_router.made"};
constexpr auto kLook = std::chrono::seconds(5);
constexpr auto kTakeAway = std::chrono::seconds(200);  // a run ends by itself before
constexpr size_t kMostBytes = 32 << 20;

}  // namespace

bool HavePagesMade() {
    std::error_code error;
    for (const char* szRecord : kRecords) {
        const auto nSize = std::filesystem::file_size(szRecord, error);
        if (!error && nSize > 0) {
            return true;
        }
    }
    return false;
}

std::optional<Published> LeftByPages() {
    if (geteuid() != 0) {
        auto published = ReadPublished(kName);
        return published && !published->blSwitchedOn ? std::move(published) : std::nullopt;
    }
    return HavePagesMade() ? PublishedIn(OutputOf({kProgram, "--left"}, kLook, kMostBytes)) : std::nullopt;
}

std::vector<PublishedLeftOver> TakeAwayByPages() {
    const time_t nStart = std::time(nullptr);
    OutputOf({kProgram, "--take-away"}, kTakeAway, kMostBytes);
    auto left = LeftByPages();
    const auto published = ReadPublished(kName);
    if (published && !published->blSwitchedOn && published->nAt >= nStart) {  // else that run did not come to its end
        left = published;
    }
    if (!left && HavePagesMade()) {
        return {{"what their record has", "", fmt::format("{} did not say what that is", kProgram), std::nullopt}};
    }
    return left ? left->rgLeftOver : std::vector<PublishedLeftOver>();
}

std::string NamesOf(const std::vector<PublishedLeftOver>& rgLeft) {
    std::vector<std::string> rgszNames;
    rgszNames.reserve(rgLeft.size());
    for (const PublishedLeftOver& left : rgLeft) {
        rgszNames.push_back(Clean(left.szName));
    }
    return fmt::format("{}", fmt::join(rgszNames, ", "));
}

void AddLeftByPages(const std::vector<PublishedLeftOver>& rgLeft, const Rules& rules, Reply& reply) {
    if (rgLeft.empty()) {
        return;
    }
    for (const PublishedLeftOver& left : rgLeft) {
        Json::Value js;
        js["name"] = left.szName;
        js["why"] = left.szWhy;
        reply.jsAnswer["left_over"].append(js);
    }
    const bool blAny = std::any_of(rules.begin(), rules.end(), [](const Rule& rule) { return rule.blEnabled; });
    // Of no rules a save has nothing to say but that the router has none of ours.
    const std::string szBefore = reply.enExit == kOk && !blAny ? "" : reply.szMessage + "\n";
    reply.enExit = reply.enExit == kOk ? kRefused : reply.enExit;
    reply.szMessage = fmt::format(
        "{}the router's own pages, which are not in use any more, still forward {} and did not take that away: {}\n"
        "'sudo tavoportmap {}' tries again; or take it away there by hand, and then call\n"
        "'sudo /usr/tavo/bin/tavoportforward --forget'",
        szBefore, NamesOf(rgLeft), Clean(rgLeft.front().szWhy), IsOff() ? "off" : "save");
}

}  // namespace tavo::cli
