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
#include <iterator>
#include <memory>

#include "ground/BootClock.h"
#include "ground/ConfList.h"
#include "ground/FileLock.h"
#include "ground/RouterScript.h"
#include "ground/TextFile.h"
#include "ground/net/Neighbour.h"
#include "mapping/Carry.h"
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
    "Usage: tavoportforward [--if-used | --take-away | --clear-unused | --left | --forget | --version |\n"
    "       --check FILE... | --help]\n"
    "Writes the enabled rules of /etc/portforward/rule.conf into the router in front of this box, through the\n"
    "web pages that its description knows (/etc/tavo/routerdb, /etc.defaults/portforward/routerdb), with the\n"
    "account that /etc/portforward/router.conf holds for it. Takes away what it made earlier and no rule asks\n"
    "for: /var/lib/tavo/pages_made.conf remembers it, and is the only memory of a router that shows no list.\n"
    "What became of each port stands in /run/tavo/tavoportforward.json.\n"
    "\n"
    "  --if-used       does nothing where the settings have the router driven in another way\n"
    "  --take-away     takes away all that it made, also when UPnP or NAT-PMP drives the router by now: with the\n"
    "                  account that /etc/portforward/router_account.conf keeps since\n"
    "  --clear-unused  the same, and nothing while the pages are in use\n"
    "  --left          says, as that file does, what the record has; asks no router\n"
    "  --forget        drops from the record what this router's pages forward while they are not in use: for who\n"
    "                  has taken it away by hand\n"
    "  --version       the version of the operations syntax that this tool understands\n"
    "  --check         says of router.ops and router.des (by that ending) files what is wrong with them\n"
    "  --help          this text\n"
    "\n"
    "Under its other name, tavopages, nobody takes it for a save under way.\n"
    "\n"
    "Exit status: 0 all is in place (or good); 1 some forwards are not (see the system log\n"
    "and /var/log/tavo/event.log), or a checked file is bad; 2 unknown argument; 3 nothing could be tried.\n";
// The settings of the pages while UPnP or NAT-PMP drives the router.
constexpr char kAside[] = "/etc/portforward/router_account.conf";
// How pages that are not in use get an account with a description again.
constexpr char kNameThem[] =
    "; 'sudo tavoportmap router set' with --upnp no and the --brand, --model and --version of their description says "
    "which they are, and with --upnp yes goes back";
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

const TAVO_PF_CONF* SectionOf(const TAVO_PF_CONF* pSection, const std::string& szGateway) {
    while (pSection != nullptr && szGateway != pSection->szSection) {
        pSection = pSection->pNext;
    }
    return pSection;
}

// Whether these settings say where the pages are.
bool HasPages(const TAVO_PF_CONF* pSection) {
    return pSection != nullptr && !Value(pSection, "conn_type").empty();
}

// Whether they have the router driven through them.
bool IsInUse(const TAVO_PF_CONF* pSection) {
    return HasPages(pSection) && Value(pSection, "support_router_upnp") != "yes" &&
           Value(pSection, "support_router_natpmp") != "yes";
}

constexpr const char* kIdentity[] = {"brand", "model", "version"};

bool IsNameless(const TAVO_PF_CONF* pSection) {
    return std::all_of(std::begin(kIdentity), std::end(kIdentity),
                       [&](const char* szKey) { return Value(pSection, szKey).empty(); });
}

// An earlier version put the account aside and not whose it is: it may be the one that the settings name now.
ConfList LoadAside(const TAVO_PF_CONF* pNow, const std::string& szGateway) {
    ConfList pAside = tavo::LoadConfList(kAside);
    const TAVO_PF_CONF* pSection = SectionOf(pAside.get(), szGateway);
    if (pNow != nullptr && pSection != nullptr && pSection->pHash != nullptr && IsNameless(pSection)) {
        for (const char* szKey : kIdentity) {
            TLIBCSzHashSetValue(pSection->pHash, szKey, Value(pNow, szKey).c_str());
        }
    }
    return pAside;
}

// blAside: where the settings do not know the pages, what was put aside will do.
bool Load(KnownRouter& router, bool blAside, std::string& szWhy) {
    if (!FindAddresses(router, szWhy)) {
        return false;
    }
    ConfList pRouters(TAVOPFGwRouterConfGet());
    const TAVO_PF_CONF* pSection = SectionOf(pRouters.get(), router.szGateway);
    if (blAside && !HasPages(pSection)) {
        pRouters = LoadAside(pSection, router.szGateway);
        pSection = SectionOf(pRouters.get(), router.szGateway);
    }
    if (pSection == nullptr) {
        szWhy = "there are no settings for the " + std::string(blAside ? "pages of the router " : "router ") +
                router.szGateway + (blAside ? kNameThem : "");
        return false;
    }
    if (!LoadOperations(router, pSection, szWhy)) {
        szWhy += blAside && !router.pDescription ? kNameThem : "";
        return false;
    }
    return ReadSettings(router, pSection, szWhy);
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

int Bring(const KnownRouter& router, tavo::MadeFile& made, tavo::JobSet jobs, const tavo::Others& mapOthers,
          bool blInUse) {
    tavo::WebClient client(router.web, std::chrono::steady_clock::now() + kRunLimit);
    tavo::Session session(client, router.operations,
                          {{"user", router.web.szUser},
                           {"pass", router.web.szPass},
                           {"gateway", router.szGateway},
                           {"url", router.web.Url()},
                           {"box", router.szBox}});
    tavo::RunResult result{.szGateway = router.szGateway, .szBox = router.szBox, .blInUse = blInUse};
    tavo::Forwarder forwarder(session, router.operations, made, router.szBox);
    result.rgRefusals = forwarder.Run(router.szGateway, jobs.rgJobs, mapOthers);
    result.enRouter = StateAfter(session.LastTrouble());
    result.szRouterWhy = RouterWhy(result.rgRefusals);
    result.rgRefusals.insert(result.rgRefusals.end(), jobs.rgRefusals.begin(), jobs.rgRefusals.end());
    result.rgWanted = std::move(jobs.rgJobs);
    tavo::Tell(result);
    return result.rgRefusals.empty() ? kAllInPlace : kSomeMissing;
}

int Run() {
    KnownRouter router;
    std::string szWhy;
    if (!Load(router, false, szWhy)) {
        return NotTried(szWhy, router);
    }
    tavo::JobSet jobs = tavo::ReadJobs(router.pDescription.get());
    if (!jobs.blReadable) {
        return NotTried("the rules cannot be read", router);
    }
    tavo::MadeFile made(tavo::kPagesMadeFile);
    tavo::TakeOverEarlierRecord(made);
    return Bring(router, made, std::move(jobs), {}, true);
}

// By the settings that a save goes by, whatever the gateway is.
int RunIfUsed() {
    return IsInUse(ConfList(TAVOPFGwRouterConfGet()).get()) ? Run() : kAllInPlace;
}

tavo::RouterName NameOf(const KnownRouter& router) {
    return {router.szGateway, tavo::HardwareAddress(router.szGateway)};
}

// What the router in front has by the record, each with that reason for being there still.
tavo::RunResult LeftBy(tavo::Record& record, const KnownRouter& router, const std::string& szWhy) {
    tavo::RunResult result{.szGateway = router.szGateway, .szBox = router.szBox, .blInUse = false};
    record.TurnTo(NameOf(router));
    for (const tavo::Outcome& left : tavo::LeftOnRecord(record, {}, {}, {}, tavo::BootSeconds())) {
        result.rgRefusals.push_back({left.szName, szWhy, {}, tavo::RefusalKind::kRemoval, false});
    }
    return result;
}

// The pages may list what upnpd has made, with our mark. Where both have made something nobody can tell whose it is: it
// goes, for the pages would keep it for ever; upnpd makes it anew.
tavo::Others MadeByUpnpd(const tavo::Record& record) {
    tavo::Others mapOthers;
    tavo::Record upnpd = tavo::MadeFile(tavo::kUpnpMadeFile).Get();
    upnpd.TurnTo(record.Router());
    for (const auto& [key, made] : upnpd.Here()) {
        if (!record.Here().contains(key)) {
            mapOthers.emplace(key, made.nBoxPort);
        }
    }
    return mapOthers;
}

// The rules are carried out in another way by now, or by nobody: none of them counts here.
int TakeAway() {
    KnownRouter router;
    std::string szWhy;
    const bool blKnown = Load(router, true, szWhy);
    tavo::MadeFile made(tavo::kPagesMadeFile);
    tavo::TakeOverEarlierRecord(made);
    const tavo::RunResult left = LeftBy(made.Get(), router, szWhy);
    if (blKnown && !left.rgRefusals.empty()) {
        return Bring(router, made, {}, MadeByUpnpd(made.Get()), false);
    }
    tavo::Tell(left);
    return left.rgRefusals.empty() && !router.blNoGateway ? kAllInPlace : kNotTried;
}

// Whoever started this may have waited for its turn while the settings went over to the pages.
int ClearUnused() {
    KnownRouter router;
    std::string szWhy;
    const ConfList pRouters(TAVOPFGwRouterConfGet());
    const bool blInUse = FindAddresses(router, szWhy) && IsInUse(SectionOf(pRouters.get(), router.szGateway));
    return blInUse ? kAllInPlace : TakeAway();
}

int ShowLeft() {
    KnownRouter router;
    std::string szWhy;
    const bool blKnown = Load(router, true, szWhy);
    szWhy = blKnown
                ? "the router's own pages forward it; 'sudo tavoportmap off', or the next save, has them take it away"
                : "the router's own pages forward it: take it away there (" + szWhy + ")";
    tavo::Record record = tavo::MadeFile(tavo::kPagesMadeFile).Get();
    tavo::RunResult left = LeftBy(record, router, szWhy);
    const size_t nHere = record.Here().size();
    record.TurnTo({router.szGateway, ""});
    if (record.Here().size() > nHere) {
        left.szRouterWhy =
            "by the record, the pages of another router that was at this address forward ports to this box; they count "
            "again should it be back";
    }
    std::fputs(tavo::TextOf(left).c_str(), stdout);
    return kAllInPlace;
}

// What a person took away there: without a list nobody else would ever notice.
int ForgetLeft() {
    KnownRouter router;
    std::string szWhy;
    const ConfList pRouters(TAVOPFGwRouterConfGet());
    if (!FindAddresses(router, szWhy)) {
        std::fprintf(stderr, "tavoportforward: %s\n", szWhy.c_str());
        return kNotTried;
    }
    if (IsInUse(SectionOf(pRouters.get(), router.szGateway))) {
        std::fputs("tavoportforward: the router's pages are in use: what no rule asks for goes by the next save\n",
                   stderr);
        return kNotTried;
    }
    tavo::MadeFile made(tavo::kPagesMadeFile);
    tavo::TakeOverEarlierRecord(made);
    made.Get().TurnTo(NameOf(router));
    made.Get().Here().clear();
    if (!made.Save()) {
        std::fprintf(stderr, "tavoportforward: %s cannot be written\n", tavo::kPagesMadeFile);
        return kNotTried;
    }
    tavo::Tell({.szGateway = router.szGateway, .szBox = router.szBox, .blInUse = false});
    return kAllInPlace;
}

int Locked(int (*fnRun)()) {
    const tavo::FileLock lock(kLock);
    if (!lock.Wait([] { return true; })) {  // whoever holds it is bounded
        return NotTried("the lock " + std::string(kLock) + " cannot be taken");
    }
    return fnRun();
}

struct Mode {
    std::string_view szOption;
    int (*fnRun)();
    bool blLocks = true;
};

constexpr Mode kModes[] = {{"", Run},
                           {"--if-used", RunIfUsed},
                           {"--take-away", TakeAway},
                           {"--clear-unused", ClearUnused},
                           {"--forget", ForgetLeft},
                           {"--left", ShowLeft, false}};

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
    const std::string_view szOption = argc == 2 ? argv[1] : "";
    const auto pMode =
        std::find_if(std::begin(kModes), std::end(kModes), [&](const Mode& mode) { return mode.szOption == szOption; });
    if (argc > 2 || (argc == 2 && szOption.empty()) || pMode == std::end(kModes)) {
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
        return pMode->blLocks ? Locked(pMode->fnRun) : pMode->fnRun();
    } catch (const std::exception& error) {
        return NotTried(error.what());
    }
}
