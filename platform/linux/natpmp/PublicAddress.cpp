// One NAT-PMP exchange: two bytes there, twelve back. Relies on a connected UDP socket, to which only the
// gateway can answer. Promises: see PublicAddress.h.
#include "natpmp/PublicAddress.h"

#include <poll.h>
#include <sys/socket.h>

#include <cstring>

#include "core/Descriptor.h"

namespace tavo {

namespace {

constexpr uint16_t kPort = 5351;
constexpr int kWaitMilliseconds[] = {250, 500};  // UDP gets lost: asked twice
constexpr unsigned char kQuestion[] = {0, 0};    // version 0, public address
constexpr unsigned char kAnswerKind = 128;
constexpr size_t kAnswerSize = 12;
constexpr size_t kAddressAt = 8;

std::optional<in_addr> ReadAnswer(int fd) {
    unsigned char rgAnswer[kAnswerSize];
    in_addr address = {};
    if (recv(fd, rgAnswer, sizeof(rgAnswer), 0) != static_cast<ssize_t>(kAnswerSize) || rgAnswer[0] != 0 ||
        rgAnswer[1] != kAnswerKind || rgAnswer[2] != 0 || rgAnswer[3] != 0) {
        return std::nullopt;
    }
    std::memcpy(&address, rgAnswer + kAddressAt, sizeof(address));
    return address.s_addr == 0 ? std::nullopt : std::optional<in_addr>(address);
}

}  // namespace

std::optional<in_addr> NatPmpPublicAddress(const in_addr& gateway) {
    const Descriptor fd(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_in to = {};
    to.sin_family = AF_INET;
    to.sin_addr = gateway;
    to.sin_port = htons(kPort);
    if (fd.Get() < 0 || connect(fd.Get(), reinterpret_cast<const sockaddr*>(&to), sizeof(to)) != 0) {
        return std::nullopt;
    }
    for (const int nMilliseconds : kWaitMilliseconds) {
        pollfd waiting = {fd.Get(), POLLIN, 0};
        if (send(fd.Get(), kQuestion, sizeof(kQuestion), 0) == static_cast<ssize_t>(sizeof(kQuestion)) &&
            poll(&waiting, 1, nMilliseconds) > 0) {
            return ReadAnswer(fd.Get());  // also when it said that nobody listens there
        }
    }
    return std::nullopt;
}

}  // namespace tavo
