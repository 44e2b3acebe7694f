// See Soap.h.
#include "wire/upnp/Soap.h"

#include <string_view>

namespace tavo {

namespace {

constexpr int kLeastErrorCode = 100;  // no protocol has less, and as a status "1" is success
constexpr char kEncoding[] = "http://schemas.xmlsoap.org/soap/encoding/";
constexpr char kEnvelope[] = "http://schemas.xmlsoap.org/soap/envelope/";

// An element without a text is written with both its tags: there are routers that read no other.
std::string Envelope(const std::string& szService, const char* szAction, const std::vector<SoapArgument>& rgArguments) {
    std::string szXml = std::string("<?xml version=\"1.0\"?><s:Envelope xmlns:s=\"") + kEnvelope +
                        "\" s:encodingStyle=\"" + kEncoding + "\"><s:Body><u:" + szAction + " xmlns:u=\"" +
                        EscapedXml(szService) + "\">";
    for (const SoapArgument& argument : rgArguments) {
        szXml += std::string("<") + argument.szName + ">" + EscapedXml(argument.szValue) + "</" + argument.szName + ">";
    }
    return szXml + "</u:" + szAction + "></s:Body></s:Envelope>";
}

// A value may be cut where the answer is: its body has to be closed.
bool IsWhole(std::string_view szText) {
    const size_t nName = szText.rfind("Body");
    const size_t nTag = nName == std::string_view::npos ? nName : szText.rfind('<', nName);
    return nTag != std::string_view::npos && szText.substr(nTag, 2) == "</" &&
           szText.find('>', nName) != std::string_view::npos;
}

int CodeOfBody(long nHttpCode, const XmlElement& root) {
    if (!root.Find("Fault")) {
        return nHttpCode == 200 && root.Find("Body").Child() ? kWireOk : kWireGarbage;
    }
    const auto nCode = ParseNumber<int>(root.Find("errorCode").Text());
    return nCode && *nCode >= kLeastErrorCode ? *nCode : kWireGarbage;
}

int CodeOf(const HttpAnswer& answer, const XmlElement& root) {
    switch (answer.enEnd) {
        case HttpEnd::kAnswered:
            return IsWhole(answer.szBody) ? CodeOfBody(answer.nCode, root) : int{kWireGarbage};
        case HttpEnd::kTimeout:
            return kWireTimeout;
        case HttpEnd::kUnreachable:
            return kWireUnreachable;
        case HttpEnd::kGarbage:
            break;
    }
    return kWireGarbage;
}

}  // namespace

SoapAnswer::SoapAnswer(const HttpAnswer& answer) : mDocument(answer.szBody), mNCode(CodeOf(answer, mDocument.Root())) {}

SoapAnswer CallService(HttpTransport& http, const HttpUrl& control, const std::string& szService, const char* szAction,
                       const std::vector<SoapArgument>& rgArguments) {
    return SoapAnswer(http.Post(
        control,
        {"Content-Type: text/xml; charset=\"utf-8\"", "Expect:", "SOAPAction: \"" + szService + "#" + szAction + "\""},
        Envelope(szService, szAction, rgArguments)));
}

}  // namespace tavo
