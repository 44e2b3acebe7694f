// upnpd in its test mode: tests by orders what a router does with mappings, and leaves none behind.
// Relies on TestMappings for the table, on TestRules for the orders, and on the IGD client.
// Promises: each step ends with its word in the progress file; the mappings are gone when it has ended,
// however it ends, and what a killed one has left goes at the next start; a signal ends it within three
// seconds; so do some minutes without an order. The daemon of the rules is not touched by it.
#pragma once

#include <functional>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "core/Descriptor.h"
#include "daemons/common/SignalQueue.h"
#include "daemons/common/TestMappings.h"
#include "upnp/Igd.h"

namespace tavo {

class TestDaemon {
public:
    // The exit status.
    int Run();

private:
    bool TakeLock();
    bool OpenSocket();
    bool FindRouter();
    bool HoldPort(uint16_t nPort);
    void LeadToEnd();
    bool Obey(const std::string& szOrder);
    bool Work(const char* szStep, bool (TestMappings::*pfnStep)(const std::function<bool()>&));
    bool IsSignalled();
    bool IsEndOrdered();
    void TakeOrders();
    std::string NextOrder();
    void Answer();
    bool Withdraw();
    void End();
    void Report(const char* szStep, const char* szWord) const;
    void WriteResults() const;

    SignalQueue mSignals;
    Descriptor mFdLock;
    Descriptor mFdOrders;
    std::vector<std::string> mRgszOrders;
    std::set<uint16_t> mSetRulePorts;  // what the rules ask for is not for tests
    std::vector<Descriptor> mRgFdPorts;
    std::unique_ptr<Igd> mPIgd;
    std::unique_ptr<TestMappings> mPMappings;
    const char* mSzFailed = nullptr;  // the step that could not be done
};

}  // namespace tavo
