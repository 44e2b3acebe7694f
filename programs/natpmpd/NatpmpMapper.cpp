// Keeps the gateway's NAT-PMP mappings in line with the rules. Relies on NatpmpPass.
// Promises: see NatpmpMapper.h.
#include "programs/natpmpd/NatpmpMapper.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <cerrno>
#include <cstring>
#include <string_view>
#include <utility>

#include "ground/SysLog.h"

namespace tavo {

namespace {

constexpr DaemonNames kNames{"natpmpd",
                             "NAT-PMP",
                             "runnatpmpportmapping",
                             "/var/run/natpmpd.pid",
                             "/var/run/natpmpd.lock",
                             "/var/tmp/natpmp_portmap.remap"};
constexpr uint16_t kAnnouncementPort = 5350;
constexpr size_t kAnnouncementSize = 12;
constexpr uint8_t kAddressAnswer[] = {0, 128, 0, 0};  // version, opcode, result
constexpr int kAnnouncementsAtOnce = 64;              // of a flood, no more than these are looked at in one go

// Of words that both daemons use, what they mean here.
constexpr std::pair<std::string_view, const char*> kCommonWords[] = {
    {"nogateway", "no gateway"}, {"busy", "upnpd has not taken its mappings away yet"}};

// Hosts are members of their all-hosts group without asking.
Descriptor ListenForAnnouncements() {
    Descriptor fd(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    const int nOn = 1;
    setsockopt(fd.Get(), SOL_SOCKET, SO_REUSEADDR, &nOn, sizeof(nOn));
    sockaddr_in group = {};
    group.sin_family = AF_INET;
    group.sin_port = htons(kAnnouncementPort);
    group.sin_addr.s_addr = htonl(INADDR_ALLHOSTS_GROUP);
    if (bind(fd.Get(), reinterpret_cast<sockaddr*>(&group), sizeof(group)) != 0) {
        SysLog(LOG_WARNING, "a router that restarts is noticed at the next check only: %s", std::strerror(errno));
        return Descriptor();
    }
    return fd;
}

}  // namespace

NatpmpMapper::NatpmpMapper() : RuleMapper(kNames, true), mFdAnnouncements(ListenForAnnouncements()) {}

void NatpmpMapper::NewGateway() {
    mState.epoch = EpochWatch();
    mState.mapRemapped.clear();
    mState.szOutside.clear();
    // What was held here before is as doubtful as what was read from the file.
    for (auto& [key, held] : mState.held.mRows) {
        held.nLifetime = 0;
    }
}

bool NatpmpMapper::OnWake() {
    bool blRestart = RuleMapper::OnWake();
    mState.blDoubtful = mState.blDoubtful || blRestart;  // its clock may not show it
    uint8_t rgBytes[kAnnouncementSize];
    sockaddr_in sender = {};
    socklen_t nLength = sizeof(sender);
    for (int i = 0; i < kAnnouncementsAtOnce; ++i) {
        const ssize_t nSize = recvfrom(mFdAnnouncements.Get(), rgBytes, sizeof(rgBytes), 0,
                                       reinterpret_cast<sockaddr*>(&sender), &nLength);
        if (nSize < 0) {
            break;
        }
        if (nSize == sizeof(rgBytes) && Gateway() == inet_ntoa(sender.sin_addr) &&
            std::memcmp(rgBytes, kAddressAnswer, sizeof(kAddressAnswer)) == 0) {
            uint32_t nEpoch = 0;
            std::memcpy(&nEpoch, rgBytes + sizeof(kAddressAnswer), sizeof(nEpoch));
            blRestart = blRestart || mState.epoch.IsRestart(ntohl(nEpoch), BootClock::now());
        }
    }
    return blRestart;
}

PassResult NatpmpMapper::Map(const std::vector<RouterMapping>& rgWanted, bool blRenew,
                             const std::function<bool()>& fnStop) {
    return NatpmpPass(mState, Gateway(), Box(), WishedLease(), fnStop).Run(rgWanted, blRenew);
}

// What is wrong, for a user: whatever stands here makes a save fail, so nothing does when all is well.
std::string NatpmpMapper::ResultText(const OutcomeList& rgOutcomes) const {
    std::string szText;
    for (const Outcome& outcome : rgOutcomes) {
        const std::string& szWord = outcome.verdict.szWord;
        if (szWord == "1") {
            continue;
        }
        std::string szShown = szWord;
        for (const auto& [szCommon, szHere] : kCommonWords) {
            szShown = szWord == szCommon ? szHere : szShown;
        }
        szText += (szText.empty() ? "" : ", ") + outcome.szName + " (" + szShown + ")";
    }
    return szText;
}

// Each pass has asked for it already.
std::string NatpmpMapper::Outside(const std::function<bool()>& /*fnStop*/) {
    return mState.szOutside;
}

}  // namespace tavo
