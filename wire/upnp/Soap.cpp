// See Soap.h.
#include "wire/upnp/Soap.h"

#include "wire/upnp/Xml.h"

namespace tavo {

namespace {

using tinyxml2::XMLDocument;

constexpr int kLeastErrorCode = 100;  // no protocol has less, and as a status "1" is success
constexpr char kEncoding[] = "http://schemas.xmlsoap.org/soap/encoding/";
constexpr char kEnvelope[] = "http://schemas.xmlsoap.org/soap/envelope/";

// An element without a text is written with both its tags: there are routers that read no other.
std::string Envelope(const std::string& szService, const char* szAction, const std::vector<SoapArgument>& rgArguments) {
    const std::string szCall = std::string("u:") + szAction;
    tinyxml2::XMLPrinter printer(nullptr, true);
    printer.PushDeclaration("xml version=\"1.0\"");
    printer.OpenElement("s:Envelope", true);
    printer.PushAttribute("xmlns:s", kEnvelope);
    printer.PushAttribute("s:encodingStyle", kEncoding);
    printer.OpenElement("s:Body", true);
    printer.OpenElement(szCall.c_str(), true);
    printer.PushAttribute("xmlns:u", szService.c_str());
    printer.PushText("");
    for (const SoapArgument& argument : rgArguments) {
        printer.OpenElement(argument.szName, true);
        printer.PushText(argument.szValue.c_str());
        printer.CloseElement(true);
    }
    printer.CloseElement(true);
    printer.CloseElement(true);
    printer.CloseElement(true);
    return printer.CStr();
}

int CodeOfBody(long nHttpCode, const XMLDocument& document) {
    const tinyxml2::XMLElement* pRoot = document.RootElement();
    if (document.Error() || pRoot == nullptr) {
        return kWireGarbage;
    }
    if (FindElement(pRoot, "Fault") == nullptr) {
        return nHttpCode == 200 && FindElement(pRoot, "Body") != nullptr ? kWireOk : kWireGarbage;
    }
    const auto nCode = ParseNumber<int>(TextOf(FindElement(pRoot, "errorCode")));
    return nCode && *nCode >= kLeastErrorCode ? *nCode : kWireGarbage;
}

int CodeOf(const HttpAnswer& answer, const XMLDocument& document) {
    switch (answer.enEnd) {
        case HttpEnd::kAnswered:
            return CodeOfBody(answer.nCode, document);
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

SoapAnswer::SoapAnswer(const HttpAnswer& answer) : mPDocument(std::make_unique<XMLDocument>()) {
    mPDocument->Parse(answer.szBody.data(), answer.szBody.size());
    mNCode = CodeOf(answer, *mPDocument);
}

SoapAnswer::~SoapAnswer() = default;
SoapAnswer::SoapAnswer(SoapAnswer&& other) noexcept = default;

const tinyxml2::XMLElement* SoapAnswer::Root() const {
    return mPDocument->RootElement();
}

std::string SoapAnswer::Text(std::string_view szName) const {
    return TextOf(FindElement(Root(), szName));
}

SoapAnswer CallService(HttpTransport& http, const HttpUrl& control, const std::string& szService, const char* szAction,
                       const std::vector<SoapArgument>& rgArguments) {
    return SoapAnswer(http.Post(
        control,
        {"Content-Type: text/xml; charset=\"utf-8\"", "Expect:", "SOAPAction: \"" + szService + "#" + szAction + "\""},
        Envelope(szService, szAction, rgArguments)));
}

}  // namespace tavo
