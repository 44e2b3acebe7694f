// Answers probes in a thread while the request to the checker is under way. Relies on poll.
// Promises: see Responder.h; callers beyond a bound, and probes that are none, are dropped without a word.
#include "porttest/Responder.h"

#include <poll.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <string_view>

#include "wire/portcheck/Protocol.h"

namespace tavo {

namespace {

constexpr int kBacklog = 16;
constexpr size_t kMaxCallers = 128;
constexpr size_t kMaxProbe = 64;

ListenEnd EndOfBind(int nError) {
    return nError == EADDRINUSE ? ListenEnd::kTaken : ListenEnd::kForbidden;
}

}  // namespace

Responder::Responder(in_addr local, std::string szProbe, std::string szAnswer)
    : mLocal(local),
      mSzProbe(std::move(szProbe)),
      mSzAnswer(std::move(szAnswer)),
      mFdStop(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {}

Responder::~Responder() {
    if (mThread.joinable()) {
        eventfd_write(mFdStop.Get(), 1);
        mThread.join();
    }
}

ListenEnd Responder::Listen(bool blTcp, uint16_t nBoxPort) {
    if (mMapListeners.count({blTcp, nBoxPort}) != 0) {
        return ListenEnd::kOurs;
    }
    Descriptor fd(socket(AF_INET, (blTcp ? SOCK_STREAM : SOCK_DGRAM) | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    // For TCP: connections of a listener of before that are still dying must not keep the port. For UDP it
    // would let us take the port away from a program that allows it.
    const int nOn = 1;
    if (fd.Get() < 0 || (blTcp && setsockopt(fd.Get(), SOL_SOCKET, SO_REUSEADDR, &nOn, sizeof(nOn)) != 0)) {
        return ListenEnd::kForbidden;
    }
    sockaddr_in own = {};
    own.sin_family = AF_INET;
    own.sin_port = htons(nBoxPort);
    own.sin_addr = mLocal;
    if (bind(fd.Get(), reinterpret_cast<const sockaddr*>(&own), sizeof(own)) != 0 ||
        (blTcp && listen(fd.Get(), kBacklog) != 0)) {
        return EndOfBind(errno);
    }
    mMapListeners[{blTcp, nBoxPort}] = std::move(fd);
    return ListenEnd::kOurs;
}

void Responder::Start() {
    if (mMapListeners.empty() || mFdStop.Get() < 0) {
        return;
    }
    // The caller's signal handlers are not for a thread that it knows nothing of.
    sigset_t all;
    sigset_t before;
    sigfillset(&all);
    pthread_sigmask(SIG_BLOCK, &all, &before);
    try {
        mThread = std::thread([this] { Run(); });
    } catch (...) {
        pthread_sigmask(SIG_SETMASK, &before, nullptr);
        throw;
    }
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
}

bool Responder::HasArrived(bool blTcp, uint16_t nRouterPort) {
    const std::lock_guard lock(mMutex);
    return mSetArrived.count({blTcp, nRouterPort}) != 0;
}

void Responder::Run() try {
    for (;;) {
        std::vector<pollfd> rgWaiting = {{mFdStop.Get(), POLLIN, 0}};
        for (const auto& [key, fd] : mMapListeners) {
            rgWaiting.push_back({fd.Get(), POLLIN, 0});
        }
        const size_t nFirstCaller = rgWaiting.size();
        for (const Caller& caller : mRgCallers) {
            rgWaiting.push_back({caller.fd.Get(), POLLIN, 0});
        }
        if (poll(rgWaiting.data(), rgWaiting.size(), -1) < 0 || rgWaiting[0].revents != 0) {
            return;
        }
        for (size_t i = mRgCallers.size(); i-- > 0;) {
            if (rgWaiting[nFirstCaller + i].revents != 0 && !Hear(mRgCallers[i])) {
                mRgCallers.erase(mRgCallers.begin() + static_cast<std::ptrdiff_t>(i));
            }
        }
        size_t nListener = 1;
        for (const auto& [key, fd] : mMapListeners) {
            if (rgWaiting[nListener++].revents != 0) {
                key.first ? TakeCaller(fd.Get()) : TakeDatagrams(fd.Get());
            }
        }
    }
} catch (const std::exception&) {
    // Without memory nothing is answered, and what did not arrive is judged as such.
}

void Responder::TakeDatagrams(int fd) {
    char szText[kMaxProbe];
    sockaddr_in peer = {};
    socklen_t nPeer = sizeof(peer);
    for (ssize_t nLength = 0;
         (nLength = recvfrom(fd, szText, sizeof(szText), 0, reinterpret_cast<sockaddr*>(&peer), &nPeer)) >= 0;) {
        const std::string szAnswer = Recognise(false, std::string(szText, static_cast<size_t>(nLength)));
        if (!szAnswer.empty()) {
            sendto(fd, szAnswer.data(), szAnswer.size(), 0, reinterpret_cast<const sockaddr*>(&peer), nPeer);
        }
    }
}

void Responder::TakeCaller(int fd) {
    Descriptor fdCaller(accept4(fd, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
    if (fdCaller.Get() >= 0 && mRgCallers.size() < kMaxCallers) {
        mRgCallers.push_back({std::move(fdCaller), ""});
    }
}

// Whether there is more to come from this caller.
bool Responder::Hear(Caller& caller) {
    char szText[kMaxProbe];
    const ssize_t nLength = recv(caller.fd.Get(), szText, sizeof(szText), 0);
    if (nLength <= 0) {
        return nLength < 0 && (errno == EAGAIN || errno == EINTR);
    }
    caller.szText.append(szText, static_cast<size_t>(nLength));
    const std::string szAnswer = Recognise(true, caller.szText);
    if (!szAnswer.empty()) {
        send(caller.fd.Get(), szAnswer.data(), szAnswer.size(), MSG_NOSIGNAL);
    }
    return szAnswer.empty() && caller.szText.size() < kMaxProbe;
}

// The answer to a whole and right probe, which is noted; else nothing.
std::string Responder::Recognise(bool blTcp, const std::string& szText) {
    const size_t nColon = szText.find(':');
    uint16_t nPort = 0;
    if (nColon == std::string::npos ||
        std::from_chars(szText.data() + nColon + 1, szText.data() + szText.size(), nPort).ec != std::errc() ||
        szText != Challenge(mSzProbe, nPort)) {
        return "";
    }
    const std::lock_guard lock(mMutex);
    mSetArrived.insert({blTcp, nPort});
    return Challenge(mSzAnswer, nPort);
}

}  // namespace tavo
