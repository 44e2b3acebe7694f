// Walks towards a host with UDP probes. Relies on IP_RECVERR. Promises: see HopProbe.h.
#include "wire/icmp/HopProbe.h"

#include <linux/errqueue.h>
#include <netinet/ip_icmp.h>
#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <chrono>
#include <iterator>

#include "ground/Descriptor.h"
#include "ground/net/Level.h"

namespace tavo {

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kFirstPort = 33434;  // nobody listens here: the host itself answers with an error as well
constexpr int kMostDistance = 30;
// Routers limit how many errors they send in a moment: each question is asked again.
constexpr int kAskAtMilliseconds[] = {0, 250, 700};

struct Step {
    bool blEnded = false;
    std::optional<in_addr> who;
};

class Walker {
public:
    Walker(const in_addr& host, int nFirst, int nLast)
        : mHost(host), mNFirst(nFirst), mRgSteps(static_cast<size_t>(nLast - nFirst + 1)) {
        const int nOn = 1;
        mFd.Reset(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
        setsockopt(mFd.Get(), IPPROTO_IP, IP_RECVERR, &nOn, sizeof(nOn));
    }

    void Ask() {
        for (size_t i = 0; i < mRgSteps.size(); ++i) {
            if (!mRgSteps[i].blEnded) {
                Send(mNFirst + static_cast<int>(i));
            }
        }
    }

    // Takes every answer that is there.
    void Receive() {
        while (ReceiveOne()) {
        }
    }

    bool IsEnded() const {
        for (const Step& step : mRgSteps) {
            if (!step.blEnded) {
                return false;
            }
            if (step.who && KindOf(*step.who) == AddressKind::kPublic) {
                return true;
            }
        }
        return true;
    }

    int Fd() const { return mFd.Get(); }

    std::vector<std::optional<in_addr>> Found() const {
        std::vector<std::optional<in_addr>> rgFound;
        for (const Step& step : mRgSteps) {
            rgFound.push_back(step.who);
        }
        return rgFound;
    }

private:
    void Send(int nDistance) {
        int nPending = 0;
        socklen_t nLength = sizeof(nPending);
        getsockopt(mFd.Get(), SOL_SOCKET, SO_ERROR, &nPending, &nLength);  // an answer that came is no failure to send
        setsockopt(mFd.Get(), IPPROTO_IP, IP_TTL, &nDistance, sizeof(nDistance));
        sockaddr_in to = {};
        to.sin_family = AF_INET;
        to.sin_addr = mHost;
        to.sin_port = htons(static_cast<uint16_t>(kFirstPort + nDistance));
        const char cProbe = 0;
        sendto(mFd.Get(), &cProbe, sizeof(cProbe), 0, reinterpret_cast<const sockaddr*>(&to), sizeof(to));
    }

    bool ReceiveOne() {
        sockaddr_in asked = {};
        char szData[64];
        alignas(cmsghdr) char szControl[512];
        iovec data = {szData, sizeof(szData)};
        msghdr message = {};
        message.msg_name = &asked;
        message.msg_namelen = sizeof(asked);
        message.msg_iov = &data;
        message.msg_iovlen = 1;
        message.msg_control = szControl;
        message.msg_controllen = sizeof(szControl);
        if (recvmsg(mFd.Get(), &message, MSG_ERRQUEUE) < 0) {
            return false;
        }
        for (cmsghdr* pPart = CMSG_FIRSTHDR(&message); pPart != nullptr; pPart = CMSG_NXTHDR(&message, pPart)) {
            if (pPart->cmsg_level == IPPROTO_IP && pPart->cmsg_type == IP_RECVERR) {
                Note(ntohs(asked.sin_port) - kFirstPort, *reinterpret_cast<sock_extended_err*>(CMSG_DATA(pPart)));
            }
        }
        return true;
    }

    // Only a router where the probe's life ended, or the host that got it, has a place on the way. One that
    // says "no way there" may stand anywhere before.
    void Note(int nDistance, sock_extended_err& error) {
        const auto nIndex = static_cast<size_t>(nDistance - mNFirst);
        if (nDistance < mNFirst || nIndex >= mRgSteps.size()) {
            return;
        }
        Step& step = mRgSteps[nIndex];
        step.blEnded = true;
        const auto* pWho = reinterpret_cast<sockaddr_in*>(SO_EE_OFFENDER(&error));
        if (error.ee_origin != SO_EE_ORIGIN_ICMP || pWho->sin_family != AF_INET) {
            return;
        }
        const bool blArrived = error.ee_type == ICMP_DEST_UNREACH && error.ee_code == ICMP_PORT_UNREACH;
        if (error.ee_type == ICMP_TIME_EXCEEDED || (blArrived && pWho->sin_addr.s_addr == mHost.s_addr)) {
            step.who = pWho->sin_addr;
        }
    }

    in_addr mHost;
    int mNFirst;
    std::vector<Step> mRgSteps;
    Descriptor mFd;
};

}  // namespace

std::vector<std::optional<in_addr>> WalkTowards(const in_addr& host, int nFirst, int nLast, int nLimitMilliseconds) {
    nLast = std::min(nLast, kMostDistance);
    if (nFirst < 1 || nLast < nFirst) {
        return {};
    }
    Walker walker(host, nFirst, nLast);
    const Clock::time_point start = Clock::now();
    size_t nAsked = 0;
    for (;;) {
        const auto nPassed = std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - start).count();
        if (nAsked < std::size(kAskAtMilliseconds) && nPassed >= kAskAtMilliseconds[nAsked]) {
            walker.Ask();
            ++nAsked;
        }
        walker.Receive();
        if (walker.IsEnded() || nPassed >= nLimitMilliseconds) {
            return walker.Found();
        }
        const bool blLast = nAsked == std::size(kAskAtMilliseconds);
        const int nWake = blLast ? nLimitMilliseconds : std::min(nLimitMilliseconds, kAskAtMilliseconds[nAsked]);
        pollfd waiting = {walker.Fd(), 0, 0};  // errors are always reported
        poll(&waiting, 1, std::max(1, nWake - static_cast<int>(nPassed)));
    }
}

}  // namespace tavo
