// Speaks NAT-PMP to one gateway. Relies on Packet and Exchange.
// Promises: every call is bounded in time; an answer is one to the question asked, from the gateway's
// own port; outputs are set only with kWireOk.
#pragma once

#include <netinet/in.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "wire/Answer.h"
#include "wire/pcp/Packet.h"

namespace tavo {

// The protocol's own result codes; they come beside those of WireCode.
enum NatpmpCode : int {
    kNatpmpUnsupportedVersion = 1,
    kNatpmpNotAuthorised = 2,
    kNatpmpNetworkFailure = 3,
    kNatpmpOutOfResources = 4,
    kNatpmpUnsupportedOpcode = 5
};

// Why a call failed, as a user reads it.
std::string NatpmpWords(int nCode);

struct NatpmpGrant {
    uint16_t nRouterPort = 0;
    uint32_t nLifetime = 0;  // seconds
};

// The protocol would have a client send up to nine times: 64 s in all, for a router a few metres away that answers
// within milliseconds or never. A user waits for a save, so we hear out five: 0.25 + 0.5 + 1 + 2 + 4 s.
inline constexpr std::chrono::milliseconds kNatpmpLimit(7750);

class NatpmpClient {
public:
    // fnStop: whether to end a call early, as if there were no answer. fnEpoch: is told the gateway's
    // "seconds since start" of each good answer. Either may be empty. limit: of each call.
    NatpmpClient(const std::string& szGateway, std::function<bool()> fnStop, std::function<void(uint32_t)> fnEpoch,
                 std::chrono::milliseconds limit = kNatpmpLimit);

    // Asks from this address of the box's from now on.
    void SetSource(const std::string& szAddress);
    // "0.0.0.0" from a gateway that has none now.
    int AskAddress(std::string& szAddress);
    // szProtocol: "TCP" or "UDP". The gateway may grant another router port and another lifetime.
    int Map(const std::string& szProtocol, uint16_t nBoxPort, uint16_t nRouterPort, uint32_t nLifetime,
            NatpmpGrant& grant);
    // Every mapping of the box's port goes, whatever its router port. No such mapping: kWireOk.
    int Unmap(const std::string& szProtocol, uint16_t nBoxPort);

private:
    int Ask(const NatpmpQuestion& question, NatpmpAnswer& answer);

    in_addr mSource = {};
    std::optional<in_addr> mGateway;  // nothing where what was given is no address
    std::function<bool()> mFnStop;
    std::function<void(uint32_t)> mFnEpoch;
    std::chrono::milliseconds mLimit;
};

// Whether a gateway speaks NAT-PMP, and what its outside address is. Changes nothing there; less than a second.
struct NatPmpWord {
    std::optional<int> nCode;        // the protocol's result code; nothing when the gateway does not speak NAT-PMP
    std::optional<in_addr> address;  // nothing when it refuses, or has no outside address now
};
NatPmpWord AskNatPmp(const std::string& szGateway);

}  // namespace tavo
