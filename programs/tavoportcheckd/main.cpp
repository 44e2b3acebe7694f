// The port checker: tells those who ask whether their own ports can be reached from here. Relies on a thread for
// each client. Promises: stays in the foreground; clients beyond a bound are turned away at once; SIGTERM
// ends it within a second.
#include <netinet/in.h>
#include <poll.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <sys/resource.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <syslog.h>

#include <cerrno>
#include <condition_variable>
#include <cstdio>
#include <map>
#include <string>
#include <system_error>
#include <thread>

#include "ground/SysLog.h"
#include "programs/tavoportcheckd/Connection.h"

namespace {

using namespace tavo;

constexpr char kHelp[] =
    "Usage: tavoportcheckd [--config FILE] [--help]\n"
    "Answers a box that asks, by HTTP and with the token, whether ports of its own address can be reached from\n"
    "this host: it connects to them, and never to any other address than the one that asked.\n"
    "\n"
    "  --config FILE  instead of /etc/tavo/portcheck.conf; mode 0600, as it holds the token\n"
    "  --help         this text\n"
    "\n"
    "Stays in the foreground and writes to the system log; SIGTERM ends it. It needs no privileges. It speaks no\n"
    "TLS: put a web server in front of it that does, and name that one in trusted_proxies.\n";
constexpr char kDefaultConfig[] = "/etc/tavo/portcheck.conf";
constexpr int kExitUsage = 2;
constexpr int kBacklog = 64;
constexpr size_t kMaxClients = 64;
constexpr int kPauseMilliseconds = 100;
constexpr int kMaxClientsPerAddress = 8;  // a trusted proxy excepted

Descriptor Listen(const sockaddr_storage& address) {
    Descriptor fd(socket(address.ss_family, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    const int nOn = 1;
    setsockopt(fd.Get(), SOL_SOCKET, SO_REUSEADDR, &nOn, sizeof(nOn));
    if (address.ss_family == AF_INET6) {
        setsockopt(fd.Get(), IPPROTO_IPV6, IPV6_V6ONLY, &nOn, sizeof(nOn));
    }
    const socklen_t nLength = address.ss_family == AF_INET ? sizeof(sockaddr_in) : sizeof(sockaddr_in6);
    if (bind(fd.Get(), reinterpret_cast<const sockaddr*>(&address), nLength) != 0 || listen(fd.Get(), kBacklog) != 0) {
        fd.Reset();
    }
    return fd;
}

// The clients' threads, counted.
class Clients {
public:
    Clients(const CheckdConfig& config, int fdStop)
        : mState{config, Limits(config.nPerAddress, config.nTotal), fdStop} {}
    void Take(Descriptor fd, const Address& peer);
    void WaitForAll();

private:
    bool Enter(const Address& peer);
    void Leave(const Address& peer);
    bool IsProxy(const Address& peer) const;

    CheckdState mState;
    std::mutex mMutex;
    std::condition_variable mLeft;
    std::map<Address, int> mMapClients;
    size_t mNClients = 0;
};

bool Clients::IsProxy(const Address& peer) const {
    for (const Address& proxy : mState.config.rgTrustedProxies) {
        if (proxy == peer) {
            return true;
        }
    }
    return false;
}

bool Clients::Enter(const Address& peer) {
    const std::lock_guard lock(mMutex);
    const auto it = mMapClients.find(peer.Owner());
    if (mNClients >= kMaxClients ||
        (it != mMapClients.end() && it->second >= kMaxClientsPerAddress && !IsProxy(peer))) {
        return false;
    }
    ++mMapClients[peer.Owner()];
    ++mNClients;
    return true;
}

void Clients::Leave(const Address& peer) {
    const std::lock_guard lock(mMutex);
    const auto it = mMapClients.find(peer.Owner());
    if (--it->second == 0) {
        mMapClients.erase(it);
    }
    --mNClients;
    mLeft.notify_all();
}

void Clients::Take(Descriptor fd, const Address& peer) {
    if (!Enter(peer)) {
        return;
    }
    try {
        std::thread([this, peer, fdClient = std::move(fd)]() mutable {
            try {
                ServeConnection(std::move(fdClient), peer, mState);
            } catch (const std::exception&) {
                tavo::SysLog(LOG_ERR, "%s: no memory to serve it", peer.Text().c_str());
            }
            Leave(peer);
        }).detach();
    } catch (const std::system_error&) {
        Leave(peer);
    }
}

void Clients::WaitForAll() {
    std::unique_lock lock(mMutex);
    mLeft.wait(lock, [this] { return mNClients == 0; });
}

void AcceptAll(int fdListen, Clients& clients) {
    for (;;) {
        sockaddr_storage peer = {};
        socklen_t nLength = sizeof(peer);
        Descriptor fd(accept4(fdListen, reinterpret_cast<sockaddr*>(&peer), &nLength, SOCK_CLOEXEC));
        if (fd.Get() < 0) {
            if (errno != EAGAIN && errno != ECONNABORTED) {  // no descriptors, no memory: not again at once
                poll(nullptr, 0, kPauseMilliseconds);
            }
            return;
        }
        clients.Take(std::move(fd), Address::Of(peer));
    }
}

// Every port probed takes one.
void AllowDescriptors() {
    rlimit limit = {};
    if (getrlimit(RLIMIT_NOFILE, &limit) == 0) {
        limit.rlim_cur = limit.rlim_max;
        setrlimit(RLIMIT_NOFILE, &limit);
    }
}

int Run(const CheckdConfig& config) {
    AllowDescriptors();
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGTERM);
    sigaddset(&signals, SIGINT);
    sigprocmask(SIG_BLOCK, &signals, nullptr);
    const Descriptor fdSignals(signalfd(-1, &signals, SFD_CLOEXEC));
    const Descriptor fdStop(eventfd(0, EFD_CLOEXEC));
    std::vector<Descriptor> rgListeners;
    std::vector<pollfd> rgWaiting = {{fdSignals.Get(), POLLIN, 0}};
    for (const sockaddr_storage& address : config.rgListen) {
        rgListeners.push_back(Listen(address));
        if (rgListeners.back().Get() < 0) {
            std::fprintf(stderr, "tavoportcheckd: cannot listen on %s\n", Address::Of(address).Text().c_str());
            return 1;
        }
        rgWaiting.push_back({rgListeners.back().Get(), POLLIN, 0});
    }
    Clients clients(config, fdStop.Get());
    while (poll(rgWaiting.data(), rgWaiting.size(), -1) >= 0 && rgWaiting[0].revents == 0) {
        for (size_t i = 0; i < rgListeners.size(); ++i) {
            if (rgWaiting[i + 1].revents != 0) {
                AcceptAll(rgListeners[i].Get(), clients);
            }
        }
    }
    eventfd_write(fdStop.Get(), 1);
    clients.WaitForAll();
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    std::string szConfig = kDefaultConfig;
    for (int i = 1; i < argc; ++i) {
        const std::string szArgument = argv[i];
        if (szArgument == "--config" && i + 1 < argc) {
            szConfig = argv[++i];
            continue;
        }
        const bool blHelp = szArgument == "--help";
        std::fputs(kHelp, blHelp ? stdout : stderr);
        return blHelp ? 0 : kExitUsage;
    }
    openlog("tavoportcheckd", LOG_PID, LOG_DAEMON);
    CheckdConfig config;
    std::string szReason;
    if (!ReadConfig(szConfig, config, szReason)) {
        std::fprintf(stderr, "tavoportcheckd: %s: %s\n", szConfig.c_str(), szReason.c_str());
        return 1;
    }
    return Run(config);
}
