// The tool that writes the rules into a manual router. Relies on the settings of the router in front, on its
// description and operations, and on Forwarder. Promises: one run at a time, and a bounded one; every
// forward that is not in place afterwards is logged, and the user learns of it from the event log.
#include <fcntl.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <syslog.h>

#include <charconv>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <exception>
#include <memory>

#include "core/Descriptor.h"
#include "core/TextFile.h"
#include "daemons/tavoportforward/Forwarder.h"
#include "portforward/ConfList.h"
#include "portforward/RouterScript.h"
#include "tavo/log.h"
#include "tavo/net.h"

namespace {

using tavo::ConfList;
using tavo::Refusal;
using tavo::Value;

constexpr char kHelp[] =
    "Usage: tavoportforward [--version | --check FILE... | --help]\n"
    "Writes the enabled rules of /etc/portforward/rule.conf into the router in front of this box, through the\n"
    "web pages that its description knows (/etc.defaults/portforward/routerdb), with the account that\n"
    "/etc/portforward/router.conf holds for it. Takes away what it made earlier and no rule asks for.\n"
    "\n"
    "  --version   the version of the operations syntax that this tool understands\n"
    "  --check     says of router.ops files whether they can be performed\n"
    "  --help      this text\n"
    "\n"
    "Exit status: 0 all is in place (or good); 1 some forwards are not (see the system log\n"
    "and /var/log/tavo/event.log), or a checked file is bad; 2 unknown argument; 3 nothing could be tried.\n";
constexpr char kLock[] = "/var/run/tavoportforward.lock";
constexpr auto kRunLimit = std::chrono::seconds(180);  // well below the five minutes that a save waits
constexpr int kAddressSize = 64;
constexpr int kErrorLevel = 3;
constexpr int kSystemEvents = 1;
constexpr size_t kMaxText = 1000;

enum Status : int { kAllInPlace = 0, kSomeMissing = 1, kUsage = 2, kNotTried = 3 };

struct ScriptDeleter {
    void operator()(TAVO_ROUTER_SCRIPT* pScript) const { TAVORouterScriptFree(pScript); }
};

// The router in front as settings and database know it.
struct KnownRouter {
    std::string szGateway;
    std::string szBox;
    tavo::WebRouter web;
    ConfList pDescription;
    tavo::Operations operations;
};

int NotTried(const std::string& szWhy) {
    syslog(LOG_ERR, "nothing was tried: %s", szWhy.c_str());
    const ConfList pRules(TAVOPFRuleGet());
    if (!pRules || TLIBPFCountRuleConf(pRules.get(), 1) != 0) {  // else there was nothing to try either
        TAVOLogSet1(kSystemEvents, kErrorLevel, TAVO_EVENT_PF_ADD_FAILED, "all", ("(" + szWhy + ")").c_str(), nullptr,
                    nullptr);
    }
    return kNotTried;
}

int ToPort(const std::string& szText) {
    int nPort = 0;
    const auto [pEnd, error] = std::from_chars(szText.data(), szText.data() + szText.size(), nPort);
    return error == std::errc() && pEnd == szText.data() + szText.size() && TAVOPFIsValidPortNo(nPort) == 1 ? nPort : 0;
}

bool FindAddresses(KnownRouter& router, std::string& szWhy) {
    char szGateway[kAddressSize] = {};
    char szBox[kAddressSize] = {};
    if (TAVONetDefaultGatewayGet(szGateway, sizeof(szGateway)) != 0 ||
        TAVONetLocalAddressGet(szGateway, szBox, sizeof(szBox), nullptr, 0) != 0) {
        szWhy = "this box has no default gateway";
        return false;
    }
    router.szGateway = router.web.szAddress = szGateway;
    router.szBox = szBox;
    return true;
}

bool ReadSettings(KnownRouter& router, const TAVO_PF_CONF* pSection, std::string& szWhy) {
    router.web.szScheme = Value(pSection, "conn_type");
    router.web.nPort = ToPort(Value(pSection, "conn_port"));
    if ((router.web.szScheme != "http" && router.web.szScheme != "https") || router.web.nPort == 0) {
        szWhy = "the router's settings name no connection of type http or https with its port";
        return false;
    }
    router.web.szUser = Value(pSection, "user");
    router.web.szPass = Value(pSection, "pass");
    if (router.web.szUser.empty() && router.web.szPass.empty()) {
        router.web.szUser = router.operations.szDefaultUser;
        router.web.szPass = router.operations.szDefaultPass;
    }
    router.web.enAuth = router.operations.enAuth;
    return true;
}

bool LoadOperations(KnownRouter& router, const TAVO_PF_CONF* pSection, std::string& szWhy) {
    TAVO_PF_CONF* pDescriptionRaw = nullptr;
    TAVO_ROUTER_SCRIPT* pScriptRaw = nullptr;
    if (TAVOPFRouterDBLoadDescAndOpsByIp(pSection, &pDescriptionRaw, &pScriptRaw) < 0) {
        szWhy = "the database of routers does not know this one";
        return false;
    }
    router.pDescription.reset(pDescriptionRaw);
    const std::unique_ptr<TAVO_ROUTER_SCRIPT, ScriptDeleter> pScript(pScriptRaw);
    if (!pScript->pOperations) {
        szWhy = "the database of routers has no operations for this one, or they cannot be read";
        return false;
    }
    auto operations = tavo::ReadOperations(pScript->pOperations.get(), szWhy);
    if (!operations) {
        szWhy = "the operations of this router: " + szWhy;
        return false;
    }
    router.operations = std::move(*operations);
    return true;
}

bool Load(KnownRouter& router, std::string& szWhy) {
    if (!FindAddresses(router, szWhy)) {
        return false;
    }
    const ConfList pRouters(TAVOPFGwRouterConfGet());
    for (const TAVO_PF_CONF* pSection = pRouters.get(); pSection != nullptr; pSection = pSection->pNext) {
        if (router.szGateway == pSection->szSection) {
            return LoadOperations(router, pSection, szWhy) && ReadSettings(router, pSection, szWhy);
        }
    }
    szWhy = "there are no settings for the router " + router.szGateway;
    return false;
}

// One log line each, and one event for each reason.
void Report(const std::vector<Refusal>& rgRefusals) {
    std::vector<std::pair<std::string, std::string>> rgEvents;  // reason, what it holds for
    for (const auto& [szWhat, szWhy] : rgRefusals) {
        syslog(LOG_ERR, "%s: %s", szWhat.c_str(), szWhy.c_str());
        auto it = rgEvents.begin();
        while (it != rgEvents.end() && it->first != szWhy) {
            ++it;
        }
        if (it == rgEvents.end()) {
            rgEvents.emplace_back(szWhy, szWhat);
        } else if (it->second.size() < kMaxText) {
            it->second += ", " + szWhat;
        }
    }
    for (const auto& [szWhy, szWhat] : rgEvents) {
        TAVOLogSet1(kSystemEvents, kErrorLevel, TAVO_EVENT_PF_ADD_FAILED, szWhat.c_str(), ("(" + szWhy + ")").c_str(),
                    nullptr, nullptr);
    }
}

int Run() {
    const tavo::Descriptor fdLock(open(kLock, O_RDWR | O_CREAT | O_CLOEXEC, tavo::kPrivateMode));
    if (fdLock.Get() < 0 || flock(fdLock.Get(), LOCK_EX) != 0) {  // whoever holds it is bounded
        return NotTried("the lock " + std::string(kLock) + " cannot be taken");
    }
    KnownRouter router;
    std::string szWhy;
    if (!Load(router, szWhy)) {
        return NotTried(szWhy);
    }
    const tavo::JobSet jobs = tavo::ReadJobs(router.pDescription.get());
    if (!jobs.blReadable) {
        return NotTried("the rules cannot be read");
    }
    tavo::WebClient client(router.web, std::chrono::steady_clock::now() + kRunLimit);
    tavo::Session session(client, router.operations,
                          {{"user", router.web.szUser},
                           {"pass", router.web.szPass},
                           {"gateway", router.szGateway},
                           {"url", router.web.Url()},
                           {"box", router.szBox}});
    tavo::MadeJobs made(router.szGateway, router.szBox);
    std::vector<Refusal> rgRefusals = tavo::Forwarder(session, router.operations, made, router.szBox).Run(jobs.rgJobs);
    rgRefusals.insert(rgRefusals.end(), jobs.rgRefusals.begin(), jobs.rgRefusals.end());
    Report(rgRefusals);
    return rgRefusals.empty() ? kAllInPlace : kSomeMissing;
}

int Check(char** pszPaths) {
    int nStatus = kAllInPlace;
    for (; *pszPaths != nullptr; ++pszPaths) {
        std::string szWhy = "no sectioned file, or an empty one";
        const ConfList pSections = tavo::LoadConfList(*pszPaths);
        if (!pSections || !tavo::ReadOperations(pSections.get(), szWhy)) {
            std::printf("%s: %s\n", *pszPaths, szWhy.c_str());
            nStatus = kSomeMissing;
        }
    }
    return nStatus;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc > 1) {
        if (std::strcmp(argv[1], "--version") == 0) {
            std::printf("syntax version=%d\n", tavo::kSyntaxVersion);
            return kAllInPlace;
        }
        if (std::strcmp(argv[1], "--check") == 0) {
            return Check(argv + 2);
        }
        const bool blHelp = std::strcmp(argv[1], "--help") == 0;
        std::fputs(kHelp, blHelp ? stdout : stderr);
        return blHelp ? kAllInPlace : kUsage;
    }
    umask(022);
    signal(SIGPIPE, SIG_IGN);
    openlog("tavoportforward", LOG_PID, LOG_DAEMON);
    try {
        return Run();
    } catch (const std::exception& error) {
        return NotTried(error.what());
    }
}
