// NAT-PMP requests, one at a time, each with its answer or the reason why there is none.
// Relies on libnatpmp. Promises: see Client.h.
#include "wire/pcp/Client.h"

#include <arpa/inet.h>
#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <utility>

namespace tavo {

namespace {

// The protocol would have a client send again after 250 ms, then after twice as long each time, up to
// nine times: 64 s in all, for a router a few metres away that answers within milliseconds or never. A
// user waits for a save, so we hear out five transmissions: 0.25 + 0.5 + 1 + 2 + 4 s.
constexpr auto kAnswerLimit = std::chrono::milliseconds(7750);
constexpr int kLeastPollMilliseconds = 10;
constexpr int kMostPollMilliseconds = 100;  // so that a stop is seen soon

// What reading found when it found no end yet: no code of ours, of the library's or of the protocol's.
enum Unfinished : int { kNotYet = 1 << 16, kForeign };

constexpr std::pair<int, int> kCodes[] = {{0, kWireOk},
                                          {NATPMP_TRYAGAIN, kNotYet},
                                          {NATPMP_ERR_UNSUPPORTEDVERSION, kNatpmpUnsupportedVersion},
                                          {NATPMP_ERR_NOTAUTHORIZED, kNatpmpNotAuthorised},
                                          {NATPMP_ERR_NETWORKFAILURE, kNatpmpNetworkFailure},
                                          {NATPMP_ERR_OUTOFRESOURCES, kNatpmpOutOfResources},
                                          {NATPMP_ERR_UNSUPPORTEDOPCODE, kNatpmpUnsupportedOpcode},
                                          {NATPMP_ERR_NOGATEWAYSUPPORT, kWireTimeout}};  // after its last sending

constexpr std::pair<int, const char*> kWords[] = {{kWireTimeout, "no answer from the gateway"},
                                                  {kWireUnreachable, "the gateway cannot be reached by NAT-PMP"},
                                                  {kWireGarbage, "senseless answers from the gateway"},
                                                  {kNatpmpUnsupportedVersion, "refused: unsupported version"},
                                                  {kNatpmpNotAuthorised, "refused: not authorised"},
                                                  {kNatpmpNetworkFailure, "refused: network failure"},
                                                  {kNatpmpOutOfResources, "refused: out of resources"},
                                                  {kNatpmpUnsupportedOpcode, "refused: unsupported opcode"}};

constexpr uint8_t kAnswerBit = 0x80;
constexpr ssize_t kHeaderSize = 8;
constexpr ssize_t kShortAnswerSize = 12;  // with an address, or with both ports
constexpr ssize_t kMappingAnswerSize = 16;

uint16_t Number16(const uint8_t* pBytes) {
    return static_cast<uint16_t>(pBytes[0] << 8U | pBytes[1]);
}

// Whether a datagram answers the question. One to a question of before may still have been under way.
bool IsAnswer(const uint8_t* pDatagram, ssize_t nSize, const NatpmpQuestion& question) {
    if (nSize < kHeaderSize || pDatagram[1] != (kAnswerBit | question.nOpcode)) {
        return false;
    }
    if (pDatagram[0] != 0) {
        return true;  // another version of the protocol, which is an answer too
    }
    const bool blRefusal = Number16(pDatagram + 2) != 0;
    if (question.nOpcode == 0) {
        return blRefusal || nSize >= kShortAnswerSize;
    }
    if (blRefusal && (nSize < kShortAnswerSize || Number16(pDatagram + 8) == 0)) {
        return true;  // some leave the port out
    }
    if (Number16(pDatagram + 8) != question.nBoxPort || (!blRefusal && nSize < kMappingAnswerSize)) {
        return false;
    }
    const bool blLasting = Number16(pDatagram + 12) != 0 || Number16(pDatagram + 14) != 0;
    return blRefusal || (blLasting == question.blLasting && (!blLasting || Number16(pDatagram + 10) != 0));
}

// The library's answer codes as ours.
int CodeOf(int nLibrary, const natpmpresp_t& answer) {
    if (nLibrary == NATPMP_ERR_UNDEFINEDERROR) {
        return answer.resultcode;
    }
    for (const auto& [nKnown, nCode] : kCodes) {
        if (nKnown == nLibrary) {
            return nCode;
        }
    }
    return kWireUnreachable;
}

}  // namespace

std::string NatpmpWords(int nCode) {
    for (const auto& [nKnown, szWords] : kWords) {
        if (nKnown == nCode) {
            return szWords;
        }
    }
    return "refused: code " + std::to_string(nCode);
}

NatpmpClient::NatpmpClient(const std::string& szGateway, std::function<bool()> fnStop,
                           std::function<void(uint32_t)> fnEpoch)
    : mFnStop(std::move(fnStop)), mFnEpoch(std::move(fnEpoch)) {
    in_addr gateway = {};
    mBlOpen = inet_pton(AF_INET, szGateway.c_str(), &gateway) == 1 && initnatpmp(&mHandle, 1, gateway.s_addr) == 0;
}

NatpmpClient::~NatpmpClient() {
    if (mBlOpen) {
        closenatpmp(&mHandle);
    }
}

// Takes one datagram, or has the library send again when it is time.
int NatpmpClient::Read(const NatpmpQuestion& question, natpmpresp_t& answer) {
    uint8_t rgDatagram[kMappingAnswerSize] = {};
    const ssize_t nSize = recv(mHandle.s, rgDatagram, sizeof(rgDatagram), MSG_PEEK | MSG_TRUNC | MSG_DONTWAIT);
    if (nSize < 0 && errno != EAGAIN) {
        return kWireUnreachable;  // above all: nobody listens at the gateway's port
    }
    if (nSize >= 0 && !IsAnswer(rgDatagram, nSize, question)) {
        recv(mHandle.s, nullptr, 0, MSG_DONTWAIT);  // a datagram is gone when any of it was read
        return kForeign;
    }
    return CodeOf(readnatpmpresponseorretry(&mHandle, &answer), answer);
}

int NatpmpClient::Ask(const NatpmpQuestion& question, int nSent, natpmpresp_t& answer) {
    if (nSent < 0) {
        return kWireUnreachable;
    }
    const auto end = std::chrono::steady_clock::now() + kAnswerLimit;
    int nFailure = kWireTimeout;
    while (std::chrono::steady_clock::now() < end && !mFnStop()) {
        timeval left = {};
        getnatpmprequesttimeout(&mHandle, &left);
        const long nLeft = left.tv_sec * 1000 + left.tv_usec / 1000;
        pollfd waiting = {mHandle.s, POLLIN, 0};
        poll(&waiting, 1, static_cast<int>(std::clamp<long>(nLeft, kLeastPollMilliseconds, kMostPollMilliseconds)));
        const int nCode = Read(question, answer);
        if (nCode == kWireOk) {
            mFnEpoch(answer.epoch);
        }
        if (nCode != kNotYet && nCode != kForeign) {
            return nCode;
        }
        nFailure = nCode == kForeign ? kWireGarbage : nFailure;
    }
    return nFailure;
}

int NatpmpClient::AskAddress(std::string& szAddress) {
    natpmpresp_t answer = {};
    const int nCode = mBlOpen ? Ask({0, 0, false}, sendpublicaddressrequest(&mHandle), answer) : int{kWireUnreachable};
    char szText[INET_ADDRSTRLEN] = {};
    if (nCode == kWireOk) {
        szAddress = inet_ntop(AF_INET, &answer.pnu.publicaddress.addr, szText, sizeof(szText));
    }
    return nCode;
}

int NatpmpClient::AskMapping(const std::string& szProtocol, uint16_t nBoxPort, uint16_t nRouterPort, uint32_t nLifetime,
                             natpmpresp_t& answer) {
    if (!mBlOpen) {
        return kWireUnreachable;
    }
    const uint8_t nOpcode = szProtocol == "TCP" ? NATPMP_PROTOCOL_TCP : NATPMP_PROTOCOL_UDP;
    const int nSent = sendnewportmappingrequest(&mHandle, nOpcode, nBoxPort, nRouterPort, nLifetime);
    return Ask({nOpcode, nBoxPort, nLifetime != 0}, nSent, answer);
}

int NatpmpClient::Map(const std::string& szProtocol, uint16_t nBoxPort, uint16_t nRouterPort, uint32_t nLifetime,
                      NatpmpGrant& grant) {
    natpmpresp_t answer = {};
    const int nCode = AskMapping(szProtocol, nBoxPort, nRouterPort, nLifetime, answer);
    if (nCode == kWireOk) {
        grant = {answer.pnu.newportmapping.mappedpublicport, answer.pnu.newportmapping.lifetime};
    }
    return nCode;
}

int NatpmpClient::Unmap(const std::string& szProtocol, uint16_t nBoxPort) {
    natpmpresp_t answer = {};
    return AskMapping(szProtocol, nBoxPort, 0, 0, answer);
}

}  // namespace tavo
