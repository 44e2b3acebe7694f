// What the programs that keep the mappings say of them in /run/tavo. Relies on jsoncpp. Promises: only root's word is
// taken, and only while the daemon that gave it lives; a file that is half, huge or no such thing is as good as none;
// texts are as the file has them, to be cleaned before they are shown.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace tavo::cli {

inline constexpr char kPublishedDirectory[] = "/run/tavo";

// Who has a port that a rule wants.
struct PublishedHolder {
    std::string szAddress;
    std::string szDescription;
};

enum class PortState { kUnknown, kOpen, kRefused, kWaiting };

struct PublishedRule {
    std::string szName;   // "443/tcp"; for what is no single port, its ports as they stand in the rule
    int nRouterPort = 0;  // 0: no single port
    int nBoxPort = 0;
    std::string szProtocol;  // "tcp" or "udp"
    std::string szRule;
    PortState enState = PortState::kUnknown;
    std::string szWord;  // of the result file
    std::string szWhy;
    std::optional<PublishedHolder> holder;
    std::optional<int64_t> nSince;  // seconds since 1970, like all times here
    std::optional<int64_t> nUntil;
};

// A mapping of ours on the router that no rule asks for.
struct PublishedLeftOver {
    std::string szName;
    std::string szAddress;
    std::string szWhy;
    std::optional<int64_t> nUntil;
};

struct Published {
    std::string szProtocol;  // "UPnP", "NAT-PMP" or "pages"
    pid_t nPid = 0;
    int64_t nAt = 0;
    bool blSwitchedOn = true;
    bool blRulesReadable = true;
    std::string szGateway;  // empty where unknown, like szBox and szOutside
    std::string szBox;
    std::string szOutside;
    std::string
        szRouter;  // "ok", "unreachable", "no_upnp", "no_natpmp", "silent", "no_gateway" or "busy"; empty: not asked
    std::string szRouterWhy;  // the same in words; empty when all is well
    std::optional<int64_t> nRouterSince;
    std::optional<int64_t> nNextLook;
    std::vector<PublishedRule> rgRules;
    std::vector<PublishedLeftOver> rgLeftOver;
};

// What szProgram ("upnpd", "natpmpd", "tavoportforward") has published. tavoportforward need not run any more: a
// router's own pages are written once.
std::optional<Published> ReadPublished(const std::string& szProgram);
// The same of a text that such a program has said.
std::optional<Published> PublishedIn(const std::string& szText);

const char* ToWord(PortState enState);
// " (192.168.1.7, console)", cleaned; empty where it is not known.
std::string WhoHas(const std::optional<PublishedHolder>& holder);

}  // namespace tavo::cli
