// Reads a request, decides whether it is served, probes, answers. Relies on cpp-httplib's parser through a
// stream of our own, as its sockets know neither a limit for the whole request nor one for its headers.
// Promises: see Connection.h.
#include "daemons/tavoportcheckd/Connection.h"

#include <httplib.h>
#include <poll.h>
#include <syslog.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>

#include "daemons/tavoportcheckd/Prober.h"
#include "porttest/Protocol.h"

namespace tavo {

namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

constexpr milliseconds kReadLimit(5000);
constexpr milliseconds kWriteLimit(5000);
constexpr milliseconds kHoldTime(1000);
constexpr size_t kMaxBody = 24U << 10U;
constexpr size_t kMaxRequest = 32U << 10U;  // headers and body
constexpr size_t kMaxHeaders = 40;
constexpr char kBearer[] = "Bearer ";
enum Code {
    kOk = 200,
    kBadRequest = 400,
    kUnauthorized = 401,
    kNotFound = 404,
    kUnsupportedType = 415,
    kTooManyRequests = 429,
    kTooManyHeaders = 431,
    kInternal = 500,
    kBusy = 503
};

bool Wait(int fd, short nEvents, int fdStop, Clock::time_point end) {
    const auto left = std::chrono::duration_cast<milliseconds>(end - Clock::now()).count();
    pollfd rgWaiting[] = {{fd, nEvents, 0}, {fdStop, POLLIN, 0}};
    return left > 0 && poll(rgWaiting, std::size(rgWaiting), static_cast<int>(left)) > 0 && rgWaiting[1].revents == 0 &&
           rgWaiting[0].revents != 0;
}

// A client's socket with an end to its patience and to its appetite.
class BoundedStream : public httplib::Stream {
public:
    BoundedStream(int fd, int fdStop) : mFd(fd), mFdStop(fdStop) {}

    bool is_readable() const override { return true; }
    bool is_writable() const override { return true; }
    ssize_t read(char* pData, size_t nSize) override {
        if (mSzBuffer.size() == mNTaken && !Fill()) {
            return -1;
        }
        const size_t nTake = std::min(nSize, mSzBuffer.size() - mNTaken);
        std::memcpy(pData, mSzBuffer.data() + mNTaken, nTake);
        mNTaken += nTake;
        return static_cast<ssize_t>(nTake);
    }
    ssize_t write(const char* pData, size_t nSize) override {
        if (mWriteEnd == Clock::time_point()) {
            mWriteEnd = Clock::now() + kWriteLimit;
        }
        for (;;) {
            const ssize_t nSent = send(mFd, pData, nSize, MSG_NOSIGNAL | MSG_DONTWAIT);
            if (nSent >= 0 || errno != EAGAIN || !Wait(mFd, POLLOUT, mFdStop, mWriteEnd)) {
                return nSent;
            }
        }
    }
    void get_remote_ip_and_port(std::string&, int&) const override {}
    void get_local_ip_and_port(std::string&, int&) const override {}
    socket_t socket() const override { return mFd; }

private:
    bool Fill() {
        mSzBuffer.resize(std::min<size_t>(mNAllowed, 4096));
        mNTaken = 0;
        const ssize_t nRead = mSzBuffer.empty() || !Wait(mFd, POLLIN, mFdStop, mReadEnd)
                                  ? -1
                                  : recv(mFd, mSzBuffer.data(), mSzBuffer.size(), MSG_DONTWAIT);
        mSzBuffer.resize(static_cast<size_t>(std::max<ssize_t>(nRead, 0)));
        mNAllowed -= mSzBuffer.size();
        return nRead > 0;
    }

    int mFd;
    int mFdStop;
    Clock::time_point mReadEnd = Clock::now() + kReadLimit;
    Clock::time_point mWriteEnd;
    size_t mNAllowed = kMaxRequest;
    std::string mSzBuffer;
    size_t mNTaken = 0;
};

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

class Connection : private httplib::Server {
public:
    Connection(const Address& peer, CheckdState& state);
    void Serve(int fd);
    bool HasHeld() const { return !mRgHeld.empty(); }

private:
    std::optional<Address> Asker(const httplib::Request& request) const;
    Code Admit(const httplib::Request& request);
    void Check(const std::string& szBody, httplib::Response& response);
    static void Refuse(httplib::Response& response, Code enCode, const char* szWhy);

    const Address& mPeer;
    CheckdState& mState;
    std::optional<Address> mAsker;
    std::optional<Turn> mTurn;
    std::vector<Descriptor> mRgHeld;
    std::string mSzNote;
};

Connection::Connection(const Address& peer, CheckdState& state) : mPeer(peer), mState(state) {
    set_payload_max_length(kMaxBody);
    // Before the body is read.
    set_pre_routing_handler([this](const httplib::Request& request, httplib::Response& response) {
        const Code enCode = Admit(request);
        if (enCode == kOk) {
            return HandlerResponse::Unhandled;
        }
        Refuse(response, enCode, "not served");
        return HandlerResponse::Handled;
    });
    Post(kCheckPath,
         [this](const httplib::Request& request, httplib::Response& response) { Check(request.body, response); });
    set_exception_handler([](const httplib::Request&, httplib::Response& response, std::exception_ptr) {
        Refuse(response, kInternal, "failed");
    });
    set_logger([this](const httplib::Request&, const httplib::Response& response) {
        syslog(LOG_INFO, "%s: HTTP %d%s", (mAsker ? *mAsker : mPeer).Text().c_str(), response.status, mSzNote.c_str());
    });
}

void Connection::Refuse(httplib::Response& response, Code enCode, const char* szWhy) {
    Json::Value jsAnswer;
    jsAnswer["error"] = szWhy;
    response.status = enCode;
    response.set_content(FormatMessage(jsAnswer), "application/json");
    if (enCode == kTooManyRequests || enCode == kBusy) {
        response.set_header("Retry-After", "60");
    }
}

// Who asked: whoever is at the other end of the connection; only a trusted proxy is believed when it names
// another. What it added itself comes last, after whatever its client sent.
std::optional<Address> Connection::Asker(const httplib::Request& request) const {
    const std::vector<Address>& rgProxies = mState.config.rgTrustedProxies;
    if (std::find(rgProxies.begin(), rgProxies.end(), mPeer) == rgProxies.end()) {
        return mPeer;
    }
    const size_t nHeaders = request.get_header_value_count(mState.config.szProxyHeader.c_str());
    if (nHeaders == 0) {
        return std::nullopt;
    }
    const std::string szValue = request.get_header_value(mState.config.szProxyHeader.c_str(), nHeaders - 1);
    const size_t nStart = szValue.find_last_of(", ") + 1;
    const auto asker = Address::Parse(szValue.substr(nStart));
    return asker && asker->IsForeignHost() ? asker : std::nullopt;
}

Code Connection::Admit(const httplib::Request& request) {
    if (request.headers.size() > kMaxHeaders) {
        return kTooManyHeaders;
    }
    mAsker = Asker(request);
    if (!mAsker) {
        return kBadRequest;
    }
    if (!mState.limits.Take(*mAsker)) {  // also for those who guess tokens
        return kTooManyRequests;
    }
    if (request.method != "POST" || request.path != kCheckPath) {
        return kNotFound;
    }
    if (!IsSame(request.get_header_value("Authorization"), kBearer + mState.config.szToken)) {
        return kUnauthorized;
    }
    // A packed body would grow beyond every bound as it is unpacked.
    return request.get_header_value("Content-Type") == "application/json" && !request.has_header("Content-Encoding")
               ? kOk
               : kUnsupportedType;
}

void Connection::Check(const std::string& szBody, httplib::Response& response) {
    CheckRequest request;
    if (const char* szWrong = ReadRequest(szBody, mState.config.nMaxPorts, request)) {
        Refuse(response, kBadRequest, szWrong);
        return;
    }
    if (!mTurn.emplace(mState.nUnderWay, mState.config.nAtOnce).IsOurs()) {
        Refuse(response, kBusy, "busy");
        return;
    }
    ProbeResult result = ProbePorts(*mAsker, request.rgPorts, request.szProbe, request.szAnswer, mState.fdStop);
    mRgHeld = std::move(result.rgHeld);
    const auto nOpen = std::count_if(result.rgFindings.begin(), result.rgFindings.end(),
                                     [](const PortFinding& finding) { return finding.enState == PortState::kOpen; });
    mSzNote = ", " + std::to_string(request.rgPorts.size()) + " ports, " + std::to_string(nOpen) + " open";
    response.set_content(Answer(*mAsker, request.rgPorts, result.rgFindings), "application/json");
}

void Connection::Serve(int fd) {
    BoundedStream stream(fd, mState.fdStop);
    bool blClosed = false;
    process_request(stream, true, blClosed, nullptr);
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
