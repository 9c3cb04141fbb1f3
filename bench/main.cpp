/*
 * main.cpp - km_bench: runs every row's TA, raw and SoftHSM2 benchmarks,
 * then prints each row's ratios against its targets and the TA's peak
 * heap, or with --json the same as one JSON array on stdout.
 *
 * Google Benchmark flags work as usual; by default each benchmark is
 * repeated three times and the ratios use the medians.
 */
#include <cmath>
#include <cstdio>
#include <cstring>
#include <exception>
#include <iostream>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include <unistd.h>

#include <benchmark/benchmark.h>
#include <nlohmann/json.hpp>

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

Row timed_row(const std::string &name, int64_t bytes, double target_raw, Side ta, Side raw, double target_softhsm,
              const Hsm &hsm, const SoftHsmSide &make) {
    Row row{
        .name = name,
        .bytes = bytes,
        .target_raw = target_raw,
        .target_softhsm = target_softhsm,
        .ta = std::move(ta),
        .raw = std::move(raw),
    };
    if (!hsm || target_softhsm <= 0)
        return row;
    // A mechanism this SoftHSM2 lacks leaves the row's columns "n/a"; a
    // disagreement with OpenSSL stops the run.
    try {
        row.softhsm = make(p11::Storage::session);
        row.softhsm_token = make(p11::Storage::token);
    } catch (const p11::Failure &e) {
        std::fprintf(stderr, "km_bench: %s: SoftHSM2 n/a: %s\n", name.c_str(), e.what());
        row.softhsm = nullptr;
        row.softhsm_token = nullptr;
    }
    return row;
}

namespace {

const RowGroup kRowGroups[] = {hmac_rows, rsa_rows, ec_rows, aes_rows, kmd_rows, scale_rows, heap_rows};

// The sides of a row, each a benchmark named prefix + row name.
struct SideOf {
    const char *prefix;
    Side Row::*side;
};
const SideOf kSides[] = {
    {"ta/", &Row::ta},
    {"raw/", &Row::raw},
    {"softhsm/", &Row::softhsm},
    {"softhsm_token/", &Row::softhsm_token},
};

// Prints the usual table and keeps each benchmark's time per operation in
// seconds: the median aggregate when there are repetitions, else the mean
// of the plain runs.
class CapturingReporter : public benchmark::ConsoleReporter {
  public:
    // Colour only on a terminal, so that captured output stays plain.
    explicit CapturingReporter(int fd) : ConsoleReporter(isatty(fd) ? OO_Defaults : OO_Tabular) {}

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

    // seconds - time per operation, or nothing when it did not run.
    std::optional<double> seconds(const std::string &name) const {
        auto it = seen_.find(name);
        if (it == seen_.end())
            return std::nullopt;
        if (it->second.median >= 0)
            return it->second.median;
        if (it->second.count)
            return it->second.sum / it->second.count;
        return std::nullopt;
    }

  private:
    struct Seen {
        double median = -1;
        double sum = 0;
        int count = 0;
    };
    std::map<std::string, Seen> seen_;
};

void register_side(const std::string &name, int64_t bytes, const Side &once) {
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

// What was measured of a row, in seconds per operation, and whether every
// target of the row was met. A target whose sides did not run is not met.
struct Measured {
    std::optional<double> ta, raw, softhsm, softhsm_token, baseline_ta;
    bool met = true;
};

std::optional<double> ratio(const std::optional<double> &other, const std::optional<double> &ta) {
    if (!other || !ta || *ta <= 0)
        return std::nullopt;
    return *other / *ta;
}

Measured measure(const Row &row, const CapturingReporter &rep) {
    Measured m;
    m.ta = rep.seconds("ta/" + row.name);
    m.raw = rep.seconds("raw/" + row.name);
    m.softhsm = rep.seconds("softhsm/" + row.name);
    m.softhsm_token = rep.seconds("softhsm_token/" + row.name);
    if (row.target_raw > 0) {
        const auto r = ratio(m.raw, m.ta);
        m.met = m.met && r && *r >= row.target_raw;
    }
    if (row.target_softhsm > 0) {
        const auto r = ratio(m.softhsm, m.ta);
        m.met = m.met && r && *r >= row.target_softhsm;
    }
    if (!row.ta_baseline.empty()) {
        m.baseline_ta = rep.seconds("ta/" + row.ta_baseline);
        const auto r = ratio(m.ta, m.baseline_ta);
        m.met = m.met && r && *r <= row.ta_max_over_baseline;
    }
    if (row.heap_bytes)
        m.met = *row.heap_bytes <= row.heap_target;
    return m;
}

// "TA/raw 0.920 (target >= 0.90)", with " MISSED" below target and "n/a"
// when a side did not run.
std::string ratio_text(const char *what, const std::optional<double> &r, double target, const char *unit) {
    char buf[160];
    if (!r) {
        if (target > 0)
            std::snprintf(buf, sizeof buf, "%s n/a (target >= %.2f%s, not measured)", what, target, unit);
        else
            std::snprintf(buf, sizeof buf, "%s n/a", what);
    } else if (target > 0) {
        std::snprintf(buf, sizeof buf, "%s %.3f%s (target >= %.2f%s)%s", what, *r, unit, target, unit,
                      *r >= target ? "" : " MISSED");
    } else {
        std::snprintf(buf, sizeof buf, "%s %.3f%s", what, *r, unit);
    }
    return buf;
}

void print_summary(const std::vector<Row> &rows, const CapturingReporter &rep) {
    std::printf("\n");
    for (const Row &row : rows) {
        const Measured m = measure(row, rep);
        if (row.heap_bytes) {
            std::printf("%s: TA heap in use %zu bytes (target <= %zu)%s\n", row.name.c_str(), *row.heap_bytes,
                        row.heap_target, m.met ? "" : " MISSED");
            continue;
        }
        if (!m.ta) {
            std::printf("%s: not measured\n", row.name.c_str());
            continue;
        }
        std::string line = row.name + ": " + ratio_text("TA/raw", ratio(m.raw, m.ta), row.target_raw, "") + "; " +
                           ratio_text("TA/SoftHSM2", ratio(m.softhsm, m.ta), row.target_softhsm, "x");
        if (row.softhsm_token)
            line += "; " + ratio_text("token objects", ratio(m.softhsm_token, m.ta), 0, "x");
        if (!row.ta_baseline.empty()) {
            const auto r = ratio(m.ta, m.baseline_ta);
            char buf[160];
            if (r)
                std::snprintf(buf, sizeof buf, "; TA time %.2fx %s's (target <= %.2fx)%s", *r, row.ta_baseline.c_str(),
                              row.ta_max_over_baseline, *r <= row.ta_max_over_baseline ? "" : " MISSED");
            else
                std::snprintf(buf, sizeof buf, "; TA time against %s n/a (not measured)", row.ta_baseline.c_str());
            line += buf;
        }
        std::printf("%s\n", line.c_str());
    }
    const tee_host::heap::Stats heap = tee_host::heap::stats();
    std::printf("TA peak heap: %zu bytes (of %zu)\n", heap.peak_bytes, heap.limit);
}

nlohmann::ordered_json ns(const std::optional<double> &seconds) {
    if (!seconds)
        return nullptr;
    return std::round(*seconds * 1e10) / 10; // to a tenth of a nanosecond
}

nlohmann::ordered_json target(double t) {
    return t > 0 ? nlohmann::ordered_json(t) : nlohmann::ordered_json(nullptr);
}

void print_json(const std::vector<Row> &rows, const CapturingReporter &rep) {
    nlohmann::ordered_json out = nlohmann::ordered_json::array();
    for (const Row &row : rows) {
        const Measured m = measure(row, rep);
        nlohmann::ordered_json r;
        r["row"] = row.name;
        r["ta_ns"] = ns(m.ta);
        r["raw_ns"] = ns(m.raw);
        r["softhsm_ns"] = ns(m.softhsm);
        r["softhsm_token_ns"] = ns(m.softhsm_token);
        r["target_raw"] = target(row.target_raw);
        r["target_softhsm"] = target(row.target_softhsm);
        r["met"] = m.met;
        if (row.heap_bytes) {
            r["heap_bytes"] = *row.heap_bytes;
            r["heap_limit_bytes"] = row.heap_target;
        }
        out.push_back(std::move(r));
    }
    std::printf("%s\n", out.dump(2).c_str());
}

// The SoftHSM2 token of the rows, or null (with the reason on stderr)
// when SoftHSM2 is not installed or does not start.
Hsm open_softhsm() {
    std::string why;
    try {
        if (auto module = p11::Module::load(&why))
            return std::make_shared<p11::Token>(module, "km-bench");
    } catch (const std::exception &e) {
        why = e.what();
    }
    std::fprintf(stderr, "km_bench: SoftHSM2 columns n/a: %s\n", why.c_str());
    return nullptr;
}

// Registered benchmarks hold the rows' sides: drop them while the TEE and
// the SoftHSM2 module they use are still there.
struct Unregister {
    Unregister() = default;
    Unregister(const Unregister &) = delete;
    Unregister &operator=(const Unregister &) = delete;
    ~Unregister() { benchmark::ClearRegisteredBenchmarks(); }
};

} // namespace
} // namespace bench

int main(int argc, char **argv) {
    // Defaults first so that the caller's own flags override them; --json
    // is ours, not Google Benchmark's.
    bool json = false;
    std::vector<std::string> defaults = {"--benchmark_repetitions=3", "--benchmark_report_aggregates_only=true"};
    std::vector<char *> args = {argv[0]};
    for (auto &d : defaults)
        args.push_back(d.data());
    for (int i = 1; i < argc; ++i) {
        if (std::strcmp(argv[i], "--json") == 0)
            json = true;
        else
            args.push_back(argv[i]);
    }
    int n = static_cast<int>(args.size());
    args.push_back(nullptr);
    benchmark::Initialize(&n, args.data());
    if (benchmark::ReportUnrecognizedArguments(n, args.data()))
        return 2;

    int status = 0;
    try {
        bench::TaSession ta;
        const bench::Hsm hsm = bench::open_softhsm();
        std::vector<bench::Row> rows;
        for (bench::RowGroup group : bench::kRowGroups) {
            std::vector<bench::Row> more = group(ta, hsm);
            rows.insert(rows.end(), more.begin(), more.end());
        }
        const bench::Unregister unregister;
        for (const bench::Row &row : rows)
            for (const bench::SideOf &s : bench::kSides)
                if (row.*s.side)
                    bench::register_side(s.prefix + row.name, row.bytes, row.*s.side);
        // With --json, stdout carries the JSON alone: the table goes to stderr.
        bench::CapturingReporter reporter(json ? STDERR_FILENO : STDOUT_FILENO);
        if (json)
            reporter.SetOutputStream(&std::cerr);
        benchmark::RunSpecifiedBenchmarks(&reporter);
        // The JSON always (rows not run read null); the text only when
        // something ran, not when listing benchmarks or filtering out all.
        if (json)
            bench::print_json(rows, reporter);
        else if (reporter.any())
            bench::print_summary(rows, reporter);
    } catch (const std::exception &e) {
        std::fprintf(stderr, "km_bench: %s\n", e.what());
        status = 1;
    }
    benchmark::Shutdown();
    return status;
}
