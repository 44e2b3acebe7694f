// The packets of NAT-PMP (RFC 6886), and of PCP (RFC 6887) the announcement. Relies on nothing but the bytes.
// Promises: never reads past the end of a datagram; what is not plainly an answer to the question is none.
#pragma once

#include <netinet/in.h>

#include <cstdint>
#include <optional>
#include <span>
#include <vector>

namespace tavo {

inline constexpr uint16_t kGatewayPort = 5351;       // where a gateway takes questions
inline constexpr uint16_t kAnnouncementPort = 5350;  // where its clients hear what it says of its own accord
inline constexpr size_t kMostPacket = 1100;          // bytes, of any packet of either protocol

enum NatpmpOpcode : uint8_t { kAskAddress = 0, kMapUdp = 1, kMapTcp = 2 };

struct NatpmpQuestion {
    NatpmpOpcode enOpcode = kAskAddress;
    uint16_t nBoxPort = 0;  // this and the rest: of a mapping only
    uint16_t nRouterPort = 0;
    uint32_t nLifetime = 0;  // seconds; 0 ends a mapping
};
std::vector<uint8_t> BytesOf(const NatpmpQuestion& question);

struct NatpmpAnswer {
    bool blOtherVersion = false;  // in a protocol that is not ours: all that it says is that it does not speak ours
    uint16_t nResult = 0;         // 0: success, and only then the rest is set
    uint32_t nEpoch = 0;          // seconds since the gateway started
    in_addr address = {};         // of the answer to kAskAddress
    uint16_t nRouterPort = 0;     // these two: of the answer to a mapping
    uint32_t nLifetime = 0;
};
// Nothing when the datagram does not answer the question: one to a question of before may still have been under way.
std::optional<NatpmpAnswer> ReadAnswer(std::span<const uint8_t> rgDatagram, const NatpmpQuestion& question);

// What a gateway that has started, or has another address, says to everybody.
struct GatewayAnnouncement {
    bool blPcp;       // else by NAT-PMP
    uint32_t nEpoch;  // seconds since it started
};
std::optional<GatewayAnnouncement> ReadAnnouncement(std::span<const uint8_t> rgDatagram);

}  // namespace tavo
