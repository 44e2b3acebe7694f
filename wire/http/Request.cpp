// Reads and parses; whatever is not plainly a request is none. Relies on nothing but the socket. Promises: see
// Request.h.
#include "wire/http/Request.h"

#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <iterator>

namespace tavo {

namespace {

constexpr std::chrono::milliseconds kWriteLimit(5000);
constexpr std::chrono::milliseconds kFinishLimit(1000);
constexpr size_t kReadSize = 4096;
constexpr size_t kMaxHeaders = 40;
constexpr size_t kMaxBody = 24U << 10U;
constexpr std::string_view kLineEnd = "\r\n";
constexpr std::string_view kHeadEnd = "\r\n\r\n";

}  // namespace

bool BoundedSocket::Wait(short nEvents, Clock::time_point end) const {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(end - Clock::now()).count();
    pollfd rgWaiting[] = {{mFd, nEvents, 0}, {mFdStop, POLLIN, 0}};
    return left > 0 && poll(rgWaiting, std::size(rgWaiting), static_cast<int>(left)) > 0 && rgWaiting[1].revents == 0 &&
           rgWaiting[0].revents != 0;
}

bool BoundedSocket::ReadMore(std::string& szText) {
    char rgBuffer[kReadSize];
    const size_t nMost = std::min(mNAllowed, sizeof(rgBuffer));
    const ssize_t nRead = nMost == 0 || !Wait(POLLIN, mReadEnd) ? -1 : recv(mFd, rgBuffer, nMost, MSG_DONTWAIT);
    if (nRead <= 0) {
        return false;
    }
    szText.append(rgBuffer, static_cast<size_t>(nRead));
    mNAllowed -= static_cast<size_t>(nRead);
    return true;
}

void BoundedSocket::Write(std::string_view szText) {
    const Clock::time_point end = Clock::now() + kWriteLimit;
    while (!szText.empty()) {
        const ssize_t nSent = send(mFd, szText.data(), szText.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
        if (nSent >= 0) {
            szText.remove_prefix(static_cast<size_t>(nSent));
        } else if (errno != EAGAIN || !Wait(POLLOUT, end)) {
            return;
        }
    }
}

// A socket closed over unread bytes is reset, and the answer may be lost with them.
void BoundedSocket::Finish() {
    shutdown(mFd, SHUT_WR);
    mReadEnd = std::min(mReadEnd, Clock::now() + kFinishLimit);
    for (std::string szRest; ReadMore(szRest); szRest.clear()) {
    }
}

HttpFault HttpRequest::ReadHead(BoundedSocket& socket) {
    std::string szText;
    size_t nEnd = std::string::npos;
    for (size_t nSeen = 0; nEnd == std::string::npos; nEnd = szText.find(kHeadEnd, nSeen)) {
        nSeen = szText.size() - std::min(szText.size(), kHeadEnd.size() - 1);
        if (!socket.ReadMore(szText)) {
            return HttpFault::kGone;
        }
    }
    mSzBody = szText.substr(nEnd + kHeadEnd.size());
    return ParseHead(std::string_view(szText).substr(0, nEnd));
}

HttpFault HttpRequest::ParseHead(std::string_view szHead) {
    const size_t nLine = std::min(szHead.find(kLineEnd), szHead.size());
    const std::string_view szRequest = szHead.substr(0, nLine);
    const size_t nPath = szRequest.find(' ') + 1;
    const size_t nVersion = szRequest.find(' ', nPath) + 1;
    if (nPath <= 1 || nVersion == 0 ||
        (szRequest.substr(nVersion) != "HTTP/1.1" && szRequest.substr(nVersion) != "HTTP/1.0")) {
        return HttpFault::kNoRequest;
    }
    mSzMethod = szRequest.substr(0, nPath - 1);
    mSzPath = szRequest.substr(nPath, nVersion - 1 - nPath);
    for (szHead.remove_prefix(nLine); !szHead.empty();) {
        szHead.remove_prefix(kLineEnd.size());
        const std::string_view szLine = szHead.substr(0, szHead.find(kLineEnd));
        szHead.remove_prefix(szLine.size());
        if (mHeaders.Size() == kMaxHeaders) {
            return HttpFault::kTooManyHeaders;
        }
        if (!mHeaders.Add(szLine)) {
            return HttpFault::kNoRequest;
        }
    }
    return HttpFault::kNone;
}

HttpFault HttpRequest::ReadLength(size_t& nLength) const {
    const std::string szLength = Header("Content-Length").value_or("");
    const auto [pEnd, enError] = std::from_chars(szLength.data(), szLength.data() + szLength.size(), nLength);
    if (enError == std::errc::result_out_of_range || nLength > kMaxBody) {
        return HttpFault::kTooLong;
    }
    const bool blPlain = enError == std::errc() && pEnd == szLength.data() + szLength.size();
    return blPlain && !Header("Transfer-Encoding") ? HttpFault::kNone : HttpFault::kNoLength;
}

HttpFault HttpRequest::ReadBody(BoundedSocket& socket) {
    size_t nLength = 0;
    if (const HttpFault enFault = ReadLength(nLength); enFault != HttpFault::kNone) {
        return enFault;
    }
    if (mSzBody.size() < nLength && IsSameWord(Header("Expect").value_or(""), "100-continue")) {
        socket.Write("HTTP/1.1 100 Continue\r\n\r\n");
    }
    while (mSzBody.size() < nLength) {
        if (!socket.ReadMore(mSzBody)) {
            return HttpFault::kGone;
        }
    }
    mSzBody.resize(nLength);
    return HttpFault::kNone;
}

HttpFault HttpRequest::Parse(std::string_view szText) {
    const size_t nEnd = szText.find(kHeadEnd);
    if (nEnd == szText.npos) {
        return HttpFault::kGone;
    }
    size_t nLength = 0;
    HttpFault enFault = ParseHead(szText.substr(0, nEnd));
    enFault = enFault == HttpFault::kNone ? ReadLength(nLength) : enFault;
    mSzBody = szText.substr(nEnd + kHeadEnd.size());
    if (enFault == HttpFault::kNone && mSzBody.size() < nLength) {
        return HttpFault::kGone;
    }
    mSzBody.resize(std::min(mSzBody.size(), nLength));
    return enFault;
}

}  // namespace tavo
