// "setup": the way from nothing to a known router. Relies on Detection, CompatRun and Offer. Promises: see Setup.h.
#include "Setup.h"

#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>

#include "Ask.h"
#include "Commands.h"
#include "CompatRun.h"
#include "CompatTest.h"
#include "Detection.h"
#include "Offer.h"
#include "RuleStore.h"
#include "Settings.h"
#include "StoredRouter.h"
#include "Table.h"

namespace tavo::cli {

namespace {

constexpr char kIntroduction[] =
    "A router lets connections out of the home network and answers back in, but turns away those that begin outside. "
    "Now it is found out how this box can tell it to let single ones through.\n\n";

// What NAT-PMP does not say: the router is remembered under it where UPnP does not say it either.
constexpr char kNoBrand[] = "unknown";
constexpr char kNatpmpModel[] = "NAT-PMP router";

bool IsSame(const RouterConf& one, const RouterConf& other) {
    return std::string(one.szBrand) == other.szBrand && std::string(one.szModel) == other.szModel &&
           std::string(one.szVersion) == other.szVersion && std::string(one.szSupportUpnp) == other.szSupportUpnp &&
           std::string(one.szSupportNatpmp) == other.szSupportNatpmp;
}

// Looks, asks, tests and stores; the router lock is held as long as it lives.
class Finder {
public:
    Finder(const SetupWish& wish, bool blJson, const std::string& szGateway) : mWish(wish), mBlJson(blJson) {
        mDetected.szGateway = szGateway;
    }
    Reply Run();

private:
    Reply ByFinding();
    Reply ByTest();
    Reply ByNatpmp();
    Reply ByPages();
    Reply Nothing();
    Reply Untested() const;
    Reply AfterTest(const TestRun& run);
    Reply Store(Way enWay, int nMaxRules);
    std::string ForceHint() const;

    SetupWish mWish;
    bool mBlJson;
    Lock mLock;
    Detected mDetected;
    Settings mBefore;
};

Reply Finder::Run() {
    if (!mLock.IsHeld()) {
        return IsTesting() ? AlreadyTesting() : Busy();
    }
    Reply reply;
    if (AreUnreadable(mDetected.szGateway)) {
        if (!PutAside()) {
            return Failure("the settings of the router cannot be read, and could not be put aside in /etc/portforward");
        }
        reply.rgszWarnings.emplace_back(
            "the settings that were stored cannot be read; they are kept as /etc/portforward/router.conf.unreadable");
    }
    mBefore = ReadSettings(true);
    if (const auto obstacle = Detect(mDetected, mBlJson)) {
        return *obstacle;
    }
    Reply found = mDetected.IsDone() ? ByFinding() : FailedDetection(mDetected);
    found.rgszWarnings.insert(found.rgszWarnings.begin(), reply.rgszWarnings.begin(), reply.rgszWarnings.end());
    if (const std::string szOther = OtherGateway(mDetected.szGateway); !szOther.empty()) {
        found.rgszWarnings.push_back(
            fmt::format("the settings that are stored are about another router ({})", Clean(szOther)));
    }
    if (mDetected.IsDone()) {
        DescribeVerdict(mDetected.result, mDetected.word, found);
    } else {
        AddEnvironment(mDetected.result, mDetected.word, found);
    }
    return found;
}

Reply Finder::ByFinding() {
    // Whoever has described the router's pages has had a reason.
    const bool blPages = mBefore.enFound == Found::kYes && *mBefore.conf.szConnType != '\0';
    if (blPages) {
        return ByPages();
    }
    switch (FindingOf(mDetected)) {
        case Finding::kKnown:
            return Store(WayOf(mDetected.result), -1);
        case Finding::kUntested:
            return ByTest();
        case Finding::kSpeaksNatpmp:
            return ByNatpmp();
        default:
            return Nothing();
    }
}

// ---- the ways ---------------------------------------------------------------------------------------------

Reply Finder::Store(Way enWay, int nMaxRules) {
    const DetectResult& result = mDetected.result;
    RouterConf conf = {};
    Put(conf.szBrand, result.szBrand);
    Put(conf.szModel, result.szModel);
    Put(conf.szVersion, result.szVersion);
    if (*conf.szBrand == '\0' && *conf.szModel == '\0' && *conf.szVersion == '\0') {
        Put(conf.szBrand, kNoBrand);
        Put(conf.szModel, kNatpmpModel);
    }
    Put(conf.szSupportUpnp, enWay == Way::kUpnp ? "yes" : "no");
    Put(conf.szSupportNatpmp, enWay == Way::kNatpmp ? "yes" : "no");
    Reply reply = StoreSettings(mDetected.szGateway, conf, nMaxRules, true);
    if (reply.enExit != kOk) {
        return reply;
    }
    const bool blChanged = mBefore.enFound != Found::kYes || !IsSame(conf, mBefore.conf);
    const auto rules = LoadRules();
    const bool blRules =
        rules && std::any_of(rules->begin(), rules->end(), [](const Rule& rule) { return rule.blEnabled; });
    reply.szMessage =
        fmt::format("the router {} is known now and is driven by {}", mDetected.szGateway, ToWords(enWay));
    if (blChanged && blRules) {
        reply.szMessage += "; 'sudo tavoportmap save' writes the rules that there are to it";
    }
    reply.jsAnswer["changed"] = blChanged;
    return reply;
}

Reply Finder::ByTest() {
    if (!mWish.blYes) {
        if (mBlJson || !IsAnybodyThere()) {
            return Untested();
        }
        const DetectResult& result = mDetected.result;
        if (!Confirm(
                fmt::format("{} ({}).\nA test makes some {} mappings on ports that nobody uses and takes them away "
                            "again; rules and other devices' mappings stay as they are. It takes a minute, on slow "
                            "routers some more. Test it now?",
                            FindingWords(Finding::kUntested, mDetected),
                            RouterName(result.szBrand, result.szModel, result.szVersion), kUsualTestRules))) {
            return Untested();
        }
    }
    if (IsTesting()) {
        return AlreadyTesting();
    }
    return AfterTest(RunTest(kUsualTestRules, mBlJson));
}

Reply Finder::Untested() const {
    return {.enExit = kFailed,
            .szMessage = FindingWords(Finding::kUntested, mDetected) +
                         ". Nothing was stored:\n"
                         "  sudo tavoportmap setup --yes                         tests it and stores the outcome\n"
                         "  sudo tavoportmap detect --last --save --trust-upnp   uses it untested"};
}

Reply Finder::AfterTest(const TestRun& run) {
    if (run.nResult < 0) {
        return SpeaksNatpmp(mDetected.word) ? ByNatpmp() : NotRun(run);
    }
    if (run.HasPassed()) {
        mDetected.result.enSupportUpnp = TAVO_ROUTER_SUPPORT_YES;
        mDetected.result.nMaxRule = run.result.nMaxRule;
        Reply reply = Store(Way::kUpnp, run.result.nMaxRule);
        if (reply.enExit != kOk && IsRouterKnown()) {  // the downloaded database has another limit, which comes first
            reply = Store(Way::kUpnp, -1);
        }
        reply.jsAnswer["tested"] = true;
        return reply;
    }
    if (SpeaksNatpmp(mDetected.word)) {
        Reply reply = ByNatpmp();
        reply.rgszWarnings.push_back(
            fmt::format("its UPnP failed the test ({}), so NAT-PMP is used", run.FailedWords()));
        return reply;
    }
    Reply reply{.enExit = kFailed,
                .szMessage = fmt::format(
                    "its UPnP failed the test: {}. Nothing was stored. {}. What can be done:\n"
                    "  - newer firmware, from its pages at http://{}/, then 'sudo tavoportmap setup'\n"
                    "  - sudo tavoportmap detect --last --save --trust-upnp   uses it all the same; each 'save' says\n"
                    "    what the router refused\n"
                    "  - {}",
                    run.FailedWords(), AfterFailure(), Clean(mDetected.szGateway), kManualWay)};
    reply.jsAnswer["failed_step"] = run.FailedName();
    return reply;
}

Reply Finder::ByNatpmp() {
    mDetected.result.enSupportNatpmp = TAVO_ROUTER_SUPPORT_YES;
    const bool blStored = mBefore.enFound == Found::kYes && std::string(mBefore.conf.szSupportNatpmp) == "yes";
    if (blStored) {  // under whatever name it was given
        Put(mDetected.result.szBrand, mBefore.conf.szBrand);
        Put(mDetected.result.szModel, mBefore.conf.szModel);
        Put(mDetected.result.szVersion, mBefore.conf.szVersion);
    }
    mDetected.result.nMaxRule = blStored ? std::atoi(mBefore.conf.szMaxRule) : 0;
    Reply reply = Store(Way::kNatpmp, -1);
    if (mDetected.word.nNatpmp == TAVO_NET_NATPMP_OFFLINE) {
        reply.rgszWarnings.emplace_back("the router says that it has no connection outside now");
    }
    return reply;
}

Reply Finder::ByPages() {
    const RouterConf& conf = mBefore.conf;
    Put(mDetected.result.szBrand, conf.szBrand);
    Put(mDetected.result.szModel, conf.szModel);
    Put(mDetected.result.szVersion, conf.szVersion);
    if (const auto szFault = WhyUnsavable(ReadStoredRouter(), mDetected.szGateway)) {
        return {.enExit = kFailed, .szMessage = *szFault};
    }
    Reply reply{.szMessage = fmt::format("the router {} stays driven through its own pages, as it is stored",
                                         mDetected.szGateway)};
    if (FindingOf(mDetected) != Finding::kNeither) {
        reply.rgszWarnings.push_back(FindingWords(FindingOf(mDetected), mDetected) +
                                     "; 'sudo tavoportmap router set --upnp yes' or '--natpmp yes' uses that instead");
    }
    return reply;
}

// What uses UPnP against the database's word.
std::string Finder::ForceHint() const {
    const DetectResult& result = mDetected.result;
    const auto fnQuoted = [](const std::string& szText) {
        std::string szQuoted = "'";
        for (const char c : szText) {
            szQuoted += c == '\'' ? std::string(R"('\'')") : std::string(1, c);
        }
        return Clean(szQuoted + "'");
    };
    return fmt::format("sudo tavoportmap router set --brand {} --model {} --version {} --upnp yes --natpmp no",
                       fnQuoted(result.szBrand), fnQuoted(result.szModel), fnQuoted(result.szVersion));
}

Reply Finder::Nothing() {
    const Finding enFinding = FindingOf(mDetected);
    std::string szMessage = FindingWords(enFinding, mDetected);
    const char* szStored = mBefore.enFound == Found::kYes ? "; what is stored of it stays as it is" : "";
    if (enFinding == Finding::kNoRouter || enFinding == Finding::kDistrusted || enFinding == Finding::kNameless) {
        szMessage += szStored;
    }
    switch (enFinding) {
        case Finding::kNoRouter:
            break;
        case Finding::kDistrusted:
            szMessage += ". To use it all the same:\n  " + ForceHint() + "\n" + kManualWay;
            break;
        case Finding::kNameless:
            szMessage +=
                ". Give it a name of your own to use it all the same:\n"
                "  sudo tavoportmap router set --brand BRAND --model MODEL --upnp yes --natpmp no\n";
            szMessage += kManualWay;
            break;
        default:
            szMessage += fmt::format(", then run 'sudo tavoportmap setup' again{}. {}", szStored, kManualWay);
    }
    return {.enExit = kFailed, .szMessage = szMessage};
}

}  // namespace

bool IsRouterKnown() {
    const auto szGateway = Gateway();
    return szGateway && !WhyUnsavable(ReadStoredRouter(), *szGateway);
}

Reply Setup(const SetupWish& wish, bool blJson) {
    if (const auto reply = NeedsRoot()) {
        return *reply;
    }
    const auto szGateway = Gateway();
    if (!szGateway) {
        return NoGateway();
    }
    if (!blJson) {
        Tell(Wrap(kIntroduction, WidthOf(STDERR_FILENO)));
    }
    Reply reply = Finder(wish, blJson, *szGateway).Run();
    if (reply.enExit == kOk && wish.blOffer) {
        OfferListeners(*szGateway, !wish.blYes && !blJson && IsAnybodyThere(), reply);
    }
    return reply;
}

void OfferSetup(CLI::App& app, Request& request) {
    const auto pWish = std::make_shared<SetupWish>();
    CLI::App* pSetup = AddCommand(app, "setup", "find out what the router is, test it and remember it: begin here");
    pSetup->add_flag("--yes", pWish->blYes, "ask nothing: test where that is needed, open no port");
    pSetup->footer(
        "Looks at the network, asks the router by UPnP and by NAT-PMP, and where nobody knows how far its model can be "
        "relied on tests it, which takes a minute and leaves nothing behind. Shows what listens on this box and could "
        "be opened. It can be run again at any time.\n");
    pSetup->callback(
        [pWish, &request] { request.fnCommand = [pWish, &request] { return Setup(*pWish, request.blJson); }; });
}

}  // namespace tavo::cli
