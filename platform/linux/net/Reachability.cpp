// Reaches for hosts and names outside. Relies on sockets that do not block and on the C library's
// resolver with a clock of ours. Promises: see Reachability.h.
#include "platform/linux/net/Reachability.h"

#include <arpa/inet.h>
#include <netinet/ip_icmp.h>
#include <poll.h>
#include <resolv.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <string>

#include "ground/Descriptor.h"
#include "ground/TextFile.h"
#include "tavo/core.h"

namespace tavo {

namespace {

using Clock = std::chrono::steady_clock;

constexpr char kSection[] = "network";
// Two of the root name servers: public, everywhere, and nobody's product.
constexpr char kDefaultHosts[] = "198.41.0.4:53 193.0.14.129:53";
constexpr char kDefaultName[] = "a.root-servers.net";
constexpr size_t kMaxHosts = 8;
// A lost first packet of a connection is sent again after one second and after three.
constexpr auto kReachLimit = std::chrono::milliseconds(4000);
// Each name server is asked twice, for a second each time: with the three that the resolver uses at
// most, an answer or none is there after six seconds.
constexpr int kResolveSeconds = 1;
constexpr int kResolveTries = 2;

bool Connect(int fd, const sockaddr_in& host) {
    return connect(fd, reinterpret_cast<const sockaddr*>(&host), sizeof(host)) == 0;
}

// One way of asking one host.
class Probe {
public:
    static Probe Tcp(const sockaddr_in& host) {
        Probe probe(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0), false);
        probe.mBlOpen = probe.Fd() >= 0 && (Connect(probe.Fd(), host) || errno == EINPROGRESS);
        return probe;
    }
    static Probe Echo(const sockaddr_in& host) {
        Probe probe(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, IPPROTO_ICMP), true);
        icmphdr question = {};
        question.type = ICMP_ECHO;
        probe.mBlOpen = probe.Fd() >= 0 && Connect(probe.Fd(), host) &&
                        send(probe.Fd(), &question, sizeof(question), 0) == static_cast<ssize_t>(sizeof(question));
        return probe;
    }

    // A probe that has failed is waited for no longer.
    pollfd Waiting() const { return {mBlOpen ? Fd() : -1, static_cast<short>(mBlEcho ? POLLIN : POLLOUT), 0}; }
    bool IsOpen() const { return mBlOpen; }

    // Something has happened: was it an answer? A host that refuses the connection has been reached, too.
    bool IsReached() {
        mBlOpen = false;
        if (mBlEcho) {
            icmphdr answer = {};
            return recv(Fd(), &answer, sizeof(answer), 0) == static_cast<ssize_t>(sizeof(answer)) &&
                   answer.type == ICMP_ECHOREPLY;
        }
        int nError = 0;
        socklen_t nLength = sizeof(nError);
        getsockopt(Fd(), SOL_SOCKET, SO_ERROR, &nError, &nLength);
        return nError == 0 || nError == ECONNREFUSED;
    }

private:
    Probe(int fd, bool blEcho) : mFd(fd), mBlEcho(blEcho) {}
    int Fd() const { return mFd.Get(); }

    Descriptor mFd;
    bool mBlEcho;
    bool mBlOpen = false;
};

// Waits for the next events. True when one of them was an answer.
bool WaitForAnswer(std::vector<Probe>& rgProbes, int nMilliseconds) {
    std::vector<pollfd> rgWaiting;
    for (const Probe& probe : rgProbes) {
        rgWaiting.push_back(probe.Waiting());
    }
    if (poll(rgWaiting.data(), rgWaiting.size(), nMilliseconds) <= 0) {
        return false;
    }
    for (size_t i = 0; i < rgProbes.size(); ++i) {
        if (rgWaiting[i].revents != 0 && rgProbes[i].IsReached()) {
            return true;
        }
    }
    return false;
}

std::string Setting(const char* szKey, const char* szDefault) {
    char szValue[1024];
    TLIBPlatformSettingGet(kSection, szKey, szDefault, szValue, sizeof(szValue));
    return szValue;
}

bool ParseHost(const std::string& szText, sockaddr_in& host) {
    const size_t nColon = szText.find(':');
    const long nPort = nColon == std::string::npos ? 0 : std::strtol(szText.c_str() + nColon + 1, nullptr, 10);
    host = {};
    host.sin_family = AF_INET;
    host.sin_port = htons(static_cast<uint16_t>(nPort));
    return nPort > 0 && nPort <= UINT16_MAX &&
           inet_pton(AF_INET, szText.substr(0, nColon).c_str(), &host.sin_addr) == 1;
}

}  // namespace

std::vector<sockaddr_in> OutsideHosts() {
    std::vector<sockaddr_in> rgHosts;
    const std::string szHosts = Setting("wan_hosts", kDefaultHosts) + " ";
    for (size_t nStart = 0, nEnd = 0; (nEnd = szHosts.find(' ', nStart)) != std::string::npos; nStart = nEnd + 1) {
        sockaddr_in host = {};
        if (rgHosts.size() < kMaxHosts && ParseHost(szHosts.substr(nStart, nEnd - nStart), host)) {
            rgHosts.push_back(host);
        }
    }
    return rgHosts;
}

bool AnyReached(const std::vector<sockaddr_in>& rgHosts) {
    std::vector<Probe> rgProbes;
    for (const sockaddr_in& host : rgHosts) {
        rgProbes.push_back(Probe::Tcp(host));
        rgProbes.push_back(Probe::Echo(host));
    }
    const Clock::time_point end = Clock::now() + kReachLimit;
    while (std::any_of(rgProbes.begin(), rgProbes.end(), [](const Probe& probe) { return probe.IsOpen(); })) {
        const auto nLeft = std::chrono::duration_cast<std::chrono::milliseconds>(end - Clock::now()).count();
        if (nLeft <= 0) {
            return false;
        }
        if (WaitForAnswer(rgProbes, static_cast<int>(nLeft))) {
            return true;
        }
    }
    return false;
}

bool IsNameResolved() {
    struct __res_state state = {};
    if (res_ninit(&state) != 0) {
        return false;
    }
    state.retrans = kResolveSeconds;
    state.retry = kResolveTries;
    // Over TCP the resolver waits as long as the kernel does; a cut answer is an answer.
    state.options = (state.options & ~static_cast<unsigned long>(RES_USEVC)) | RES_IGNTC;
    unsigned char rgAnswer[NS_PACKETSZ];
    const int nLength =
        res_nquery(&state, Setting("dns_name", kDefaultName).c_str(), ns_c_in, ns_t_a, rgAnswer, sizeof(rgAnswer));
    res_nclose(&state);
    return nLength > 0;
}

}  // namespace tavo
