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
    explicit Impl(int nMost) : nMostMilliseconds(nMost) {}
    ~Impl() { curl_easy_cleanup(pCurl); }
};

HttpClient::HttpClient(int nMostMilliseconds) : mPImpl(std::make_unique<Impl>(nMostMilliseconds)) {}

HttpClient::~HttpClient() = default;

void HttpClient::SetLimit(int nMilliseconds) {
    mPImpl->nLimitMilliseconds = std::clamp<long>(nMilliseconds, 1, mPImpl->nMostMilliseconds);
}

void HttpClient::SetStop(std::function<bool()> fnStop) {
    mPImpl->fnStop = std::move(fnStop);
}

HttpAnswer HttpClient::Get(const HttpUrl& url) {
    return Perform(url, {}, nullptr);
}

HttpAnswer HttpClient::Post(const HttpUrl& url, const std::vector<std::string>& rgszHeaders,
                            const std::string& szBody) {
    return Perform(url, rgszHeaders, &szBody);
}

HttpAnswer HttpClient::Perform(const HttpUrl& url, const std::vector<std::string>& rgszHeaders,
                               const std::string* pSzBody) {
    HttpAnswer answer;
    CURL* pCurl = mPImpl->pCurl;
    if (pCurl == nullptr) {
        return answer;
    }
    curl_easy_reset(pCurl);  // keeps the open connection
    const HeaderList pHeaders = MakeHeaders(rgszHeaders);
    const std::string szUrl = url.Text();
    curl_easy_setopt(pCurl, CURLOPT_URL, szUrl.c_str());
    curl_easy_setopt(pCurl, CURLOPT_PROTOCOLS_STR, url.blTls ? "https" : "http");
    curl_easy_setopt(pCurl, CURLOPT_IPRESOLVE, CURL_IPRESOLVE_V4);
    curl_easy_setopt(pCurl, CURLOPT_PROXY, "");
    curl_easy_setopt(pCurl, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(pCurl, CURLOPT_FOLLOWLOCATION, 0L);
    curl_easy_setopt(pCurl, CURLOPT_TCP_NODELAY, 1L);
    curl_easy_setopt(pCurl, CURLOPT_CONNECTTIMEOUT_MS, std::min(kConnectMilliseconds, mPImpl->nLimitMilliseconds));
    curl_easy_setopt(pCurl, CURLOPT_TIMEOUT_MS, mPImpl->nLimitMilliseconds);
    curl_easy_setopt(pCurl, CURLOPT_USERAGENT, "Linux UPnP/1.1 tavo/1.0");
    curl_easy_setopt(pCurl, CURLOPT_HTTPHEADER, pHeaders.get());
    curl_easy_setopt(pCurl, CURLOPT_WRITEFUNCTION, &TakeBody);
    curl_easy_setopt(pCurl, CURLOPT_WRITEDATA, &answer.szBody);
    curl_easy_setopt(pCurl, CURLOPT_NOPROGRESS, 0L);
    curl_easy_setopt(pCurl, CURLOPT_XFERINFOFUNCTION, &AskStop);
    curl_easy_setopt(pCurl, CURLOPT_XFERINFODATA, &mPImpl->fnStop);
    if (pSzBody != nullptr) {
        curl_easy_setopt(pCurl, CURLOPT_POSTFIELDSIZE, static_cast<long>(pSzBody->size()));
        curl_easy_setopt(pCurl, CURLOPT_POSTFIELDS, pSzBody->c_str());
    }
    answer.enEnd = EndOf(curl_easy_perform(pCurl));
    curl_easy_getinfo(pCurl, CURLINFO_RESPONSE_CODE, &answer.nCode);
    return answer;
}

}  // namespace tavo
