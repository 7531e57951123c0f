// Runs the registered benchmarks and prints their figures, one
// "<figure> <value>" line each, and nothing else on standard output.
//
// A figure is a user counter whose name is lower snake case, such as
// state.counters["parcel_rw_mb_per_s"]. A benchmark computes its figures
// itself (medians, rates over its own clock) and stores them there; counters
// named otherwise stay internal. The usual --benchmark_filter=<regex> selects
// benchmarks.
//
// Some figures are ratios of two figures of the same run: a round trip over
// the physical floor of its hand-over, measured alongside it (HandlerBench,
// BinderBench). They are printed last, when both of their figures ran.

#include <benchmark/benchmark.h>

#include <cmath>
#include <cstdio>
#include <map>
#include <string>
#include <vector>

namespace {

struct Ratio {
    const char* name;
    const char* numerator;
    const char* denominator;
};

constexpr Ratio kRatios[] = {
        {"handler_sync_vs_raw_ratio", "handler_sync_roundtrip_us_p50",
         "raw_thread_pingpong_us_p50"},
        {"binder_vs_raw_socket_ratio", "binder_roundtrip_us_p50",
         "raw_unix_socket_roundtrip_us_p50"},
        {"binder_vs_raw_process_socket_ratio", "binder_roundtrip_us_p50",
         "raw_unix_socket_process_roundtrip_us_p50"},
        {"gpu_reading_vs_raw_socket_ratio", "gpu_reading_us", "raw_unix_socket_roundtrip_us_p50"},
        {"hidl_event_vs_binder_ratio", "hidl_event_us_p50", "binder_roundtrip_us_p50"},
};

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
                    print(counter.first, counter.second.value);
                    mFigures[counter.first] = counter.second.value;
                }
            }
        }
    }

    void printRatios() const {
        for (const Ratio& ratio : kRatios) {
            auto numerator = mFigures.find(ratio.numerator);
            auto denominator = mFigures.find(ratio.denominator);
            if (numerator != mFigures.end() && denominator != mFigures.end() &&
                denominator->second > 0) {
                print(ratio.name, numerator->second / denominator->second);
            }
        }
    }

    bool failed() const { return mFailed; }

private:
    static void print(const std::string& name, double value) {
        printf("%s %s\n", name.c_str(), formatValue(value).c_str());
        fflush(stdout);
    }

    bool mFailed = false;
    std::map<std::string, double> mFigures;
};

} // namespace

int main(int argc, char** argv) {
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
        return 2;
    }
    FigureReporter reporter;
    size_t ran = benchmark::RunSpecifiedBenchmarks(&reporter);
    reporter.printRatios();
    benchmark::Shutdown();
    if (ran == 0) {
        fprintf(stderr, "no benchmark matched\n");
        return 1;
    }
    return reporter.failed() ? 1 : 0;
}
