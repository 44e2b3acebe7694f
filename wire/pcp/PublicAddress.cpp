// One NAT-PMP exchange: two bytes there, twelve back. Relies on a connected UDP socket, to which only the
// gateway can answer. Promises: see PublicAddress.h.
#include "wire/pcp/PublicAddress.h"

#include <poll.h>
#include <sys/socket.h>

#include <cstring>

#include "ground/Descriptor.h"

namespace tavo {

namespace {

constexpr uint16_t kPort = 5351;
constexpr int kWaitMilliseconds[] = {250, 500};  // UDP gets lost: asked twice
constexpr unsigned char kQuestion[] = {0, 0};    // version 0, public address
constexpr unsigned char kAnswerKind = 128;
constexpr size_t kAnswerSize = 12;
constexpr size_t kAddressAt = 8;

constexpr size_t kCodeAt = 2;

NatPmpWord ReadAnswer(int fd) {
    unsigned char rgAnswer[kAnswerSize];
    const ssize_t nSize = recv(fd, rgAnswer, sizeof(rgAnswer), 0);
    // A refusal may leave the address out.
    if (nSize < static_cast<ssize_t>(kAddressAt) || rgAnswer[0] != 0 || rgAnswer[1] != kAnswerKind) {
        return {};
    }
    NatPmpWord word;
    word.nCode = static_cast<int>(rgAnswer[kCodeAt] << 8U | rgAnswer[kCodeAt + 1]);
    in_addr address = {};
    if (word.nCode == 0 && nSize == static_cast<ssize_t>(kAnswerSize)) {
        std::memcpy(&address, rgAnswer + kAddressAt, sizeof(address));
        word.address = address.s_addr == 0 ? std::nullopt : std::optional<in_addr>(address);
    }
    return word;
}

}  // namespace

NatPmpWord AskNatPmp(const in_addr& gateway) {
    const Descriptor fd(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_in to = {};
    to.sin_family = AF_INET;
    to.sin_addr = gateway;
    to.sin_port = htons(kPort);
    if (fd.Get() < 0 || connect(fd.Get(), reinterpret_cast<const sockaddr*>(&to), sizeof(to)) != 0) {
        return {};
    }
    for (const int nMilliseconds : kWaitMilliseconds) {
        pollfd waiting = {fd.Get(), POLLIN, 0};
        if (send(fd.Get(), kQuestion, sizeof(kQuestion), 0) == static_cast<ssize_t>(sizeof(kQuestion)) &&
            poll(&waiting, 1, nMilliseconds) > 0) {
            return ReadAnswer(fd.Get());  // also when it said that nobody listens there
        }
    }
    return {};
}

}  // namespace tavo
