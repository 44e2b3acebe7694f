// HTTP towards a router that may be broken or hostile. Relies on libcurl.
// Promises: every request ends within its deadline and its body within its bound; no redirects, no
// proxies, no other host than the one given.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "core/Export.h"

namespace tavo {

// An http URL taken apart; nothing for another scheme, an unreadable URL or one with an account in it.
struct HttpUrl {
    std::string szHost;
    int nPort;
    std::string szPath;  // begins with "/"
    std::string Text() const { return "http://" + szHost + ":" + std::to_string(nPort) + szPath; }
};
TAVO_PLATFORM_API std::optional<HttpUrl> ParseHttpUrl(const std::string& szUrl);

enum class HttpEnd { kAnswered, kTimeout, kUnreachable, kGarbage };

struct HttpAnswer {
    HttpEnd enEnd = HttpEnd::kUnreachable;
    long nCode = 0;
    std::string szBody;
};

// One client keeps its connection open between requests where the router does.
class TAVO_PLATFORM_API HttpClient {
public:
    HttpClient();
    ~HttpClient();
    HttpClient(const HttpClient&) = delete;
    HttpClient& operator=(const HttpClient&) = delete;

    // The most that one request may take from now on.
    void SetLimit(int nMilliseconds);
    HttpAnswer Get(const HttpUrl& url);
    HttpAnswer Post(const HttpUrl& url, const std::vector<std::string>& rgszHeaders, const std::string& szBody);

private:
    HttpAnswer Perform(const HttpUrl& url, const std::vector<std::string>& rgszHeaders, const std::string* pSzBody);

    struct Impl;
    std::unique_ptr<Impl> mPImpl;
};

}  // namespace tavo
