// NAT-PMP requests, one at a time, each with its answer or the reason why there is none. Promises: see Client.h.
#include "wire/pcp/Client.h"

#include <arpa/inet.h>

#include <utility>

#include "wire/pcp/Exchange.h"

namespace tavo {

namespace {

constexpr std::chrono::milliseconds kQuickLimit(750);  // asked twice

constexpr std::pair<int, const char*> kWords[] = {{kWireTimeout, "no answer from the gateway"},
                                                  {kWireUnreachable, "the gateway cannot be reached by NAT-PMP"},
                                                  {kWireGarbage, "senseless answers from the gateway"},
                                                  {kNatpmpUnsupportedVersion, "refused: unsupported version"},
                                                  {kNatpmpNotAuthorised, "refused: not authorised"},
                                                  {kNatpmpNetworkFailure, "refused: network failure"},
                                                  {kNatpmpOutOfResources, "refused: out of resources"},
                                                  {kNatpmpUnsupportedOpcode, "refused: unsupported opcode"}};

int CodeOf(ExchangeEnd enEnd, const NatpmpAnswer& answer) {
    switch (enEnd) {
        case ExchangeEnd::kAnswered:
            return answer.blOtherVersion ? int{kNatpmpUnsupportedVersion} : answer.nResult;
        case ExchangeEnd::kSilent:
            return kWireTimeout;
        case ExchangeEnd::kUnreachable:
            return kWireUnreachable;
        case ExchangeEnd::kGarbage:
            break;
    }
    return kWireGarbage;
}

NatpmpOpcode OpcodeOf(const std::string& szProtocol) {
    return szProtocol == "TCP" ? kMapTcp : kMapUdp;
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
                           std::function<void(uint32_t)> fnEpoch, std::chrono::milliseconds limit)
    : mFnStop(std::move(fnStop)), mFnEpoch(std::move(fnEpoch)), mLimit(limit) {
    in_addr gateway = {};
    if (inet_pton(AF_INET, szGateway.c_str(), &gateway) == 1) {
        mGateway = gateway;
    }
}

void NatpmpClient::SetSource(const std::string& szAddress) {
    inet_pton(AF_INET, szAddress.c_str(), &mSource);
}

int NatpmpClient::Ask(const NatpmpQuestion& question, NatpmpAnswer& answer) {
    if (!mGateway) {
        return kWireUnreachable;
    }
    const auto fnTake = [&](std::span<const uint8_t> rgDatagram) {
        const auto read = ReadAnswer(rgDatagram, question);
        answer = read.value_or(NatpmpAnswer());
        return read.has_value();
    };
    const int nCode = CodeOf(Exchange(mSource, *mGateway, BytesOf(question), mLimit, fnTake, mFnStop), answer);
    if (nCode == kWireOk && mFnEpoch) {
        mFnEpoch(answer.nEpoch);
    }
    return nCode;
}

int NatpmpClient::AskAddress(std::string& szAddress) {
    NatpmpAnswer answer;
    const int nCode = Ask({}, answer);
    char szText[INET_ADDRSTRLEN] = {};
    if (nCode == kWireOk) {
        szAddress = inet_ntop(AF_INET, &answer.address, szText, sizeof(szText));
    }
    return nCode;
}

int NatpmpClient::Map(const std::string& szProtocol, uint16_t nBoxPort, uint16_t nRouterPort, uint32_t nLifetime,
                      NatpmpGrant& grant) {
    NatpmpAnswer answer;
    const int nCode = Ask({OpcodeOf(szProtocol), nBoxPort, nRouterPort, nLifetime}, answer);
    if (nCode == kWireOk) {
        grant = {answer.nRouterPort, answer.nLifetime};
    }
    return nCode;
}

int NatpmpClient::Unmap(const std::string& szProtocol, uint16_t nBoxPort) {
    NatpmpAnswer answer;
    return Ask({OpcodeOf(szProtocol), nBoxPort, 0, 0}, answer);
}

NatPmpWord AskNatPmp(const std::string& szGateway) {
    NatPmpWord word;
    std::string szAddress;
    in_addr address = {};
    const int nCode = NatpmpClient(szGateway, {}, {}, kQuickLimit).AskAddress(szAddress);
    if (nCode >= 0 && nCode != kNatpmpUnsupportedVersion) {
        word.nCode = nCode;
    }
    if (nCode == kWireOk && inet_pton(AF_INET, szAddress.c_str(), &address) == 1 && address.s_addr != 0) {
        word.address = address;
    }
    return word;
}

}  // namespace tavo
