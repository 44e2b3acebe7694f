// Speaks NAT-PMP to one gateway. Relies on libnatpmp, which sends and sends again, and on a look at each
// datagram before the library takes it: the library checks neither its length nor what it answers.
// Promises: every call is bounded in time; an answer is one to the question asked, from the gateway's
// own port; outputs are set only with kWireOk.
#pragma once

#include <natpmp.h>

#include <cstdint>
#include <functional>
#include <string>

#include "wire/Answer.h"

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

struct NatpmpQuestion {
    uint8_t nOpcode;  // 0: the address; 1, 2: a mapping
    uint16_t nBoxPort;
    bool blLasting;  // a mapping that is to stay, as against the end of one
};

class NatpmpClient {
public:
    // fnStop: whether to end a call early, as if there were no answer. fnEpoch: is told the gateway's
    // "seconds since start" of each good answer.
    NatpmpClient(const std::string& szGateway, std::function<bool()> fnStop, std::function<void(uint32_t)> fnEpoch);
    ~NatpmpClient();
    NatpmpClient(const NatpmpClient&) = delete;
    NatpmpClient& operator=(const NatpmpClient&) = delete;

    int AskAddress(std::string& szAddress);
    // szProtocol: "TCP" or "UDP". The gateway may grant another router port and another lifetime.
    int Map(const std::string& szProtocol, uint16_t nBoxPort, uint16_t nRouterPort, uint32_t nLifetime,
            NatpmpGrant& grant);
    // Every mapping of the box's port goes, whatever its router port. No such mapping: kWireOk.
    int Unmap(const std::string& szProtocol, uint16_t nBoxPort);

private:
    int Ask(const NatpmpQuestion& question, int nSent, natpmpresp_t& answer);
    int Read(const NatpmpQuestion& question, natpmpresp_t& answer);
    int AskMapping(const std::string& szProtocol, uint16_t nBoxPort, uint16_t nRouterPort, uint32_t nLifetime,
                   natpmpresp_t& answer);

    natpmp_t mHandle = {};
    bool mBlOpen;
    std::function<bool()> mFnStop;
    std::function<void(uint32_t)> mFnEpoch;
};

}  // namespace tavo
