// Reads a request, decides whether it is served, probes, answers. Relies on wire/http for HTTP.
// Promises: see Connection.h.
#include "programs/tavoportcheckd/Connection.h"

#include <poll.h>

#include <algorithm>
#include <chrono>
#include <new>
#include <optional>
#include <string>
#include <vector>

#include "ground/SysLog.h"
#include "programs/tavoportcheckd/Prober.h"
#include "wire/http/Request.h"
#include "wire/portcheck/Protocol.h"

namespace tavo {

namespace {

constexpr std::chrono::milliseconds kHoldTime(1000);
constexpr char kBearer[] = "Bearer ";
enum Code {
    kOk = 200,
    kBadRequest = 400,
    kUnauthorized = 401,
    kNotFound = 404,
    kLengthRequired = 411,
    kTooLong = 413,
    kUnsupportedType = 415,
    kTooManyRequests = 429,
    kTooManyHeaders = 431,
    kInternal = 500,
    kBusy = 503
};

const char* Reason(Code enCode) {
    switch (enCode) {
        case kOk:
            return "OK";
        case kBadRequest:
            return "Bad Request";
        case kUnauthorized:
            return "Unauthorized";
        case kNotFound:
            return "Not Found";
        case kLengthRequired:
            return "Length Required";
        case kTooLong:
            return "Content Too Large";
        case kUnsupportedType:
            return "Unsupported Media Type";
        case kTooManyRequests:
            return "Too Many Requests";
        case kTooManyHeaders:
            return "Request Header Fields Too Large";
        case kInternal:
            return "Internal Server Error";
        case kBusy:
            return "Service Unavailable";
    }
    return "";
}

Code CodeOf(HttpFault enFault) {
    switch (enFault) {
        case HttpFault::kNone:
            return kOk;
        case HttpFault::kTooManyHeaders:
            return kTooManyHeaders;
        case HttpFault::kNoLength:
            return kLengthRequired;
        case HttpFault::kTooLong:
            return kTooLong;
        case HttpFault::kGone:
        case HttpFault::kNoRequest:
            break;
    }
    return kBadRequest;
}

// Takes as long for a wrong text as for the right one; only the length may show.
bool IsSame(const std::string& szOne, const std::string& szOther) {
    if (szOne.size() != szOther.size()) {
        return false;
    }
    volatile unsigned nDifference = 0;
    for (size_t i = 0; i < szOne.size(); ++i) {
        nDifference = nDifference | static_cast<unsigned>(szOne[i] ^ szOther[i]);
    }
    return nDifference == 0;
}

// One of the requests that are under way, for as long as it keeps descriptors.
class Turn {
public:
    Turn(std::atomic<int>& nUnderWay, int nMost) : mNUnderWay(nUnderWay), mBlOurs(++nUnderWay <= nMost) {}
    ~Turn() { --mNUnderWay; }
    Turn(const Turn&) = delete;
    Turn& operator=(const Turn&) = delete;
    bool IsOurs() const { return mBlOurs; }

private:
    std::atomic<int>& mNUnderWay;
    bool mBlOurs;
};

struct CheckRequest {
    std::string szProbe;
    std::string szAnswer;
    std::vector<CheckedPort> rgPorts;
};

bool ReadNonce(const Json::Value& jsNonce, std::string& szNonce) {
    szNonce = jsNonce.isString() ? jsNonce.asString() : "";
    return szNonce.size() == kNonceLength && szNonce.find_first_not_of("0123456789abcdef") == std::string::npos;
}

bool ReadPort(const Json::Value& jsPort, CheckedPort& port) {
    if (!jsPort.isObject() || !jsPort["port"].isInt() || jsPort["port"].asInt() < 1 ||
        jsPort["port"].asInt() > UINT16_MAX || !jsPort["challenge"].isBool()) {
        return false;
    }
    port = {jsPort["protocol"] == ProtocolWord(true), static_cast<uint16_t>(jsPort["port"].asInt()),
            jsPort["challenge"].asBool()};
    return jsPort["protocol"] == ProtocolWord(port.blTcp);
}

// Null, or what is wrong with it.
const char* ReadRequest(const std::string& szBody, int nMaxPorts, CheckRequest& request) {
    const std::optional<Json::Value> jsRequest = ParseMessage(szBody);
    if (!jsRequest || !(*jsRequest)["version"].isInt() || (*jsRequest)["version"].asInt() != kCheckVersion) {
        return "a JSON object with version 1 is expected";
    }
    const Json::Value& jsPorts = (*jsRequest)["ports"];
    if (!ReadNonce((*jsRequest)["probe"], request.szProbe) || !ReadNonce((*jsRequest)["answer"], request.szAnswer) ||
        !jsPorts.isArray() || jsPorts.empty()) {
        return "probe, answer or ports is missing or no such thing";
    }
    if (jsPorts.size() > static_cast<Json::ArrayIndex>(nMaxPorts)) {
        return "too many ports";
    }
    for (const Json::Value& jsPort : jsPorts) {
        CheckedPort port = {};
        if (!ReadPort(jsPort, port)) {
            return "a port is none";
        }
        request.rgPorts.push_back(port);
    }
    return nullptr;
}

std::string Answer(const Address& asker, const std::vector<CheckedPort>& rgPorts,
                   const std::vector<PortFinding>& rgFindings) {
    Json::Value jsAnswer;
    jsAnswer["version"] = kCheckVersion;
    jsAnswer["address"] = asker.Text();
    for (size_t i = 0; i < rgPorts.size(); ++i) {
        Json::Value jsResult;
        jsResult["protocol"] = ProtocolWord(rgPorts[i].blTcp);
        jsResult["port"] = rgPorts[i].nPort;
        jsResult["state"] = kPortStateWords[static_cast<size_t>(rgFindings[i].enState)];
        jsResult["answered"] = rgFindings[i].blAnswered;
        jsResult["source"] = rgFindings[i].nSource;
        jsAnswer["results"].append(jsResult);
    }
    return FormatMessage(jsAnswer);
}

struct Reply {
    Code enCode;
    std::string szBody;
};

Reply Refusal(Code enCode, const char* szWhy) {
    Json::Value jsAnswer;
    jsAnswer["error"] = szWhy;
    return {enCode, FormatMessage(jsAnswer)};
}

class Connection {
public:
    Connection(const Address& peer, CheckdState& state) : mPeer(peer), mState(state) {}
    void Serve(int fd);
    bool HasHeld() const { return !mRgHeld.empty(); }

private:
    std::optional<Reply> Process(BoundedSocket& socket);
    std::optional<Address> Asker() const;
    Code Admit();
    Reply Check();
    void Send(BoundedSocket& socket, const Reply& reply) const;

    const Address& mPeer;
    CheckdState& mState;
    HttpRequest mRequest;
    std::optional<Address> mAsker;
    std::optional<Turn> mTurn;
    std::vector<Descriptor> mRgHeld;
    std::string mSzNote;
};

// Who asked: whoever is at the other end of the connection; only a trusted proxy is believed when it names
// another. What it added itself comes last, after whatever its client sent.
std::optional<Address> Connection::Asker() const {
    const std::vector<Address>& rgProxies = mState.config.rgTrustedProxies;
    if (std::find(rgProxies.begin(), rgProxies.end(), mPeer) == rgProxies.end()) {
        return mPeer;
    }
    const std::optional<std::string> szValue = mRequest.Header(mState.config.szProxyHeader);
    if (!szValue) {
        return std::nullopt;
    }
    const auto asker = Address::Parse(szValue->substr(szValue->find_last_of(", ") + 1));
    return asker && asker->IsForeignHost() ? asker : std::nullopt;
}

// From the headers alone.
Code Connection::Admit() {
    mAsker = Asker();
    if (!mAsker) {
        return kBadRequest;
    }
    if (!mState.limits.Take(*mAsker)) {  // also for those who guess tokens
        return kTooManyRequests;
    }
    if (mRequest.Method() != "POST" || mRequest.Path() != kCheckPath) {
        return kNotFound;
    }
    if (!IsSame(mRequest.Header("Authorization").value_or(""), kBearer + mState.config.szToken)) {
        return kUnauthorized;
    }
    // A packed body would grow beyond every bound as it is unpacked.
    return mRequest.Header("Content-Type") == "application/json" && !mRequest.Header("Content-Encoding")
               ? kOk
               : kUnsupportedType;
}

Reply Connection::Check() {
    CheckRequest request;
    if (const char* szWrong = ReadRequest(mRequest.Body(), mState.config.nMaxPorts, request)) {
        return Refusal(kBadRequest, szWrong);
    }
    if (!mTurn.emplace(mState.nUnderWay, mState.config.nAtOnce).IsOurs()) {
        return Refusal(kBusy, "busy");
    }
    ProbeResult result = ProbePorts(*mAsker, request.rgPorts, request.szProbe, request.szAnswer, mState.fdStop);
    mRgHeld = std::move(result.rgHeld);
    const auto nOpen = std::count_if(result.rgFindings.begin(), result.rgFindings.end(),
                                     [](const PortFinding& finding) { return finding.enState == PortState::kOpen; });
    mSzNote = ", " + std::to_string(request.rgPorts.size()) + " ports, " + std::to_string(nOpen) + " open";
    return {kOk, Answer(*mAsker, request.rgPorts, result.rgFindings)};
}

// Nothing for a client that left.
std::optional<Reply> Connection::Process(BoundedSocket& socket) {
    HttpFault enFault = mRequest.ReadHead(socket);
    const Code enCode = enFault == HttpFault::kNone ? Admit() : CodeOf(enFault);
    if (enFault != HttpFault::kGone && enCode != kOk) {
        return Refusal(enCode, "not served");
    }
    enFault = enFault == HttpFault::kNone ? mRequest.ReadBody(socket) : enFault;
    if (enFault == HttpFault::kGone) {
        return std::nullopt;
    }
    return enFault == HttpFault::kNone ? Check() : Refusal(CodeOf(enFault), "not served");
}

void Connection::Send(BoundedSocket& socket, const Reply& reply) const {
    std::string szText = "HTTP/1.1 " + std::to_string(reply.enCode) + ' ' + Reason(reply.enCode);
    szText += "\r\nContent-Type: application/json\r\nContent-Length: " + std::to_string(reply.szBody.size());
    szText += "\r\nConnection: close\r\n";
    if (reply.enCode == kTooManyRequests || reply.enCode == kBusy) {
        szText += "Retry-After: 60\r\n";
    }
    socket.Write(szText + "\r\n" + reply.szBody);
}

void Connection::Serve(int fd) {
    BoundedSocket socket(fd, mState.fdStop);
    std::optional<Reply> reply;
    try {
        reply = Process(socket);
    } catch (const std::bad_alloc&) {
        reply = Refusal(kInternal, "failed");
    }
    if (reply) {
        Send(socket, *reply);
        SysLog(LOG_INFO, "%s: HTTP %d%s", (mAsker ? *mAsker : mPeer).Text().c_str(), reply->enCode, mSzNote.c_str());
        socket.Finish();
    }
}

}  // namespace

void ServeConnection(Descriptor fd, const Address& peer, CheckdState& state) {
    Connection connection(peer, state);
    connection.Serve(fd.Get());
    fd.Reset();
    if (connection.HasHeld()) {
        pollfd stop = {state.fdStop, POLLIN, 0};
        poll(&stop, 1, static_cast<int>(kHoldTime.count()));
    }
}

}  // namespace tavo
