// The test of single ports, step by step: who listens here, what the checker found, what of it came to this box.
// Relies on Checker, Responder and Arrivals. Promises: see PortTest.h.
#include "porttest/PortTest.h"

#include <arpa/inet.h>
#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <iterator>
#include <optional>

#include "ground/Descriptor.h"
#include "porttest/Arrivals.h"
#include "porttest/Responder.h"
#include "tavo/net.h"
#include "tavo/porttest.h"
#include "wire/portcheck/Checker.h"

namespace tavo {

namespace {

using Clock = std::chrono::steady_clock;

constexpr auto kTestLimit = std::chrono::seconds(30);
constexpr auto kServedLimit = std::chrono::seconds(1);

struct Item {
    const PortQuestion* pQuestion;
    PortVerdict verdict{TAVO_PORT_UNKNOWN, ""};
    bool blAsk = false;
    bool blChallenge = false;
    bool IsTcp() const { return pQuestion->mapping.szProtocol == "TCP"; }
    CheckedPort Asked() const { return {IsTcp(), pQuestion->mapping.nRouterPort, blChallenge}; }
};

int MillisecondsLeft(Clock::time_point end) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(end - Clock::now()).count();
    return static_cast<int>(std::max<int64_t>(left, 0));
}

std::string OnBox(const Item& item) {
    return "port " + std::to_string(item.pQuestion->mapping.nBoxPort) + " of this box";
}

std::optional<in_addr> OwnAddress() {
    char szGateway[INET_ADDRSTRLEN];
    char szOwn[INET_ADDRSTRLEN];
    in_addr own = {};
    if (TAVONetDefaultGatewayGet(szGateway, sizeof(szGateway)) != 0 ||
        TAVONetLocalAddressGet(szGateway, szOwn, sizeof(szOwn), nullptr, 0) != 0 ||
        inet_pton(AF_INET, szOwn, &own) != 1) {
        return std::nullopt;
    }
    return own;
}

// A port of the box is called at the address that the router sends to. The table of
// listeners would not do: it knows neither whether a listener on "::" takes IPv4 nor what is passed on to
// a container.
class ServedTest {
public:
    ServedTest(in_addr local, uint16_t nPort) : mFd(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0)) {
        sockaddr_in own = {};
        own.sin_family = AF_INET;
        own.sin_port = htons(nPort);
        own.sin_addr = local;
        if (connect(mFd.Get(), reinterpret_cast<const sockaddr*>(&own), sizeof(own)) != 0) {
            mBlRefused = errno == ECONNREFUSED;
            mBlOpen = errno == EINPROGRESS;
        }
    }
    pollfd Waiting() const { return {mBlOpen ? mFd.Get() : -1, POLLOUT, 0}; }
    bool IsOpen() const { return mBlOpen; }
    void Take() {
        int nError = 0;
        socklen_t nLength = sizeof(nError);
        mBlRefused = getsockopt(mFd.Get(), SOL_SOCKET, SO_ERROR, &nError, &nLength) == 0 && nError == ECONNREFUSED;
        mBlOpen = false;
    }
    bool IsRefused() const { return mBlRefused; }

private:
    Descriptor mFd;
    bool mBlOpen = false;
    bool mBlRefused = false;
};

// Ports that the box itself refuses; one that does not answer in time has somebody.
void FindListeners(in_addr local, std::vector<Item*>& rgItems) {
    std::vector<ServedTest> rgTests;
    for (const Item* pItem : rgItems) {
        rgTests.emplace_back(local, pItem->pQuestion->mapping.nBoxPort);
    }
    const Clock::time_point end = Clock::now() + kServedLimit;
    while (std::any_of(rgTests.begin(), rgTests.end(), [](const ServedTest& test) { return test.IsOpen(); })) {
        std::vector<pollfd> rgWaiting;
        for (const ServedTest& test : rgTests) {
            rgWaiting.push_back(test.Waiting());
        }
        if (poll(rgWaiting.data(), rgWaiting.size(), MillisecondsLeft(end)) <= 0) {
            break;
        }
        for (size_t i = 0; i < rgTests.size(); ++i) {
            if (rgWaiting[i].revents != 0) {
                rgTests[i].Take();
            }
        }
    }
    for (size_t i = 0; i < rgItems.size(); ++i) {
        rgItems[i]->blAsk = !rgTests[i].IsRefused();
        if (rgTests[i].IsRefused()) {
            rgItems[i]->verdict = {TAVO_PORT_NOLISTEN, "nobody listens on " + OnBox(*rgItems[i])};
        }
    }
}

// Everything that is judged with one nonce, one responder and one watch.
class Test {
public:
    Test(in_addr local, CheckerSettings settings)
        : mLocal(local),
          mNPortsPerRequest(settings.nPortsPerRequest),
          mChecker(std::move(settings)),
          mSzProbe(MakeNonce()),
          mSzAnswer(MakeNonce()),
          mResponder(local, mSzProbe, mSzAnswer) {}

    void Run(std::vector<Item>& rgItems);

private:
    void Prepare(std::vector<Item>& rgItems);
    void PrepareOwn(Item& item);
    bool AskAbout(const std::vector<Item*>& rgItems, Arrivals& arrivals);
    PortVerdict Judge(const Item& item, const PortFinding& finding, Arrivals& arrivals);
    PortVerdict JudgeConnection(const Item& item, const PortFinding& finding, Arrivals& arrivals);
    PortVerdict JudgeDatagram(const Item& item, const PortFinding& finding);
    void JudgeSilence();

    in_addr mLocal;
    size_t mNPortsPerRequest;
    Checker mChecker;
    std::string mSzProbe;
    std::string mSzAnswer;
    Responder mResponder;
    Clock::time_point mEnd = Clock::now() + kTestLimit;
    bool mBlUdpProven = false;
    std::vector<Item*> mRgSilent;  // UDP of which nothing was heard
};

void Test::PrepareOwn(Item& item) {
    const ListenEnd enEnd = mResponder.Listen(item.IsTcp(), item.pQuestion->mapping.nBoxPort);
    item.blAsk = item.blChallenge = enEnd == ListenEnd::kOurs;
    if (enEnd == ListenEnd::kTaken) {
        item.verdict.szReason = "a program has " + OnBox(item) + ", and what it would answer is not known; not tested";
    } else if (enEnd == ListenEnd::kForbidden) {
        item.verdict.szReason = "this user may not listen on " + OnBox(item) + "; not tested";
    }
}

void Test::Prepare(std::vector<Item>& rgItems) {
    std::vector<Item*> rgServed;
    for (Item& item : rgItems) {
        if (!item.IsTcp() || item.pQuestion->blOwnListener) {
            PrepareOwn(item);
        }
        if (item.IsTcp() && !item.blAsk) {
            rgServed.push_back(&item);
        }
    }
    FindListeners(mLocal, rgServed);
}

void Test::Run(std::vector<Item>& rgItems) {
    Prepare(rgItems);
    std::vector<Item*> rgAsked;
    for (Item& item : rgItems) {
        if (item.blAsk) {
            rgAsked.push_back(&item);
        }
    }
    Arrivals arrivals;
    mResponder.Start();
    for (size_t nFirst = 0; nFirst < rgAsked.size(); nFirst += mNPortsPerRequest) {
        const auto it = rgAsked.begin() + static_cast<std::ptrdiff_t>(nFirst);
        const auto nCount = static_cast<std::ptrdiff_t>(std::min(mNPortsPerRequest, rgAsked.size() - nFirst));
        if (!AskAbout({it, it + nCount}, arrivals)) {
            // A checker that failed once is not waited for again.
            std::for_each(it + nCount, rgAsked.end(), [&](Item* pItem) { pItem->verdict = (*it)->verdict; });
            break;
        }
    }
    JudgeSilence();
}

bool Test::AskAbout(const std::vector<Item*>& rgItems, Arrivals& arrivals) {
    std::vector<CheckedPort> rgPorts;
    std::transform(rgItems.begin(), rgItems.end(), std::back_inserter(rgPorts),
                   [](const Item* pItem) { return pItem->Asked(); });
    const int nLeft = MillisecondsLeft(mEnd);
    const CheckerAnswer answer = nLeft > 0
                                     ? mChecker.Ask(rgPorts, mSzProbe, mSzAnswer, nLeft)
                                     : CheckerAnswer{{}, "not tested: the port checker took too long over the others"};
    for (size_t i = 0; i < rgItems.size(); ++i) {
        Item& item = *rgItems[i];
        item.verdict = answer.rgFindings.empty() ? PortVerdict{TAVO_PORT_UNKNOWN, answer.szReason}
                                                 : Judge(item, answer.rgFindings[i], arrivals);
        if (!answer.rgFindings.empty() && !item.IsTcp() && item.verdict.szReason.empty()) {
            mRgSilent.push_back(&item);
        }
    }
    return !answer.rgFindings.empty();
}

PortVerdict Test::Judge(const Item& item, const PortFinding& finding, Arrivals& arrivals) {
    switch (finding.enState) {
        case PortState::kUnreachable:
            return {TAVO_PORT_REFUSED, "rejected by a router or firewall on the way"};
        case PortState::kUntold:
            return {TAVO_PORT_UNKNOWN, "the checker could not try it"};
        default:
            return item.IsTcp() ? JudgeConnection(item, finding, arrivals) : JudgeDatagram(item, finding);
    }
}

PortVerdict Test::JudgeConnection(const Item& item, const PortFinding& finding, Arrivals& arrivals) {
    const SingleMapping& mapping = item.pQuestion->mapping;
    // A listener of our own knows of itself whether it was called.
    const Arrival enArrival =
        item.blChallenge && finding.enState == PortState::kOpen
            ? (mResponder.HasArrived(true, mapping.nRouterPort) ? Arrival::kHere : Arrival::kElsewhere)
            : arrivals.Of(mapping.nBoxPort, finding.nSource);
    struct Row {
        PortState enState;
        Arrival enArrival;
        int enStatus;
        const char* szReason;
    };
    static constexpr Row kRows[] = {
        {PortState::kOpen, Arrival::kHere, TAVO_PORT_OPEN, "open"},
        {PortState::kOpen, Arrival::kElsewhere, TAVO_PORT_REFUSED, "another host answers on it, not this box"},
        {PortState::kOpen, Arrival::kUntold, TAVO_PORT_UNKNOWN,
         "something answers on it, but whether it is this box cannot be told"},
        {PortState::kRefused, Arrival::kHere, TAVO_PORT_REFUSED,
         "connection refused by this box itself: a firewall on it, or the program does not serve strangers"},
        {PortState::kRefused, Arrival::kElsewhere, TAVO_PORT_REFUSED,
         "connection refused before it came to this box: the router does not pass it on"},
        {PortState::kRefused, Arrival::kUntold, TAVO_PORT_REFUSED, "connection refused"},
        {PortState::kTimeout, Arrival::kHere, TAVO_PORT_TIMEOUT,
         "no answer, though the request came to this box: a firewall on it?"},
        {PortState::kTimeout, Arrival::kElsewhere, TAVO_PORT_TIMEOUT,
         "no answer, and nothing came to this box: the router, or a firewall in front of it, drops it"},
        {PortState::kTimeout, Arrival::kUntold, TAVO_PORT_TIMEOUT, "no answer"}};
    const auto* pRow = std::find_if(std::begin(kRows), std::end(kRows), [&](const Row& row) {
        return row.enState == finding.enState && row.enArrival == enArrival;
    });
    return {pRow->enStatus, pRow->szReason};
}

// No reason: nothing was heard, which JudgeSilence judges.
PortVerdict Test::JudgeDatagram(const Item& item, const PortFinding& finding) {
    if (mResponder.HasArrived(false, item.pQuestion->mapping.nRouterPort)) {
        mBlUdpProven = true;
        return finding.blAnswered
                   ? PortVerdict{TAVO_PORT_OPEN, "open"}
                   : PortVerdict{TAVO_PORT_OPEN, "open towards this box; the answer did not get back in time"};
    }
    switch (finding.enState) {
        case PortState::kOpen:  // it cannot know our answer unless the probe came here
            return {TAVO_PORT_UNKNOWN, "the port checker says what cannot be"};
        case PortState::kRefused:
            return {TAVO_PORT_REFUSED, "refused before it came to this box"};
        default:
            return {TAVO_PORT_UNKNOWN, ""};
    }
}

void Test::JudgeSilence() {
    for (Item* pItem : mRgSilent) {
        pItem->verdict = mBlUdpProven
                             ? PortVerdict{TAVO_PORT_TIMEOUT, "no probe arrived, though other UDP did"}
                             : PortVerdict{TAVO_PORT_UNKNOWN,
                                           "no probe arrived, and whether any UDP comes from the checker is not known"};
    }
}

std::vector<PortVerdict> AllUnknown(size_t nCount, const char* szReason) {
    return std::vector<PortVerdict>(nCount, {TAVO_PORT_UNKNOWN, szReason});
}

}  // namespace

std::vector<PortVerdict> TestPorts(const std::vector<PortQuestion>& rgQuestions) {
    const CheckerSettings settings = ReadCheckerSettings();
    if (settings.szUrl.empty()) {
        return AllUnknown(rgQuestions.size(),
                          "not tested: no port checker is configured (/etc/tavo/platform.conf, [portcheck])");
    }
    const std::optional<in_addr> local = OwnAddress();
    if (!local) {
        return AllUnknown(rgQuestions.size(), "not tested: there is no gateway");
    }
    std::vector<Item> rgItems;
    for (size_t i = 0; i < std::min(rgQuestions.size(), settings.nMaxPorts); ++i) {
        rgItems.push_back({&rgQuestions[i]});
    }
    Test(*local, settings).Run(rgItems);
    std::vector<PortVerdict> rgVerdicts;
    std::transform(rgItems.begin(), rgItems.end(), std::back_inserter(rgVerdicts),
                   [](Item& item) { return std::move(item.verdict); });
    rgVerdicts.resize(rgQuestions.size(),
                      {TAVO_PORT_UNKNOWN, "not tested: more ports than one test takes ([portcheck] max_ports)"});
    return rgVerdicts;
}

}  // namespace tavo
