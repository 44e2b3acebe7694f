// How many address translations stand in front of the box, told from addresses alone.
// Relies on nothing. Promises: no traffic; the same evidence gives the same answer.
#pragma once

#include <netinet/in.h>

#include <optional>
#include <vector>

namespace tavo {

enum class AddressKind {
    kPublic,   // the networks set aside for documentation (203.0.113.0/24 and so on) count as public
    kPrivate,  // 10/8, 172.16/12, 192.168/16
    kCarrier,  // 100.64/10, between a carrier's translation and its customers
    kNone      // loopback, link-local, multicast, reserved: says nothing about a place in the network
};
AddressKind KindOf(const in_addr& address);

struct LevelEvidence {
    in_addr own = {};
    // What the gateway says is its address on the other side.
    std::optional<in_addr> external;
    // A packet for that address that may make one hop only was passed on (and died): it is not the gateway's.
    bool blExternalElsewhere = false;
    // The routers beyond the gateway, in order; nothing for one that stayed silent.
    std::vector<std::optional<in_addr>> rgBeyond;
};

// 0: the box's own address is public.
// At least 1 otherwise, and one more for a private network, and for a carrier's (at the box or outside
// the gateway), that lies before the public one. What the gateway says of its outside counts first: a
// public address that is really its own ends the question, because providers number routers of their own
// privately without translating anything. Else the routers beyond it are looked at, up to the first
// public one.
// Nothing: the box's address is private, the gateway says nothing, and no router beyond it answered.
std::optional<int> LevelOf(const LevelEvidence& evidence);

}  // namespace tavo
