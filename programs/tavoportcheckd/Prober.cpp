// One small state machine for each port, and one poll for all of them. Relies on the kernel's answers to
// connect and on ICMP for UDP. Promises: see Prober.h.
#include "programs/tavoportcheckd/Prober.h"

#include <poll.h>

#include <algorithm>
#include <cerrno>
#include <chrono>

namespace tavo {

namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

constexpr milliseconds kTcpLimit(4000);  // the kernel asks again after 1 and 3 seconds
constexpr milliseconds kUdpLimit(2500);
constexpr milliseconds kSendTimes[] = {milliseconds(0), milliseconds(400), milliseconds(1000), milliseconds(1700)};
constexpr milliseconds kTick(50);
constexpr size_t kMaxHeard = 64;

PortState StateOf(int nError) {
    switch (nError) {
        case ECONNREFUSED:
        case ECONNRESET:
            return PortState::kRefused;
        case ETIMEDOUT:
            return PortState::kTimeout;
        case EHOSTUNREACH:
        case ENETUNREACH:
            return PortState::kUnreachable;
        default:
            return PortState::kUntold;
    }
}

class PortProbe {
public:
    PortProbe(const Address& host, const CheckedPort& port, const std::string& szProbe, const std::string& szAnswer,
              Clock::time_point start);

    bool IsOpen() const { return mBlOpen; }
    pollfd Waiting() const {
        return {mBlOpen ? mFd.Get() : -1, static_cast<short>(mBlConnecting ? POLLOUT : POLLIN), 0};
    }
    // What the socket has to say.
    void Take();
    // What the clock has to say.
    void Tick(Clock::time_point now);
    PortFinding Finding() const { return mFinding; }
    Descriptor TakeConnection() {
        return mPort.blTcp && mFinding.enState == PortState::kOpen ? std::move(mFd) : Descriptor();
    }

private:
    void End(PortState enState) {
        mFinding.enState = enState;
        mBlOpen = false;
    }
    void Send();
    void TakeConnected();
    void Hear();

    CheckedPort mPort;
    std::string mSzChallenge;
    std::string mSzExpected;
    std::string mSzHeard;
    Clock::time_point mStart;
    Descriptor mFd;
    PortFinding mFinding;
    bool mBlOpen = true;
    bool mBlConnecting;
    size_t mNSent = 0;
};

PortProbe::PortProbe(const Address& host, const CheckedPort& port, const std::string& szProbe,
                     const std::string& szAnswer, Clock::time_point start)
    : mPort(port),
      mSzChallenge(Challenge(szProbe, port.nPort)),
      mSzExpected(Challenge(szAnswer, port.nPort)),
      mStart(start),
      mFd(socket(host.Family(), (port.blTcp ? SOCK_STREAM : SOCK_DGRAM) | SOCK_CLOEXEC | SOCK_NONBLOCK, 0)),
      mBlConnecting(port.blTcp) {
    const sockaddr_storage peer = host.WithPort(port.nPort);
    if (mFd.Get() < 0 || (connect(mFd.Get(), reinterpret_cast<const sockaddr*>(&peer),
                                  host.Family() == AF_INET ? sizeof(sockaddr_in) : sizeof(sockaddr_in6)) != 0 &&
                          errno != EINPROGRESS)) {
        // At once, so it was this host that did not let it out; only for an address of its own it may refuse.
        End(errno == ECONNREFUSED ? PortState::kRefused : PortState::kUntold);
        return;
    }
    sockaddr_storage own = {};
    socklen_t nLength = sizeof(own);
    getsockname(mFd.Get(), reinterpret_cast<sockaddr*>(&own), &nLength);
    mFinding.nSource = ntohs(own.ss_family == AF_INET ? reinterpret_cast<const sockaddr_in&>(own).sin_port
                                                      : reinterpret_cast<const sockaddr_in6&>(own).sin6_port);
}

void PortProbe::Take() {
    if (mBlConnecting) {
        TakeConnected();
    } else {
        Hear();
    }
}

void PortProbe::TakeConnected() {
    int nError = 0;
    socklen_t nLength = sizeof(nError);
    if (getsockopt(mFd.Get(), SOL_SOCKET, SO_ERROR, &nError, &nLength) != 0 || nError != 0) {
        End(StateOf(nError));
        return;
    }
    mBlConnecting = false;
    mFinding.enState = PortState::kOpen;
    mBlOpen = mPort.blChallenge;
    if (mBlOpen) {
        Send();
    }
}

// A failed send may be where word of an earlier datagram's end comes up.
void PortProbe::Send() {
    if (send(mFd.Get(), mSzChallenge.data(), mSzChallenge.size(), MSG_NOSIGNAL) < 0 && !mPort.blTcp &&
        errno != EAGAIN) {
        End(StateOf(errno));
    }
}

void PortProbe::Hear() {
    char szText[kMaxHeard];
    const ssize_t nLength = recv(mFd.Get(), szText, sizeof(szText), 0);
    if (nLength < 0 && (errno == EAGAIN || errno == EINTR)) {
        return;
    }
    if (!mPort.blTcp) {
        if (nLength < 0) {
            End(StateOf(errno));
        } else if (std::string(szText, static_cast<size_t>(nLength)) == mSzExpected) {
            mFinding.blAnswered = true;
            End(PortState::kOpen);
        }
        return;
    }
    mSzHeard.append(szText, static_cast<size_t>(std::max<ssize_t>(nLength, 0)));
    mFinding.blAnswered = mSzHeard == mSzExpected;
    if (nLength <= 0 || mFinding.blAnswered || mSzHeard.size() >= mSzExpected.size()) {
        End(PortState::kOpen);
    }
}

void PortProbe::Tick(Clock::time_point now) {
    if (!mPort.blTcp && mNSent < std::size(kSendTimes) && now >= mStart + kSendTimes[mNSent]) {
        Send();
        ++mNSent;
    }
    if (mBlOpen && now >= mStart + (mPort.blTcp ? kTcpLimit : kUdpLimit)) {
        End(mFinding.enState == PortState::kOpen ? PortState::kOpen : PortState::kTimeout);
    }
}

// One round: the clock, then whatever the sockets say until the next tick. False on a stop.
bool RunRound(std::vector<PortProbe>& rgProbes, int fdStop) {
    std::vector<pollfd> rgWaiting = {{fdStop, POLLIN, 0}};
    for (PortProbe& probe : rgProbes) {
        if (probe.IsOpen()) {
            probe.Tick(Clock::now());
        }
        rgWaiting.push_back(probe.Waiting());
    }
    poll(rgWaiting.data(), rgWaiting.size(), static_cast<int>(kTick.count()));
    for (size_t i = 0; i < rgProbes.size(); ++i) {
        if (rgProbes[i].IsOpen() && rgWaiting[i + 1].revents != 0) {
            rgProbes[i].Take();
        }
    }
    return rgWaiting[0].revents == 0;
}

}  // namespace

ProbeResult ProbePorts(const Address& host, const std::vector<CheckedPort>& rgPorts, const std::string& szProbe,
                       const std::string& szAnswer, int fdStop) {
    std::vector<PortProbe> rgProbes;
    const Clock::time_point start = Clock::now();
    for (const CheckedPort& port : rgPorts) {
        rgProbes.emplace_back(host, port, szProbe, szAnswer, start);
    }
    while (std::any_of(rgProbes.begin(), rgProbes.end(), [](const PortProbe& probe) { return probe.IsOpen(); }) &&
           RunRound(rgProbes, fdStop)) {
    }
    ProbeResult result;
    for (PortProbe& probe : rgProbes) {
        result.rgFindings.push_back(probe.Finding());
        result.rgHeld.push_back(probe.TakeConnection());
    }
    return result;
}

}  // namespace tavo
