/*
 * main.cpp - km_bench: runs every row's TA and raw benchmark, then prints
 * each row's ratio (raw time / TA time) against its target and the TA's
 * peak heap.
 *
 * Google Benchmark flags work as usual; by default each benchmark is
 * repeated three times and the ratio uses the medians.
 */
#include <algorithm>
#include <cstdio>
#include <exception>
#include <map>
#include <string>
#include <vector>

#include <unistd.h>

#include <benchmark/benchmark.h>

#include "rows.h"

namespace bench {

Bytes message(size_t n) {
    Bytes m(n);
    uint32_t x = 0x12345678;
    for (auto &b : m) {
        x = x * 1664525u + 1013904223u;
        b = static_cast<uint8_t>(x >> 24);
    }
    return m;
}

namespace {

const RowGroup kRowGroups[] = {hmac_rows, rsa_rows, ec_rows, aes_rows, kmd_rows};

std::string ta_name(const Row &r) {
    return "ta/" + r.algorithm + "/" + r.size;
}
std::string raw_name(const Row &r) {
    return "raw/" + r.algorithm + "/" + r.size;
}

// Prints the usual table and keeps each benchmark's time per operation in
// seconds: the median aggregate when there are repetitions, else the mean
// of the plain runs.
class CapturingReporter : public benchmark::ConsoleReporter {
  public:
    // Colour only on a terminal, so that captured output stays plain.
    CapturingReporter() : ConsoleReporter(isatty(STDOUT_FILENO) ? OO_Defaults : OO_Tabular) {}

    void ReportRuns(const std::vector<Run> &runs) override {
        ConsoleReporter::ReportRuns(runs);
        for (const Run &run : runs) {
            if (run.error_occurred)
                continue;
            const std::string name = run.run_name.function_name;
            const double seconds = run.GetAdjustedRealTime() / benchmark::GetTimeUnitMultiplier(run.time_unit);
            Seen &s = seen_[name];
            if (run.run_type == Run::RT_Aggregate) {
                if (run.aggregate_name == "median")
                    s.median = seconds;
            } else {
                s.sum += seconds;
                ++s.count;
            }
        }
    }

    bool any() const { return !seen_.empty(); }

    // seconds - time per operation, or a negative value when it did not run.
    double seconds(const std::string &name) const {
        auto it = seen_.find(name);
        if (it == seen_.end())
            return -1;
        if (it->second.median >= 0)
            return it->second.median;
        return it->second.count ? it->second.sum / it->second.count : -1;
    }

  private:
    struct Seen {
        double median = -1;
        double sum = 0;
        int count = 0;
    };
    std::map<std::string, Seen> seen_;
};

void register_side(const std::string &name, const Row &row, const std::function<void()> &once) {
    const int64_t bytes = row.bytes;
    benchmark::RegisterBenchmark(name.c_str(),
                                 [once, bytes](benchmark::State &state) {
                                     try {
                                         for (auto _ : state)
                                             once();
                                     } catch (const std::exception &e) {
                                         state.SkipWithError(e.what());
                                         return;
                                     }
                                     state.SetBytesProcessed(state.iterations() * bytes);
                                 })
        ->UseRealTime()
        ->Unit(benchmark::kMicrosecond);
}

void print_summary(const std::vector<Row> &rows, const CapturingReporter &rep) {
    std::printf("\n");
    for (const Row &row : rows) {
        const double ta = rep.seconds(ta_name(row));
        const double raw = rep.seconds(raw_name(row));
        if (ta <= 0 || raw <= 0) {
            std::printf("ratio %s %s: not measured (target >= %.2f)\n", row.algorithm.c_str(), row.size.c_str(),
                        row.target);
            continue;
        }
        const double ratio = raw / ta;
        if (row.target <= 0) { // informational rows have no target
            std::printf("ratio %s %s: %.2f\n", row.algorithm.c_str(), row.size.c_str(), ratio);
            continue;
        }
        const bool met = ratio >= row.target;
        std::printf("ratio %s %s: %.2f (target >= %.2f)%s\n", row.algorithm.c_str(), row.size.c_str(), ratio,
                    row.target, met ? "" : " MISSED");
    }
    const tee_host::heap::Stats heap = tee_host::heap::stats();
    std::printf("TA peak heap: %zu bytes (of %zu)\n", heap.peak_bytes, heap.limit);
}

} // namespace
} // namespace bench

int main(int argc, char **argv) {
    // Defaults first so that the caller's own flags override them.
    std::vector<std::string> defaults = {"--benchmark_repetitions=3", "--benchmark_report_aggregates_only=true"};
    std::vector<char *> args = {argv[0]};
    for (auto &d : defaults)
        args.push_back(d.data());
    for (int i = 1; i < argc; ++i)
        args.push_back(argv[i]);
    int n = static_cast<int>(args.size());
    args.push_back(nullptr);
    benchmark::Initialize(&n, args.data());
    if (benchmark::ReportUnrecognizedArguments(n, args.data()))
        return 2;

    int status = 0;
    try {
        bench::TaSession ta;
        std::vector<bench::Row> rows;
        for (bench::RowGroup group : bench::kRowGroups) {
            std::vector<bench::Row> more = group(ta);
            rows.insert(rows.end(), more.begin(), more.end());
        }
        for (const bench::Row &row : rows) {
            bench::register_side(bench::ta_name(row), row, row.ta);
            bench::register_side(bench::raw_name(row), row, row.raw);
        }
        bench::CapturingReporter reporter;
        benchmark::RunSpecifiedBenchmarks(&reporter);
        // Nothing ran when only listing benchmarks or filtering out all.
        if (reporter.any())
            bench::print_summary(rows, reporter);
    } catch (const std::exception &e) {
        std::fprintf(stderr, "km_bench: %s\n", e.what());
        status = 1;
    }
    benchmark::Shutdown();
    return status;
}
