// A router's table of port mappings, whatever protocol is spoken to it.
// Relies on nothing. Promises: every call is bounded in time by its implementation.
#pragma once

#include <cstdint>
#include <string>
#include <utility>
#include <vector>

namespace tavo {

struct RouterMapping {
    std::string szProtocol;  // "TCP" or "UDP"; "BOTH" where one entry of the router is for the two
    uint16_t nRouterPort = 0;
    uint16_t nBoxPort = 0;
    std::string szClient;       // dotted address of the host behind the port; empty: the router does not show it
    std::string szDescription;  // printable, bounded
    uint32_t nLease = 0;        // seconds; 0: until the router restarts
    bool blEnabled = true;
    uint16_t nMore = 0;  // further ports, one for one: the entry is a range
};

// All that a router can say. What its protocol calls it is known to the adapter alone.
enum class Reply {
    kOk,
    // No answer: nobody knows what came of the question.
    kTimeout,
    kUnreachable,
    kGarbage,
    kTooLong,  // a table that could not be read to its end in time
    // Refusals.
    kNoSuchEntry,
    kConflict,
    kOnlyPermanent,  // it takes no lease
    kBadArguments,   // which some say instead
    kElsewhere,      // it was made at another port of the router than the one that was asked for
    kRefused
};

struct RouterReply {
    Reply enReply = Reply::kOk;
    std::string szWord = {};  // for the result file; empty with kOk

    bool IsOk() const { return enReply == Reply::kOk; }
    bool IsSilence() const { return enReply >= Reply::kTimeout && enReply <= Reply::kTooLong; }
    bool IsRefusal() const { return enReply > Reply::kTooLong; }
};

// What a router can do.
struct Abilities {
    bool blShows = true;       // its table can be read; else what it has granted is what there is to know
    bool blLeases = false;     // every mapping ends by itself, whatever becomes of the answer
    bool blByBoxPort = false;  // it knows a mapping by its client and the client\'s port, and has one for each
    std::string szConflict = "conflict";  // its word for kConflict
    // Its table is kept as in a form: an entry is changed by taking it away and making it anew, what was done takes
    // effect together, by Apply(), and any change may move the other entries. To look at one costs nothing.
    bool blForm = false;
};

class Router {
public:
    virtual ~Router() = default;
    virtual Abilities What() const { return {}; }
    // Outputs are set only with kOk; with kTooLong, List() has what was read. Of a router that shows nothing: whether
    // it is there.
    virtual RouterReply List(std::vector<RouterMapping>& rgMappings) = 0;
    // The box's own mappings between two ports, where the router can show them at once. May leave some
    // out: what it shows is there, what it does not show may be there too.
    virtual RouterReply ListRange(const std::string& /*szProtocol*/, uint16_t /*nFirst*/, uint16_t /*nLast*/,
                                  std::vector<RouterMapping>& /*rgMappings*/) {
        return {Reply::kRefused};
    }
    // After kConflict: the entry in the way, which may be a range that begins elsewhere.
    virtual RouterReply Get(const std::string& szProtocol, uint16_t nRouterPort, RouterMapping& mapping) = 0;
    // mapping becomes what was made, as far as the router says: its lease, and with kElsewhere its port.
    virtual RouterReply Add(RouterMapping& mapping) = 0;
    // What is known of the mapping: protocols differ in what they call it by.
    virtual RouterReply Remove(const RouterMapping& mapping) = 0;
    // Has what was done since take effect, on a form.
    virtual RouterReply Apply() { return {}; }
};

}  // namespace tavo
