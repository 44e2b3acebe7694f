// What the two sides of the UPnP compatibility test share: the file of test rules, the words of the progress
// file, and the orders that the callers give to the daemon in test mode.
// Relies on a sectioned file below /var/lib/tavo and on a datagram socket below /var/run that only the system
// may write to: an order reaches a daemon that lives, or is known not to have reached one.
// Promises: reading and giving orders never waits long for the other side.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace tavo {

inline constexpr char kTestDaemon[] = "/usr/tavo/sbin/upnpd --debug -p";  // its whole command line
inline constexpr char kTestSocket[] = "/var/run/upnpd_test.sock";
inline constexpr char kTestProgress[] = "/tmp/upnp_test.progress";
inline constexpr char kPortTestMarker[] = "/tmp/pfStatusRule";
inline constexpr char kUpnpResults[] = "/var/tmp/upnp_portmap.status";  // as of the daemon of the rules

inline constexpr char kOrderDelete[] = "delete";
inline constexpr char kOrderModify[] = "modify";
inline constexpr char kOrderEnd[] = "end";

inline constexpr char kStepAdd[] = "upnp_add";
inline constexpr char kStepDelete[] = "upnp_delete";
inline constexpr char kStepReadd[] = "upnp_readd1";
inline constexpr char kStepChange[] = "upnp_readd2";
inline constexpr char kStepTerminal[] = "upnp_terminal";
inline constexpr char kWordProcessing[] = "processing";
inline constexpr char kWordFinished[] = "finished";
inline constexpr char kWordFailed[] = "failed";

// One mapping of the test, TCP.
struct TestRule {
    uint16_t nRouterPort = 0;
    uint16_t nBoxPort = 0;
    bool blKept = false;   // the router showed it when it had been made
    std::string szResult;  // as in upnpd's result file: "1", or why not; empty: not tried yet
};

// Empty when there is no such file, or it cannot be read.
std::vector<TestRule> LoadTestRules();
bool SaveTestRules(const std::vector<TestRule>& rgRules);
bool RemoveTestRules();

// Whether the progress file says that a step is being worked at.
bool IsStepUnderWay(const char* szStep);

// Whether the daemon in test mode runs.
bool IsTestDaemonAlive();
// Gives an order; false when there is no daemon to take it.
bool SendTestOrder(std::string_view szOrder);
// Has the daemon end, and waits for that, within a bound.
void EndTestDaemon();

}  // namespace tavo
