// tavo-igd: times what upnpd does with a router's UPnP table; a tool of the benchmark, not installed.
// Relies on the same classes as upnpd. Promises: touches only mappings with a mark of its own, never a rule's.
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <string_view>
#include <vector>

#include "ground/Marks.h"
#include "ground/TextFile.h"
#include "mapping/Carry.h"
#include "programs/common/IgdRouter.h"
#include "programs/common/RuleFile.h"
#include "tavo/net.h"
#include "wire/upnp/Igd.h"

namespace {

constexpr int kDiscoveryMilliseconds = 5000;
constexpr int kFirstPort = 20000;
constexpr int kMostPorts = 1000;
constexpr char kHelp[] =
    "Usage: tavo-igd discover | list | map N | unmap\n"
    "  discover  where the gateway's port-mapping service is, and what the router calls itself\n"
    "  list      the router's table\n"
    "  map N     make the tool's mappings TCP 20000 and up, N of them (1 to 1000), the only ones of the tool\n"
    "  unmap     take the tool's mappings away\n";

constexpr char kRecord[] = "/tmp/tavo-igd.conf";
constexpr std::string_view kBenchPrefix = "tavobench:";
constexpr std::string_view kForeignPrefix = "rule's:";

using Clock = std::chrono::steady_clock;
using tavo::RouterMapping;

// A router as it would look if the benchmark's mappings were the rules': the code under test runs unchanged, and
// takes the mappings of upnpd itself for another program's.
class BenchRouter : public tavo::Router {
public:
    explicit BenchRouter(tavo::Igd& igd) : mIgd(igd) {}
    tavo::Abilities What() const override { return mIgd.What(); }
    tavo::RouterReply List(std::vector<RouterMapping>& rgMappings) override {
        return Shown(mIgd.List(rgMappings), rgMappings);
    }
    tavo::RouterReply ListRange(const std::string& szProtocol, uint16_t nFirst, uint16_t nLast,
                                std::vector<RouterMapping>& rgMappings) override {
        return Shown(mIgd.ListRange(szProtocol, nFirst, nLast, rgMappings), rgMappings);
    }
    tavo::RouterReply Get(const std::string& szProtocol, uint16_t nRouterPort, RouterMapping& mapping) override {
        tavo::RouterReply reply = mIgd.Get(szProtocol, nRouterPort, mapping);
        Show(mapping);
        return reply;
    }
    tavo::RouterReply Add(RouterMapping& mapping) override {
        RouterMapping sent = mapping;
        Exchange(sent.szDescription, tavo::kOwnPrefix, kBenchPrefix);
        return mIgd.Add(sent);
    }
    tavo::RouterReply Remove(const RouterMapping& mapping) override { return mIgd.Remove(mapping); }

private:
    static bool Exchange(std::string& szText, std::string_view szFrom, std::string_view szTo) {
        const bool blFound = szText.starts_with(szFrom);
        if (blFound) {
            szText.replace(0, szFrom.size(), szTo);
        }
        return blFound;
    }
    static void Show(RouterMapping& mapping) {
        if (!Exchange(mapping.szDescription, tavo::kOwnPrefix, kForeignPrefix)) {
            Exchange(mapping.szDescription, kBenchPrefix, tavo::kOwnPrefix);
        }
    }
    static tavo::RouterReply Shown(tavo::RouterReply reply, std::vector<RouterMapping>& rgMappings) {
        for (RouterMapping& mapping : rgMappings) {
            Show(mapping);
        }
        return reply;
    }

    tavo::IgdRouter mIgd;
};

void PrintTime(const char* szWhat, Clock::time_point start) {
    std::printf("%s_ms=%.2f\n", szWhat, std::chrono::duration<double, std::milli>(Clock::now() - start).count());
}

int List(tavo::Igd& igd) {
    std::vector<RouterMapping> rgMappings;
    const tavo::RouterReply reply = tavo::IgdRouter(igd).List(rgMappings);
    if (!reply.IsOk()) {
        std::fprintf(stderr, "tavo-igd: the router answered %s\n", reply.szWord.c_str());
        return 1;
    }
    for (const RouterMapping& mapping : rgMappings) {
        std::printf("%-10s -> %s:%u lease %u '%s'\n", tavo::MappingName(mapping).c_str(), mapping.szClient.c_str(),
                    mapping.nBoxPort, mapping.nLease, mapping.szDescription.c_str());
    }
    return 0;
}

int Map(tavo::Igd& igd, const std::string& szBox, int nPorts) {
    std::vector<RouterMapping> rgWanted;
    for (int i = 0; i < nPorts; ++i) {
        const auto nPort = static_cast<uint16_t>(kFirstPort + i);
        rgWanted.push_back({"TCP", nPort, nPort, "", std::string(tavo::kOwnPrefix) + "igd", 0, true});
    }
    tavo::Habits habit;
    BenchRouter router(igd);
    // As upnpd remembers what it made.
    tavo::Record record(tavo::ReadFile(kRecord).value_or(""), "bench");
    record.TurnTo({"the gateway", ""});
    const tavo::PassResult result =
        tavo::BringInLine(router, rgWanted, record, habit,
                          {szBox, tavo::BootSeconds, [] { return false; },
                           [&record] { return tavo::WriteFileAtomic(kRecord, record.Text()); }});
    int nMissing = 0;
    for (const tavo::Outcome& outcome : result.rgOutcomes) {
        if (outcome.verdict.szWord != "1") {
            std::printf("%s: %s\n", outcome.szName.c_str(), outcome.verdict.szWord.c_str());
            ++nMissing;
        }
    }
    return nMissing == 0 && result.transport.IsOk() ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
    const std::string szVerb = argc > 1 ? argv[1] : "";
    const int nPorts = szVerb == "map" && argc == 3 ? std::atoi(argv[2]) : 0;
    const bool blPlain = argc == 2 && (szVerb == "discover" || szVerb == "list" || szVerb == "unmap");
    if (!blPlain && (nPorts < 1 || nPorts > kMostPorts)) {
        std::fputs(kHelp, szVerb == "--help" ? stdout : stderr);
        return szVerb == "--help" ? 0 : 2;
    }
    char szGateway[16] = {};
    char szBox[16] = {};
    if (TAVONetDefaultGatewayGet(szGateway, sizeof(szGateway)) != 0 ||
        TAVONetLocalAddressGet(szGateway, szBox, sizeof(szBox), nullptr, 0) != 0) {
        std::fputs("tavo-igd: this box has no default gateway\n", stderr);
        return 1;
    }
    const Clock::time_point start = Clock::now();
    const auto pIgd = tavo::Igd::Find(szGateway, szBox, kDiscoveryMilliseconds, nullptr, 0);
    if (pIgd == nullptr) {
        std::fprintf(stderr, "tavo-igd: the gateway %s offers no UPnP port mapping\n", szGateway);
        return 1;
    }
    PrintTime("discover", start);
    const Clock::time_point work = Clock::now();
    int nStatus = 0;
    if (szVerb == "discover") {
        const tavo::IgdService& service = pIgd->Service();
        std::printf("%s at %s\n", service.szType.c_str(), service.control.Text().c_str());
        std::printf("brand '%s' model '%s' version '%s'\n", service.model.szBrand.c_str(),
                    service.model.szModel.c_str(), service.model.szVersion.c_str());
    } else if (szVerb == "list") {
        nStatus = List(*pIgd);
    } else {
        nStatus = Map(*pIgd, szBox, nPorts);
    }
    PrintTime(szVerb.c_str(), work);
    PrintTime("total", start);
    return nStatus;
}
