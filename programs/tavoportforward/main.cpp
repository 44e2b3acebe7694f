// The tool that writes the rules into a manual router. Relies on the settings of the router in front, on its
// description and operations, and on Forwarder. Promises: one run at a time, and a bounded one; every
// forward that is not in place afterwards is logged, and the user learns of it from the event log.
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <exception>
#include <memory>

#include "ground/ConfList.h"
#include "ground/FileLock.h"
#include "ground/RouterScript.h"
#include "ground/TextFile.h"
#include "programs/tavoportforward/Description.h"
#include "programs/tavoportforward/EarlierRecord.h"
#include "programs/tavoportforward/Forwarder.h"
#include "programs/tavoportforward/Telling.h"
#include "tavo/net.h"

namespace {

using tavo::ConfList;
using tavo::Refusal;
using tavo::Value;

constexpr char kHelp[] =
    "Usage: tavoportforward [--version | --check FILE... | --help]\n"
    "Writes the enabled rules of /etc/portforward/rule.conf into the router in front of this box, through the\n"
    "web pages that its description knows (/etc/tavo/routerdb, /etc.defaults/portforward/routerdb), with the\n"
    "account that /etc/portforward/router.conf holds for it. Takes away what it made earlier and no rule asks\n"
    "for: /var/lib/tavo/pages_made.conf remembers it, and is the only memory of a router that shows no list.\n"
    "What became of each port stands in /run/tavo/tavoportforward.json.\n"
    "\n"
    "  --version   the version of the operations syntax that this tool understands\n"
    "  --check     says of router.ops and router.des (by that ending) files what is wrong with them\n"
    "  --help      this text\n"
    "\n"
    "Exit status: 0 all is in place (or good); 1 some forwards are not (see the system log\n"
    "and /var/log/tavo/event.log), or a checked file is bad; 2 unknown argument; 3 nothing could be tried.\n";
constexpr char kMadeFile[] = "/var/lib/tavo/pages_made.conf";
constexpr char kLock[] = "/var/run/tavoportforward.lock";
constexpr auto kRunLimit = std::chrono::seconds(180);  // well below the five minutes that a save waits
constexpr int kAddressSize = 64;

enum Status : int { kAllInPlace = 0, kSomeMissing = 1, kUsage = 2, kNotTried = 3 };

struct ScriptDeleter {
    void operator()(TAVO_ROUTER_SCRIPT* pScript) const { TAVORouterScriptFree(pScript); }
};

// The router in front as settings and database know it.
struct KnownRouter {
    std::string szGateway;
    std::string szBox;
    bool blNoGateway = false;
    tavo::WebRouter web;
    ConfList pDescription;
    tavo::Operations operations;
};

int NotTried(const std::string& szWhy, const KnownRouter& router = {}) {
    tavo::RunResult result{router.szGateway, router.szBox};
    result.enRouter = router.blNoGateway ? tavo::RouterState::kNoGateway : tavo::RouterState::kNotAsked;
    tavo::TellNotTried(std::move(result), szWhy);
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
        router.blNoGateway = true;
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

tavo::RouterState StateAfter(tavo::WebEnd enTrouble) {
    switch (enTrouble) {
        case tavo::WebEnd::kTimeout:
            return tavo::RouterState::kSilent;
        case tavo::WebEnd::kUnreachable:
            return tavo::RouterState::kUnreachable;
        default:
            return tavo::RouterState::kOk;
    }
}

// Why the router as a whole is not as it should be: the run's own trouble, or one reason for all that was asked.
std::string RouterWhy(const std::vector<Refusal>& rgRefusals) {
    const auto itRun = std::find_if(rgRefusals.begin(), rgRefusals.end(), [](const Refusal& refusal) {
        return refusal.enKind == tavo::RefusalKind::kRun || !refusal.blAnswered;
    });
    return itRun == rgRefusals.end() ? "" : itRun->szWhy;
}

int Run() {
    const tavo::FileLock lock(kLock);
    if (!lock.Wait([] { return true; })) {  // whoever holds it is bounded
        return NotTried("the lock " + std::string(kLock) + " cannot be taken");
    }
    KnownRouter router;
    std::string szWhy;
    if (!Load(router, szWhy)) {
        return NotTried(szWhy, router);
    }
    tavo::JobSet jobs = tavo::ReadJobs(router.pDescription.get());
    if (!jobs.blReadable) {
        return NotTried("the rules cannot be read", router);
    }
    tavo::WebClient client(router.web, std::chrono::steady_clock::now() + kRunLimit);
    tavo::Session session(client, router.operations,
                          {{"user", router.web.szUser},
                           {"pass", router.web.szPass},
                           {"gateway", router.szGateway},
                           {"url", router.web.Url()},
                           {"box", router.szBox}});
    tavo::MadeFile made(kMadeFile);
    tavo::TakeOverEarlierRecord(made);
    tavo::RunResult result{router.szGateway, router.szBox};
    tavo::Forwarder forwarder(session, router.operations, made, router.szBox);
    result.rgRefusals = forwarder.Run(router.szGateway, jobs.rgJobs);
    result.enRouter = StateAfter(session.LastTrouble());
    result.szRouterWhy = RouterWhy(result.rgRefusals);
    result.rgRefusals.insert(result.rgRefusals.end(), jobs.rgRefusals.begin(), jobs.rgRefusals.end());
    result.rgWanted = std::move(jobs.rgJobs);
    tavo::Tell(result);
    return result.rgRefusals.empty() ? kAllInPlace : kSomeMissing;
}

int Check(char** pszPaths) {
    int nStatus = kAllInPlace;
    for (; *pszPaths != nullptr; ++pszPaths) {
        std::string szWhy = "no sectioned file, or an empty one";
        const ConfList pSections = tavo::LoadConfList(*pszPaths);
        const bool blDescription = std::string_view(*pszPaths).ends_with(".des");
        const bool blGood = pSections && (blDescription ? tavo::IsGoodDescription(pSections.get(), szWhy)
                                                        : tavo::ReadOperations(pSections.get(), szWhy).has_value());
        if (!blGood) {
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
    if (geteuid() != 0) {  // it could read neither the account nor the rules, and nobody would see what it logs
        std::fputs("tavoportforward: this needs root: run it with sudo\n", stderr);
        return kNotTried;
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
