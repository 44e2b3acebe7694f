// upnpd in its test mode: tests by orders what a router does with mappings, and leaves none behind.
// Relies on TestMappings for the table, on TestRules for the orders, and on the IGD client.
// Promises: each step ends with its word in the progress file; the mappings are gone when it has ended,
// however it ends: of its two processes one watches over the other, and what both leave, killed at once, goes
// at the next start; a signal ends it within three seconds, some minutes without an order end it as well. The
// daemon of the rules is not touched by it.
#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "ground/Descriptor.h"
#include "ground/FileLock.h"
#include "programs/common/IgdRouter.h"
#include "programs/common/SignalQueue.h"
#include "programs/upnpd/TestMappings.h"
#include "wire/upnp/Igd.h"

namespace tavo {

class TestDaemon {
public:
    // The exit status.
    int Run();

private:
    int RunTest();
    int WatchOver(pid_t pid);
    bool TakeLock();
    bool OpenSocket();
    bool FindRouter();
    bool HoldPort(uint16_t nPort);
    bool LeadToEnd();
    bool Obey(const std::string& szOrder);
    bool Work(const char* szStep, bool (TestMappings::*pfnStep)(const std::function<bool()>&));
    bool IsSignalled();
    bool IsEndOrdered();
    void TakeOrders();
    std::string NextOrder();
    void Answer();
    bool Withdraw();
    void End();
    void WriteResults() const;

    SignalQueue mSignals;
    FileLock mLock;
    Descriptor mFdOrders;
    std::vector<std::string> mRgszOrders;
    std::set<uint16_t> mSetRulePorts;  // what the rules ask for is not for tests
    std::vector<Descriptor> mRgFdPorts;
    std::unique_ptr<Igd> mPIgd;
    std::unique_ptr<IgdRouter> mPRouter;
    std::unique_ptr<TestMappings> mPMappings;
};

}  // namespace tavo
