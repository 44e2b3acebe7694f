// What a merge costs: one pass of ports 1 to N against 1 to N, by the library's index and by walking the
// lists. Relies on Google Benchmark. Promises: both sides in one run, and the ratio of their processor
// time at the end.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <map>

#include "naive_conflicts.h"

namespace {

using namespace tavo::lib;

using Pass = int (*)(OPERATION_RULE*, int, const OPERATION_RULE*, int, bool, const RULE_FILTER*, const RULE_FILTER*);

struct OneRule : OperationRules {
    explicit OneRule(int nPorts) {
        __tag_TAVO_PORTMAP_RULE request = {};
        FillText(request.szPorts, "1-" + std::to_string(nPorts));
        CreateOperationRulesArray(&rgRules, &nRules, "hoplink", &request, 1);
    }
};

// The three passes of a merge at their worst: every pair is looked for and found; the first keeps what
// it finds, the others remove it. The lists are made outside the time.
void ThreePasses(benchmark::State& state, Pass pfnPass) {
    const int nPorts = static_cast<int>(state.range(0));
    for (auto _ : state) {
        state.PauseTiming();
        {
            OneRule disabled(nPorts), request(nPorts), again(nPorts), user(nPorts);
            state.ResumeTiming();
            int nResult = pfnPass(disabled.rgRules, 1, request.rgRules, 1, false, nullptr, nullptr);
            nResult |= pfnPass(request.rgRules, 1, user.rgRules, 1, true, nullptr, nullptr);
            nResult |= pfnPass(again.rgRules, 1, disabled.rgRules, 1, true, nullptr, nullptr);
            state.PauseTiming();
            if (nResult != 0 || disabled.rgRules->blDeleted || !request.rgRules->blDeleted ||
                !again.rgRules->blDeleted) {
                state.SkipWithError("a pass went wrong");
            }
        }
        state.ResumeTiming();
    }
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
