// See Exchange.h.
#include "wire/pcp/Exchange.h"

#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>

#include "ground/Descriptor.h"
#include "wire/pcp/Packet.h"

namespace tavo {

namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

constexpr milliseconds kFirstPause(250);
constexpr milliseconds kMostPoll(100);  // so that a stop is seen soon

Descriptor Connect(const in_addr& source, const in_addr& gateway) {
    Descriptor fd(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_in from = {};
    from.sin_family = AF_INET;
    from.sin_addr = source;
    sockaddr_in to = {};
    to.sin_family = AF_INET;
    to.sin_addr = gateway;
    to.sin_port = htons(kGatewayPort);
    if (bind(fd.Get(), reinterpret_cast<const sockaddr*>(&from), sizeof(from)) != 0 ||
        connect(fd.Get(), reinterpret_cast<const sockaddr*>(&to), sizeof(to)) != 0) {
        fd.Reset();
    }
    return fd;
}

void WaitUntil(int fd, Clock::time_point when) {
    const auto left = std::chrono::ceil<milliseconds>(when - Clock::now());
    pollfd waiting = {fd, POLLIN, 0};
    poll(&waiting, 1, static_cast<int>(std::clamp(left, milliseconds(0), kMostPoll).count()));
}

}  // namespace

ExchangeEnd Exchange(const in_addr& source, const in_addr& gateway, std::span<const uint8_t> rgQuestion,
                     milliseconds limit, const std::function<bool(std::span<const uint8_t>)>& fnTake,
                     const std::function<bool()>& fnStop) {
    const Descriptor fd = Connect(source, gateway);
    const Clock::time_point end = Clock::now() + limit;
    Clock::time_point nextSending = Clock::now();
    milliseconds pause = kFirstPause;
    ExchangeEnd enEnd = ExchangeEnd::kSilent;
    uint8_t rgDatagram[kMostPacket];
    while (Clock::now() < end && !(fnStop && fnStop())) {
        if (Clock::now() >= nextSending) {
            if (send(fd.Get(), rgQuestion.data(), rgQuestion.size(), 0) < 0) {
                return ExchangeEnd::kUnreachable;
            }
            nextSending += pause;
            pause *= 2;
        }
        WaitUntil(fd.Get(), std::min(end, nextSending));
        const ssize_t nSize = recv(fd.Get(), rgDatagram, sizeof(rgDatagram), 0);
        if (nSize < 0 && errno != EAGAIN) {
            return ExchangeEnd::kUnreachable;  // above all: nobody listens at the gateway's port
        }
        if (nSize >= 0) {
            if (fnTake(std::span(rgDatagram).first(static_cast<size_t>(nSize)))) {
                return ExchangeEnd::kAnswered;
            }
            enEnd = ExchangeEnd::kGarbage;
        }
    }
    return enEnd;
}

}  // namespace tavo
