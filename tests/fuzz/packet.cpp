// The fuzzer as a gateway that speaks NAT-PMP and PCP: its bytes are a question and the datagram that comes back.
// Relies on libFuzzer. Promises: stops at the first datagram that is read past its end, or taken for an answer to what
// was not asked.
//
// An input: a byte for the opcode, two for the box's port, one for whether the mapping is to stay, then the datagram.
#include <cstdio>
#include <cstdlib>

#include "wire/pcp/Packet.h"

namespace {

constexpr size_t kQuestionSize = 4;

// How far inputs got: a fuzzer that stays outside the door finds nothing behind it.
struct Reach {
    long nInputs, nRefused, nGranted, nNatpmp, nPcp;
    ~Reach() {
        std::fprintf(stderr, "inputs %ld, refused %ld, granted %ld, announced %ld, by PCP %ld\n", nInputs, nRefused,
                     nGranted, nNatpmp, nPcp);
    }
} gReach;

void Require(bool blTrue, const char* szWhat) {
    if (!blTrue) {
        std::fprintf(stderr, "broken promise: %s\n", szWhat);
        std::abort();
    }
}

void Answer(const tavo::NatpmpQuestion& question, const std::vector<uint8_t>& rgDatagram) {
    const auto answer = tavo::ReadAnswer(rgDatagram, question);
    if (!answer) {
        return;
    }
    Require(rgDatagram[1] == 128 + question.enOpcode, "an answer is one to what was asked");
    gReach.nRefused += answer->nResult != 0 ? 1 : 0;
    if (answer->nResult == 0 && !answer->blOtherVersion && question.enOpcode != tavo::kAskAddress) {
        Require(rgDatagram[8] << 8U == (question.nBoxPort & 0xFF00U) && rgDatagram[9] == (question.nBoxPort & 0xFFU),
                "a grant is for the port that was asked for");
        Require((answer->nLifetime == 0) == (question.nLifetime == 0), "the end of a mapping is no grant");
        ++gReach.nGranted;
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* pData, size_t nSize) {
    ++gReach.nInputs;
    if (nSize < kQuestionSize) {
        return 0;
    }
    tavo::NatpmpQuestion question{static_cast<tavo::NatpmpOpcode>(pData[0] % 3)};
    question.nBoxPort = static_cast<uint16_t>(pData[1] << 8U | pData[2]);
    question.nLifetime = pData[3];
    const std::vector<uint8_t> rgDatagram(pData + kQuestionSize, pData + nSize);
    Require(!tavo::ReadAnswer(tavo::BytesOf(question), question), "a question is no answer");
    Answer(question, rgDatagram);
    if (const auto announcement = tavo::ReadAnnouncement(rgDatagram)) {
        ++(announcement->blPcp ? gReach.nPcp : gReach.nNatpmp);
    }
    return 0;
}
