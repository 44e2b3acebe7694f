// One HTTP request as those of our programs take it that answer some. Relies on poll; no library's server knows a limit
// for the whole of a request, nor one for its headers. Promises: reading ends within a bounded time and a bounded
// number of bytes, whatever the client sends; a body has a stated length, no encoding, and is read only when it is
// asked for.
#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <string_view>

#include "wire/http/Headers.h"

namespace tavo {

// A client's socket with an end to its patience and to its appetite.
class BoundedSocket {
public:
    BoundedSocket(int fd, int fdStop) : mFd(fd), mFdStop(fdStop) {}
    bool ReadMore(std::string& szText);  // appends; false at the end of either
    void Write(std::string_view szText);
    void Finish();  // has the client see the answer before its unread rest is thrown away

private:
    using Clock = std::chrono::steady_clock;
    bool Wait(short nEvents, Clock::time_point end) const;

    int mFd;
    int mFdStop;
    Clock::time_point mReadEnd = Clock::now() + std::chrono::seconds(5);
    size_t mNAllowed = 32U << 10U;  // headers and body
};

enum class HttpFault { kNone, kGone, kNoRequest, kTooManyHeaders, kNoLength, kTooLong };

class HttpRequest {
public:
    // Up to the end of the headers. kGone: the client sent no whole request.
    HttpFault ReadHead(BoundedSocket& socket);
    // The rest, after "100 Continue" where the client waits for that.
    HttpFault ReadBody(BoundedSocket& socket);
    // Both, of what has come so far, for somebody who does not wait. kGone: it is not whole yet.
    HttpFault Parse(std::string_view szText);

    const std::string& Method() const { return mSzMethod; }
    const std::string& Path() const { return mSzPath; }
    const std::string& Body() const { return mSzBody; }
    // The last of that name, whose case does not matter; nothing where there is none.
    std::optional<std::string> Header(std::string_view szName) const { return mHeaders.Find(szName); }

private:
    HttpFault ParseHead(std::string_view szHead);
    HttpFault ReadLength(size_t& nLength) const;

    std::string mSzMethod;
    std::string mSzPath;
    std::string mSzBody;
    HttpHeaders mHeaders;
};

}  // namespace tavo
