// The IGD client, and what else is heard by UPnP, against hostile answers.
#include <gtest/gtest.h>

#include <tuple>

#include "wire/upnp/Description.h"
#include "wire/upnp/Igd.h"
#include "wire/upnp/Notify.h"
#include "wire/upnp/Search.h"
#include "wire/upnp/Soap.h"

namespace {

using tavo::IgdEntry;

TEST(Ssdp, OnlyTheGatewayItselfCounts) {
    const std::pair<const char*, bool> rgCases[] = {
        {"HTTP/1.1 200 OK\r\nLocation:http://192.168.1.1:5000/x\r\n\r\n", true},
        {"HTTP/1.1 200 OK\r\nLOCATION: http://192.168.1.2:5000/x\r\n\r\n", false},
        {"HTTP/1.1 200 OK\r\nLOCATION: http://192.168.1.1:0/x\r\n\r\n", false},
        {"HTTP/1.1 200 OK\r\nLOCATION: http://192.168.1.1:-1/x\r\n\r\n", false},
        {"HTTP/1.1 200 OK\r\nLOCATION: http://192.168.1.1:65536/x\r\n\r\n", false},
        {"HTTP/1.1 200 OK\r\nLOCATION: http://192.168.1.1:99999999999999999999/x\r\n\r\n", false},
        {"HTTP/1.1 200 OK\r\nLOCATION: http://192.168.1.1:/x\r\n\r\n", true},
        {"HTTP/1.1 200 OK\r\nLOCATION: http://[::ffff:192.168.1.1]/x\r\n\r\n", false},
        {"HTTP/1.1 200 OK\r\nLOCATION: http://192.168.1.1.evil/x\r\n\r\n", false},
        {"HTTP/1.1 200 OK\r\nLOCATION: http://192.168.1.1@evil/x\r\n\r\n", false},
        {"HTTP/1.1 200 OK\r\nLOCATION: http://a:b@192.168.1.1/x\r\n\r\n", false},
        {"HTTP/1.1 200 OK\r\nLOCATION: https://192.168.1.1/x\r\n\r\n", false},
        {"HTTP/1.1 200 OK\r\nLOCATION: file:///etc/passwd\r\n\r\n", false},
        {"HTTP/1.1 404 No\r\nLOCATION: http://192.168.1.1/x\r\n\r\n", false},
        {"HTTP/1.1 200 OK\r\n\r\n", false},
        {"", false}};
    for (const auto& [szAnswer, blGood] : rgCases) {
        std::string szReason;
        EXPECT_EQ(tavo::LocationOf(szAnswer, "192.168.1.1", szReason).has_value(), blGood) << szAnswer;
        EXPECT_EQ(szReason.empty(), blGood);
    }
    for (const char* szOwn : {"127.0.0.1", "169.254.1.1"}) {
        std::string szReason;
        const std::string szAnswer = std::string("HTTP/1.1 200 OK\r\nLOCATION: http://") + szOwn + "/x\r\n\r\n";
        EXPECT_FALSE(tavo::LocationOf(szAnswer, szOwn, szReason));
    }
}

TEST(Igd, DescriptionsLeadToTheGatewayOrNowhere) {
    const tavo::HttpUrl location{"192.168.1.1", 80, "/dir/root.xml"};
    const auto fnControl = [&](const std::string& szControl, const std::string& szExtra) {
        const auto service = tavo::ParseDescription("<root>" + szExtra +
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
    EXPECT_EQ(fnControl("http://10.0.0.9/c", ""), "");
    EXPECT_EQ(fnControl("", ""), "");
    const auto fnEvents = [&](const std::string& szElement) {
        const auto service = tavo::ParseDescription(
            "<root><service><serviceType>urn:schemas-upnp-org:service:"
            "WANIPConnection:1</serviceType><controlURL>/c</controlURL>" +
                szElement + "</service></root>",
            location);
        return service && service->events ? service->events->Text() : "";
    };
    EXPECT_EQ(fnEvents("<eventSubURL>evt</eventSubURL>"), "http://192.168.1.1:80/dir/evt");
    EXPECT_EQ(fnEvents("<eventSubURL>http://10.0.0.9/e</eventSubURL>"), "");
    EXPECT_EQ(fnEvents("<eventSubURL/>"), "");
    EXPECT_EQ(fnEvents(""), "");
    std::string szDeep;
    for (int i = 0; i < 5000; ++i) {
        szDeep += "<a>";
    }
    EXPECT_FALSE(tavo::ParseDescription(szDeep, location));
    EXPECT_FALSE(tavo::ParseDescription("", location));
}

TEST(Igd, ARouterIsWhatItsRootDeviceSaysInOneHarmlessText) {
    const auto fnModel = [](const std::string& szDevice) {
        const std::string szXml = "<u:root xmlns:u='x'><u:device>" + szDevice +
                                  "<deviceList><device><manufacturer>inner</manufacturer><modelName>inner</modelName>"
                                  "<serviceList><service><serviceType>urn:schemas-upnp-org:service:WANIPConnection:1"
                                  "</serviceType><controlURL>/c</controlURL></service></serviceList></device>"
                                  "</deviceList></u:device></u:root>";
        const auto service = tavo::ParseDescription(szXml, {"192.168.1.1", 80, "/"});
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
    EXPECT_EQ(fnBrand(szLong).size(), tavo::kMaxModelText + 2);
    EXPECT_EQ(fnBrand(szLong), fnBrand(szLong));
    EXPECT_NE(fnBrand(szLong), fnBrand(szLong + "x"));  // the difference lies behind the cut
    EXPECT_EQ(fnBrand(std::string(tavo::kMaxModelText, 'x')), std::string(tavo::kMaxModelText, 'x') + "||");
    EXPECT_EQ(fnBrand(std::string(53, 'x') + "\xc3\xa4" + szLong).find("\xc3"), std::string::npos);  // no half letter
}

TEST(Igd, AnswersThatAreNoneAreGarbage) {
    const auto fnCode = [](long nHttpCode, const std::string& szXml) {
        return tavo::SoapAnswer({tavo::HttpEnd::kAnswered, nHttpCode, szXml}).Code();
    };
    EXPECT_EQ(fnCode(200, "<e><Body><r/></Body></e>"), tavo::kWireOk);
    EXPECT_EQ(fnCode(500, "<e><Body><x:Fault><errorCode> 718 </errorCode></x:Fault></Body></e>"), 718);
    for (const char* szXml : {"", "<html/>", "<e><Body><Fault/></Body></e>", "<e><Body>",
                              "<e><Body><Fault><errorCode>1</errorCode></Fault></Body></e>",
                              "<e><Body><Fault><errorCode>0</errorCode></Fault></Body></e>"}) {
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
    tavo::HttpAnswer Post(const tavo::HttpUrl&, const std::vector<std::string>&, const std::string& szBody) override {
        ++mNPosts;
        mSzAsked = szBody;
        return {tavo::HttpEnd::kAnswered, 200, "<e><Body><r>" + mSzAnswer + "</r></Body></e>"};
    }
    std::string mSzVersion = "2";
    std::string mSzAnswer;
    std::string mSzAsked;
    int mNPosts = 0;
};

TEST(Igd, WhatIsAskedIsXmlWhateverATextHolds) {
    const auto pRouter = std::make_shared<Canned>();
    const auto pIgd = tavo::Igd::At({"192.168.1.1", 80, "/"}, pRouter);
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
}

TEST(Igd, ARangeShowsWhatMakesSense) {
    const auto fnEntry = [](const char* szPort, const char* szClient) {
        return std::string("<p:E><p:NewExternalPort>") + szPort + "</p:NewExternalPort><p:NewProtocol>TCP" +
               "</p:NewProtocol><p:NewInternalPort>5</p:NewInternalPort><p:NewInternalClient>" + szClient +
               "</p:NewInternalClient></p:E>";
    };
    const std::string szGood = fnEntry("1", "192.168.1.5");
    const std::string szBad = fnEntry("65536", "192.168.1.5") + fnEntry("-1", "192.168.1.5") + fnEntry("2", "evil");
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
        EXPECT_EQ(tavo::Igd::At({"192.168.1.1", 80, "/"}, pHttp)->ListRange("TCP", 1, 9, rgMappings), 0) << szAnswer;
        EXPECT_EQ(rgMappings.size(), nExpected) << szAnswer;
    }
    const auto pFirst = std::make_shared<Canned>();
    pFirst->mSzVersion = "1";  // the first generation knows no ranges: it is not even asked
    std::vector<IgdEntry> rgMappings;
    EXPECT_NE(tavo::Igd::At({"192.168.1.1", 80, "/"}, pFirst)->ListRange("TCP", 1, 9, rgMappings), 0);
    EXPECT_EQ(pFirst->mNPosts, 0);
}

// A table of which each index shows the next of these entries.
class Table : public Canned {
public:
    tavo::HttpAnswer Post(const tavo::HttpUrl&, const std::vector<std::string>&, const std::string&) override {
        if (mRgEntries.empty()) {
            return {tavo::HttpEnd::kAnswered, 500, "<e><Body><Fault><errorCode>713</errorCode></Fault></Body></e>"};
        }
        const auto [nPort, szClient] = mRgEntries.front();
        mRgEntries.erase(mRgEntries.begin());
        return {tavo::HttpEnd::kAnswered, 200,
                "<e><Body><r><NewExternalPort>" + std::to_string(nPort) +
                    "</NewExternalPort><NewProtocol>TCP</NewProtocol><NewInternalPort>5</NewInternalPort>"
                    "<NewInternalClient>" +
                    szClient + "</NewInternalClient></r></Body></e>"};
    }
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
        {{{1, szOne}, {1, szOne}, {2, szOne}}, tavo::kWireTooLong, 1}};
    for (const auto& [rgEntries, nCode, nShown] : rgCases) {
        const auto pHttp = std::make_shared<Table>();
        pHttp->mRgEntries = rgEntries;
        std::vector<IgdEntry> rgMappings;
        EXPECT_EQ(tavo::Igd::At({"192.168.1.1", 80, "/"}, pHttp)->List(rgMappings), nCode);
        EXPECT_EQ(rgMappings.size(), nShown);
        EXPECT_EQ(rgMappings.at(0).szClient, szOne);
    }
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
    for (int i = 0; i < 10000; ++i) {
        lives.IsNews(fnMessage(std::to_string(i), "x"));
        ASSERT_LE(lives.Size(), 64U);
    }
    EXPECT_FALSE(lives.IsNews("NOTIFY * HTTP/1.1\r\nNTS: ssdp:byebye\r\nUSN: new\r\nLOCATION: x\r\n\r\n"));
}

}  // namespace
