// What a merge costs: one pass of ports 1 to N against 1 to N, by the library's index and by walking the
// lists; and what a whole merge of wide rules holds. Relies on Google Benchmark. Promises: both sides in one run,
// and at the end the ratio of their processor time and the peak of memory, each merge in a process of its own.
#include <benchmark/benchmark.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <map>
#include <string>
#include <vector>

#include "Text.h"
#include "naive_conflicts.h"

namespace {

using namespace tavo::lib;

using Pass = int (*)(const MergeHost&, OPERATION_RULE*, int, const OPERATION_RULE*, int, bool, const RULE_FILTER*,
                     const RULE_FILTER*, MergeObserver*);

struct OneRule : OperationRules {
    explicit OneRule(int nPorts) {
        __tag_TAVO_PORTMAP_RULE request = {};
        FillText(request.szPorts, "1-" + std::to_string(nPorts));
        CreateOperationRulesArray(Host(), &rgRules, &nRules, "hoplink", &request, 1);
    }
};

// The three passes of a merge at their worst: every pair is looked for and found; the first keeps what
// it finds, the others remove it. The lists are made outside the time.
void ThreePasses(benchmark::State& state, Pass pfnPass) {
    const int nPorts = static_cast<int>(state.range(0));
    for ([[maybe_unused]] auto _ : state) {
        state.PauseTiming();
        {
            OneRule disabled(nPorts), request(nPorts), again(nPorts), user(nPorts);
            state.ResumeTiming();
            int nResult = pfnPass(Host(), disabled.rgRules, 1, request.rgRules, 1, false, nullptr, nullptr, nullptr);
            nResult |= pfnPass(Host(), request.rgRules, 1, user.rgRules, 1, true, nullptr, nullptr, nullptr);
            nResult |= pfnPass(Host(), again.rgRules, 1, disabled.rgRules, 1, true, nullptr, nullptr, nullptr);
            state.PauseTiming();
            if (nResult != 0 || disabled.rgRules->blDeleted || !request.rgRules->blDeleted ||
                !again.rgRules->blDeleted) {
                state.SkipWithError("a pass went wrong");
            }
        }
        state.ResumeTiming();
    }
}

// A service's request for every port meets nRules stored rules of every port, from the records to the records.
bool MergeWideRules(int nRules, const char* szOwner, bool blEnabled) {
    __tag_TAVO_ROUTER_RULE rule = {};
    rule.blEnable = blEnabled;
    FillText(rule.szProtocol, "tcp");
    FillText(rule.szRouterPort, "1-65535");
    FillText(rule.szSrcPort, "1-65535");
    FillText(rule.szServiceName, szOwner);
    const std::vector<__tag_TAVO_ROUTER_RULE> rgStored(static_cast<size_t>(nRules), rule);
    OperationRules stored;
    OneRule request(65535);
    RouterRules merged;
    return CreateOperationRulesArray(Host(), &stored.rgRules, &stored.nRules, rgStored.data(), nRules) == 0 &&
           DeletePortsFromRuleConf(Host(), stored.rgRules, stored.nRules, "hoplink") == 0 &&
           DeletePortsFromInputRules(Host(), request.rgRules, 1, stored.rgRules, stored.nRules, "hoplink") == 0 &&
           CreateRulesArray(Host(), &merged.rgRules, &merged.nRules, stored.rgRules, stored.nRules, request.rgRules,
                            1) == 0 &&
           request.rgRules->blDeleted && merged.nRules == nRules;
}

// In a process of its own, whose peak is the merge's.
void PrintPeak(int nRules, const char* szWhat, const char* szOwner, bool blEnabled) {
    const auto start = std::chrono::steady_clock::now();
    const pid_t nPid = fork();
    if (nPid == 0) {
        _exit(MergeWideRules(nRules, szOwner, blEnabled) ? 0 : 1);
    }
    int nStatus = -1;
    rusage usage = {};
    const bool blDone = nPid > 0 && wait4(nPid, &nStatus, 0, &usage) == nPid && nStatus == 0;
    const std::chrono::duration<double, std::milli> time = std::chrono::steady_clock::now() - start;
    std::printf("%d rules 1-65535 %s: %s, peak %.1f MB, %.0f ms\n", nRules, szWhat, blDone ? "merged" : "FAILED",
                static_cast<double>(usage.ru_maxrss) / 1024, time.count());
}

class RatioReporter : public benchmark::ConsoleReporter {
public:
    void ReportRuns(const std::vector<Run>& rgRuns) override {
        ConsoleReporter::ReportRuns(rgRuns);
        for (const Run& run : rgRuns) {
            const std::string& szSide = run.run_name.function_name;
            mSeconds[run.run_name.args][szSide] = run.cpu_accumulated_time / static_cast<double>(run.iterations);
        }
    }
    void Finalize() override {
        for (const auto& [szPorts, sides] : mSeconds) {
            if (sides.size() == 2) {
                std::printf("%s ports: walked %.3f ms, indexed %.3f ms, ratio %.0f\n", szPorts.c_str(),
                            1e3 * sides.at("walked"), 1e3 * sides.at("indexed"),
                            sides.at("walked") / sides.at("indexed"));
            }
        }
    }

private:
    std::map<std::string, std::map<std::string, double>> mSeconds;
};

}  // namespace

int main(int argc, char** argv) {
    benchmark::Initialize(&argc, argv);
    for (const int nRules : {1, 400}) {
        PrintPeak(nRules, "of a user", "", true);
        PrintPeak(nRules, "switched off for the service", "hoplink", false);
    }
    std::fflush(stdout);
    for (const auto& [szSide, pfnPass] : {std::pair<const char*, Pass>("indexed", tavo::lib::DeletePortsFromRules1),
                                          std::pair<const char*, Pass>("walked", naive::DeletePortsFromRules1)}) {
        for (const int nPorts : {1, 64, 1024, 65535}) {
            benchmark::RegisterBenchmark(szSide, ThreePasses, pfnPass)->Arg(nPorts)->Unit(benchmark::kMillisecond);
        }
    }
    RatioReporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    return 0;
}
