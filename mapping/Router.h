// A router's table of port mappings, whatever protocol is spoken to it.
// Relies on nothing. Promises: every call is bounded in time by its implementation.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace tavo {

// Every description that we give to a rule's mapping begins with this; it tells ours from everybody else's.
inline constexpr char kOwnPrefix[] = "tavo:";
// The same for the mappings that only test a router.
inline constexpr char kTestPrefix[] = "tavotest:";

struct RouterMapping {
    std::string szProtocol;  // "TCP" or "UDP"
    uint16_t nRouterPort = 0;
    uint16_t nBoxPort = 0;
    std::string szClient;       // dotted address of the host behind the port
    std::string szDescription;  // printable, bounded
    uint32_t nLease = 0;        // seconds; 0: until the router restarts
    bool blEnabled = true;
};

// Answers of a router: 0, the protocol's own error code above 0, or why there was no answer below 0.
enum RouterCode : int {
    kRouterOk = 0,
    kRouterTimeout = -1,
    kRouterUnreachable = -2,
    kRouterGarbage = -3,
    kRouterTooLong = -4,  // a table that could not be read to its end in time
    kRouterInvalidAction = 401,
    kRouterInvalidArgs = 402,
    kRouterNoSuchIndex = 713,
    kRouterNoSuchEntry = 714,
    kRouterConflict = 718,
    kRouterOnlyPermanentLeases = 725
};

class Router {
public:
    virtual ~Router() = default;
    // Outputs are set only with kRouterOk; with kRouterTooLong, List() has what was read.
    virtual int List(std::vector<RouterMapping>& rgMappings) = 0;
    // The box's own mappings between two ports, where the router can show them at once. May leave some
    // out: what it shows is there, what it does not show may be there too.
    virtual int ListRange(const std::string& /*szProtocol*/, uint16_t /*nFirst*/, uint16_t /*nLast*/,
                          std::vector<RouterMapping>& /*rgMappings*/) {
        return kRouterInvalidAction;
    }
    virtual int Get(const std::string& szProtocol, uint16_t nRouterPort, RouterMapping& mapping) = 0;
    virtual int Add(const RouterMapping& mapping) = 0;
    virtual int Remove(const std::string& szProtocol, uint16_t nRouterPort) = 0;
};

}  // namespace tavo
