// The fuzzer as a router: its bytes are the successive answers to the real requests of discovery, listing,
// adding and reading back. Relies on libFuzzer. Promises: stops at the first answer that makes the client
// speak to another host, take away what is not ours, or count a mapping that no router showed.
//
// An input is a row of answers, each ended by a byte 0xFF: first that to the question of discovery, then
// those to HTTP requests, each with one letter before its body: "o" 200, "e" 500, "b" 200 with the body put
// into a SOAP envelope, "f" a SOAP fault with the body as its code, "t" silence. After the last one the
// router is gone. By hand, router.dict (-dict=) has the words that get in.
#include <cstdio>
#include <cstdlib>
#include <set>
#include <string>
#include <string_view>
#include <tuple>

#include "ground/Marks.h"
#include "mapping/Carry.h"
#include "programs/common/IgdRouter.h"
#include "programs/common/RuleFile.h"
#include "wire/upnp/Igd.h"
#include "wire/upnp/Search.h"

namespace {

constexpr char kGateway[] = "192.168.1.1";
constexpr char kBox[] = "192.168.1.5";
constexpr char kEnd = '\xff';
constexpr size_t kMaxText = 256;
constexpr int kPorts = 6;

// How far inputs got: a fuzzer that stays outside the door finds nothing behind it.
struct Reach {
    long nInputs, nFound, nListed, nAdded, nConfirmed, nRemoved;
    ~Reach() {
        std::fprintf(stderr, "inputs %ld, found %ld, listed %ld, added %ld, confirmed %ld, removed %ld\n", nInputs,
                     nFound, nListed, nAdded, nConfirmed, nRemoved);
    }
} gReach;

void Require(bool blTrue, const char* szWhat) {
    if (!blTrue) {
        std::fprintf(stderr, "broken promise: %s\n", szWhat);
        std::abort();
    }
}

class Script {
public:
    explicit Script(std::string_view szBytes) : mSzBytes(szBytes) {}
    bool IsOver() const { return mSzBytes.empty(); }
    std::string_view Next() {
        const std::string_view szAnswer = mSzBytes.substr(0, mSzBytes.find(kEnd));
        mSzBytes.remove_prefix(std::min(mSzBytes.size(), szAnswer.size() + 1));
        return szAnswer;
    }

private:
    std::string_view mSzBytes;
};

class FuzzedRouter : public tavo::HttpTransport {
public:
    explicit FuzzedRouter(Script& script) : mScript(script) {}

    tavo::HttpAnswer Get(const tavo::HttpUrl& url) override { return Answer(url); }
    tavo::HttpAnswer Post(const tavo::HttpUrl& url, const std::vector<std::string>&, const std::string&) override {
        return Answer(url);
    }

private:
    tavo::HttpAnswer Answer(const tavo::HttpUrl& url) {
        Require(url.szHost == kGateway, "only the gateway is spoken to");
        Require(url.nPort > 0 && url.nPort <= 65535 && url.szPath.starts_with("/"), "addresses make sense");
        if (mScript.IsOver()) {
            return {};
        }
        const std::string_view szAnswer = mScript.Next();
        const std::string szBody(szAnswer.substr(std::min<size_t>(1, szAnswer.size())));
        switch (szAnswer.empty() ? 'o' : szAnswer.front()) {
            case 't':
                return {tavo::HttpEnd::kTimeout, 0, ""};
            case 'e':
                return {tavo::HttpEnd::kAnswered, 500, szBody};
            case 'b':
                return {tavo::HttpEnd::kAnswered, 200, "<e><Body><r>" + szBody + "</r></Body></e>"};
            case 'f':
                return {tavo::HttpEnd::kAnswered, 500,
                        "<e><Body><Fault><errorCode>" + szBody + "</errorCode></Fault></Body></e>"};
            default:
                return {tavo::HttpEnd::kAnswered, 200, szBody};
        }
    }

    Script& mScript;
};

void RequirePrintable(const std::string& szText) {
    Require(szText.size() <= kMaxText, "texts are bounded");
    for (const char c : szText) {
        Require(static_cast<unsigned char>(c) >= ' ' && c != '\x7f', "texts are printable");
    }
}

// The IGD as the reconciling side sees it; remembers what it showed of each port.
class Watched : public tavo::Router {
public:
    explicit Watched(tavo::Igd& igd) : mIgd(igd) {}

    tavo::Abilities What() const override { return mIgd.What(); }
    tavo::RouterReply List(std::vector<tavo::RouterMapping>& rgMappings) override {
        tavo::RouterReply reply = mIgd.List(rgMappings);
        gReach.nListed += reply.IsOk() ? 1 : 0;
        return Take(rgMappings, std::move(reply));
    }
    tavo::RouterReply ListRange(const std::string& szProtocol, uint16_t nFirst, uint16_t nLast,
                                std::vector<tavo::RouterMapping>& rgMappings) override {
        return Take(rgMappings, mIgd.ListRange(szProtocol, nFirst, nLast, rgMappings));
    }
    tavo::RouterReply Get(const std::string& szProtocol, uint16_t nRouterPort, tavo::RouterMapping& mapping) override {
        std::vector<tavo::RouterMapping> rgMappings(1);
        tavo::RouterReply reply = Take(rgMappings, mIgd.Get(szProtocol, nRouterPort, rgMappings[0]));
        mapping = rgMappings[0];
        return reply;
    }
    tavo::RouterReply Add(tavo::RouterMapping& mapping) override {
        tavo::RouterReply reply = mIgd.Add(mapping);
        gReach.nAdded += reply.IsOk() ? 1 : 0;
        return reply;
    }
    tavo::RouterReply Remove(const tavo::RouterMapping& mapping) override {
        Require(mSetOwn.contains(tavo::KeyOf(mapping)), "only what the router showed as ours is taken away");
        tavo::RouterReply reply = mIgd.Remove(mapping);
        gReach.nRemoved += reply.IsOk() ? 1 : 0;
        return reply;
    }
    bool HasShown(const tavo::RouterMapping& wanted) const {
        return mSetServed.contains({wanted.szProtocol, wanted.nRouterPort, wanted.nBoxPort});
    }

private:
    tavo::RouterReply Take(const std::vector<tavo::RouterMapping>& rgMappings, tavo::RouterReply reply) {
        for (const tavo::RouterMapping& mapping : rgMappings) {
            if (reply.IsOk() || reply.enReply == tavo::Reply::kTooLong) {
                Require(mapping.szProtocol == "TCP" || mapping.szProtocol == "UDP", "entries make sense");
                RequirePrintable(mapping.szDescription);
                RequirePrintable(mapping.szClient);
                if (mapping.szClient == kBox && mapping.szDescription.starts_with(tavo::kOwnPrefix)) {
                    mSetOwn.emplace(mapping.szProtocol, mapping.nRouterPort);
                }
                if (mapping.szClient == kBox && mapping.blEnabled) {
                    mSetServed.emplace(mapping.szProtocol, mapping.nRouterPort, mapping.nBoxPort);
                }
            }
        }
        return reply;
    }

    tavo::IgdRouter mIgd;
    std::set<std::pair<std::string, uint16_t>> mSetOwn;
    std::set<std::tuple<std::string, uint16_t, uint16_t>> mSetServed;
};

void Map(tavo::Igd& igd) {
    std::vector<tavo::RouterMapping> rgWanted;
    for (uint16_t i = 1; i <= kPorts; ++i) {
        rgWanted.push_back({i % 2 == 0 ? "UDP" : "TCP", i, i, "", "tavo:fuzz", 0, true});
    }
    Watched router(igd);
    tavo::Habits habit;
    tavo::Record record("", "boot");
    const tavo::PassResult result = tavo::BringInLine(
        router, rgWanted, record, habit, {kBox, tavo::BootSeconds, [] { return false; }, [] { return true; }});
    Require(result.rgOutcomes.size() >= rgWanted.size(), "every mapping has a status");
    for (size_t i = 0; i < result.rgOutcomes.size(); ++i) {
        const std::string& szStatus = result.rgOutcomes[i].verdict.szWord;
        Require(szStatus != "written" && !szStatus.empty(), "no status is left open");
        Require(szStatus != "1" || (i < rgWanted.size() && router.HasShown(rgWanted[i])),
                "a mapping counts only when the router showed it");
        gReach.nConfirmed += szStatus == "1" ? 1 : 0;
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* pData, size_t nSize) {
    ++gReach.nInputs;
    Script script({reinterpret_cast<const char*>(pData), nSize});
    std::string szReason;
    const auto location = tavo::LocationOf(script.Next(), kGateway, true, szReason);
    RequirePrintable(szReason);
    if (!location) {
        return 0;
    }
    std::string szWhy;
    const auto pIgd = tavo::Igd::At(*location, std::make_shared<FuzzedRouter>(script), szWhy);
    Require((pIgd == nullptr) != szWhy.empty(), "what is refused has a reason");
    if (pIgd == nullptr) {
        return 0;
    }
    ++gReach.nFound;
    RequirePrintable(pIgd->Service().szType);
    RequirePrintable(pIgd->Service().model.szBrand + pIgd->Service().model.szModel + pIgd->Service().model.szVersion);
    std::string szAddress;
    if (pIgd->ExternalAddress(szAddress) == tavo::kWireOk) {
        RequirePrintable(szAddress);
    }
    Map(*pIgd);
    return 0;
}
