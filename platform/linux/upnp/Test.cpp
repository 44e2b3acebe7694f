// The callers' side of the UPnP compatibility test. Relies on TestRules for the daemon in test mode, on the IGD
// client for reading the router's table, and on the port connection tester for the view from outside.
// Promises: see tavo/upnptest.h. A step that fails here has the daemon end: nobody else would tell it.
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <memory>

#include "ground/Border.h"
#include "ground/Fail.h"
#include "ground/Marks.h"
#include "ground/TextFile.h"
#include "porttest/PortTest.h"
#include "tavo/log.h"
#include "tavo/porttest.h"
#include "tavo/upnptest.h"
#include "wire/upnp/GatewayMemory.h"
#include "wire/upnptest/TestRules.h"

namespace {

using Clock = std::chrono::steady_clock;
using tavo::AtBorder;
using tavo::Fail;
using tavo::TestRule;

constexpr char kTestProgram[] = "/usr/tavo/sbin/upnpd";
constexpr int kMostRules = 1000;  // no router for a home keeps more
constexpr int kFindMilliseconds = 8000;
constexpr int kSilentAnswers = 2;          // in a row, before the router is given up
constexpr size_t kCheckedFromOutside = 4;  // a checker is a guest's host: few questions
constexpr int kMostLimitSeconds = 600;
constexpr mode_t kMarkerMode = 0644;

int gNLimitSeconds = 60;

void Log(const std::string& szText) {
    TAVOWriteLog(szText.c_str(), 1, 1);
}

// The router's table as the test sees it: bounded in time and in patience.
class TableReader {
public:
    explicit TableReader(int nLimitSeconds) : mEnd(Clock::now() + std::chrono::seconds(nLimitSeconds)) {
        mPIgd = tavo::FindGatewayIgd(std::min(nLimitSeconds * 1000, kFindMilliseconds), 0, &mSzBox);
    }
    // False: the router does not tell any more.
    bool Shows(const TestRule& rule, bool& blShown) {
        while (mPIgd != nullptr && mNSilent < kSilentAnswers && Clock::now() < mEnd) {
            tavo::IgdEntry entry;
            const int nCode = mPIgd->Get("TCP", rule.nRouterPort, entry);
            if (nCode >= 0) {  // whatever code it gives for an entry, it does not show one
                blShown = nCode == tavo::kWireOk && entry.szClient == mSzBox && entry.nBoxPort == rule.nBoxPort &&
                          entry.blEnabled;
                mNSilent = 0;
                return true;
            }
            ++mNSilent;
        }
        return false;
    }
    // How many mappings upnpd has at the router for the box; below 0: it cannot be told.
    int CountOwn() {
        std::vector<tavo::IgdEntry> rgTable;
        if (mPIgd == nullptr || mPIgd->List(rgTable) != tavo::kWireOk) {
            return -1;
        }
        return static_cast<int>(std::count_if(rgTable.begin(), rgTable.end(), [this](const auto& entry) {
            return entry.szClient == mSzBox && entry.szDescription.starts_with(tavo::kOwnPrefix);
        }));
    }

private:
    Clock::time_point mEnd;
    std::unique_ptr<tavo::Igd> mPIgd;
    std::string mSzBox;
    int mNSilent = 0;
};

std::vector<TestRule> KeptRules() {
    std::vector<TestRule> rgRules = tavo::LoadTestRules();
    std::erase_if(rgRules, [](const TestRule& rule) { return !rule.blKept; });
    return rgRules;
}

int CountHeld() {
    const size_t nAsked = tavo::LoadTestRules().size();
    const std::vector<TestRule> rgKept = KeptRules();
    TableReader table(gNLimitSeconds);
    int nHeld = 0;
    for (const TestRule& rule : rgKept) {
        bool blShown = false;
        if (!table.Shows(rule, blShown)) {
            return Fail(TLIBC_ERR_READ);
        }
        nHeld += blShown ? 1 : 0;
    }
    Log("the router holds " + std::to_string(nHeld) + " of " + std::to_string(nAsked) + " test mappings");
    if (nHeld > 0 && static_cast<size_t>(nHeld) < nAsked) {
        // The router is full, and what our rules have there already is a part of what it keeps for the box.
        const int nOwn = table.CountOwn();
        if (nOwn > 0) {
            Log("and " + std::to_string(nOwn) + " mappings of the rules");
            nHeld += nOwn;
        }
    }
    return nHeld;
}

// What the checker outside says of some of the test's ports, on which the daemon listens; empty when nobody was
// asked, or nobody could tell.
std::vector<int> AskOutside(const std::vector<TestRule>& rgKept) {
    std::vector<tavo::PortQuestion> rgQuestions;
    const size_t nStride = std::max<size_t>(1, rgKept.size() / kCheckedFromOutside);
    for (size_t i = 0; i < rgKept.size() && rgQuestions.size() < kCheckedFromOutside; i += nStride) {
        rgQuestions.push_back({{"TCP", rgKept[i].nRouterPort, rgKept[i].nBoxPort}});
    }
    std::vector<int> rgVerdicts;
    const std::vector<tavo::PortVerdict> rgAll = tavo::TestPorts(rgQuestions);
    for (size_t i = 0; i < rgAll.size(); ++i) {
        Log(std::to_string(rgQuestions[i].mapping.nRouterPort) + "/tcp: " + rgAll[i].szReason);
        if (rgAll[i].enStatus != TAVO_PORT_UNKNOWN && rgAll[i].enStatus != TAVO_PORT_NOLISTEN) {
            rgVerdicts.push_back(rgAll[i].enStatus);
        }
    }
    return rgVerdicts;
}

// True when the ports are as they should be, as seen from outside.
bool JudgeOutside(const std::vector<int>& rgVerdicts, bool blAdded) {
    const auto nOpen = std::count(rgVerdicts.begin(), rgVerdicts.end(), TAVO_PORT_OPEN);
    Log("from outside " + std::to_string(nOpen) + " of " + std::to_string(rgVerdicts.size()) + " test ports are open");
    return nOpen == (blAdded ? static_cast<std::ptrdiff_t>(rgVerdicts.size()) : 0);
}

// The same by the router's own word.
bool JudgeByTable(const std::vector<TestRule>& rgKept, bool blAdded) {
    Log("no checker outside can tell: the router's own table is the judge");
    TableReader table(gNLimitSeconds);
    size_t nShown = 0;
    for (const TestRule& rule : rgKept) {
        bool blShown = false;
        if (!table.Shows(rule, blShown)) {
            Log("the router does not answer");
            return false;
        }
        nShown += blShown ? 1 : 0;
    }
    Log("the router shows " + std::to_string(nShown) + " of " + std::to_string(rgKept.size()) + " test mappings");
    return nShown == (blAdded ? rgKept.size() : 0);
}

// Leaves what was found where a report of the test looks for it.
void WriteMarker(const std::vector<TestRule>& rgKept, bool blAdded, bool blGood) {
    std::string szText = std::string("wanted=\"") + (blAdded ? "open" : "closed") + "\"\n";
    for (const TestRule& rule : rgKept) {
        szText += std::to_string(rule.nRouterPort) + "/tcp=\"" + std::to_string(rule.nBoxPort) + "\"\n";
    }
    szText += std::string("result=\"") + (blGood ? tavo::kWordFinished : tavo::kWordFailed) + "\"\n";
    tavo::WriteFileAtomic(tavo::kPortTestMarker, szText, kMarkerMode);
}

int TestPorts(bool blAdded) {
    const std::vector<TestRule> rgKept = KeptRules();
    const int nMarked = TavoPortConnTestInit();  // first, for the report of a failure
    if (rgKept.empty() || !tavo::IsTestDaemonAlive()) {
        return Fail(TLIBC_ERR_NOT_FOUND);
    }
    if (nMarked < 0) {
        return -1;
    }
    const std::vector<int> rgVerdicts = AskOutside(rgKept);
    const bool blGood = rgVerdicts.empty() ? JudgeByTable(rgKept, blAdded) : JudgeOutside(rgVerdicts, blAdded);
    WriteMarker(rgKept, blAdded, blGood);
    return blGood ? 0 : Fail(TLIBC_ERR_READ);
}

// An answer that makes the caller give up ends the daemon.
template <typename Function>
int OrEnd(Function fnAnswer, int nLeast) {
    return AtBorder(-1, [&] {
        const int nResult = AtBorder(-1, fnAnswer);
        if (nResult < nLeast) {
            tavo::EndTestDaemon();
        }
        return nResult;
    });
}

std::vector<TestRule> NewRules(int nRules) {
    char szPort[8];
    TLIBPlatformSettingGet("upnptest", "first_port", "24500", szPort, sizeof(szPort));
    const long nFirst = std::clamp<long>(std::strtol(szPort, nullptr, 10), 1024, 60000);
    std::vector<TestRule> rgRules;
    for (int i = 0; i < std::min(nRules, kMostRules); ++i) {
        const auto nPort = static_cast<uint16_t>(nFirst + i);
        rgRules.push_back({nPort, nPort, false, ""});
    }
    return rgRules;
}

}  // namespace

int TAVOUPnPAddTest(int nRules) {
    return AtBorder(-1, [&] {
        // A report of a test that ends early, wherever that is, is made of the same files as any other.
        TLIBCFileTouch(tavo::kUpnpResults);
        TavoPortConnTestInit();
        if (nRules < 1 || tavo::IsTestDaemonAlive()) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        if (!tavo::SaveTestRules(NewRules(nRules))) {
            return -1;
        }
        return TLIBCExec(kTestProgram, "--debug", "-p", nullptr, nullptr);
    });
}

int TAVOUPnPCountMaxRule() {
    return OrEnd(&CountHeld, 1);
}

int TAVOUPnPDeletetest() {
    return AtBorder(-1, [] {
        const bool blEnd = tavo::IsStepUnderWay(tavo::kStepTerminal);
        return tavo::SendTestOrder(blEnd ? tavo::kOrderEnd : tavo::kOrderDelete) ? 0 : Fail(TLIBC_ERR_NOT_FOUND);
    });
}

int TAVOUPnPSetupTest(int nLimitSeconds, int nFlags) {
    return OrEnd(
        [&] {
            const int nMarked = TavoPortConnTestInit();  // first, as above
            if (nLimitSeconds < 1 || nFlags != 0 || !tavo::IsTestDaemonAlive()) {
                return Fail(TLIBC_ERR_BAD_PARAMETER);
            }
            gNLimitSeconds = std::min(nLimitSeconds, kMostLimitSeconds);
            return nMarked < 0 ? -1 : 0;
        },
        0);
}

int TAVOUPnPPortTest(int blAdded) {
    return OrEnd([&] { return TestPorts(blAdded != 0); }, 0);
}

int TAVOUPnPModifyRule() {
    return AtBorder(-1, [] { return tavo::SendTestOrder(tavo::kOrderModify) ? 0 : Fail(TLIBC_ERR_NOT_FOUND); });
}

int TAVOUpnpRemoveTestRulePath() {
    return tavo::RemoveTestRules() ? 0 : Fail(TLIBC_ERR_WRITE);
}

int TAVOUpnpReportTestProgress(const char* szStep, const char* szValue, int /*nFlags*/) {
    return TLIBCFileSetKeyValue(tavo::kTestProgress, szStep, szValue, nullptr) == 1 ? 0 : -1;
}

const char* GetUPnPReportServer() {
    static char szServer[1024];
    TLIBPlatformSettingGet("report", "server", "", szServer, sizeof(szServer));
    return szServer;
}
