// Watches for requests for connections. Relies on AF_PACKET with a filter in the kernel (needs CAP_NET_RAW) and
// on /proc/net/tcp. Promises: see Arrivals.h; the box's other traffic is never copied to this process.
#include "porttest/Arrivals.h"

#include <arpa/inet.h>
#include <linux/filter.h>
#include <linux/if_ether.h>
#include <linux/if_packet.h>
#include <netinet/ip.h>
#include <netinet/tcp.h>
#include <sys/socket.h>

#include <cstdio>
#include <cstring>
#include <fstream>
#include <string>
#include <vector>

#include "tavo/net.h"

namespace tavo {

namespace {

constexpr int kMaxCards = 256;
constexpr int kUpAndNoLoopback = 2;
constexpr int kReceiveBuffer = 1 << 20;
constexpr size_t kMaxRequests = 65536;  // remembered; a flood makes the answer untold

constexpr unsigned kPacketBytes = 60 + 20;  // the longest header of IPv4, and TCP's

// IPv4's TCP, no later fragment, SYN without ACK.
bool SetFilter(int fd) {
    static const sock_filter kRequests[] = {{BPF_LD | BPF_B | BPF_ABS, 0, 0, 9},
                                            {BPF_JMP | BPF_JEQ | BPF_K, 0, 7, IPPROTO_TCP},
                                            {BPF_LD | BPF_H | BPF_ABS, 0, 0, 6},
                                            {BPF_JMP | BPF_JSET | BPF_K, 5, 0, 0x1fff},
                                            {BPF_LDX | BPF_B | BPF_MSH, 0, 0, 0},
                                            {BPF_LD | BPF_B | BPF_IND, 0, 0, 13},
                                            {BPF_ALU | BPF_AND | BPF_K, 0, 0, TH_SYN | TH_ACK},
                                            {BPF_JMP | BPF_JEQ | BPF_K, 0, 1, TH_SYN},
                                            {BPF_RET | BPF_K, 0, 0, kPacketBytes},
                                            {BPF_RET | BPF_K, 0, 0, 0}};
    const sock_fprog program = {static_cast<unsigned short>(std::size(kRequests)), const_cast<sock_filter*>(kRequests)};
    return setsockopt(fd, SOL_SOCKET, SO_ATTACH_FILTER, &program, sizeof(program)) == 0;
}

// Nothing of the network gets in before the filter stands: only the bind says which packets are wanted.
Descriptor OpenPackets() {
    Descriptor fd(socket(AF_PACKET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_ll all = {};
    all.sll_family = AF_PACKET;
    all.sll_protocol = htons(ETH_P_IP);
    setsockopt(fd.Get(), SOL_SOCKET, SO_RCVBUF, &kReceiveBuffer, sizeof(kReceiveBuffer));
    if (fd.Get() >= 0 &&
        (!SetFilter(fd.Get()) || bind(fd.Get(), reinterpret_cast<const sockaddr*>(&all), sizeof(all)) != 0)) {
        fd.Reset();
    }
    return fd;
}

// Not only the one that faces the router: a mapping made by hand may lead to any of them.
std::set<in_addr_t> OwnAddresses() {
    std::vector<TAVO_NET_CARD> rgCards(kMaxCards);
    const int nCards = TLIBNetGetInterfaceInfo(rgCards.data(), kMaxCards, kUpAndNoLoopback);
    std::set<in_addr_t> setOwn;
    for (int i = 0; i < nCards; ++i) {
        in_addr address = {};
        inet_pton(AF_INET, rgCards[static_cast<size_t>(i)].szAddress, &address);
        setOwn.insert(address.s_addr);
    }
    return setOwn;
}

// A row of the table: "sl local_address rem_address st ...", addresses as HEX:PORT.
bool IsInTable(const char* szTable, uint16_t nBoxPort, uint16_t nCheckerPort) {
    constexpr unsigned kListening = 0x0A;
    std::ifstream table(szTable);
    for (std::string szLine; std::getline(table, szLine);) {
        unsigned nLocal = 0;
        unsigned nRemote = 0;
        unsigned nState = 0;
        if (std::sscanf(szLine.c_str(), " %*u: %*[0-9A-F]:%4X %*[0-9A-F]:%4X %2X", &nLocal, &nRemote, &nState) == 3 &&
            nLocal == nBoxPort && nRemote == nCheckerPort && nState != kListening) {
            return true;
        }
    }
    return false;
}

}  // namespace

Arrivals::Arrivals() : mSetOwn(OwnAddresses()), mFdPackets(OpenPackets()) {}

void Arrivals::TakePackets() {
    alignas(iphdr) unsigned char rgPacket[kPacketBytes];
    sockaddr_ll from = {};
    socklen_t nFrom = sizeof(from);
    for (ssize_t nLength = 0; !mBlMissed && (nLength = recvfrom(mFdPackets.Get(), rgPacket, sizeof(rgPacket), 0,
                                                                reinterpret_cast<sockaddr*>(&from), &nFrom)) >= 0;) {
        iphdr ip = {};
        tcphdr tcp = {};
        std::memcpy(&ip, rgPacket, sizeof(ip));
        const size_t nHeader = ip.ihl * 4UL;
        // What this box sends to itself is seen here too.
        if (from.sll_pkttype == PACKET_HOST && mSetOwn.count(ip.daddr) != 0 && ip.saddr != ip.daddr &&
            static_cast<size_t>(nLength) >= nHeader + sizeof(tcp)) {
            std::memcpy(&tcp, rgPacket + nHeader, sizeof(tcp));
            mMapRequests[ntohs(tcp.dest)].insert(ntohs(tcp.source));
            mBlMissed = ++mNRequests > kMaxRequests;
        }
    }
    tpacket_stats stats = {};
    socklen_t nStats = sizeof(stats);
    if (getsockopt(mFdPackets.Get(), SOL_PACKET, PACKET_STATISTICS, &stats, &nStats) != 0 || stats.tp_drops != 0) {
        mBlMissed = true;
    }
}

Arrival Arrivals::Of(uint16_t nBoxPort, uint16_t nCheckerPort) {
    if (mFdPackets.Get() < 0) {
        const bool blHere = nCheckerPort != 0 && (IsInTable("/proc/net/tcp", nBoxPort, nCheckerPort) ||
                                                  IsInTable("/proc/net/tcp6", nBoxPort, nCheckerPort));
        return blHere ? Arrival::kHere : Arrival::kUntold;
    }
    TakePackets();
    const auto it = mMapRequests.find(nBoxPort);
    if (it == mMapRequests.end()) {
        return mBlMissed ? Arrival::kUntold : Arrival::kElsewhere;
    }
    return it->second.count(nCheckerPort) != 0 ? Arrival::kHere : Arrival::kUntold;
}

}  // namespace tavo
