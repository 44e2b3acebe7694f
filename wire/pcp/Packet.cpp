// See Packet.h.
#include "wire/pcp/Packet.h"

#include <cstring>

namespace tavo {

namespace {

// Both protocols.
constexpr size_t kVersionAt = 0;
constexpr size_t kOpcodeAt = 1;
constexpr uint8_t kAnswerBit = 0x80;

// NAT-PMP.
constexpr uint8_t kNatpmpVersion = 0;
constexpr size_t kAddressQuestionSize = 2;
constexpr size_t kMappingQuestionSize = 12;
constexpr size_t kAskedBoxPortAt = 4;
constexpr size_t kAskedRouterPortAt = 6;
constexpr size_t kAskedLifetimeAt = 8;
constexpr size_t kResultAt = 2;
constexpr size_t kEpochAt = 4;
constexpr size_t kHeaderSize = 8;
constexpr size_t kAddressAt = 8;
constexpr size_t kBoxPortAt = 8;
constexpr size_t kRouterPortAt = 10;
constexpr size_t kPortsSize = 12;  // an answer up to the ports, or with the address
constexpr size_t kLifetimeAt = 12;
constexpr size_t kMappingAnswerSize = 16;

// PCP.
constexpr uint8_t kPcpVersion = 2;
constexpr uint8_t kPcpAnnounce = 0;
constexpr size_t kPcpResultAt = 3;
constexpr size_t kPcpEpochAt = 8;
constexpr size_t kPcpHeaderSize = 24;

using Bytes = std::span<const uint8_t>;

uint16_t Number16(Bytes rgBytes, size_t nAt) {
    return static_cast<uint16_t>(rgBytes[nAt] << 8U | rgBytes[nAt + 1]);
}

uint32_t Number32(Bytes rgBytes, size_t nAt) {
    return static_cast<uint32_t>(Number16(rgBytes, nAt)) << 16U | Number16(rgBytes, nAt + 2);
}

void Put16(std::vector<uint8_t>& rgBytes, size_t nAt, uint16_t nValue) {
    rgBytes[nAt] = static_cast<uint8_t>(nValue >> 8U);
    rgBytes[nAt + 1] = static_cast<uint8_t>(nValue);
}

void Put32(std::vector<uint8_t>& rgBytes, size_t nAt, uint32_t nValue) {
    Put16(rgBytes, nAt, static_cast<uint16_t>(nValue >> 16U));
    Put16(rgBytes, nAt + 2, static_cast<uint16_t>(nValue));
}

// A refusal answers the mapping that it names; some leave the port out, or all that stands behind the header.
bool IsRefusalOf(Bytes rgDatagram, const NatpmpQuestion& question) {
    if (question.enOpcode == kAskAddress || rgDatagram.size() < kPortsSize) {
        return true;
    }
    const uint16_t nBoxPort = Number16(rgDatagram, kBoxPortAt);
    return nBoxPort == 0 || nBoxPort == question.nBoxPort;
}

// What was granted, or was ended, and not the other of the two.
bool IsGrantOf(const NatpmpAnswer& answer, const NatpmpQuestion& question) {
    const bool blLasting = answer.nLifetime != 0;
    return blLasting == (question.nLifetime != 0) && (!blLasting || answer.nRouterPort != 0);
}

}  // namespace

std::vector<uint8_t> BytesOf(const NatpmpQuestion& question) {
    const bool blMapping = question.enOpcode != kAskAddress;
    std::vector<uint8_t> rgBytes(blMapping ? kMappingQuestionSize : kAddressQuestionSize);
    rgBytes[kVersionAt] = kNatpmpVersion;
    rgBytes[kOpcodeAt] = question.enOpcode;
    if (blMapping) {
        Put16(rgBytes, kAskedBoxPortAt, question.nBoxPort);
        Put16(rgBytes, kAskedRouterPortAt, question.nRouterPort);
        Put32(rgBytes, kAskedLifetimeAt, question.nLifetime);
    }
    return rgBytes;
}

std::optional<NatpmpAnswer> ReadAnswer(Bytes rgDatagram, const NatpmpQuestion& question) {
    NatpmpAnswer answer;
    if (rgDatagram.size() < kHeaderSize || rgDatagram[kOpcodeAt] != (kAnswerBit | question.enOpcode)) {
        return std::nullopt;
    }
    answer.blOtherVersion = rgDatagram[kVersionAt] != kNatpmpVersion;
    if (answer.blOtherVersion) {
        return answer;
    }
    answer.nResult = Number16(rgDatagram, kResultAt);
    if (answer.nResult != 0) {
        return IsRefusalOf(rgDatagram, question) ? std::optional(answer) : std::nullopt;
    }
    answer.nEpoch = Number32(rgDatagram, kEpochAt);
    if (question.enOpcode == kAskAddress) {
        if (rgDatagram.size() < kPortsSize) {
            return std::nullopt;
        }
        std::memcpy(&answer.address, &rgDatagram[kAddressAt], sizeof(answer.address));
        return answer;
    }
    if (rgDatagram.size() < kMappingAnswerSize || Number16(rgDatagram, kBoxPortAt) != question.nBoxPort) {
        return std::nullopt;
    }
    answer.nRouterPort = Number16(rgDatagram, kRouterPortAt);
    answer.nLifetime = Number32(rgDatagram, kLifetimeAt);
    return IsGrantOf(answer, question) ? std::optional(answer) : std::nullopt;
}

std::optional<GatewayAnnouncement> ReadAnnouncement(Bytes rgDatagram) {
    if (rgDatagram.size() >= kPcpHeaderSize && rgDatagram[kVersionAt] == kPcpVersion) {
        const bool blGood = rgDatagram[kOpcodeAt] == (kAnswerBit | kPcpAnnounce) && rgDatagram[kPcpResultAt] == 0;
        return blGood ? std::optional(GatewayAnnouncement{true, Number32(rgDatagram, kPcpEpochAt)}) : std::nullopt;
    }
    const auto answer = ReadAnswer(rgDatagram, {});  // it is the answer to a question that nobody has asked
    return answer && !answer->blOtherVersion && answer->nResult == 0
               ? std::optional(GatewayAnnouncement{false, answer->nEpoch})
               : std::nullopt;
}

}  // namespace tavo
