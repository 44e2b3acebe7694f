// One call to a router's service, and its answer. Relies on HttpTransport for the bounds and on tinyxml2.
// Written here and not taken from a UPnP client library, because those read answers without a bound and open a
// connection for every call. Promises: an answer that makes no sense is told from one that refuses.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "wire/Answer.h"
#include "wire/http/Http.h"

namespace tinyxml2 {
class XMLDocument;
class XMLElement;
}  // namespace tinyxml2

namespace tavo {

struct SoapArgument {
    const char* szName;
    std::string szValue;
};

class SoapAnswer {
public:
    explicit SoapAnswer(const HttpAnswer& answer);
    ~SoapAnswer();
    SoapAnswer(SoapAnswer&& other) noexcept;

    // A WireCode, or the service's own code.
    int Code() const { return mNCode; }
    bool IsOk() const { return mNCode == kWireOk; }
    // What was read; null for nothing.
    const tinyxml2::XMLElement* Root() const;
    // One of its values.
    std::string Text(std::string_view szName) const;

private:
    std::unique_ptr<tinyxml2::XMLDocument> mPDocument;
    int mNCode = kWireGarbage;
};

SoapAnswer CallService(HttpTransport& http, const HttpUrl& control, const std::string& szService, const char* szAction,
                       const std::vector<SoapArgument>& rgArguments);

}  // namespace tavo
