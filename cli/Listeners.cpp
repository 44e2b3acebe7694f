// Reads the kernel's tables of sockets and of packet filter rules. Relies on the texts of /proc/net/tcp and its like,
// and on nft's JSON. Promises: see Listeners.h.
#include "Listeners.h"

#include <arpa/inet.h>

#include <algorithm>
#include <array>
#include <charconv>
#include <filesystem>
#include <fstream>
#include <map>
#include <optional>
#include <sstream>
#include <tuple>

#include "Child.h"
#include "JsonText.h"
#include "tavo/net.h"

namespace tavo::cli {

namespace {

constexpr char kNft[] = "/usr/sbin/nft";
constexpr auto kNftLimit = std::chrono::seconds(3);
constexpr size_t kMostRuleset = size_t{8} << 20;
constexpr int kMostCards = 64;
// Programs that carry a published port to a container and have nothing to say themselves.
constexpr std::string_view kCarriers[] = {"docker-proxy", "rootlessport", "rootlessport-ch", "conmon",
                                          "slirp4netns",  "pasta",        "pasta.avx2"};

struct Table {
    const char* szPath;
    const char* szProtocol;
    int nFamily;
    unsigned nWaiting;  // the state of a socket that waits: listening, or bound to no peer
};

constexpr Table kTables[] = {{"/proc/net/tcp", "tcp", AF_INET, 0x0a},
                             {"/proc/net/tcp6", "tcp", AF_INET6, 0x0a},
                             {"/proc/net/udp", "udp", AF_INET, 0x07},
                             {"/proc/net/udp6", "udp", AF_INET6, 0x07}};

struct Socket {
    Listener listener;
    uint64_t nInode = 0;
};

// ---- sockets ----------------------------------------------------------------------------------------------

// An address as the kernel prints it: words of four bytes, each as a number of this machine.
std::optional<std::string> ReadAddress(std::string_view szHex, int nFamily, bool& blLoopback) {
    std::array<uint32_t, 4> rgWords = {};
    const size_t nWords = nFamily == AF_INET ? 1 : 4;
    if (szHex.size() != nWords * 8) {
        return std::nullopt;
    }
    for (size_t i = 0; i < nWords; ++i) {
        std::from_chars(szHex.data() + i * 8, szHex.data() + (i + 1) * 8, rgWords[i], 16);
    }
    // ::ffff:127.0.0.1 is the loopback of a program that takes both families.
    const bool blMapped = nWords == 4 && rgWords[0] == 0 && rgWords[1] == 0 && rgWords[2] == htonl(0xffff);
    const uint32_t nLast = ntohl(rgWords[nWords - 1]);
    blLoopback = nWords == 1 || blMapped ? nLast >> 24U == 127
                                         : nLast == 1 && rgWords[0] == 0 && rgWords[1] == 0 && rgWords[2] == 0;
    char szText[INET6_ADDRSTRLEN] = {};
    return inet_ntop(nFamily, rgWords.data(), szText, sizeof(szText)) == nullptr ? std::nullopt
                                                                                 : std::optional<std::string>(szText);
}

// "0: 0100007F:1F90 00000000:0000 0A 00000000:00000000 00:00000000 00000000 0 0 INODE ..."
std::optional<Socket> ReadSocket(const std::string& szLine, const Table& table) {
    std::istringstream line(szLine);
    std::string szSlot, szLocal, szPeer, szState, szQueues, szTimer, szRetries, szUser, szTimeout;
    Socket found;
    line >> szSlot >> szLocal >> szPeer >> szState >> szQueues >> szTimer >> szRetries >> szUser >> szTimeout;
    const size_t nColon = szLocal.find(':');
    unsigned nState = 0;
    std::from_chars(szState.data(), szState.data() + szState.size(), nState, 16);
    if (!(line >> found.nInode) || nColon == std::string::npos || nState != table.nWaiting) {
        return std::nullopt;
    }
    std::from_chars(szLocal.data() + nColon + 1, szLocal.data() + szLocal.size(), found.listener.nPort, 16);
    const auto szAddress =
        ReadAddress(std::string_view(szLocal).substr(0, nColon), table.nFamily, found.listener.blLoopbackOnly);
    if (!szAddress || found.listener.nPort == 0) {
        return std::nullopt;
    }
    found.listener.szProtocol = table.szProtocol;
    found.listener.szAddress = *szAddress;
    return found;
}

std::vector<Socket> ReadSockets() {
    std::vector<Socket> rgFound;
    for (const Table& table : kTables) {
        std::ifstream file(table.szPath);
        for (std::string szLine; std::getline(file, szLine);) {
            if (auto found = ReadSocket(szLine, table)) {
                rgFound.push_back(std::move(*found));
            }
        }
    }
    return rgFound;
}

// ---- their programs ---------------------------------------------------------------------------------------

std::string NameOf(const std::filesystem::path& process) {
    std::string szName;
    std::getline(std::ifstream(process / "comm"), szName);
    return szName;
}

// Names the sockets that a process holds.
void AddNames(const std::filesystem::path& process, std::map<uint64_t, std::string>& mapNames) {
    constexpr std::string_view kSocket = "socket:[";
    std::error_code error;
    std::string szName;
    for (const auto& entry : std::filesystem::directory_iterator(process / "fd", error)) {
        std::error_code gone;
        const std::string szTarget = std::filesystem::read_symlink(entry.path(), gone).string();
        uint64_t nInode = 0;
        if (gone || !szTarget.starts_with(kSocket) ||
            std::from_chars(szTarget.data() + kSocket.size(), szTarget.data() + szTarget.size(), nInode).ec !=
                std::errc()) {
            continue;
        }
        if (const auto pName = mapNames.find(nInode); pName != mapNames.end() && pName->second.empty()) {
            szName = szName.empty() ? NameOf(process) : szName;
            pName->second = szName;
        }
    }
}

void AddPrograms(std::vector<Socket>& rgSockets) {
    std::map<uint64_t, std::string> mapNames;
    for (const Socket& socket : rgSockets) {
        mapNames.emplace(socket.nInode, "");
    }
    std::error_code error;
    for (const auto& entry : std::filesystem::directory_iterator("/proc", error)) {
        const std::string szPid = entry.path().filename().string();
        if (std::all_of(szPid.begin(), szPid.end(), [](unsigned char c) { return std::isdigit(c) != 0; })) {
            AddNames(entry.path(), mapNames);
        }
    }
    for (Socket& socket : rgSockets) {
        Listener& listener = socket.listener;
        listener.szProgram = mapNames[socket.nInode];
        listener.blContainer =
            std::find(std::begin(kCarriers), std::end(kCarriers), listener.szProgram) != std::end(kCarriers);
    }
}

// ---- published ports --------------------------------------------------------------------------------------

// One rule of the packet filter, as far as it hands ports over.
struct Handing {
    std::string szProtocol;
    std::vector<uint16_t> rgPorts;
    std::string szTarget;
};

void AddPorts(const Json::Value& js, std::vector<uint16_t>& rgPorts) {
    if (js.isUInt() && js.asUInt() <= UINT16_MAX) {
        rgPorts.push_back(static_cast<uint16_t>(js.asUInt()));
    } else if (js.isObject() && js["set"].isArray()) {
        for (const Json::Value& jsItem : js["set"]) {
            AddPorts(jsItem, rgPorts);
        }
    } else if (js.isObject() && js["range"].isArray() && js["range"].size() == 2) {
        const Json::Value &jsFirst = js["range"][0], &jsLast = js["range"][1];
        const bool blNumbers = jsFirst.isUInt() && jsLast.isUInt() && jsLast.asUInt() <= UINT16_MAX;
        for (unsigned n = blNumbers ? jsFirst.asUInt() : 1; n <= (blNumbers ? jsLast.asUInt() : 0); ++n) {
            rgPorts.push_back(static_cast<uint16_t>(n));
        }
    }
}

Handing ReadHanding(const Json::Value& jsRule) {
    Handing handing;
    const Json::Value& jsSteps = jsRule["expr"];
    for (const Json::Value& jsStep : jsSteps.isArray() ? jsSteps : Json::Value(Json::arrayValue)) {
        if (!jsStep.isObject()) {
            continue;
        }
        const Json::Value& jsMatch = jsStep["match"];
        if (jsMatch.isObject() && jsMatch["left"].isObject() && jsMatch["op"] != "!=") {
            const Json::Value& jsField = jsMatch["left"]["payload"];
            if (jsField.isObject() && jsField["field"] == "dport" && jsField["protocol"].isString()) {
                handing.szProtocol = jsField["protocol"].asString();
                AddPorts(jsMatch["right"], handing.rgPorts);
            }
        }
        if (jsStep["dnat"].isObject() && jsStep["dnat"]["addr"].isString()) {
            handing.szTarget = jsStep["dnat"]["addr"].asString();
        }
    }
    return handing;
}

// A network of this box that is not the router's: where containers live. szOutwards: the box's address there.
bool IsInnerNetwork(const std::string& szTarget, const std::string& szOutwards) {
    std::vector<TAVO_NET_CARD> rgCards(kMostCards);
    rgCards.resize(static_cast<size_t>(std::max(TLIBNetGetInterfaceInfo(rgCards.data(), kMostCards, 2), 0)));
    bool blInner = false;
    for (const TAVO_NET_CARD& card : rgCards) {
        if (TAVONetIsSameSubnet(szTarget.c_str(), card.szAddress, card.szMask) == 1) {
            blInner = card.szAddress != szOutwards && card.szAddress != szTarget;
            break;
        }
    }
    return blInner;
}

std::string OutwardAddress() {
    char szGateway[INET_ADDRSTRLEN] = {}, szLocal[INET_ADDRSTRLEN] = {};
    return TAVONetDefaultGatewayGet(szGateway, sizeof(szGateway)) == 0 &&
                   TAVONetLocalAddressGet(szGateway, szLocal, sizeof(szLocal), nullptr, 0) == 0
               ? szLocal
               : "";
}

auto Place(const Listener& listener) {
    return std::tie(listener.szProtocol, listener.nPort, listener.szAddress);
}

void Sort(std::vector<Listener>& rgListeners) {
    std::stable_sort(rgListeners.begin(), rgListeners.end(),
                     [](const Listener& one, const Listener& other) { return Place(one) < Place(other); });
    rgListeners.erase(
        std::unique(rgListeners.begin(), rgListeners.end(),
                    [](const Listener& one, const Listener& other) { return Place(one) == Place(other); }),
        rgListeners.end());
}

}  // namespace

std::vector<Listener> ReadPublishedPorts(const std::string& szRuleset) {
    std::vector<Listener> rgFound;
    const auto js = ReadJson(szRuleset);
    if (!js || !js->isObject() || !(*js)["nftables"].isArray()) {
        return rgFound;
    }
    const std::string szOutwards = OutwardAddress();
    for (const Json::Value& jsItem : (*js)["nftables"]) {
        if (!jsItem.isObject() || !jsItem["rule"].isObject()) {
            continue;
        }
        const Handing handing = ReadHanding(jsItem["rule"]);
        if ((handing.szProtocol == "tcp" || handing.szProtocol == "udp") &&
            IsInnerNetwork(handing.szTarget, szOutwards)) {
            for (const uint16_t nPort : handing.rgPorts) {
                rgFound.push_back({handing.szProtocol, nPort, "0.0.0.0", false, "", true});
            }
        }
    }
    return rgFound;
}

std::vector<Listener> ReadListeners() {
    std::vector<Socket> rgSockets = ReadSockets();
    AddPrograms(rgSockets);
    std::vector<Listener> rgFound =
        ReadPublishedPorts(OutputOf({kNft, "-j", "list", "ruleset"}, kNftLimit, kMostRuleset));
    for (Socket& socket : rgSockets) {
        rgFound.push_back(std::move(socket.listener));
    }
    Sort(rgFound);
    return rgFound;
}

}  // namespace tavo::cli
