// The IGD client, and what else is heard by UPnP, against hostile answers.
#include <gtest/gtest.h>
#include <poll.h>

#include <atomic>
#include <chrono>
#include <set>
#include <thread>
#include <tuple>

#include "loopback.h"
#include "programs/common/IgdRouter.h"
#include "tavo/core.h"
#include "webserver.h"
#include "wire/upnp/Description.h"
#include "wire/upnp/GatewayMemory.h"
#include "wire/upnp/Igd.h"
#include "wire/upnp/Notify.h"
#include "wire/upnp/Search.h"
#include "wire/upnp/Soap.h"
#include "world.h"

namespace {

using namespace std::chrono_literals;

using tavo::IgdEntry;

// The first service of a description.
std::optional<tavo::IgdService> ServiceIn(const std::string& szXml, const tavo::HttpUrl& location) {
    std::string szWhy;
    const auto rgServices = tavo::ParseDescription(szXml, location, szWhy);
    EXPECT_EQ(rgServices.empty(), !szWhy.empty());
    return rgServices.empty() ? std::nullopt : std::optional(rgServices.front());
}

std::unique_ptr<tavo::Igd> IgdAt(const std::shared_ptr<tavo::HttpTransport>& pHttp) {
    std::string szWhy;
    return tavo::Igd::At({"192.168.1.1", 80, "/"}, pHttp, szWhy);
}

TEST(Ssdp, AnAnswerLeadsToTheGatewayOrNowhere) {
    const auto fnAt = [](const std::string& szPlace) { return "HTTP/1.1 200 OK\r\nLOCATION: " + szPlace + "\r\n\r\n"; };
    // Where the gateway's answer leads, if anywhere, and whether it would count from another address, too.
    const std::tuple<std::string, const char*, bool> rgCases[] = {
        {"HTTP/1.1 200 OK\r\nLocation:http://192.168.1.1:5000/x\r\n\r\n", "http://192.168.1.1:5000/x", true},
        {fnAt("http://192.168.1.1:/x"), "http://192.168.1.1:80/x", true},
        {fnAt("http://192.168.1.2:5000/x?y"), "http://192.168.1.1:5000/x?y", false},
        {fnAt("http://router.lan/x"), "http://192.168.1.1:80/x", false},
        {fnAt("http://192.168.1.1.evil/x"), "http://192.168.1.1:80/x", false},
        {fnAt("http://127.0.0.1:99/x"), "http://192.168.1.1:99/x", false},
        {fnAt("http://[::ffff:192.168.1.1]/x"), "http://192.168.1.1:80/x", false},
        {fnAt("http://192.168.1.1:0/x"), "", false},
        {fnAt("http://192.168.1.1:-1/x"), "", false},
        {fnAt("http://192.168.1.1:65536/x"), "", false},
        {fnAt("http://192.168.1.1:99999999999999999999/x"), "", false},
        {fnAt("http://192.168.1.1@evil/x"), "", false},
        {fnAt("http://a:b@192.168.1.1/x"), "", false},
        {fnAt("https://192.168.1.1/x"), "", false},
        {fnAt("file:///etc/passwd"), "", false},
        {"HTTP/1.1 404 No\r\nLOCATION: http://192.168.1.1/x\r\n\r\n", "", false},
        {"HTTP/1.1 200 OK\r\n\r\n", "", false},
        {"", "", false}};
    for (const auto& [szAnswer, szPlace, blAnybodys] : rgCases) {
        for (const bool blGateway : {true, false}) {
            std::string szReason;
            const auto place = tavo::LocationOf(szAnswer, "192.168.1.1", blGateway, szReason);
            EXPECT_EQ(place ? place->Text() : "", blGateway || blAnybodys ? szPlace : "") << szAnswer;
            EXPECT_EQ(szReason.empty(), place.has_value());
        }
    }
    for (const char* szOwn : {"127.0.0.1", "169.254.1.1"}) {
        std::string szReason;
        const std::string szAnswer = std::string("HTTP/1.1 200 OK\r\nLOCATION: http://") + szOwn + "/x\r\n\r\n";
        EXPECT_FALSE(tavo::LocationOf(szAnswer, szOwn, true, szReason));
    }
}

TEST(Igd, DescriptionsLeadToTheGateway) {
    const tavo::HttpUrl location{"192.168.1.1", 80, "/dir/root.xml"};
    const auto fnControl = [&](const std::string& szControl, const std::string& szExtra) {
        const auto service = ServiceIn("<root>" + szExtra +
                                           "<d><d><service><serviceType>urn:schemas-upnp-org:service:"
                                           "WANPPPConnection:1</serviceType><controlURL>" +
                                           szControl + "</controlURL></service></d></d></root>",
                                       location);
        return service ? service->control.Text() : "";
    };
    EXPECT_EQ(fnControl("/ctl?a=b", ""), "http://192.168.1.1:80/ctl?a=b");
    EXPECT_EQ(fnControl("ctl", ""), "http://192.168.1.1:80/dir/ctl");
    EXPECT_EQ(fnControl("/c", "<URLBase>http://192.168.1.1:99/</URLBase>"), "http://192.168.1.1:99/c");
    EXPECT_EQ(fnControl("/c", "<URLBase>http://10.0.0.9/</URLBase>"), "http://192.168.1.1:80/c");
    EXPECT_EQ(fnControl("http://10.0.0.9:8/c", ""), "http://192.168.1.1:8/c");
    EXPECT_EQ(fnControl("http://x:y@192.168.1.1/c", ""), "");
    EXPECT_EQ(fnControl("", ""), "");
    const auto fnEvents = [&](const std::string& szElement) {
        const auto service = ServiceIn(
            "<root><service><serviceType>urn:schemas-upnp-org:service:"
            "WANIPConnection:1</serviceType><controlURL>/c</controlURL>" +
                szElement + "</service></root>",
            location);
        return service && service->events ? service->events->Text() : "";
    };
    EXPECT_EQ(fnEvents("<eventSubURL>evt</eventSubURL>"), "http://192.168.1.1:80/dir/evt");
    EXPECT_EQ(fnEvents("<eventSubURL>http://10.0.0.9:8/e</eventSubURL>"), "http://192.168.1.1:8/e");
    EXPECT_EQ(fnEvents("<eventSubURL/>"), "");
    EXPECT_EQ(fnEvents(""), "");
    for (const int nDepth : {10, 11}) {  // of the service's own elements, twelve with their root and their service
        std::string szOpen, szClose;
        for (int i = 0; i < nDepth; ++i) {
            szOpen += "<a>";
            szClose += "</a>";
        }
        EXPECT_EQ(ServiceIn("<root>" + szOpen +
                                "<service><serviceType>urn:schemas-upnp-org:service:WANIPConnection:1"
                                "</serviceType><controlURL>/c</controlURL></service>" +
                                szClose + "</root>",
                            location)
                      .has_value(),
                  nDepth == 10)
            << nDepth;
    }
    std::string szDeep;
    for (int i = 0; i < 5000; ++i) {
        szDeep += "<a>";
    }
    EXPECT_FALSE(ServiceIn(szDeep, location));
    EXPECT_FALSE(ServiceIn("", location));
}

// What a router says it is, and where its service is, of a description that others would not read.
TEST(Igd, BrokenDescriptionsAreReadAsFarAsTheyGo) {
    const std::string szService =
        "<service><serviceType>urn:schemas-upnp-org:service:WANIPConnection:1</serviceType><controlURL>/c</controlURL>"
        "</service>";
    const auto fnDevice = [&](const std::string& szModel, const std::string& szMore = "") {
        return "<root xmlns='urn:x'><device><modelName>" + szModel + "</modelName>" + szMore + "<serviceList>" +
               szService + "</serviceList></device></root>";
    };
    const std::string szLatin1 =
        "Stra\xDF"
        "e";
    const std::string szUtf8 =
        "Stra\xC3\x9F"
        "e";
    std::string szAttributes;
    for (int i = 0; i < 20000; ++i) {
        szAttributes += " a" + std::to_string(i) + "=''";
    }
    const std::pair<std::string, std::string> rgCases[] = {
        {fnDevice("M"), "M"},
        {fnDevice("M") + "trailing <text/>", "M"},
        {"\r\n <?xml version='1.0'?>" + fnDevice("M"), "M"},
        {fnDevice("M", "<open><presentationURL>/</presentationURL>"), "M"},
        {fnDevice("M", "</wrong>"), "M"},
        {fnDevice("M", "<a>x & y < z</a>"), "M"},
        {fnDevice("M", "<a b=c d>x</a>"), "M"},
        {fnDevice("M", "<u:unknown>x</u:unknown>"), "M"},
        {fnDevice("M").substr(0, fnDevice("M").find("</serviceList>")), "M"},
        {"\xEF\xBB\xBF" + fnDevice(szUtf8), szUtf8},
        {fnDevice(szUtf8), szUtf8},
        {fnDevice(szLatin1), szUtf8},
        {"<?xml version='1.0' encoding='utf-8'?>" + fnDevice(szLatin1), szUtf8},
        {"<?xml version='1.0' encoding='ISO-8859-1'?>" + fnDevice(szLatin1), szUtf8},
        {"<?xml version='1.0' encoding='gibberish'?>" + fnDevice(szLatin1), szUtf8},
        {"<!DOCTYPE r [<!ENTITY e 'x'><!ENTITY f '&e;&e;'>]>" + fnDevice("M&f;&lt;"), "none"},
        {"<!DOCTYPE r [<!ENTITY e SYSTEM '/etc/passwd'>]>" + fnDevice("M&e;"), "none"},
        {"<!DOCTYPE root><!-- <device> -->" + fnDevice("M<!-- x > -->&lt;<![CDATA[<!-- y -->]]>"), "M<<!-- y -->"},
        {fnDevice("M", "<!-- cut"), "none"},
        {fnDevice("M", "<a" + szAttributes + "/>"), "none"}};
    for (const auto& [szXml, szModel] : rgCases) {
        const auto service = ServiceIn(szXml, {"192.168.1.1", 80, "/"});
        EXPECT_EQ(service ? service->model.szModel : "none", szModel) << szXml.substr(0, 300);
        EXPECT_EQ(service ? service->control.Text() : "http://192.168.1.1:80/c", "http://192.168.1.1:80/c");
    }
}

TEST(Igd, ARouterIsWhatItsRootDeviceSaysInOneHarmlessText) {
    const auto fnModel = [](const std::string& szDevice) {
        const std::string szXml = "<u:root xmlns:u='x'><u:device>" + szDevice +
                                  "<deviceList><device><manufacturer>inner</manufacturer><modelName>inner</modelName>"
                                  "<serviceList><service><serviceType>urn:schemas-upnp-org:service:WANIPConnection:1"
                                  "</serviceType><controlURL>/c</controlURL></service></serviceList></device>"
                                  "</deviceList></u:device></u:root>";
        const auto service = ServiceIn(szXml, {"192.168.1.1", 80, "/"});
        return service ? service->model.szBrand + "|" + service->model.szModel + "|" + service->model.szVersion : "-";
    };
    const std::string szNumber = "<modelNumber>1</modelNumber>";
    const std::pair<std::string, std::string> rgCases[] = {
        {"<manufacturer> A &amp; B </manufacturer><modelName>M</modelName>" + szNumber, "A & B|M|1"},
        {"<u:manufacturer>A</u:manufacturer><u:modelName>M</u:modelName>" + szNumber, "A|M|1"},
        {szNumber + "<softwareVersion>v2</softwareVersion>", "||v2"},
        {"<firmwareVersion> </firmwareVersion>" + szNumber, "||1"},
        {"", "||"},
        {"<manufacturer><b>A</b></manufacturer>", "||"},
        {"<manufacturer>x\"; [192.168.1.1]\r\n&#10;&#x1b;user=\"me\t</manufacturer>", "x\"; [192.168.1.1]user=\"me||"}};
    for (const auto& [szDevice, szExpected] : rgCases) {
        EXPECT_EQ(fnModel(szDevice), szExpected) << szDevice;
    }
    const auto fnBrand = [&](const std::string& szBrand) {
        return fnModel("<manufacturer>" + szBrand + "</manufacturer>");
    };
    const std::string szLong(10000, '"');
    EXPECT_EQ(fnBrand(szLong), std::string(54, '"') + "~ddababc5||")
        << "what is on a user's disk stays a router's name";
    EXPECT_EQ(fnBrand(szLong), fnBrand(szLong));
    EXPECT_NE(fnBrand(szLong), fnBrand(szLong + "x"));  // the difference lies behind the cut
    EXPECT_EQ(fnBrand(std::string(63, 'x')), std::string(63, 'x') + "||");
    EXPECT_EQ(fnBrand(std::string(64, 'x')).substr(50, 5), "xxxx~");
    EXPECT_EQ(fnBrand(std::string(53, 'x') + "\xc3\xa4" + szLong).find("\xc3"), std::string::npos);  // no half letter
}

TEST(Igd, AnswersThatAreNoneAreGarbage) {
    const auto fnCode = [](long nHttpCode, const std::string& szXml) {
        return tavo::SoapAnswer({tavo::HttpEnd::kAnswered, nHttpCode, szXml}).Code();
    };
    EXPECT_EQ(fnCode(200, "<e><Body><r/></Body></e>"), tavo::kWireOk);
    for (const auto& [szCode, nCode] : {std::pair(" 718 ", 718),
                                        {"100", 100},
                                        {"99", tavo::kWireGarbage * 1},
                                        {"1", -3},
                                        {"0", -3},
                                        {"x", -3},
                                        {"", -3}}) {
        EXPECT_EQ(
            fnCode(500, std::string("<e><Body><x:Fault><errorCode>") + szCode + "</errorCode></x:Fault></Body></e>"),
            nCode)
            << szCode;
    }
    for (const char* szXml : {"", "<html/>", "<e><Body><Fault/></Body></e>", "<e><Body>", "<e><Body><r><v>19",
                              "<e><Body><r/></e>", "<e><Body><r/></Body"}) {
        EXPECT_EQ(fnCode(200, szXml), tavo::kWireGarbage) << szXml;
    }
    EXPECT_EQ(fnCode(404, "<e><Body><r/></Body></e>"), tavo::kWireGarbage);
    const std::string szGood = "<e><Body><r/></Body></e>";
    EXPECT_EQ(tavo::SoapAnswer({tavo::HttpEnd::kTimeout, 200, szGood}).Code(), tavo::kWireTimeout);
    EXPECT_EQ(tavo::SoapAnswer({tavo::HttpEnd::kUnreachable, 200, szGood}).Code(), tavo::kWireUnreachable);
    EXPECT_EQ(tavo::SoapAnswer({tavo::HttpEnd::kGarbage, 200, szGood}).Code(), tavo::kWireGarbage);
}

// A router whose answers are given beforehand.
class Canned : public tavo::HttpTransport {
public:
    tavo::HttpAnswer Get(const tavo::HttpUrl&) override {
        return {tavo::HttpEnd::kAnswered, 200,
                "<root><device><service><serviceType>urn:schemas-upnp-org:service:WANIPConnection:" + mSzVersion +
                    "</serviceType><controlURL>/c</controlURL></service></device></root>"};
    }
    tavo::HttpAnswer Post(const tavo::HttpUrl& url, const std::vector<std::string>& rgszHeaders,
                          const std::string& szBody) override {
        ++mNPosts;
        mRgszHeaders = rgszHeaders;
        mRgszHeaders.push_back(url.Text());
        mSzAsked = szBody;
        return mNFault == 0 ? Said(mSzAnswer) : Fault(mNFault);
    }
    static tavo::HttpAnswer Said(const std::string& szText) {
        return {tavo::HttpEnd::kAnswered, 200, "<e><Body><r>" + szText + "</r></Body></e>"};
    }
    static tavo::HttpAnswer Fault(int nCode) {
        return {tavo::HttpEnd::kAnswered, 500,
                "<e><Body><Fault><errorCode>" + std::to_string(nCode) + "</errorCode></Fault></Body></e>"};
    }
    int mNFault = 0;
    std::string mSzVersion = "2";
    std::string mSzAnswer;
    std::vector<std::string> mRgszHeaders;  // and the address
    std::string mSzAsked;
    int mNPosts = 0;
};

TEST(Igd, WhatIsAskedIsXmlWhateverATextHolds) {
    const auto pRouter = std::make_shared<Canned>();
    const auto pIgd = IgdAt(pRouter);
    ASSERT_NE(pIgd, nullptr);
    tavo::IgdEntry entry{"TCP", 5001, 8080, "192.168.1.5", "a</NewEnabled>&\"b'", 60, true};
    EXPECT_EQ(pIgd->Add(entry), tavo::kWireOk);
    for (const char* szPart : {"<u:AddPortMapping xmlns:u=\"urn:schemas-upnp-org:service:WANIPConnection:2\">",
                               "<NewRemoteHost></NewRemoteHost><NewExternalPort>5001</NewExternalPort>",
                               "<NewInternalPort>8080</NewInternalPort>", "<NewLeaseDuration>60</NewLeaseDuration>",
                               "<NewPortMappingDescription>a&lt;/NewEnabled&gt;&amp;\"b'</NewPortMappingDescription>",
                               "</u:AddPortMapping></s:Body></s:Envelope>"}) {
        EXPECT_NE(pRouter->mSzAsked.find(szPart), std::string::npos) << szPart << " in " << pRouter->mSzAsked;
    }
    EXPECT_EQ(pRouter->mRgszHeaders,
              (std::vector<std::string>{"Content-Type: text/xml; charset=\"utf-8\"", "Expect:",
                                        "SOAPAction: \"urn:schemas-upnp-org:service:WANIPConnection:2#AddPortMapping\"",
                                        "http://192.168.1.1:80/c"}));
}

TEST(Igd, ARangeShowsWhatMakesSense) {
    const auto fnEntry = [](const char* szPort, const char* szClient) {
        return std::string("<p:E><p:NewExternalPort>") + szPort + "</p:NewExternalPort><p:NewProtocol>TCP" +
               "</p:NewProtocol><p:NewInternalPort>5</p:NewInternalPort><p:NewInternalClient>" + szClient +
               "</p:NewInternalClient></p:E>";
    };
    const std::string szGood = fnEntry("1", "192.168.1.5");
    const std::string szBad = fnEntry("65536", "192.168.1.5") + fnEntry("-1", "192.168.1.5");
    const auto fnListing = [](const std::string& szInner) {
        return "<NewPortListing><![CDATA[<p:List xmlns:p='x'>" + szInner + "</p:List>]]></NewPortListing>";
    };
    const std::pair<std::string, size_t> rgCases[] = {
        {fnListing(szGood), 1},
        {fnListing(szBad + szGood + szBad), 1},
        {fnListing(""), 0},
        {"<NewPortListing>&lt;l&gt;&lt;e/&gt;&lt;/l&gt;</NewPortListing>", 0},
        {"<NewPortListing><![CDATA[<l><e>]]></NewPortListing>", 0},
        {"<NewPortListing/>", 0},
        {"", 0}};
    for (const auto& [szAnswer, nExpected] : rgCases) {
        const auto pHttp = std::make_shared<Canned>();
        pHttp->mSzAnswer = szAnswer;
        std::vector<IgdEntry> rgMappings;
        EXPECT_EQ(IgdAt(pHttp)->ListRange("TCP", 1, 9, rgMappings), 0) << szAnswer;
        EXPECT_EQ(rgMappings.size(), nExpected) << szAnswer;
    }
    const auto pFirst = std::make_shared<Canned>();
    pFirst->mSzVersion = "1";  // the first generation knows no ranges: it is not even asked
    std::vector<IgdEntry> rgMappings;
    EXPECT_NE(IgdAt(pFirst)->ListRange("TCP", 1, 9, rgMappings), 0);
    EXPECT_EQ(pFirst->mNPosts, 0);
}

// A router with a line each at /1, /2 and so on: its state and its address; "?" where it does not say.
class Lines : public tavo::HttpTransport {
public:
    using Line = std::pair<std::string, std::string>;
    explicit Lines(std::vector<Line> rgLines) : mRgLines(std::move(rgLines)) {}
    tavo::HttpAnswer Get(const tavo::HttpUrl&) override {
        std::string szXml = "<root>";
        for (size_t i = 1; i <= mRgLines.size(); ++i) {
            szXml += std::string("<device><service><serviceType>urn:") + (i % 2 == 0 ? "dslforum" : "schemas-upnp") +
                     "-org:service:WANPPPConnection:1</serviceType><controlURL>/" + std::to_string(i) +
                     "</controlURL></service></device>";
        }
        return {tavo::HttpEnd::kAnswered, 200, szXml + "</root>"};
    }
    tavo::HttpAnswer Post(const tavo::HttpUrl& url, const std::vector<std::string>&,
                          const std::string& szBody) override {
        ++mNPosts;
        const auto& [szState, szAddress] = mRgLines.at(std::stoul(url.szPath.substr(1)) - 1);
        const bool blState = szBody.find("GetStatusInfo") != std::string::npos;
        const std::string& szText = blState ? szState : szAddress;
        const std::string szName = blState ? "NewConnectionStatus" : "NewExternalIPAddress";
        return szText == "?" ? Canned::Fault(401) : Canned::Said("<" + szName + ">" + szText + "</" + szName + ">");
    }
    int mNPosts = 0;

private:
    std::vector<Line> mRgLines;
};

TEST(Igd, OfSeveralLinesTheOneThatIsUpIsUsed) {
    constexpr char kFirst[] = "/1 urn:schemas-upnp-org:service:WANPPPConnection:1";
    constexpr char kSecond[] = "/2 urn:dslforum-org:service:WANPPPConnection:1";
    const Lines::Line down{"Disconnected", "0.0.0.0"};
    const Lines::Line mute{"?", "?"};
    const Lines::Line inside{"Connected", "100.64.0.9"};
    const Lines::Line outside{"Connected", "198.41.0.4"};
    const Lines::Line none{"Connected", ""};
    const std::tuple<std::vector<Lines::Line>, const char*, const char*, int> rgCases[] = {
        {{down}, "", "/1", 0},  // there is nothing to choose
        {{down, outside}, "", "/2", 4},
        {{outside, down}, "", "/1", 4},
        {{inside, outside}, "", "/2", 4},
        {{none, inside}, "", "/2", 4},
        {{mute, none}, "", "/2", 4},
        {{down, mute}, "", "/2", 4},
        {{mute, mute}, "", "/1", 4},
        {{{"Disconnected", "198.41.0.4"}, none}, "", "/2", 4},
        {{{"?", "198.41.0.4"}, {"?", "10.0.0.4"}}, "", "/1", 4},
        {{inside, outside}, kFirst, "/1", 1},
        {{outside, inside}, kSecond, "/2", 3},
        {{down, inside}, kFirst, "/2", 4},
        {{down, down}, kSecond, "/2", 4},
        {{inside, outside}, "/9 x", "/2", 4}};
    for (const auto& [rgLines, szKnown, szUsed, nPosts] : rgCases) {
        const auto pLines = std::make_shared<Lines>(rgLines);
        std::string szWhy;
        const auto pIgd = tavo::Igd::At({"192.168.1.1", 80, "/"}, pLines, szWhy, szKnown);
        EXPECT_EQ(pIgd->Service().control.szPath, szUsed) << szKnown << nPosts;
        EXPECT_EQ(pLines->mNPosts, nPosts) << szKnown << szUsed;
        EXPECT_EQ(pIgd->IsOneOfSeveral(), rgLines.size() > 1);
        const auto pFirst = pIgd->Beside(kFirst);
        EXPECT_EQ(pFirst != nullptr, szUsed != std::string("/1"));
        EXPECT_TRUE(pFirst == nullptr || pFirst->Service().control.szPath == "/1");
    }
}

// A table of which each index shows the next of these entries.
class Table : public Canned {
public:
    tavo::HttpAnswer Post(const tavo::HttpUrl&, const std::vector<std::string>&, const std::string&) override {
        gNClockJumped += mNSeconds;
        if (mRgEntries.empty()) {
            return Fault(mNEnd);
        }
        const auto [nPort, szClient] = mRgEntries.front();
        mRgEntries.erase(mRgEntries.begin());
        return Said("<NewExternalPort>" + std::to_string(nPort) +
                    "</NewExternalPort><NewProtocol>TCP</NewProtocol><NewInternalPort>5</NewInternalPort>"
                    "<NewInternalClient>" +
                    szClient + "</NewInternalClient>");
    }
    int mNEnd = 713;
    int mNSeconds = 0;  // that each answer takes
    std::vector<std::pair<int, std::string>> mRgEntries;
};

// Some keep several entries for one port, for different hosts outside; and an entry that is made while the table is
// read moves the others. Neither is the end of the table.
TEST(Igd, APortThatIsListedTwiceIsNotTheEnd) {
    const std::string szOne = "192.168.1.5";
    const std::string szTwo = "192.168.1.9";
    const std::tuple<std::vector<std::pair<int, std::string>>, int, size_t> rgCases[] = {
        {{{1, szOne}, {2, szOne}}, tavo::kWireOk, 2},
        {{{1, szOne}, {1, szTwo}, {2, szOne}}, tavo::kWireOk, 2},
        {{{1, szOne}, {0x10000, szOne}, {3, "evil"}, {2, szOne}}, tavo::kWireOk, 2},  // what makes no sense, too
        {{{1, szOne}, {1, szOne}, {2, szOne}}, tavo::kWireTooLong, 1}};
    for (const auto& [rgEntries, nCode, nShown] : rgCases) {
        const auto pHttp = std::make_shared<Table>();
        pHttp->mRgEntries = rgEntries;
        std::vector<IgdEntry> rgMappings;
        EXPECT_EQ(IgdAt(pHttp)->List(rgMappings), nCode);
        EXPECT_EQ(rgMappings.size(), nShown);
        EXPECT_EQ(rgMappings.at(0).szClient, szOne);
    }
}

TEST(Igd, ATableEndsWhereTheRouterSaysSoOrAfterEightSeconds) {
    const JumpingClock clock;
    const std::tuple<int, int, int, int, size_t> rgCases[] = {{0, 713, 0, 0, 0}, {2, 713, 0, 0, 2},
                                                              {0, 714, 0, 0, 0}, {2, 714, 0, 0, 2},
                                                              {2, 402, 0, 0, 2}, {0, 402, 0, 402, 0},
                                                              {2, 501, 0, 0, 2}, {0, 401, 0, 401, 0},
                                                              {7, 713, 1, 0, 7}, {99, 713, 1, tavo::kWireTooLong, 8}};
    for (const auto& [nEntries, nEnd, nSeconds, nCode, nShown] : rgCases) {
        const auto pHttp = std::make_shared<Table>();
        for (int i = 1; i <= nEntries; ++i) {
            pHttp->mRgEntries.emplace_back(i, "192.168.1.5");
        }
        pHttp->mNEnd = nEnd;
        pHttp->mNSeconds = nSeconds;
        std::vector<IgdEntry> rgMappings;
        EXPECT_EQ(IgdAt(pHttp)->List(rgMappings), nCode) << nEntries << " " << nEnd;
        EXPECT_EQ(rgMappings.size(), nShown) << nEntries << " " << nEnd;
    }
}

TEST(Igd, WhatAnEntryAndAnAddressSay) {
    const auto pHttp = std::make_shared<Canned>();
    const auto pIgd = IgdAt(pHttp);
    const auto fnTag = [](const char* szName, const char* szText) {
        return std::string("<") + szName + ">" + szText + "</" + szName + ">";
    };
    const std::tuple<const char*, const char*, const char*, const char*, std::string> rgCases[] = {
        {"65535", "192.168.1.5", "60", "1", "65535 60 on"},
        {"1", "192.168.1.5", "", "", "1 0 on"},
        {"1", "192.168.1.5", "4294967295", "0", "1 4294967295 off"},
        {"1", "192.168.1.5", "-1", "false", "1 0 off"},
        {"1", "192.168.1.5", "4294967296", "no", "1 0 off"},
        {"65536", "192.168.1.5", "0", "1", "none"},
        {"", "192.168.1.5", "0", "1", "none"},
        {"1", "192.168.1", "0", "1", "none"},
        {"1", "", "0", "1", "none"},
        {"1", "box.lan", "0", "1", "none"},
        {"1", "192.168.1.5", "0", "FALSE", "1 0 off"},
        {"1", " 192.168.001.005 ", "0", "1", "1 0 on"},
        {"1", "0192.168.1.05", "0", "1", "1 0 on"}};
    for (const auto& [szPort, szClient, szLease, szEnabled, szRead] : rgCases) {
        pHttp->mSzAnswer = fnTag("NewInternalPort", szPort) + fnTag("NewInternalClient", szClient) +
                           fnTag("NewLeaseDuration", szLease) + fnTag("NewEnabled", szEnabled);
        IgdEntry entry;
        entry.szProtocol = "as";
        const int nCode = pIgd->Get("UDP", 65535, entry);
        EXPECT_EQ(nCode, szRead == "none" ? tavo::kWireGarbage : tavo::kWireOk);
        EXPECT_EQ(nCode != 0 ? "none"
                             : std::to_string(entry.nBoxPort) + " " + std::to_string(entry.nLease) +
                                   (entry.blEnabled ? " on" : " off") + (entry.szClient == "192.168.1.5" ? "" : "?"),
                  szRead);
        EXPECT_EQ(entry.szProtocol, nCode == 0 ? "UDP" : "as");
        EXPECT_NE(pHttp->mSzAsked.find("<NewExternalPort>65535</NewExternalPort><NewProtocol>UDP</NewProtocol>"),
                  std::string::npos);
        EXPECT_EQ(pIgd->GetAt(9, entry), tavo::kWireOk) << "one that makes no sense is there, and nothing of ours";
        EXPECT_TRUE(entry.szProtocol.empty() && !entry.blEnabled);
    }
    std::string szAddress = "as it was";
    for (const char* szSaid : {"", "1.2.3", "evil"}) {
        pHttp->mSzAnswer = fnTag("NewExternalIPAddress", szSaid);
        EXPECT_EQ(pIgd->ExternalAddress(szAddress), tavo::kWireGarbage);
        EXPECT_EQ(szAddress, "as it was");
    }
    IgdEntry bounded;
    pHttp->mSzAnswer = fnTag("NewInternalPort", "1") + fnTag("NewInternalClient", "192.168.1.5") +
                       fnTag("NewPortMappingDescription", std::string(257, 'x').c_str());
    EXPECT_EQ(pIgd->Get("UDP", 1, bounded), tavo::kWireOk);
    EXPECT_EQ(bounded.szDescription, std::string(256, 'x'));
    pHttp->mSzAnswer = fnTag("NewExternalIPAddress", " 198.41.0.4 ");
    EXPECT_EQ(pIgd->ExternalAddress(szAddress), tavo::kWireOk);
    EXPECT_EQ(szAddress, "198.41.0.4");
    std::vector<IgdEntry> rgMappings;
    EXPECT_EQ(pIgd->ListRange("UDP", 7, 9, rgMappings), tavo::kWireOk);
    EXPECT_NE(pHttp->mSzAsked.find("<NewStartPort>7</NewStartPort><NewEndPort>9</NewEndPort><NewProtocol>UDP<"),
              std::string::npos);
    pHttp->mNFault = 606;
    pHttp->mNPosts = 0;
    EXPECT_EQ(pIgd->ExternalAddress(szAddress), 606);
    EXPECT_EQ(pIgd->Remove("TCP", 1), 606);
    EXPECT_EQ(pIgd->Get("TCP", 1, rgMappings.emplace_back()), 606);
    EXPECT_EQ(pIgd->GetAt(0, rgMappings.back()), 606);
    EXPECT_EQ(pIgd->ListRange("TCP", 1, 2, rgMappings), 606);
    EXPECT_EQ(pHttp->mNPosts, 5);
}

// A router with a list, whose answer about one entry is always the same code; 0: what there is.
class ByList : public Canned {
public:
    tavo::HttpAnswer Post(const tavo::HttpUrl&, const std::vector<std::string>&, const std::string& szBody) override {
        const auto fnHas = [&](const std::string& szText) { return szBody.find(szText) != std::string::npos; };
        mSzAsked += fnHas("Generic") ? "l" : fnHas("Specific") ? "g" : "a";
        if (fnHas("AddPortMapping")) {
            mNEntries = 1;
        }
        const bool blShown = mNEntries != 0 && (fnHas("Index>0<") || (fnHas("Specific") && mNGet == 0));
        return blShown ? Said(
                             "<NewExternalPort>1</NewExternalPort><NewProtocol>TCP</NewProtocol><NewInternalPort>5"
                             "</NewInternalPort><NewInternalClient>192.168.1.5</NewInternalClient>")
               : fnHas("Generic")  ? Fault(mNList)
               : fnHas("Specific") ? Fault(mNGet == 0 ? 714 : mNGet)
                                   : Said("");
    }
    int mNGet = 0;
    int mNList = 713;
    int mNEntries = 0;
};

// A list of one entry takes two questions.
TEST(Igd, WhereNothingIsShownByNameTheListIsTheProof) {
    struct Case {
        int nGet;
        int nList;
        std::string szAsked;  // looks for what is not there, makes it, and looks twice
        std::string szSeen;   // and what each look finds
        bool blNoGet;
    };
    const Case rgCases[] = {{0, 713, "gagg", "-11", false},   {401, 713, "glall", "-11", true},
                            {501, 713, "glall", "-11", true}, {714, 713, "gagllg", "-11", true},
                            {401, 401, "glall", "?11", true}, {714, 401, "gagllg", "-11", true}};
    for (const Case& one : rgCases) {
        const auto pHttp = std::make_shared<ByList>();
        pHttp->mNGet = one.nGet;
        pHttp->mNList = one.nList;
        const auto pIgd = IgdAt(pHttp);
        tavo::IgdRouter router(*pIgd);
        std::string szSeen;
        const auto fnLook = [&] {
            tavo::RouterMapping seen;
            const tavo::RouterReply reply = router.Get("TCP", 1, seen);
            szSeen += reply.IsOk()                                 ? std::to_string(seen.nRouterPort)
                      : reply.enReply == tavo::Reply::kNoSuchEntry ? "-"
                                                                   : "?";
        };
        fnLook();
        tavo::RouterMapping mapping{"TCP", 1, 5, "192.168.1.5", "", 0, true};
        EXPECT_TRUE(router.Add(mapping).IsOk());
        fnLook();
        fnLook();
        EXPECT_EQ(pHttp->mSzAsked, one.szAsked) << one.nGet << " " << one.nList;
        EXPECT_EQ(szSeen, one.szSeen) << one.nGet << " " << one.nList;
        EXPECT_EQ(router.HasNoGet(), one.blNoGet);
    }
}

// A home network on the loopback device, with a gateway that answers searches.
class SearchTest : public testing::Test {
protected:
    static constexpr char kGateway[] = "192.168.77.1";
    static constexpr char kBox[] = "192.168.77.5";

    static tavo::Descriptor SocketAt(const char* szAddress, uint16_t nPort) {
        return ::SocketAt(szAddress, nPort, SOCK_DGRAM | SOCK_NONBLOCK);
    }
    static std::string Answer(const std::string& szPlace, const char* szHost = kGateway) {
        return std::string("HTTP/1.1 200 OK\r\nLOCATION: http://") + szHost + szPlace + "\r\n\r\n";
    }
    // Takes the questions that are there. True when there was one.
    bool Hear() {
        char szQuestion[1000] = {};
        bool blHeard = false;
        while (Receive(mFd.Get(), std::span(szQuestion).first(999), mFrom) > 0) {
            mRgszTargets.push_back(std::string(szQuestion).substr(std::string(szQuestion).find("ST: ")));
            blHeard = true;
        }
        return blHeard;
    }
    void Say(const std::string& szText) const { Send(mFd.Get(), szText, mFrom); }
    // fnTurn: what the gateway does each time that the search looks whether it is to stop.
    bool Search(int nMilliseconds, const std::function<void()>& fnTurn, int nPort = 0, bool blTakes = false) {
        mRgszTried.clear();
        return tavo::SearchGateway(
            kGateway, kBox, nMilliseconds, nPort,
            [&](const tavo::HttpUrl& url) {
                mRgszTried.push_back(url.szPath);
                return blTakes;
            },
            [&] {
                fnTurn();
                return mBlStop;
            });
    }

    LoopbackHosts mHosts{kGateway, kBox};
    tavo::Descriptor mFd = SocketAt(kGateway, 1900);
    sockaddr_in mFrom = {};
    std::vector<std::string> mRgszTargets;
    std::vector<std::string> mRgszTried;
    bool mBlStop = false;
};

TEST_F(SearchTest, AsksForEachKindAgainAndAgainUntilItsLimit) {
    for (const auto& [nMilliseconds, nQuestions, nKinds] : {std::tuple(100, 4U, 4U), {280, 8U, 4U}, {900, 17U, 9U}}) {
        mRgszTargets.clear();
        int nTurns = 0;
        const auto start = std::chrono::steady_clock::now();
        EXPECT_FALSE(Search(nMilliseconds, [&] {
            Hear();
            ++nTurns;
        }));
        EXPECT_GE(nTurns, nMilliseconds == 1100 ? 7 : 1) << "a stop is looked for in between";
        const auto took = std::chrono::steady_clock::now() - start;
        EXPECT_TRUE(took >= nMilliseconds * 1ms && took < nMilliseconds * 1ms + 2s) << took / 1ms;
        EXPECT_EQ(mRgszTargets.size(), nQuestions) << nMilliseconds;
        EXPECT_EQ(std::set(mRgszTargets.begin(), mRgszTargets.end()).size(), nKinds);
    }
    mBlStop = true;
    EXPECT_FALSE(Search(30000, [] {}));
}

TEST_F(SearchTest, TriesWhatTheGatewayItselfSaysOnceAndNotForEver) {
    const tavo::Descriptor fdNeighbour = SocketAt(kBox, 0);
    bool blSaid = false;
    const auto fnTalk = [&] {
        if (Hear() && !std::exchange(blSaid, true)) {
            Send(fdNeighbour.Get(), Answer("/neighbour", kBox), mFrom);
            Say(Answer("/a"));
            Say(Answer("/a"));
            Say(Answer("/b", kBox));
            Send(fdNeighbour.Get(), Answer("/c"), mFrom);
        }
    };
    EXPECT_FALSE(Search(290, fnTalk));
    EXPECT_EQ(mRgszTried, (std::vector<std::string>{"/a", "/b"}));
    blSaid = false;  // where the gateway is silent, two places that others name
    EXPECT_FALSE(Search(290, [&] {
        if (Hear() && !std::exchange(blSaid, true)) {
            for (const char* szPlace : {"/a", "/b", "/c"}) {
                Send(fdNeighbour.Get(), Answer(szPlace), mFrom);
            }
        }
    }));
    EXPECT_EQ(mRgszTried, (std::vector<std::string>{"/a", "/b"}));
    blSaid = false;
    EXPECT_TRUE(Search(30000, fnTalk, 50123, true));
    EXPECT_EQ(mRgszTried, std::vector<std::string>{"/a"});
    EXPECT_EQ(ntohs(mFrom.sin_port), 50123);
    blSaid = false;
    const tavo::Descriptor fdTaken = SocketAt(kBox, 50124);
    EXPECT_TRUE(Search(30000, fnTalk, 50124, true)) << "from another port";
    int nPlace = 0;
    gLog.clear();
    EXPECT_FALSE(Search(30000, [&] {
        if (Hear() || nPlace > 0) {
            Say(Answer("/" + std::to_string(nPlace++)));
            Say("HTTP/1.1 404 no\r\n\r\n");
        }
    }));
    EXPECT_EQ(mRgszTried.size(), 16U) << "one that names more is playing games";
    EXPECT_EQ(gLog, std::vector<std::string>(8, "discovery answer refused: no positive answer")) << "and not more";
    EXPECT_FALSE(tavo::SearchGateway(kGateway, "198.41.0.4", 30000, 0, {}, {})) << "that is no address of this box";
}

// Where nothing is heard it is over after two seconds and a half, else after three of silence.
TEST_F(SearchTest, IsOverSoonWhereThereIsNobody) {
    const JumpingClock clock;
    for (const auto& [nSpeaks, took] : {std::pair(-1, 2.5), {1, 3.5}}) {
        const time_t nStart = gNClockJumped;
        int nSaid = 0;
        EXPECT_FALSE(Search(30000, [&, nSpeaks = nSpeaks] {
            if (Hear()) {
                return;
            }
            if (gNClockJumped - nStart == nSpeaks && nSaid++ < 2) {
                Say("HTTP/1.1 404 no\r\n\r\n");
                return;
            }
            ++gNClockJumped;
        }));
        EXPECT_NEAR(static_cast<double>(gNClockJumped - nStart), took, 0.6) << nSpeaks;  // and what really went by
    }
}

// What is tried and of no use may take longer than the silence that ends a search.
TEST_F(SearchTest, ATryIsNoSilence) {
    const JumpingClock clock;
    int nTried = 0;
    const auto fnTry = [&](const tavo::HttpUrl&) {
        gNClockJumped += 4;
        return ++nTried == 3;
    };
    EXPECT_TRUE(tavo::SearchGateway(kGateway, kBox, 30000, 0, fnTry, [&] {
        if (Hear()) {
            Say(Answer("/a"));
            Say(Answer("/b"));
            Say(Answer("/c"));
        }
        return false;
    }));
}

// Some answer to the protocol's own port only, and some when nobody waits any more.
TEST_F(SearchTest, WhatComesFromOddPlacesAndLateIsHeard) {
    EXPECT_TRUE(Search(
        5000,
        [this] {
            if (Hear() && ntohs(mFrom.sin_port) == 1900) {
                Say(Answer("/a"));
            }
        },
        0, true));
    EXPECT_EQ(std::set(mRgszTargets.begin(), mRgszTargets.end()).size(), 9U);
    tavo::Descriptor fdLate;
    const auto fnNever = [](const tavo::HttpUrl&) { return false; };
    EXPECT_FALSE(tavo::SearchGateway(kGateway, kBox, 100, 0, fnNever, {}, &fdLate));
    EXPECT_FALSE(tavo::TakeLate(fdLate, kGateway));
    Hear();
    for (int i = 0; i < 70; ++i) {
        Say("HTTP/1.1 404 no\r\n\r\n");
    }
    Send(SocketAt(kBox, 0).Get(), Answer("/forged"), mFrom);
    Say(Answer("/late"));
    EXPECT_FALSE(tavo::TakeLate(fdLate, kGateway)) << "of a flood, so many at once";
    EXPECT_EQ(tavo::TakeLate(fdLate, kGateway)->szPath, "/late");
}

TEST_F(SearchTest, TheGatewaysOwnAnnouncementsAreNews) {
    tavo::Announcements announcements;
    EXPECT_FALSE(announcements.TakeNews(kGateway));
    announcements.Listen(kBox);
    ASSERT_GE(announcements.Fd(), 0);
    // The number stands at the end of a datagram of so many bytes at least.
    const auto fnSay = [&](const char* szFrom, const std::string& szBoot, size_t nBytes = 0) {
        const tavo::Descriptor fd = SocketAt(szFrom, 0);
        const std::string szText = "NOTIFY * HTTP/1.1\r\nNTS: ssdp:alive\r\nUSN: u\r\nBOOTID.UPNP.ORG: ";
        const size_t nLength = szText.size() + szBoot.size();
        Send(ToAll(fd, szFrom).Get(), szText + std::string(std::max(nBytes, nLength) - nLength, ' ') + szBoot,
             AddressOf("239.255.255.250", 1900));
    };
    const std::tuple<const char*, const char*, size_t, bool> rgCases[] = {
        {kBox, "1", 0, false},    {kGateway, "1", 0, true},    {kGateway, "1", 0, false},
        {kGateway, "2", 0, true}, {kGateway, "3", 4096, true}, {kGateway, "4", 4097, false}};
    for (const auto& [szFrom, szBoot, nBytes, blNews] : rgCases) {
        fnSay(szFrom, szBoot, nBytes);
        EXPECT_EQ(announcements.TakeNews(kGateway), blNews) << szFrom << " " << szBoot;
    }
    fnSay(kGateway, "5");
    EXPECT_TRUE(announcements.TakeNews(kGateway));
    for (int i = 1; i <= 65; ++i) {  // of a flood, so many at once
        fnSay(kGateway, i == 64 ? "6" : i == 65 ? "7" : "5");
    }
    for (const bool blNews : {true, true, false}) {
        EXPECT_EQ(announcements.TakeNews(kGateway), blNews);
    }
    gLog.clear();
    announcements.Listen("no address");
    EXPECT_EQ(announcements.Fd(), -1);
    EXPECT_TRUE(LoggedFrom("router that restarts is noticed at the next check only: "));
}

TEST_F(SearchTest, AKnownPlaceIsTriedFirstAndOnTheGatewayOnly) {
    const std::string szXml =
        "<root><service><serviceType>urn:schemas-upnp-org:service:WANIPConnection:1</serviceType>"
        "<controlURL>/c</controlURL></service></root>";
    const std::string szPage =
        "HTTP/1.1 200 OK\r\nContent-Length: " + std::to_string(szXml.size()) + "\r\n\r\n" + szXml;
    for (const char* szHost : {kGateway, kBox}) {
        WebServer server(szPage, szHost);
        tavo::IgdPlace place{std::string("http://") + szHost + ":" + std::to_string(server.Port()) + "/x", ""};
        const auto pIgd = tavo::Igd::Find(kGateway, kBox, 300, &place, 0);
        EXPECT_EQ(pIgd != nullptr, szHost == kGateway) << szHost;
        if (pIgd == nullptr) {
            tavo::HttpClient().Get({szHost, server.Port(), "/nobody"});
            EXPECT_NE(server.Request().find("/nobody"), std::string::npos) << "it was asked";
        }
    }
    {
        // The one that is remembered, with the box's own address.
        gSzGateway = kGateway;
        WebServer server(szPage, kGateway);
        const std::string szKnown = "http://192.168.77.1:" + std::to_string(server.Port()) + "/x";
        const tavo::KnownRouter known{{szKnown, ""}, "aa", true, true, true};
        tavo::KeepRouter(kGateway, known);
        std::string szLocal;
        EXPECT_NE(tavo::FindGatewayIgd(300, 0, &szLocal, {}), nullptr);
        EXPECT_TRUE(szLocal.starts_with("192.168.77.")) << szLocal;
        EXPECT_EQ(tavo::RecallRouter(kGateway), known);
        tavo::KeepRouter(kGateway, {});
        EXPECT_EQ(tavo::FindGatewayIgd(100, 0, nullptr, {}), nullptr);
        gSzGateway = "";
        EXPECT_EQ(tavo::FindGatewayIgd(30000, 0, nullptr, {}), nullptr);
        gSzGateway = "192.168.1.1";
    }
    WebServer server(szPage, kGateway);
    std::atomic<bool> blEnd = false;
    std::thread gateway([&] {
        while (!blEnd) {
            if (Hear()) {
                Say(Answer(":" + std::to_string(server.Port()) + "/found"));
            }
            poll(nullptr, 0, 10);
        }
    });
    gSzGateway = kGateway;
    tavo::KeepRouter(kGateway, {{"http://192.168.77.1:1/gone", ""}, "aa", true});
    EXPECT_NE(tavo::FindGatewayIgd(5000, 0, nullptr, {}), nullptr);
    blEnd = true;
    gateway.join();
    gSzGateway = "192.168.1.1";
    EXPECT_TRUE(tavo::RecallRouter(kGateway).place.szLocation.ends_with("/found")) << "what is found is kept";
    EXPECT_TRUE(tavo::RecallRouter(kGateway).blPermanentOnly);
    std::filesystem::remove_all("/var/lib/tavo/upnp_igd.conf");
    std::filesystem::create_directories("/var/lib/tavo/upnp_igd.conf");
    tavo::KeepRouter(kGateway, {{"http://192.168.77.1/", ""}, "aa"});
    EXPECT_TRUE(Logged("write /var/lib/tavo/upnp_igd.conf"));
    std::filesystem::remove("/var/lib/tavo/upnp_igd.conf");
}

TEST(Notify, ALifeIsANumberOrAPlace) {
    const std::pair<const char*, std::optional<std::string>> rgCases[] = {
        {"NOTIFY * HTTP/1.1\r\nNTS: ssdp:alive\r\nLocation: http://192.168.1.1:5000/\r\nBOOTID.UPNP.ORG: 7\r\n\r\n",
         "7"},
        {"NOTIFY * HTTP/1.1\r\nnts:ssdp:alive\r\nLOCATION:http://192.168.1.1:5000/\r\n\r\n",
         "http://192.168.1.1:5000/"},
        {"NOTIFY * HTTP/1.1\r\nNTS: ssdp:byebye\r\nBOOTID.UPNP.ORG: 7\r\n\r\n", ""},
        {"HTTP/1.1 200 OK\r\nNTS: ssdp:alive\r\nBOOTID.UPNP.ORG: 7\r\n\r\n", std::nullopt},
        {"NOTIFY", std::nullopt},
        {"", std::nullopt}};
    for (const auto& [szMessage, szLife] : rgCases) {
        EXPECT_EQ(tavo::LifeOf(szMessage), szLife) << szMessage;
    }
}

// A router often is several devices, each with a life of its own; a neighbour may send any number in its name.
TEST(Notify, EachDeviceOfARouterHasALifeOfItsOwn) {
    const auto fnMessage = [](const std::string& szDevice, const std::string& szPlace) {
        return "NOTIFY * HTTP/1.1\r\nNTS: ssdp:alive\r\nUSN: uuid:" + szDevice +
               "::upnp:rootdevice\r\nLOCATION: " + szPlace + "\r\n\r\n";
    };
    tavo::Lives lives;
    const std::tuple<const char*, const char*, bool> rgCases[] = {
        {"igd", "http://192.168.1.1:5000/", true},  {"media", "http://192.168.1.1:8200/", true},
        {"igd", "http://192.168.1.1:5000/", false}, {"media", "http://192.168.1.1:8200/", false},
        {"igd", "http://192.168.1.1:5001/", true},  {"igd", "http://192.168.1.1:5001/", false}};
    for (const auto& [szDevice, szPlace, blNews] : rgCases) {
        EXPECT_EQ(lives.IsNews(fnMessage(szDevice, szPlace)), blNews) << szDevice << " " << szPlace;
    }
    for (const int nDevices : {64, 65}) {  // of those that it cannot keep, it keeps none
        tavo::Lives many;
        for (int i = 0; i < nDevices; ++i) {
            EXPECT_TRUE(many.IsNews(fnMessage(std::to_string(i), "x")));
        }
        EXPECT_EQ(many.IsNews(fnMessage("0", "x")), nDevices == 65);
        EXPECT_FALSE(many.IsNews(fnMessage(std::to_string(nDevices - 1), "x")));
    }
    for (const size_t nSame : {size_t{255}, size_t{256}}) {  // two that differ behind a life's bound are one
        const std::string szLife(nSame, 'x');
        lives.IsNews(fnMessage("igd", szLife + "a"));
        EXPECT_EQ(lives.IsNews(fnMessage("igd", szLife + "b")), nSame == 255) << nSame;
    }
    // One that takes its leave is forgotten, and it alone.
    tavo::Lives some;
    EXPECT_TRUE(some.IsNews(fnMessage("igd", "x")) && some.IsNews(fnMessage("media", "y")));
    const char* szGoodbye = "NOTIFY * HTTP/1.1\r\nNTS: ssdp:byebye\r\nUSN: uuid:igd::upnp:rootdevice\r\n\r\n";
    EXPECT_TRUE(some.IsNews(szGoodbye));
    EXPECT_FALSE(some.IsNews(szGoodbye)) << "it had gone";
    EXPECT_FALSE(some.IsNews(fnMessage("media", "y")));
    EXPECT_TRUE(some.IsNews(fnMessage("igd", "x")));
}

}  // namespace
