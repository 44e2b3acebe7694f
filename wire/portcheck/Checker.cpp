// The box's side of the conversation with the port checker. Relies on jsoncpp and the bounded HTTP client.
// Promises: see Checker.h.
#include "wire/portcheck/Checker.h"

#include <arpa/inet.h>
#include <json/json.h>
#include <signal.h>
#include <sys/random.h>

#include <algorithm>
#include <array>
#include <charconv>
#include <cstdio>
#include <stdexcept>

#include "tavo/core.h"

namespace tavo {

namespace {

constexpr char kSection[] = "portcheck";
constexpr size_t kDefaultPortsPerRequest = 64;
constexpr size_t kDefaultMaxPorts = 256;
constexpr size_t kMostPorts = 1024;
constexpr int kAnswerMilliseconds = 10000;
constexpr char kNotOne[] = "the port checker did not answer as one";

std::string Setting(const char* szKey) {
    char szValue[1024];
    TLIBPlatformSettingGet(kSection, szKey, "", szValue, sizeof(szValue));
    return szValue;
}

size_t NumberSetting(const char* szKey, size_t nDefault) {
    const std::string szValue = Setting(szKey);
    size_t nValue = 0;
    const auto [pEnd, error] = std::from_chars(szValue.data(), szValue.data() + szValue.size(), nValue);
    const bool blNumber = error == std::errc() && pEnd == szValue.data() + szValue.size();
    return blNumber && nValue > 0 ? std::min(nValue, kMostPorts) : nDefault;
}

std::string RequestBody(const std::vector<CheckedPort>& rgPorts, const std::string& szProbe,
                        const std::string& szAnswer) {
    Json::Value jsRequest;
    jsRequest["version"] = kCheckVersion;
    jsRequest["probe"] = szProbe;
    jsRequest["answer"] = szAnswer;
    for (const CheckedPort& port : rgPorts) {
        Json::Value jsPort;
        jsPort["protocol"] = ProtocolWord(port.blTcp);
        jsPort["port"] = port.nPort;
        jsPort["challenge"] = port.blChallenge;
        jsRequest["ports"].append(jsPort);
    }
    return FormatMessage(jsRequest);
}

std::string ReasonOf(const HttpAnswer& answer, bool blTls) {
    switch (answer.enEnd) {
        case HttpEnd::kTimeout:
            return "the port checker did not answer in time";
        case HttpEnd::kUnreachable:
            return "the port checker cannot be reached by IPv4";
        case HttpEnd::kGarbage:
            return blTls ? std::string(kNotOne) + ", or its certificate is not to be trusted" : kNotOne;
        case HttpEnd::kAnswered:
            break;
    }
    switch (answer.nCode) {
        case 401:
        case 403:
            return "the port checker does not accept the token or the address of this network";
        case 429:
        case 503:
            return "the port checker is busy; try again in a minute";
        default:
            return std::string(kNotOne) + " (HTTP " + std::to_string(answer.nCode) + ")";
    }
}

CheckerAnswer None(std::string szReason) {
    return {{}, std::move(szReason)};
}

std::optional<PortFinding> ReadFinding(const Json::Value& jsFinding, const CheckedPort& port) {
    if (!jsFinding.isObject()) {
        return std::nullopt;
    }
    const Json::Value& jsState = jsFinding["state"];
    const auto pWord = std::find(std::begin(kPortStateWords), std::end(kPortStateWords),
                                 jsState.isString() ? jsState.asString() : std::string());
    const Json::Value& jsPort = jsFinding["port"];
    const Json::Value& jsSource = jsFinding["source"];
    const Json::Value& jsAnswered = jsFinding["answered"];
    if (jsFinding["protocol"] != ProtocolWord(port.blTcp) || !jsPort.isInt() || jsPort.asInt() != port.nPort ||
        pWord == std::end(kPortStateWords) || !jsAnswered.isBool() || !jsSource.isInt() || jsSource.asInt() < 0 ||
        jsSource.asInt() > UINT16_MAX) {
        return std::nullopt;
    }
    return PortFinding{static_cast<PortState>(pWord - std::begin(kPortStateWords)), jsAnswered.asBool(),
                       static_cast<uint16_t>(jsSource.asInt())};
}

// TLS writes to its socket in a way that raises SIGPIPE when the other side has gone, which would end a caller that
// is not prepared for it.
class WithoutSigpipe {
public:
    WithoutSigpipe() {
        sigemptyset(&mPipe);
        sigaddset(&mPipe, SIGPIPE);
        pthread_sigmask(SIG_BLOCK, &mPipe, &mBefore);
    }
    ~WithoutSigpipe() {
        const timespec now = {};
        while (sigismember(&mBefore, SIGPIPE) == 0 && sigtimedwait(&mPipe, nullptr, &now) > 0) {
        }
        pthread_sigmask(SIG_SETMASK, &mBefore, nullptr);
    }
    WithoutSigpipe(const WithoutSigpipe&) = delete;
    WithoutSigpipe& operator=(const WithoutSigpipe&) = delete;

private:
    sigset_t mPipe;
    sigset_t mBefore;
};

}  // namespace

CheckerSettings ReadCheckerSettings() {
    return {Setting("url"), Setting("token"), NumberSetting("ports_per_request", kDefaultPortsPerRequest),
            NumberSetting("max_ports", kDefaultMaxPorts)};
}

std::string MakeNonce() {
    std::array<unsigned char, kNonceLength / 2> rgBytes;
    if (getrandom(rgBytes.data(), rgBytes.size(), 0) != static_cast<ssize_t>(rgBytes.size())) {
        throw std::runtime_error("no random bytes");
    }
    std::string szNonce;
    for (const unsigned char nByte : rgBytes) {
        char szDigits[3];
        std::snprintf(szDigits, sizeof(szDigits), "%02x", nByte);
        szNonce += szDigits;
    }
    return szNonce;
}

CheckerAnswer ReadCheckerAnswer(const std::string& szBody, const std::vector<CheckedPort>& rgPorts) {
    const std::optional<Json::Value> jsAnswer = ParseMessage(szBody);
    if (!jsAnswer) {
        return None(kNotOne);
    }
    const Json::Value& jsVersion = (*jsAnswer)["version"];
    if (!jsVersion.isInt() || jsVersion.asInt() != kCheckVersion) {
        return None("the port checker speaks another version");
    }
    const Json::Value& jsAddress = (*jsAnswer)["address"];
    in_addr address = {};
    if (!jsAddress.isString() || inet_pton(AF_INET, jsAddress.asCString(), &address) != 1) {
        return None("the port checker did not see an IPv4 address of this network, and mappings are of IPv4");
    }
    const Json::Value& jsResults = (*jsAnswer)["results"];
    if (!jsResults.isArray() || jsResults.size() != rgPorts.size()) {
        return None(kNotOne);
    }
    CheckerAnswer answer;
    for (Json::ArrayIndex i = 0; i < jsResults.size(); ++i) {
        const std::optional<PortFinding> finding = ReadFinding(jsResults[i], rgPorts[i]);
        if (!finding) {
            return None(kNotOne);
        }
        answer.rgFindings.push_back(*finding);
    }
    return answer;
}

Checker::Checker(CheckerSettings settings)
    : mSettings(std::move(settings)), mUrl(ParseHttpUrl(mSettings.szUrl, true)), mHttp(kAnswerMilliseconds) {
    if (mUrl) {
        mUrl->szPath = mUrl->szPath.substr(0, mUrl->szPath.find_last_not_of('/') + 1) + kCheckPath;
    }
}

CheckerAnswer Checker::Ask(const std::vector<CheckedPort>& rgPorts, const std::string& szProbe,
                           const std::string& szAnswer, int nMilliseconds) {
    const bool blHeaderText = std::all_of(mSettings.szToken.begin(), mSettings.szToken.end(),
                                          [](unsigned char c) { return c > ' ' && c <= '~'; });
    if (!mUrl || !blHeaderText) {
        return None("the port checker's url or token cannot be used ([portcheck] of /etc/tavo/platform.conf)");
    }
    const WithoutSigpipe guard;
    mHttp.SetLimit(nMilliseconds);
    const HttpAnswer answer =
        mHttp.Post(*mUrl, {"Content-Type: application/json", "Authorization: Bearer " + mSettings.szToken},
                   RequestBody(rgPorts, szProbe, szAnswer));
    if (answer.enEnd != HttpEnd::kAnswered || answer.nCode != 200) {
        return None(ReasonOf(answer, mUrl->blTls));
    }
    return ReadCheckerAnswer(answer.szBody, rgPorts);
}

}  // namespace tavo
