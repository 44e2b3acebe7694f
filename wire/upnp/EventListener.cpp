// See EventListener.h.
#include "wire/upnp/EventListener.h"

#include <arpa/inet.h>
#include <sys/random.h>
#include <sys/socket.h>

#include <cerrno>
#include <charconv>
#include <cstdio>
#include <optional>

#include "wire/http/Request.h"

namespace tavo {

namespace {

constexpr size_t kPathBytes = 16;
constexpr int kBacklog = 8;
constexpr size_t kMostGuests = 4;
constexpr int kAtOnce = 16;  // of a flood, no more than these are looked at in one go
constexpr size_t kMaxText = 8U << 10U;
constexpr size_t kReadSize = 2048;

constexpr char kTaken[] = "200 OK";
constexpr char kNotFound[] = "404 Not Found";
constexpr char kBadRequest[] = "400 Bad Request";
constexpr char kNotSubscribed[] = "412 Precondition Failed";

std::string RandomPath() {
    unsigned char rgBytes[kPathBytes];
    if (getrandom(rgBytes, sizeof(rgBytes), 0) != sizeof(rgBytes)) {
        return "";
    }
    std::string szPath = "/";
    for (const unsigned char nByte : rgBytes) {
        char szByte[3];
        std::snprintf(szByte, sizeof(szByte), "%02x", nByte);
        szPath += szByte;
    }
    return szPath;
}

std::optional<uint32_t> ReadNumber(const std::string& szText) {
    uint32_t nValue = 0;
    const auto [pEnd, enError] = std::from_chars(szText.data(), szText.data() + szText.size(), nValue);
    return enError == std::errc() && pEnd == szText.data() + szText.size() ? std::optional(nValue) : std::nullopt;
}

}  // namespace

bool EventListener::Open(const std::string& szLocal, const std::string& szRouter) {
    Close();
    Descriptor fd(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_in own = {};
    own.sin_family = AF_INET;
    socklen_t nLength = sizeof(own);
    mSzPath = RandomPath();
    if (mSzPath.empty() || inet_pton(AF_INET, szRouter.c_str(), &mRouter) != 1 ||
        inet_pton(AF_INET, szLocal.c_str(), &own.sin_addr) != 1 ||
        bind(fd.Get(), reinterpret_cast<const sockaddr*>(&own), sizeof(own)) != 0 || listen(fd.Get(), kBacklog) != 0 ||
        getsockname(fd.Get(), reinterpret_cast<sockaddr*>(&own), &nLength) != 0) {
        return false;
    }
    mSzUrl = "http://" + szLocal + ":" + std::to_string(ntohs(own.sin_port)) + mSzPath;
    mFd = std::move(fd);
    return true;
}

void EventListener::Close() {
    mGuests.clear();
    mFd.Reset();
}

std::vector<int> EventListener::Fds() const {
    std::vector<int> rgFds{mFd.Get()};
    for (const Guest& guest : mGuests) {
        rgFds.push_back(guest.fd.Get());
    }
    return rgFds;
}

// One who never comes to an end makes room for one who comes later.
void EventListener::Admit() {
    for (int i = 0; i < kAtOnce; ++i) {
        sockaddr_in peer = {};
        socklen_t nLength = sizeof(peer);
        Descriptor fd(accept4(mFd.Get(), reinterpret_cast<sockaddr*>(&peer), &nLength, SOCK_CLOEXEC | SOCK_NONBLOCK));
        if (fd.Get() < 0) {
            if (errno != EAGAIN && errno != ECONNABORTED && errno != EINTR) {
                Close();  // it would stay readable, and its owner would turn round and round
            }
            return;
        }
        if (peer.sin_addr.s_addr != mRouter.s_addr) {
            continue;
        }
        if (mGuests.size() == kMostGuests) {
            mGuests.pop_front();
        }
        mGuests.push_back({std::move(fd), ""});
    }
}

bool EventListener::Hear(Guest& guest) {
    char rgBytes[kReadSize];
    while (guest.szText.size() < kMaxText) {
        const ssize_t nRead = recv(guest.fd.Get(), rgBytes, sizeof(rgBytes), 0);
        if (nRead <= 0) {
            return nRead < 0 && errno == EAGAIN;
        }
        guest.szText.append(rgBytes, static_cast<size_t>(nRead));
    }
    return true;
}

// Empty while the request is not whole.
std::string EventListener::Answer(const Guest& guest, const std::string& szSubscription,
                                  std::vector<EventNotice>& rgNotices) const {
    HttpRequest request;
    const HttpFault enFault = request.Parse(guest.szText);
    if (enFault == HttpFault::kGone && guest.szText.size() < kMaxText) {
        return "";
    }
    const auto nNumber = ReadNumber(request.Header("SEQ").value_or(""));
    if (enFault != HttpFault::kNone || request.Method() != "NOTIFY" || !nNumber) {
        return kBadRequest;
    }
    if (request.Path() != mSzPath) {
        return kNotFound;
    }
    if (szSubscription.empty() || request.Header("SID") != szSubscription) {
        return kNotSubscribed;
    }
    rgNotices.push_back({*nNumber, request.Body()});
    return kTaken;
}

std::vector<EventNotice> EventListener::Take(const std::string& szSubscription) {
    std::vector<EventNotice> rgNotices;
    Admit();
    for (auto it = mGuests.begin(); it != mGuests.end();) {
        const bool blMore = Hear(*it);
        const std::string szAnswer = Answer(*it, szSubscription, rgNotices);
        if (!szAnswer.empty()) {
            const std::string szText = "HTTP/1.1 " + szAnswer + "\r\nContent-Length: 0\r\nConnection: close\r\n\r\n";
            send(it->fd.Get(), szText.data(), szText.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
        }
        it = szAnswer.empty() && blMore ? std::next(it) : mGuests.erase(it);
    }
    return rgNotices;
}

}  // namespace tavo
