// One call to a router's service, and its answer. Relies on HttpTransport for the bounds and on Xml.
// Written here and not taken from a UPnP client library, because those read answers without a bound and open a
// connection for every call. Promises: an answer that makes no sense is told from one that refuses.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "wire/Answer.h"
#include "wire/http/Http.h"
#include "wire/upnp/Xml.h"

namespace tavo {

struct SoapArgument {
    const char* szName;
    std::string szValue;
};

class SoapAnswer {
public:
    explicit SoapAnswer(const HttpAnswer& answer);

    // A WireCode, or the service's own code.
    int Code() const { return mNCode; }
    bool IsOk() const { return mNCode == kWireOk; }
    XmlElement Root() const { return mDocument.Root(); }
    // One of its values.
    std::string Text(std::string_view szName) const { return Root().Find(szName).Text(); }

private:
    XmlDocument mDocument;
    int mNCode;
};

SoapAnswer CallService(HttpTransport& http, const HttpUrl& control, const std::string& szService, const char* szAction,
                       const std::vector<SoapArgument>& rgArguments);

}  // namespace tavo
