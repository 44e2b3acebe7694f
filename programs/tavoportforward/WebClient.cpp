// Speaks to the router's web server. Relies on libcurl's easy interface; the requests of the UPnP client
// know neither accounts nor cookies nor TLS. Promises: see WebClient.h.
#include "programs/tavoportforward/WebClient.h"

#include <curl/curl.h>

#include <algorithm>
#include <new>

#include "wire/http/HeaderList.h"

namespace tavo {

namespace {

using std::chrono::milliseconds;

constexpr milliseconds kConnectLimit(3000);
constexpr milliseconds kRequestLimit(10000);  // some routers write their flash before they answer
constexpr size_t kMaxPage = 512U << 10U;

struct CurlFree {
    void operator()(CURL* pCurl) const { curl_easy_cleanup(pCurl); }
};

// Taking fewer bytes than were offered ends the transfer.
size_t TakePage(char* pData, size_t nSize, size_t nCount, void* pUser) {
    auto& szPage = *static_cast<std::string*>(pUser);
    const size_t nBytes = std::min(nSize * nCount, kMaxPage - szPage.size());
    szPage.append(pData, nBytes);
    return nBytes;
}

WebEnd EndOf(CURLcode enCode) {
    switch (enCode) {
        case CURLE_OK:
            return WebEnd::kAnswered;
        case CURLE_OPERATION_TIMEDOUT:
            return WebEnd::kTimeout;
        case CURLE_COULDNT_CONNECT:
            return WebEnd::kUnreachable;
        default:
            return WebEnd::kBroken;
    }
}

long CurlAuth(WebAuth enAuth) {
    return static_cast<long>(enAuth == WebAuth::kDigest ? CURLAUTH_DIGEST : CURLAUTH_BASIC);
}

}  // namespace

struct WebClient::Impl {
    std::unique_ptr<CURL, CurlFree> pCurl{curl_easy_init()};
};

// What holds for every request. Set once: libcurl's reset would also lose what belongs to the cookies.
WebClient::WebClient(WebRouter router, std::chrono::steady_clock::time_point end)
    : mRouter(std::move(router)), mEnd(end), mPImpl(std::make_unique<Impl>()) {
    CURL* pCurl = mPImpl->pCurl.get();
    if (pCurl == nullptr) {
        throw std::bad_alloc();
    }
    curl_easy_setopt(pCurl, CURLOPT_PATH_AS_IS, 1L);
    curl_easy_setopt(pCurl, CURLOPT_PROTOCOLS_STR, mRouter.szScheme.c_str());
    curl_easy_setopt(pCurl, CURLOPT_PROXY, "");
    curl_easy_setopt(pCurl, CURLOPT_FOLLOWLOCATION, 0L);
    curl_easy_setopt(pCurl, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(pCurl, CURLOPT_COOKIEFILE, "");  // no file: cookies in memory
    // A home router signs its own certificate, for a name or an address that is not the one it has here,
    // and makes a new one when it is reset: there is nothing to check it against. TLS then keeps the
    // password from those who only listen; against one who answers in the gateway's place it does not
    // help, and such a one has all of the box's traffic anyway. Many a router's TLS is as old as the router.
    curl_easy_setopt(pCurl, CURLOPT_SSL_VERIFYPEER, 0L);
    curl_easy_setopt(pCurl, CURLOPT_SSL_VERIFYHOST, 0L);
    curl_easy_setopt(pCurl, CURLOPT_SSLVERSION, static_cast<long>(CURL_SSLVERSION_TLSv1_0));
    curl_easy_setopt(pCurl, CURLOPT_SSL_CIPHER_LIST, "DEFAULT:@SECLEVEL=0");
    curl_easy_setopt(pCurl, CURLOPT_WRITEFUNCTION, &TakePage);
    if (mRouter.enAuth != WebAuth::kNone) {
        curl_easy_setopt(pCurl, CURLOPT_HTTPAUTH, CurlAuth(mRouter.enAuth));
        curl_easy_setopt(pCurl, CURLOPT_USERNAME, mRouter.szUser.c_str());
        curl_easy_setopt(pCurl, CURLOPT_PASSWORD, mRouter.szPass.c_str());
    }
}

WebClient::~WebClient() = default;

WebAnswer WebClient::Send(const WebRequest& request) {
    WebAnswer answer;
    CURL* pCurl = mPImpl->pCurl.get();
    const auto left = std::chrono::duration_cast<milliseconds>(mEnd - std::chrono::steady_clock::now());
    if (left <= milliseconds(0)) {
        answer.enEnd = WebEnd::kTimeout;
        return answer;
    }
    const HeaderList pHeaders = MakeHeaders(request.rgszHeaders);
    const std::string szUrl = mRouter.Url() + request.szPath;
    curl_easy_setopt(pCurl, CURLOPT_URL, szUrl.c_str());
    curl_easy_setopt(pCurl, CURLOPT_CONNECTTIMEOUT_MS, static_cast<long>(std::min(left, kConnectLimit).count()));
    curl_easy_setopt(pCurl, CURLOPT_TIMEOUT_MS, static_cast<long>(std::min(left, kRequestLimit).count()));
    curl_easy_setopt(pCurl, CURLOPT_HTTPHEADER, pHeaders.get());
    curl_easy_setopt(pCurl, CURLOPT_WRITEDATA, &answer.szBody);
    if (request.szBody) {
        curl_easy_setopt(pCurl, CURLOPT_POST, 1L);
        curl_easy_setopt(pCurl, CURLOPT_POSTFIELDSIZE, static_cast<long>(request.szBody->size()));
        curl_easy_setopt(pCurl, CURLOPT_POSTFIELDS, request.szBody->c_str());
    } else {
        curl_easy_setopt(pCurl, CURLOPT_HTTPGET, 1L);
    }
    curl_easy_setopt(pCurl, CURLOPT_CUSTOMREQUEST, request.szMethod.c_str());
    answer.enEnd = EndOf(curl_easy_perform(pCurl));
    curl_easy_getinfo(pCurl, CURLINFO_RESPONSE_CODE, &answer.nCode);
    return answer;
}

}  // namespace tavo
