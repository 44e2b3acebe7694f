// Reads the published state. Relies on jsoncpp, and on /proc for who runs. Promises: see Published.h.
#include "Published.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <fstream>
#include <iterator>
#include <string_view>

#include "Answer.h"
#include "JsonText.h"

namespace tavo::cli {

namespace {

constexpr off_t kMostBytes = 32 << 20;        // every port of both protocols, with room for words
constexpr size_t kMostText = 1023;            // bytes of one text; the rest is dropped
constexpr size_t kMostEntries = 2UL * 65536;  // ports of both protocols
constexpr int kMostPort = 65535;
constexpr char kPagesProgram[] = "tavoportforward";
constexpr std::array<const char*, 4> kStates = {"unknown", "open", "refused", "waiting"};

// Root's, and nobody else may write to it.
bool IsRoots(const struct stat& info) {
    return info.st_uid == 0 && (info.st_mode & (S_IWGRP | S_IWOTH)) == 0;
}

class Handle {
public:
    explicit Handle(int fd) : mFd(fd) {}
    ~Handle() {
        if (mFd >= 0) {
            close(mFd);
        }
    }
    Handle(const Handle&) = delete;
    Handle& operator=(const Handle&) = delete;
    int Get() const { return mFd; }

private:
    int mFd;
};

// Root's file in root's directory, whole; nothing for anything else. Nobody can make the reader wait: a pipe in its
// place is not opened for longer than it takes to see that it is one.
std::optional<std::string> ReadRootsFile(const std::string& szName) {
    const Handle directory(open(kPublishedDirectory, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    struct stat info = {};
    if (directory.Get() < 0 || fstat(directory.Get(), &info) != 0 || !IsRoots(info)) {
        return std::nullopt;
    }
    const Handle file(openat(directory.Get(), szName.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    if (file.Get() < 0 || fstat(file.Get(), &info) != 0 || !S_ISREG(info.st_mode) || !IsRoots(info) ||
        info.st_size > kMostBytes) {
        return std::nullopt;
    }
    std::string szText(static_cast<size_t>(info.st_size), '\0');
    size_t nRead = 0;
    while (nRead < szText.size()) {
        const ssize_t nMore = read(file.Get(), szText.data() + nRead, szText.size() - nRead);
        if (nMore <= 0) {
            return std::nullopt;
        }
        nRead += static_cast<size_t>(nMore);
    }
    return szText;
}

// ---- members, each of them what it should be or nothing ---------------------------------------------------

std::string Text(const Json::Value& js, const char* szKey) {
    const Json::Value& jsText = js[szKey];
    return jsText.isString() ? jsText.asString().substr(0, kMostText) : "";
}

std::optional<int64_t> Number(const Json::Value& js, const char* szKey) {
    const Json::Value& jsNumber = js[szKey];
    return jsNumber.isInt64() && jsNumber.asInt64() >= 0 ? std::optional(jsNumber.asInt64()) : std::nullopt;
}

// True unless it says otherwise.
bool Flag(const Json::Value& js, const char* szKey) {
    return !js[szKey].isBool() || js[szKey].asBool();
}

int Port(const Json::Value& js, const char* szKey) {
    const auto nPort = Number(js, szKey);
    return nPort && *nPort <= kMostPort ? static_cast<int>(*nPort) : 0;
}

// fnRead of each entry that is an object.
template <typename Entry, typename Read>
std::vector<Entry> Entries(const Json::Value& js, const char* szKey, Read fnRead) {
    std::vector<Entry> rgEntries;
    const Json::Value& jsEntries = js[szKey];
    if (jsEntries.isArray()) {
        for (const Json::Value& jsEntry : jsEntries) {
            if (jsEntry.isObject() && rgEntries.size() < kMostEntries) {
                rgEntries.push_back(fnRead(jsEntry));
            }
        }
    }
    return rgEntries;
}

PublishedRule ReadRule(const Json::Value& js) {
    PublishedRule rule{.szName = Text(js, "name"),
                       .nRouterPort = Port(js, "router_port"),
                       .nBoxPort = Port(js, "box_port"),
                       .szProtocol = Text(js, "protocol"),
                       .szRule = Text(js, "rule"),
                       .szWord = Text(js, "word"),
                       .szWhy = Text(js, "why"),
                       .holder = {},
                       .nSince = Number(js, "since"),
                       .nUntil = Number(js, "until")};
    const auto pState = std::find(kStates.begin(), kStates.end(), Text(js, "state"));
    rule.enState = pState == kStates.end() ? PortState::kUnknown : static_cast<PortState>(pState - kStates.begin());
    if (const Json::Value& jsHolder = js["holder"]; jsHolder.isObject()) {
        rule.holder = {Text(jsHolder, "address"), Text(jsHolder, "description")};
    }
    return rule;
}

PublishedLeftOver ReadLeftOver(const Json::Value& js) {
    return {Text(js, "name"), Text(js, "address"), Text(js, "why"), Number(js, "until")};
}

Published FromJson(const Json::Value& js) {
    return {.szProtocol = Text(js, "protocol"),
            .nPid = static_cast<pid_t>(std::min<int64_t>(Number(js, "pid").value_or(0), INT32_MAX)),
            .nAt = Number(js, "at").value_or(0),
            .blSwitchedOn = Flag(js, "switched_on"),
            .blRulesReadable = Flag(js, "rules_readable"),
            .szGateway = Text(js, "gateway"),
            .szBox = Text(js, "box"),
            .szOutside = Text(js, "outside"),
            .szRouter = Text(js, "router"),
            .szRouterWhy = Text(js, "router_why"),
            .nRouterSince = Number(js, "router_since"),
            .nNextLook = Number(js, "next_look"),
            .rgRules = Entries<PublishedRule>(js, "rules", &ReadRule),
            .rgLeftOver = Entries<PublishedLeftOver>(js, "left_over", &ReadLeftOver)};
}

// Whether nPid is root's szProgram; a number that the kernel has given to another program since is not.
bool IsProgram(pid_t nPid, const std::string& szProgram) {
    const std::string szProc = "/proc/" + std::to_string(nPid);
    struct stat info = {};
    std::ifstream stream(szProc + "/cmdline", std::ios::binary);
    const std::string szLine((std::istreambuf_iterator<char>(stream)), std::istreambuf_iterator<char>());
    const std::string szPath = szLine.substr(0, szLine.find('\0'));
    return nPid > 0 && stat(szProc.c_str(), &info) == 0 && info.st_uid == 0 &&
           szPath.substr(szPath.rfind('/') + 1) == szProgram;
}

}  // namespace

std::optional<Published> ReadPublished(const std::string& szProgram) {
    const auto szText = ReadRootsFile(szProgram + ".json");
    auto published = szText ? PublishedIn(*szText) : std::nullopt;
    const bool blAlive = published && (szProgram == kPagesProgram || IsProgram(published->nPid, szProgram));
    return blAlive ? std::move(published) : std::nullopt;
}

std::optional<Published> PublishedIn(const std::string& szText) {
    const auto js = ReadJson(szText);
    return js && js->isObject() ? std::optional(FromJson(*js)) : std::nullopt;
}

std::string WhoHas(const std::optional<PublishedHolder>& holder) {
    if (!holder || holder->szAddress.empty()) {
        return "";
    }
    return " (" + Clean(holder->szAddress) + (holder->szDescription.empty() ? "" : ", ") +
           Clean(holder->szDescription) + ")";
}

const char* ToWord(PortState enState) {
    return kStates[static_cast<size_t>(enState)];
}

}  // namespace tavo::cli
