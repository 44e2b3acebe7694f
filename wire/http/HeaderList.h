// Request headers as libcurl takes them. Relies on libcurl.
#pragma once

#include <curl/curl.h>

#include <memory>
#include <new>
#include <string>
#include <vector>

namespace tavo {

struct HeaderListFree {
    void operator()(curl_slist* pList) const { curl_slist_free_all(pList); }
};
using HeaderList = std::unique_ptr<curl_slist, HeaderListFree>;

// Null for no headers; throws std::bad_alloc.
inline HeaderList MakeHeaders(const std::vector<std::string>& rgszHeaders) {
    HeaderList pHeaders;
    for (const std::string& szHeader : rgszHeaders) {
        curl_slist* pGrown = curl_slist_append(pHeaders.get(), szHeader.c_str());
        if (pGrown == nullptr) {
            throw std::bad_alloc();
        }
        static_cast<void>(pHeaders.release());
        pHeaders.reset(pGrown);
    }
    return pHeaders;
}

}  // namespace tavo
