// HTTP towards a router, or a service, that may be broken or hostile. Relies on libcurl.
// Promises: every request ends within its deadline, its headers and its body within their bounds; no redirects, no
// proxies, no other host than the one given, and that by IPv4, of which all mappings are.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "wire/http/Headers.h"

namespace tavo {

// A URL taken apart.
struct HttpUrl {
    std::string szHost;
    int nPort;
    std::string szPath;  // begins with "/"
    bool blTls = false;  // https, with the certificate checked
    std::string Text() const {
        return (blTls ? "https://" : "http://") + szHost + ":" + std::to_string(nPort) + szPath;
    }
};
// Nothing for an unreadable URL, port 0, an account in it, or a scheme other than http and, where blTlsToo,
// https.
std::optional<HttpUrl> ParseHttpUrl(const std::string& szUrl, bool blTlsToo = false);

enum class HttpEnd { kAnswered, kTimeout, kUnreachable, kGarbage };

struct HttpAnswer {
    HttpEnd enEnd = HttpEnd::kUnreachable;
    long nCode = 0;
    std::string szBody;
    HttpHeaders headers = {};
};

// The most that a request to a router takes.
inline constexpr int kRequestMilliseconds = 5000;

// What carries requests to a router.
class HttpTransport {
public:
    virtual ~HttpTransport() = default;
    virtual HttpAnswer Get(const HttpUrl& url) = 0;
    virtual HttpAnswer Post(const HttpUrl& url, const std::vector<std::string>& rgszHeaders,
                            const std::string& szBody) = 0;
    // A request of any other method, without a body; that of the answer is not waited for.
    virtual HttpAnswer Ask(const std::string& /*szMethod*/, const HttpUrl& /*url*/,
                           const std::vector<std::string>& /*rgszHeaders*/) {
        return {};
    }
    // The most that one request may take from now on.
    virtual void SetLimit(int /*nMilliseconds*/) {}
    // Requests go out from this address of the box's from now on; empty: from whichever the way there has.
    virtual void SetSource(const std::string& /*szAddress*/) {}
    // Requests end, as timeouts, within a second of the moment from which fnStop answers true.
    virtual void SetStop(const std::function<bool()>& /*fnStop*/) {}
};

// The network. One client keeps its connection open between requests where the router does.
class HttpClient : public HttpTransport {
public:
    // nMostMilliseconds: for one request, also when SetLimit is given more.
    explicit HttpClient(int nMostMilliseconds = kRequestMilliseconds);
    ~HttpClient() override;
    HttpClient(const HttpClient&) = delete;
    HttpClient& operator=(const HttpClient&) = delete;

    HttpAnswer Get(const HttpUrl& url) override;
    HttpAnswer Post(const HttpUrl& url, const std::vector<std::string>& rgszHeaders,
                    const std::string& szBody) override;
    HttpAnswer Ask(const std::string& szMethod, const HttpUrl& url,
                   const std::vector<std::string>& rgszHeaders) override;
    void SetLimit(int nMilliseconds) override;
    void SetStop(const std::function<bool()>& fnStop) override;
    void SetSource(const std::string& szAddress) override;

private:
    void Prepare(const HttpUrl& url);
    HttpAnswer Perform(const std::vector<std::string>& rgszHeaders);

    struct Impl;
    std::unique_ptr<Impl> mPImpl;
};

}  // namespace tavo
