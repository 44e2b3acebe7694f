// What a router tells its subscribers: how one subscribes, and what of all that comes to the ear is news.
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <chrono>
#include <deque>
#include <memory>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "loopback.h"
#include "webserver.h"
#include "wire/http/Request.h"
#include "wire/upnp/Events.h"

namespace {

using namespace std::chrono_literals;
using tavo::HttpEnd;

constexpr char kRouter[] = "127.0.0.1";
constexpr char kNeighbour[] = "127.0.0.2";
const tavo::HttpUrl kService{kRouter, 5000, "/evt"};

// Answers subscriptions; the notices go over real sockets.
class Subscriptions : public tavo::HttpTransport {
public:
    tavo::HttpAnswer Get(const tavo::HttpUrl&) override { return {}; }
    tavo::HttpAnswer Post(const tavo::HttpUrl&, const std::vector<std::string>&, const std::string&) override {
        return {};
    }
    tavo::HttpAnswer Ask(const std::string& szMethod, const tavo::HttpUrl& url,
                         const std::vector<std::string>& rgszHeaders) override {
        EXPECT_EQ(url.Text(), kService.Text());
        std::string szAsked = szMethod;
        for (const std::string& szHeader : rgszHeaders) {
            const bool blCallback = szHeader.starts_with("CALLBACK: <http://127.0.0.1:");
            szAsked += blCallback ? " CALLBACK" : " " + szHeader;
            mSzCallback = blCallback ? szHeader.substr(std::string("CALLBACK: <").size()) : mSzCallback;
        }
        mRgszAsked.push_back(szAsked);
        if (mRgAnswers.empty()) {
            return {HttpEnd::kTimeout, 0, ""};
        }
        tavo::HttpAnswer answer = mRgAnswers.front();
        mRgAnswers.pop_front();
        return answer;
    }
    void SetLimit(int nMilliseconds) override { mNLimit = nMilliseconds; }
    void SetStop(const std::function<bool()>& fnStop) override { mBlStoppable = fnStop != nullptr; }
    void Grant(const std::vector<std::string>& rgszHeaders) { Say(200, rgszHeaders); }
    void Say(long nCode, const std::vector<std::string>& rgszHeaders = {}) {
        tavo::HttpAnswer answer{HttpEnd::kAnswered, nCode, ""};
        for (const std::string& szHeader : rgszHeaders) {
            answer.headers.Add(szHeader);
        }
        mRgAnswers.push_back(answer);
    }
    std::vector<std::string> TakeAsked() { return std::exchange(mRgszAsked, {}); }
    uint16_t Port() const {
        return static_cast<uint16_t>(std::stoi(mSzCallback.substr(std::string("http://127.0.0.1:").size())));
    }
    std::string Path() const {
        const size_t nPath = mSzCallback.find('/', std::string("http://").size());
        return mSzCallback.substr(nPath, mSzCallback.find('>') - nPath);
    }

    int mNLimit = 0;
    bool mBlStoppable = false;

private:
    std::vector<std::string> mRgszAsked;
    std::deque<tavo::HttpAnswer> mRgAnswers;
    std::string mSzCallback;
};

class EventsTest : public testing::Test {
protected:
    void Subscribe() {
        mPRouter->Grant({"SID: uuid:1", "TIMEOUT: Second-1800"});
        mEvents.TurnTo(kService, kRouter);
        mEvents.Keep(mNow, {});
        ASSERT_TRUE(mEvents.IsSubscribed());
        mPRouter->TakeAsked();
    }
    tavo::Descriptor Connect(const char* szFrom = kRouter) const {
        tavo::Descriptor fd = SocketAt(szFrom, 0, SOCK_STREAM);
        const sockaddr_in router = AddressOf(kRouter, mPRouter->Port());
        EXPECT_EQ(connect(fd.Get(), reinterpret_cast<const sockaddr*>(&router), sizeof(router)), 0);
        return fd;
    }
    static void Send(const tavo::Descriptor& fd, const std::string& szText) {
        send(fd.Get(), szText.data(), szText.size(), MSG_NOSIGNAL);
    }
    // The code of the answer; "" when the connection was closed without one, "-" when it is still open.
    static std::string Answer(const tavo::Descriptor& fd) {
        char szText[200] = {};
        const ssize_t nRead = recv(fd.Get(), szText, sizeof(szText) - 1, MSG_DONTWAIT);
        return nRead < 0 && errno == EAGAIN ? "-" : std::string(szText).substr(0, 12);
    }
    std::string Notice(uint32_t nNumber, const std::string& szBody, const std::string& szSubscription = "uuid:1",
                       const std::string& szMethod = "NOTIFY") const {
        return szMethod + " " + mPRouter->Path() +
               " HTTP/1.1\r\nHost: x\r\nNT: upnp:event\r\nNTS: upnp:propchange\r\n" + "SID: " + szSubscription +
               "\r\nSEQ: " + std::to_string(nNumber) + "\r\nContent-Length: " + std::to_string(szBody.size()) +
               "\r\n\r\n" + szBody;
    }
    // Sends it and looks whether it is news.
    bool IsNews(const std::string& szText, std::string* pSzAnswer = nullptr) {
        const tavo::Descriptor fd = Connect();
        Send(fd, szText);
        const bool blNews = mEvents.TakeNews();
        if (pSzAnswer != nullptr) {
            *pSzAnswer = Answer(fd);
        }
        return blNews;
    }

    tavo::BootClock::time_point mNow = tavo::BootClock::now();
    std::shared_ptr<Subscriptions> mPRouter = std::make_shared<Subscriptions>();
    tavo::Events mEvents{mPRouter};
};

constexpr char kCount[] = "<e:propertyset><e:property><PortMappingNumberOfEntries>3</PortMappingNumberOfEntries>";
constexpr char kState[] = "<e:propertyset><e:property><ConnectionStatus>Connected</ConnectionStatus>";
constexpr char kOk[] = "HTTP/1.1 200";

TEST_F(EventsTest, ASubscriptionIsKeptAndEnded) {
    using Asked = std::vector<std::string>;
    const std::string szSubscribe = "SUBSCRIBE CALLBACK NT: upnp:event TIMEOUT: Second-1800";
    const std::string szRenew = "SUBSCRIBE SID: uuid:1 TIMEOUT: Second-1800";
    mEvents.Keep(mNow, {});
    EXPECT_EQ(mPRouter->TakeAsked(), Asked()) << "no service, nothing to subscribe to";
    mPRouter->Grant({"sid:uuid:1", "Timeout: second-600"});
    mEvents.TurnTo(kService, kRouter);
    mEvents.Keep(mNow, {});
    EXPECT_EQ(mPRouter->TakeAsked(), Asked{szSubscribe});
    const std::string szPath = mPRouter->Path();
    mEvents.Keep(mNow + 299s, {});
    EXPECT_EQ(mPRouter->TakeAsked(), Asked()) << "not before half of what was granted";
    mPRouter->Grant({"SID: uuid:1", "TIMEOUT: infinite"});
    mEvents.Keep(mNow + 301s, {});
    EXPECT_EQ(mPRouter->TakeAsked(), Asked{szRenew});
    mEvents.Keep(mNow + 1200s, {});
    EXPECT_EQ(mPRouter->TakeAsked(), Asked()) << "a term without an end is renewed all the same, but later";
    // The router has forgotten us: at once anew, and by another path.
    mPRouter->Say(412);
    mPRouter->Grant({"SID: uuid:2"});
    mEvents.Keep(mNow + 1202s, {});
    EXPECT_EQ(mPRouter->TakeAsked(), (Asked{szRenew, szSubscribe}));
    EXPECT_NE(mPRouter->Path(), szPath);
    mEvents.TurnTo(kService, kRouter);
    mPRouter->Grant({});
    mEvents.Keep(mNow + 1203s, [] { return false; });
    EXPECT_TRUE(mPRouter->mBlStoppable);
    EXPECT_EQ(mPRouter->TakeAsked(), Asked{"SUBSCRIBE SID: uuid:2 TIMEOUT: Second-1800"})
        << "one that was found anew may have forgotten us";
    mEvents.End();
    EXPECT_EQ(mPRouter->TakeAsked(), Asked{"UNSUBSCRIBE SID: uuid:2"});
    EXPECT_EQ(mPRouter->mNLimit, 1000) << "also of who is told to end, but not for long";
    EXPECT_FALSE(mPRouter->mBlStoppable);
    EXPECT_EQ(mEvents.Fds(), std::vector<int>{-1});
    mEvents.End();
    EXPECT_EQ(mPRouter->TakeAsked(), Asked());
}

TEST_F(EventsTest, ATermIsHalvedAndBounded) {
    const std::pair<const char*, std::chrono::seconds> rgCases[] = {
        {"Second-1", 30s},     {"Second-61", 30s},     {"Second-62", 31s}, {"SECOND-120", 60s}, {"Second-1799", 899s},
        {"Second-1801", 900s}, {"Second-99999", 900s}, {"Second-", 900s},  {"Second-x", 900s},  {"Minute-120", 900s}};
    for (const auto& [szTerm, half] : rgCases) {
        mPRouter->Grant({"SID: uuid:1", std::string("TIMEOUT: ") + szTerm});
        mEvents.TurnTo(kService, kRouter);
        mEvents.Keep(mNow, {});
        mPRouter->TakeAsked();
        mEvents.Keep(mNow + half - 1s, {});
        EXPECT_EQ(mPRouter->TakeAsked().size(), 0U) << szTerm;
        mPRouter->Grant({});
        mEvents.Keep(mNow + half + 1s, {});
        EXPECT_EQ(mPRouter->TakeAsked().size(), 1U) << szTerm;
    }
}

TEST_F(EventsTest, ARouterThatWillNotIsLeftAloneForAWhile) {
    const auto fnAsk = [this](const char* szWhat) {
        mEvents.TurnTo(kService, kRouter);
        mEvents.Keep(mNow, {});
        EXPECT_FALSE(mEvents.IsSubscribed()) << szWhat;
        EXPECT_EQ(mEvents.Fds(), std::vector<int>{-1}) << szWhat << ": nobody is listened for";
        EXPECT_EQ(mPRouter->TakeAsked().size(), 1U) << szWhat;
        mEvents.Keep(mNow + 120s, {});
        EXPECT_EQ(mPRouter->TakeAsked().size(), 0U) << szWhat;
    };
    mPRouter->Say(501);
    fnAsk("refused");
    mPRouter->Grant({"TIMEOUT: Second-1800"});
    fnAsk("no name");
    mPRouter->Grant({"SID: " + std::string(257, 'x')});
    fnAsk("a name without end");
    fnAsk("silent");
    mEvents.TurnTo(kService, "198.41.0.4");  // no address of this box: there is nothing to ask for
    mEvents.Keep(mNow, {});
    EXPECT_TRUE(!mEvents.IsSubscribed() && mPRouter->TakeAsked().empty());
    mEvents.TurnTo(kService, kRouter);
    mEvents.Keep(mNow, {});
    EXPECT_EQ(mPRouter->TakeAsked().size(), 1U);
    mPRouter->Grant({"SID: " + std::string(256, 'x')});
    mEvents.Keep(mNow + 10min - 1s, {});
    EXPECT_FALSE(mEvents.IsSubscribed());
    mEvents.Keep(mNow + 10min, {});
    EXPECT_TRUE(mEvents.IsSubscribed());
}

TEST_F(EventsTest, NewsIsWhatNamesOurTableAndWhatCountsAnew) {
    Subscribe();
    const std::string szLong = std::string(7500, 'x') + kCount;
    const std::tuple<const char*, uint32_t, const char*, bool> rgCases[] = {
        {"how things stand", 0, kCount, false},
        {"the table", 1, kCount, true},
        {"something else", 2, kState, false},
        {"the address", 3, "<ExternalIPAddress>198.41.0.4</ExternalIPAddress>", true},
        {"a table of the second generation", 4, "<SystemUpdateID>7</SystemUpdateID>", true},
        {"nothing", 5, "", false},
        {"one was lost", 7, kState, true},
        {"it goes on", 8, kState, false},
        {"it counts anew", 0, kState, true},
        {"it goes on again", 1, kState, false},
        {"the last number", UINT32_MAX, kState, true},
        {"after which comes 1", 1, kState, false},
        {"a long one", 2, szLong.c_str(), true}};
    for (const auto& [szWhat, nNumber, szBody, blNews] : rgCases) {
        std::string szAnswer;
        EXPECT_EQ(IsNews(Notice(nNumber, szBody), &szAnswer), blNews) << szWhat;
        EXPECT_EQ(szAnswer, kOk) << szWhat;
    }
}

TEST_F(EventsTest, WhatIsNoNoticeOfOursIsNoNews) {
    Subscribe();
    const std::string szGood = Notice(1, kCount);
    const auto fnWithout = [&](const std::string& szHeader) {
        const size_t nAt = szGood.find(szHeader);
        return szGood.substr(0, nAt) + szGood.substr(szGood.find("\r\n", nAt) + 2);
    };
    const auto fnLong = [](size_t nSize) {
        const std::string szStart = "NOTIFY / HTTP/1.1\r\nA: ";
        return szStart + std::string(nSize - szStart.size(), 'x');
    };
    EXPECT_EQ(mPRouter->Path().size(), 33U) << "nobody guesses it";
    const std::tuple<const char*, std::string, std::string> rgCases[] = {
        {"another subscription", Notice(1, kCount, "uuid:11"), "HTTP/1.1 412"},
        {"no subscription", fnWithout("SID:"), "HTTP/1.1 412"},
        {"no number", fnWithout("SEQ:"), "HTTP/1.1 400"},
        {"no length", fnWithout("Content-Length:"), "HTTP/1.1 400"},
        {"another method", Notice(1, kCount, "uuid:1", "POST"), "HTTP/1.1 400"},
        {"another path", "NOTIFY /0" + szGood.substr(szGood.find(' ', 7)), "HTTP/1.1 404"},
        {"no HTTP", "\r\n\r\n", "HTTP/1.1 400"},
        {"headers without end", fnLong(8192), "HTTP/1.1 400"},
        {"headers that may have one", fnLong(8191), "-"},
        {"a body without end", Notice(1, std::string(9000, 'x') + kCount), "HTTP/1.1 400"},
        {"cut short", szGood.substr(0, szGood.size() - 1), "-"}};
    for (const auto& [szWhat, szText, szAnswer] : rgCases) {
        std::string szSaid;
        EXPECT_FALSE(IsNews(szText, &szSaid)) << szWhat;
        EXPECT_EQ(szSaid, szAnswer) << szWhat;
    }
    const tavo::Descriptor fdNeighbour = Connect(kNeighbour);
    Send(fdNeighbour, szGood);
    EXPECT_FALSE(mEvents.TakeNews());
    EXPECT_EQ(Answer(fdNeighbour), "") << "closed, and not a word";
    EXPECT_TRUE(IsNews(szGood)) << "the same from the router";
}

TEST_F(EventsTest, SlowOnesHoldNobodyUp) {
    Subscribe();
    const std::string szNotice = Notice(0, kState);
    std::vector<tavo::Descriptor> rgStalled;
    for (int i = 0; i < 40; ++i) {
        rgStalled.push_back(Connect(i % 2 == 0 ? kRouter : kNeighbour));
        Send(rgStalled.back(), szNotice.substr(0, 30));
        const auto start = std::chrono::steady_clock::now();
        EXPECT_FALSE(mEvents.TakeNews());
        EXPECT_LT(std::chrono::steady_clock::now() - start, 1s);
        EXPECT_LE(mEvents.Fds().size(), 5U) << "a few, however many come";
    }
    EXPECT_FALSE(IsNews(szNotice));
    const tavo::Descriptor fd = Connect();
    const std::string szNews = Notice(1, kCount);
    for (size_t i = 0; i < szNews.size(); ++i) {  // byte by byte
        EXPECT_EQ(Answer(fd), "-");
        Send(fd, szNews.substr(i, 1));
        EXPECT_EQ(mEvents.TakeNews(), i + 1 == szNews.size());
    }
    EXPECT_EQ(Answer(fd), kOk);
}

// No proxy, and nobody else where it is sent to.
TEST(HttpClient, AsksWhomItIsToldAndNobodyElse) {
    setenv("http_proxy", "http://127.0.0.1:1", 1);
    WebServer other("HTTP/1.1 200 OK\r\nContent-Length: 0\r\n\r\n");
    const std::string szElsewhere = "http://127.0.0.1:" + std::to_string(other.Port()) + "/";
    WebServer server("HTTP/1.1 302 Found\r\nLocation: " + szElsewhere + "\r\nContent-Length: 2\r\n\r\nno");
    const tavo::HttpAnswer answer = tavo::HttpClient().Post({kRouter, server.Port(), "/c"}, {"SOAPAction: x"}, "body");
    unsetenv("http_proxy");
    EXPECT_EQ(answer.enEnd, HttpEnd::kAnswered);
    EXPECT_EQ(std::to_string(answer.nCode) + answer.szBody, "302no");
    for (const char* szPart : {"POST /c HTTP/1.1\r\n", "\r\nUser-Agent: Linux UPnP/1.1 tavo/1.0\r\n",
                               "\r\nSOAPAction: x\r\n", "\r\nContent-Length: 4\r\n"}) {
        EXPECT_NE(server.Request().find(szPart), std::string::npos) << szPart << server.Request();
    }
    tavo::HttpClient().Get({kRouter, other.Port(), "/first"});
    EXPECT_TRUE(other.Request().starts_with("GET /first ")) << other.Request();
    WebServer plain("HTTP/1.1 200 OK\r\nContent-Length: 0\r\n\r\n");
    EXPECT_NE(tavo::HttpClient(300).Get({kRouter, plain.Port(), "/", true}).enEnd, HttpEnd::kAnswered)
        << "it speaks no TLS";
    EXPECT_EQ(plain.Request().find("GET"), std::string::npos);
}

TEST(HttpClient, AsksByAnyMethodAndReadsTheHeaders) {
    WebServer server("HTTP/1.1 200 OK\r\nSID:  uuid:1 \r\nTimeout: Second-7\r\n\r\n");  // and no end of the body
    const auto start = std::chrono::steady_clock::now();
    const tavo::HttpAnswer answer =
        tavo::HttpClient().Ask("SUBSCRIBE", {kRouter, server.Port(), "/evt?a=b"}, {"NT: upnp:event"});
    EXPECT_LT(std::chrono::steady_clock::now() - start, 2s) << "the body is not waited for";
    EXPECT_EQ(answer.enEnd, HttpEnd::kAnswered);
    EXPECT_EQ(answer.nCode, 200);
    EXPECT_EQ(answer.headers.Find("sid"), "uuid:1");
    EXPECT_EQ(answer.headers.Find("TIMEOUT"), "Second-7");
    EXPECT_TRUE(server.Request().starts_with("SUBSCRIBE /evt?a=b HTTP/1.1\r\n")) << server.Request();
    EXPECT_NE(server.Request().find("\r\nNT: upnp:event\r\n"), std::string::npos);
}

// A head of so many bytes, its end included.
std::string HeadOf(size_t nSize, const std::string& szFirst) {
    std::string szHead = szFirst + "\r\n";
    while (szHead.size() + 2 < nSize) {
        const size_t nLine = std::min<size_t>(nSize - 2 - szHead.size(), 1000);
        const size_t nRest = nSize - 2 - szHead.size() - nLine;
        szHead += "A: " + std::string(nLine - 5 - (nRest > 0 && nRest < 10 ? 10 : 0), 'x') + "\r\n";
    }
    return szHead + "\r\n";
}

TEST(HttpClient, EndsInTimeAndTakesNoMoreThanItsBounds) {
    const std::string szOk = "HTTP/1.1 200 OK";
    const auto fnBody = [&](size_t nSize) {
        return szOk + "\r\nContent-Length: " + std::to_string(nSize) + "\r\n\r\n" + std::string(nSize, 'x');
    };
    const std::string szEmpty = szOk + "\r\nContent-Length: 0";
    struct Case {
        const char* szWhat;
        std::string szAnswer;
        HttpEnd enEnd;
        int nMost = 5000;
        int nLimit = 5000;
        int nTakes = 0;  // milliseconds, at least
        bool blStop = false;
    };
    const Case rgCases[] = {{"the longest body", fnBody(256U << 10U), HttpEnd::kAnswered},
                            {"a longer one", fnBody((256U << 10U) + 1), HttpEnd::kGarbage},
                            {"the longest head", HeadOf(32U << 10U, szEmpty), HttpEnd::kAnswered},
                            {"a longer one", HeadOf((32U << 10U) + 1, szEmpty), HttpEnd::kGarbage},
                            {"no HTTP", "hello\r\n\r\n", HttpEnd::kGarbage},
                            {"silence", "", HttpEnd::kTimeout, 5000, 300, 290},
                            {"silence, and a limit beyond the client's own", "", HttpEnd::kTimeout, 300, 5000, 290},
                            {"no time at all", "", HttpEnd::kTimeout, 5000, 0},
                            {"a stop", "", HttpEnd::kTimeout, 5000, 5000, 0, true}};
    for (const Case& one : rgCases) {
        WebServer server(one.szAnswer);
        tavo::HttpClient client(one.nMost);
        client.SetLimit(one.nLimit);
        const auto start = std::chrono::steady_clock::now();
        client.SetStop([&] { return one.blStop && std::chrono::steady_clock::now() - start > 100ms; });
        const tavo::HttpAnswer answer = client.Get({kRouter, server.Port(), "/"});
        const auto took = std::chrono::steady_clock::now() - start;
        EXPECT_EQ(answer.enEnd, one.enEnd) << one.szWhat;
        EXPECT_TRUE(took >= one.nTakes * 1ms && took < 2500ms) << one.szWhat << " " << took / 1ms;
        EXPECT_TRUE(one.enEnd != HttpEnd::kAnswered || answer.nCode == 200) << one.szWhat;
        if (one.nLimit == 0) {  // it may have ended before it was connected
            tavo::HttpClient(300).Get({kRouter, server.Port(), "/"});
        }
    }
    EXPECT_EQ(tavo::HttpClient().Get({kRouter, 1, "/"}).enEnd, HttpEnd::kUnreachable);
}

TEST(HttpUrl, IsOfOneHostAndOnePort) {
    const std::pair<const char*, const char*> rgCases[] = {{"http://h/", "http://h:80/"},
                                                           {"http://h:1/a?b=c", "http://h:1/a?b=c"},
                                                           {"http://h:65535", "http://h:65535/"},
                                                           {"https://h/a", "https://h:443/a"},
                                                           {"ftp://h/", ""},
                                                           {"http://u@h/", ""},
                                                           {"http://h:0/", ""},
                                                           {"http://h:65536/", ""},
                                                           {"nonsense://", ""}};
    for (const auto& [szUrl, szRead] : rgCases) {
        const auto url = tavo::ParseHttpUrl(szUrl, true);
        EXPECT_EQ(url ? url->Text() : "", szRead) << szUrl;
    }
    EXPECT_FALSE(tavo::ParseHttpUrl("https://h/"));
}

using Pair = std::pair<tavo::Descriptor, tavo::Descriptor>;

Pair ConnectedPair() {
    int rgFds[2] = {};
    EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, rgFds), 0);
    return {tavo::Descriptor(rgFds[0]), tavo::Descriptor(rgFds[1])};
}

// Of what has come so far, and over a socket whose other side says no more.
TEST(HttpRequest, IsWholeAndPlainOrItIsNone) {
    using tavo::HttpFault;
    const auto fnHeaders = [](int nMore) {
        std::string szText = "POST /p HTTP/1.1\r\nContent-Length: 0\r\n";
        for (int i = 0; i < nMore; ++i) {
            szText += "A: b\r\n";
        }
        return szText + "\r\n";
    };
    const auto fnLength = [](const std::string& szLength, const std::string& szBody = "") {
        return "POST /p HTTP/1.1\r\nContent-Length:" + szLength + "\r\n\r\n" + szBody;
    };
    const std::string szLongest(24U << 10U, 'x');
    const std::tuple<const char*, std::string, HttpFault> rgCases[] = {
        {"plain", "POST /p HTTP/1.1\r\nContent-Length: 2 \r\n\r\nab", HttpFault::kNone},
        {"the older version", "POST /p HTTP/1.0\r\ncontent-length:2\r\n\r\nabc", HttpFault::kNone},
        {"a later version", "POST /p HTTP/1.2\r\nContent-Length: 2\r\n\r\nab", HttpFault::kNoRequest},
        {"no version", "POST /p\r\nContent-Length: 2\r\n\r\nab", HttpFault::kNoRequest},
        {"no method", " /p HTTP/1.1\r\nContent-Length: 2\r\n\r\nab", HttpFault::kNoRequest},
        {"a blank before the colon", "POST /p HTTP/1.1\r\nContent-Length : 2\r\n\r\nab", HttpFault::kNoRequest},
        {"a line that goes on", "POST /p HTTP/1.1\r\nContent-Length: 2\r\n A: b\r\n\r\nab", HttpFault::kNoRequest},
        {"a header without name", "POST /p HTTP/1.1\r\n: 2\r\n\r\n", HttpFault::kNoRequest},
        {"40 headers", fnHeaders(39), HttpFault::kNone},
        {"41 headers", fnHeaders(40), HttpFault::kTooManyHeaders},
        {"the longest body", fnLength("24576", szLongest), HttpFault::kNone},
        {"a longer one", fnLength("24577", szLongest + "x"), HttpFault::kTooLong},
        {"more than there are numbers for", fnLength("99999999999999999999"), HttpFault::kTooLong},
        {"less than nothing", fnLength("-1"), HttpFault::kNoLength},
        {"no number", fnLength("1x", "a"), HttpFault::kNoLength},
        {"an empty length", fnLength(""), HttpFault::kNoLength},
        {"no length", "POST /p HTTP/1.1\r\n\r\n", HttpFault::kNoLength},
        {"an encoding", fnLength("1\r\nTransfer-Encoding: chunked", "a"), HttpFault::kNoLength},
        {"a body cut short", fnLength("2", "a"), HttpFault::kGone},
        {"a head cut short", "POST /p HTTP/1.1\r\nContent-Length: 0\r\n\r", HttpFault::kGone}};
    for (const auto& [szWhat, szText, enFault] : rgCases) {
        tavo::HttpRequest whole;
        EXPECT_EQ(whole.Parse(szText), enFault) << szWhat;
        const auto [fdHere, fdThere] = ConnectedPair();
        send(fdThere.Get(), szText.data(), szText.size(), 0);
        shutdown(fdThere.Get(), SHUT_WR);
        tavo::BoundedSocket bounded(fdHere.Get(), -1);
        tavo::HttpRequest read;
        const HttpFault enHead = read.ReadHead(bounded);
        EXPECT_EQ(enHead == HttpFault::kNone ? read.ReadBody(bounded) : enHead, enFault) << szWhat;
        if (enFault == HttpFault::kNone) {
            for (const tavo::HttpRequest& request : {whole, read}) {
                EXPECT_EQ(request.Method() + request.Path(), "POST/p") << szWhat;
                EXPECT_EQ(std::to_string(request.Body().size()), request.Header("CONTENT-LENGTH")) << szWhat;
            }
        }
    }
}

TEST(HttpRequest, IsReadToABoundAndToAStop) {
    const std::string szFirst = "POST /p HTTP/1.1\r\nExpect: 100-Continue\r\nContent-Length: 1";
    for (const auto& [szText, blStop, blRead] :
         {std::tuple(HeadOf(32767, szFirst) + "x", false, true), std::tuple(HeadOf(32768, szFirst) + "x", false, false),
          std::tuple(std::string(), true, false)}) {
        const Pair connected = ConnectedPair();
        const tavo::Descriptor &fdHere = connected.first, &fdThere = connected.second;
        auto [fdStop, fdStopper] = ConnectedPair();
        send(fdThere.Get(), szText.data(), szText.size() - (blRead ? 1 : 0), 0);
        if (blStop) {
            fdStopper.Reset();
        }
        tavo::BoundedSocket bounded(fdHere.Get(), fdStop.Get());
        tavo::HttpRequest request;
        const auto start = std::chrono::steady_clock::now();
        EXPECT_EQ(request.ReadHead(bounded) == tavo::HttpFault::kNone, !blStop);
        if (!blStop) {
            std::thread late([blRead = blRead, fd = fdThere.Get()] {
                char szTold[100] = {};
                EXPECT_TRUE(!blRead || recv(fd, szTold, sizeof(szTold), 0) > 0);
                EXPECT_EQ(std::string(szTold), blRead ? "HTTP/1.1 100 Continue\r\n\r\n" : "");
                send(fd, "x", blRead ? 1 : 0, 0);
            });
            EXPECT_EQ(request.ReadBody(bounded) == tavo::HttpFault::kNone, blRead);
            late.join();
        }
        EXPECT_LT(std::chrono::steady_clock::now() - start, 1s);
    }
}

// A slow reader gets the whole of an answer, though it said more than was read; one that does not read is given up.
TEST(BoundedSocket, AnAnswerIsWholeOrGivenUp) {
    const std::string szAnswer(4U << 20U, 'x');
    for (const bool blReads : {true, false}) {
        Pair connected = ConnectedPair();
        Pair stop = ConnectedPair();
        tavo::Descriptor &fdHere = connected.first, &fdThere = connected.second, &fdStopper = stop.second;
        send(fdThere.Get(), "more", 4, 0);
        size_t nRead = 0;
        std::thread reader([&] {
            std::vector<char> rgBytes(1U << 16U);
            for (ssize_t nNow = 1; blReads && nNow > 0; nRead += static_cast<size_t>(nNow)) {
                nNow = recv(fdThere.Get(), rgBytes.data(), rgBytes.size(), 0);
            }
            blReads ? fdThere.Reset() : fdStopper.Reset();
        });
        const auto start = std::chrono::steady_clock::now();
        tavo::BoundedSocket bounded(fdHere.Get(), stop.first.Get());
        bounded.Write(szAnswer);
        bounded.Finish();
        EXPECT_LT(std::chrono::steady_clock::now() - start, 3s);
        reader.join();
        EXPECT_EQ(nRead, blReads ? szAnswer.size() : 0);
        char cRest = 0;
        EXPECT_EQ(recv(fdHere.Get(), &cRest, 1, MSG_DONTWAIT), blReads ? 0 : 1);
    }
}

}  // namespace
