// Runs every benchmark with the usual console output, then prints one summary table
// that sets each library figure beside its baseline measured in the same run.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <map>
#include <string>
#include <vector>

#include "bench_registry.h"

namespace {

struct Figure {
  double seconds = 0;               // real time per iteration
  double bytesPerSec = 0;           // 0 when the benchmark reads no file
  double share = 0;                 // a paired benchmark's median share of its reference's speed
  double shareQ1 = 0, shareQ3 = 0;  // and the quartiles around it
  double pairs = 0;
  bool failed = false;
};

class SummaryReporter : public benchmark::ConsoleReporter {
 public:
  // Plain text: the output is meant to be kept in reports.
  SummaryReporter() : ConsoleReporter(OO_Tabular) {}

  void ReportRuns(const std::vector<Run>& runs) override {
    ConsoleReporter::ReportRuns(runs);
    for (const Run& run : runs) {
      if (run.run_type != Run::RT_Iteration) continue;
      Figure figure;
      figure.failed = run.error_occurred;
      if (run.iterations > 0)
        figure.seconds = run.real_accumulated_time / static_cast<double>(run.iterations);
      auto counter = [&](const char* name) {
        auto found = run.counters.find(name);
        return found == run.counters.end() ? 0.0 : found->second.value;
      };
      figure.bytesPerSec = counter("bytes_per_second");
      figure.share = counter("share");
      figure.shareQ1 = counter("share_q1");
      figure.shareQ3 = counter("share_q3");
      figure.pairs = counter("pairs");
      // "<scenario>/<variant>", followed by what the library appends ("/real_time").
      const std::string name = run.benchmark_name();
      const std::string::size_type slash = name.find('/');
      const std::string scenario = name.substr(0, slash);
      std::string variant;
      if (slash != std::string::npos) variant = name.substr(slash + 1, name.find('/', slash + 1) - slash - 1);
      if (figures_.find(scenario) == figures_.end()) order_.push_back(scenario);
      figures_[scenario].emplace_back(variant, figure);
    }
  }

  void Summary() const {
    std::printf("\n%-28s %-15s %12s %12s  %s\n", "scenario", "variant", "throughput", "time/call",
                "vs baseline");
    for (const std::string& scenario : order_) {
      const auto& variants = figures_.at(scenario);
      const Figure* baseline = Find(variants, "baseline");
      for (const auto& entry : variants) {
        const Figure& figure = entry.second;
        std::string ratio;
        if (entry.first == "library" && baseline != nullptr && !baseline->failed && figure.seconds > 0) {
          const double speedup = baseline->seconds / figure.seconds;
          ratio = speedup >= 1 ? Printf("%.1fx faster", speedup) : Printf("%.2fx slower", 1 / speedup);
        }
        if (figure.share > 0)
          ratio = Printf("%.2f of read_count_lines's speed (median of %.0f pairs, middle half %.2f to %.2f)",
                         figure.share, figure.pairs, figure.shareQ1, figure.shareQ3);
        std::printf("%-28s %-15s %12s %12s  %s\n", scenario.c_str(), entry.first.c_str(),
                    figure.failed ? "FAILED" : Rate(figure).c_str(), Time(figure.seconds).c_str(),
                    ratio.c_str());
      }
    }
    // The durable write's share of an upsert.
    auto upsert = figures_.find("upsert_into_999");
    if (upsert != figures_.end()) {
      const Figure* total = Find(upsert->second, "end_to_end");
      const Figure* save = Find(upsert->second, "save_json_only");
      if (total != nullptr && save != nullptr) {
        std::printf("%-28s %-15s %12s %12s\n", "upsert_into_999", "rest", "-",
                    Time(total->seconds - save->seconds).c_str());
      }
    }
  }

 private:
  using Variants = std::vector<std::pair<std::string, Figure>>;

  static const Figure* Find(const Variants& variants, const std::string& name) {
    for (const auto& entry : variants) {
      if (entry.first == name) return &entry.second;
    }
    return nullptr;
  }
  template <typename... Values>
  static std::string Printf(const char* fmt, Values... values) {
    char buffer[128];
    std::snprintf(buffer, sizeof(buffer), fmt, values...);
    return buffer;
  }
  static std::string Rate(const Figure& figure) {
    if (figure.bytesPerSec <= 0) return "-";
    return Printf("%.0f MB/s", figure.bytesPerSec / 1e6);  // 10^6 bytes
  }
  static std::string Time(double seconds) {
    if (seconds >= 1) return Printf("%.2f s", seconds);
    if (seconds >= 1e-3) return Printf("%.2f ms", seconds * 1e3);
    return Printf("%.1f us", seconds * 1e6);
  }

  std::vector<std::string> order_;
  // Variants in the order they ran: the library's figure before its baseline.
  std::map<std::string, Variants> figures_;
};

}  // namespace

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  bench::RegisterQueueBenchmarks();
  bench::RegisterConfigBenchmarks();
  SummaryReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  reporter.Summary();
  benchmark::Shutdown();
  return 0;
}
