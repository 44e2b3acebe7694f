// HTTP requests with a deadline and a bounded body. Relies on libcurl, and not on the UPnP client
// library's own HTTP, which has no overall deadline and reads a body without end.
// Promises: see Http.h.
#include "wire/http/Http.h"

#include <curl/curl.h>

#include <algorithm>
#include <charconv>

#include "wire/http/HeaderList.h"

namespace tavo {

namespace {

constexpr long kConnectMilliseconds = 3000;
constexpr size_t kMaxBody = 256U << 10U;
constexpr size_t kMaxHead = 32U << 10U;

// Refusing a byte makes libcurl end the transfer.
size_t TakeBody(char* pData, size_t nSize, size_t nCount, void* pUser) {
    auto* pBody = static_cast<std::string*>(pUser);
    const size_t nBytes = nSize * nCount;
    if (pBody->size() + nBytes > kMaxBody) {
        return 0;
    }
    pBody->append(pData, nBytes);
    return nBytes;
}

struct Head {
    HttpHeaders headers;
    size_t nBytes = 0;
};

// One line at a time.
size_t TakeHead(char* pData, size_t nSize, size_t nCount, void* pUser) {
    auto* pHead = static_cast<Head*>(pUser);
    std::string_view szLine(pData, nSize * nCount);
    pHead->nBytes += szLine.size();
    if (pHead->nBytes > kMaxHead) {
        return 0;
    }
    szLine = szLine.substr(0, szLine.find_last_not_of("\r\n") + 1);
    pHead->headers.Add(szLine);
    return nSize * nCount;
}

// Asked at least once a second while a request lasts; anything but 0 ends it.
int AskStop(void* pUser, curl_off_t, curl_off_t, curl_off_t, curl_off_t) {
    const auto& fnStop = *static_cast<const std::function<bool()>*>(pUser);
    return fnStop && fnStop() ? 1 : 0;
}

HttpEnd EndOf(CURLcode enCode) {
    switch (enCode) {
        case CURLE_OK:
            return HttpEnd::kAnswered;
        case CURLE_OPERATION_TIMEDOUT:
        case CURLE_ABORTED_BY_CALLBACK:
            return HttpEnd::kTimeout;
        case CURLE_COULDNT_CONNECT:
        case CURLE_COULDNT_RESOLVE_HOST:
        case CURLE_SEND_ERROR:
        case CURLE_INTERFACE_FAILED:
            return HttpEnd::kUnreachable;
        default:
            return HttpEnd::kGarbage;
    }
}

struct UrlFree {
    void operator()(CURLU* pUrl) const { curl_url_cleanup(pUrl); }
};

std::string UrlPart(CURLU* pUrl, CURLUPart enPart) {
    char* szPart = nullptr;
    if (curl_url_get(pUrl, enPart, &szPart, CURLU_DEFAULT_PORT) != CURLUE_OK) {
        return "";
    }
    std::string szText = szPart;
    curl_free(szPart);
    return szText;
}

}  // namespace

std::optional<HttpUrl> ParseHttpUrl(const std::string& szUrl, bool blTlsToo) {
    const std::unique_ptr<CURLU, UrlFree> pUrl(curl_url());
    if (!pUrl || curl_url_set(pUrl.get(), CURLUPART_URL, szUrl.c_str(), 0) != CURLUE_OK) {
        return std::nullopt;
    }
    const std::string szScheme = UrlPart(pUrl.get(), CURLUPART_SCHEME);
    const bool blTls = blTlsToo && szScheme == "https";
    if ((!blTls && szScheme != "http") || !UrlPart(pUrl.get(), CURLUPART_USER).empty()) {
        return std::nullopt;
    }
    const std::string szQuery = UrlPart(pUrl.get(), CURLUPART_QUERY);
    const std::string szPort = UrlPart(pUrl.get(), CURLUPART_PORT);
    uint16_t nPort = 0;
    if (std::from_chars(szPort.data(), szPort.data() + szPort.size(), nPort).ec != std::errc() || nPort == 0) {
        return std::nullopt;
    }
    return HttpUrl{UrlPart(pUrl.get(), CURLUPART_HOST), nPort,
                   UrlPart(pUrl.get(), CURLUPART_PATH) + (szQuery.empty() ? "" : "?" + szQuery), blTls};
}

struct HttpClient::Impl {
    CURL* pCurl = curl_easy_init();
    long nMostMilliseconds;
    long nLimitMilliseconds = nMostMilliseconds;
    std::function<bool()> fnStop;
    std::string szSource;
    explicit Impl(int nMost) : nMostMilliseconds(nMost) {}
    ~Impl() { curl_easy_cleanup(pCurl); }
};

HttpClient::HttpClient(int nMostMilliseconds) : mPImpl(std::make_unique<Impl>(nMostMilliseconds)) {}

HttpClient::~HttpClient() = default;

void HttpClient::SetLimit(int nMilliseconds) {
    mPImpl->nLimitMilliseconds = std::clamp<long>(nMilliseconds, 1, mPImpl->nMostMilliseconds);
}

void HttpClient::SetStop(const std::function<bool()>& fnStop) {
    mPImpl->fnStop = fnStop;
}

void HttpClient::SetSource(const std::string& szAddress) {
    mPImpl->szSource = szAddress.empty() ? "" : "host!" + szAddress;
}

HttpAnswer HttpClient::Get(const HttpUrl& url) {
    Prepare(url);
    return Perform({});
}

HttpAnswer HttpClient::Post(const HttpUrl& url, const std::vector<std::string>& rgszHeaders,
                            const std::string& szBody) {
    Prepare(url);
    curl_easy_setopt(mPImpl->pCurl, CURLOPT_POSTFIELDSIZE, static_cast<long>(szBody.size()));
    curl_easy_setopt(mPImpl->pCurl, CURLOPT_POSTFIELDS, szBody.c_str());
    return Perform(rgszHeaders);
}

HttpAnswer HttpClient::Ask(const std::string& szMethod, const HttpUrl& url,
                           const std::vector<std::string>& rgszHeaders) {
    Prepare(url);
    curl_easy_setopt(mPImpl->pCurl, CURLOPT_NOBODY, 1L);
    curl_easy_setopt(mPImpl->pCurl, CURLOPT_CUSTOMREQUEST, szMethod.c_str());
    return Perform(rgszHeaders);
}

void HttpClient::Prepare(const HttpUrl& url) {
    CURL* pCurl = mPImpl->pCurl;
    if (pCurl == nullptr) {
        return;
    }
    curl_easy_reset(pCurl);  // keeps the open connection
    curl_easy_setopt(pCurl, CURLOPT_URL, url.Text().c_str());
    curl_easy_setopt(pCurl, CURLOPT_PROTOCOLS_STR, url.blTls ? "https" : "http");
    curl_easy_setopt(pCurl, CURLOPT_IPRESOLVE, CURL_IPRESOLVE_V4);
    curl_easy_setopt(pCurl, CURLOPT_PROXY, "");
    if (!mPImpl->szSource.empty()) {
        curl_easy_setopt(pCurl, CURLOPT_INTERFACE, mPImpl->szSource.c_str());
        curl_easy_setopt(pCurl, CURLOPT_FRESH_CONNECT, 1L);
        curl_easy_setopt(pCurl, CURLOPT_FORBID_REUSE, 1L);  // by a request that may go out from anywhere
    }
    curl_easy_setopt(pCurl, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(pCurl, CURLOPT_FOLLOWLOCATION, 0L);
    curl_easy_setopt(pCurl, CURLOPT_TCP_NODELAY, 1L);
    curl_easy_setopt(pCurl, CURLOPT_CONNECTTIMEOUT_MS, std::min(kConnectMilliseconds, mPImpl->nLimitMilliseconds));
    curl_easy_setopt(pCurl, CURLOPT_TIMEOUT_MS, mPImpl->nLimitMilliseconds);
    curl_easy_setopt(pCurl, CURLOPT_USERAGENT, "Linux UPnP/1.1 tavo/1.0");
    curl_easy_setopt(pCurl, CURLOPT_HEADERFUNCTION, &TakeHead);
    curl_easy_setopt(pCurl, CURLOPT_WRITEFUNCTION, &TakeBody);
    curl_easy_setopt(pCurl, CURLOPT_NOPROGRESS, 0L);
    curl_easy_setopt(pCurl, CURLOPT_XFERINFOFUNCTION, &AskStop);
    curl_easy_setopt(pCurl, CURLOPT_XFERINFODATA, &mPImpl->fnStop);
}

HttpAnswer HttpClient::Perform(const std::vector<std::string>& rgszHeaders) {
    HttpAnswer answer;
    CURL* pCurl = mPImpl->pCurl;
    if (pCurl == nullptr) {
        return answer;
    }
    Head head;
    const HeaderList pHeaders = MakeHeaders(rgszHeaders);
    curl_easy_setopt(pCurl, CURLOPT_HTTPHEADER, pHeaders.get());
    curl_easy_setopt(pCurl, CURLOPT_HEADERDATA, &head);
    curl_easy_setopt(pCurl, CURLOPT_WRITEDATA, &answer.szBody);
    answer.enEnd = EndOf(curl_easy_perform(pCurl));
    curl_easy_getinfo(pCurl, CURLINFO_RESPONSE_CODE, &answer.nCode);
    answer.headers = std::move(head.headers);
    return answer;
}

}  // namespace tavo
