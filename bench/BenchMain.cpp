// Runs the registered benchmarks and prints their figures, one
// "<figure> <value>" line each, and nothing else on standard output.
//
// A figure is a user counter whose name is lower snake case, such as
// state.counters["parcel_rw_mb_per_s"]. A benchmark computes its figures
// itself (medians, rates over its own clock) and stores them there; counters
// named otherwise stay internal. The usual --benchmark_filter=<regex> selects
// benchmarks.

#include <benchmark/benchmark.h>

#include <cmath>
#include <cstdio>
#include <string>
#include <vector>

namespace {

bool isFigureName(const std::string& name) {
    if (name.empty() || name[0] < 'a' || name[0] > 'z' || name.find('_') == std::string::npos) {
        return false;
    }
    for (char c : name) {
        if (!((c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '_')) {
            return false;
        }
    }
    return true;
}

std::string formatValue(double value) {
    char text[64];
    if (!std::isfinite(value)) {
        snprintf(text, sizeof(text), "%f", value);
    } else if (std::fabs(value) >= 1000) {
        snprintf(text, sizeof(text), "%.0f", value);
    } else {
        snprintf(text, sizeof(text), "%.4g", value);
    }
    return text;
}

class FigureReporter : public benchmark::BenchmarkReporter {
public:
    bool ReportContext(const Context&) override { return true; }

    void ReportRuns(const std::vector<Run>& runs) override {
        for (const Run& run : runs) {
            if (run.run_type != Run::RT_Iteration) {
                continue; // aggregates of --benchmark_repetitions
            }
            if (run.error_occurred) {
                fprintf(stderr, "%s failed: %s\n", run.benchmark_name().c_str(),
                        run.error_message.c_str());
                mFailed = true;
                continue;
            }
            for (const auto& counter : run.counters) {
                if (isFigureName(counter.first)) {
                    printf("%s %s\n", counter.first.c_str(),
                           formatValue(counter.second.value).c_str());
                    fflush(stdout);
                }
            }
        }
    }

    bool failed() const { return mFailed; }

private:
    bool mFailed = false;
};

} // namespace

int main(int argc, char** argv) {
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
        return 2;
    }
    FigureReporter reporter;
    size_t ran = benchmark::RunSpecifiedBenchmarks(&reporter);
    benchmark::Shutdown();
    if (ran == 0) {
        fprintf(stderr, "no benchmark matched\n");
        return 1;
    }
    return reporter.failed() ? 1 : 0;
}
