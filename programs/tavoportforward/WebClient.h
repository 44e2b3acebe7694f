// Requests to the web pages of one router. Relies on libcurl.
// Promises: no other host is ever contacted: no redirect is followed, no proxy asked, no name looked up;
// every request ends in time and its answer is bounded; cookies live as long as the client.
#pragma once

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace tavo {

enum class WebAuth { kNone, kBasic, kDigest };

struct WebRouter {
    std::string szScheme;   // "http" or "https"
    std::string szAddress;  // IPv4
    int nPort = 0;
    WebAuth enAuth = WebAuth::kNone;
    std::string szUser;  // sent by kBasic and kDigest only
    std::string szPass;
    std::string Url() const { return szScheme + "://" + szAddress + ":" + std::to_string(nPort); }
};

struct WebRequest {
    std::string szMethod;
    std::string szPath;  // begins with "/"; no blanks or control characters
    std::vector<std::string> rgszHeaders;
    std::optional<std::string> szBody;
};

enum class WebEnd { kAnswered, kTimeout, kUnreachable, kBroken };

struct WebAnswer {
    WebEnd enEnd = WebEnd::kUnreachable;
    long nCode = 0;
    std::string szBody;
};

class WebClient {
public:
    // After end, every request times out at once.
    WebClient(WebRouter router, std::chrono::steady_clock::time_point end);
    ~WebClient();
    WebClient(const WebClient&) = delete;
    WebClient& operator=(const WebClient&) = delete;

    WebAnswer Send(const WebRequest& request);
    const WebRouter& Router() const { return mRouter; }

private:
    struct Impl;
    WebRouter mRouter;
    std::chrono::steady_clock::time_point mEnd;
    std::unique_ptr<Impl> mPImpl;
};

}  // namespace tavo
