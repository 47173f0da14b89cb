// A console reporter for benchmarks run beside a peer library: it keeps the median of every
// case whose label reads "plano/<case>" or "<peer>/<case>" and prints, at the end, our time
// over the peer's: wall clock, and CPU time of the calling thread (steadier on a shared
// machine; with one job all the work runs on the calling thread, on both sides).
#ifndef PLANO_BENCH_RATIO_REPORTER_HPP
#define PLANO_BENCH_RATIO_REPORTER_HPP

#include <benchmark/benchmark.h>

#include <cstdio>
#include <map>
#include <string>
#include <utility>
#include <vector>

class RatioReporter : public benchmark::ConsoleReporter {
public:
    // peer: the peer's label prefix and column title; width: of the case column; digits:
    // decimals of the times.
    RatioReporter(std::string peer, int width, int digits) : peer_(std::move(peer)), width_(width), digits_(digits) {}

    void ReportRuns(const std::vector<Run> &runs) override
    {
        ConsoleReporter::ReportRuns(runs);
        for (const Run &r : runs) {
            if (r.aggregate_name != "median") continue;
            const std::string &l = r.report_label;
            const std::size_t slash = l.find('/');
            if (slash == std::string::npos) continue;
            Times &t = (l.compare(0, slash, "plano") == 0 ? ours_ : peers_)[l.substr(slash + 1)];
            t.real = r.GetAdjustedRealTime();
            t.cpu = r.GetAdjustedCPUTime();
        }
    }
    void Finalize() override
    {
        ConsoleReporter::Finalize();
        std::printf("\n%-*s %9s %9s %7s %9s %9s %7s\n", width_, "median ms", "plano", peer_.c_str(), "ratio",
                    "plano cpu", peer_.c_str(), "ratio");
        for (const auto &[name, t] : ours_) {
            const auto peer = peers_.find(name);
            if (peer == peers_.end()) {
                std::printf("%-*s %9.*f %9s %7s %9.*f\n", width_, name.c_str(), digits_, t.real, "-", "-", digits_,
                            t.cpu);
                continue;
            }
            const Times &o = peer->second;
            std::printf("%-*s %9.*f %9.*f %7.2f %9.*f %9.*f %7.2f\n", width_, name.c_str(), digits_, t.real, digits_,
                        o.real, t.real / o.real, digits_, t.cpu, digits_, o.cpu, t.cpu / o.cpu);
        }
    }

private:
    struct Times {
        double real = 0, cpu = 0;
    };
    std::string peer_;
    int width_, digits_;
    std::map<std::string, Times> ours_, peers_;
};

#endif
