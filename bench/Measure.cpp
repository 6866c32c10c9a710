#include "Measure.h"

#include <algorithm>

namespace {

constexpr int kRepetitions = 11;
constexpr double kSeconds = 0.05;  // a repetition, at the least

// Keeps the repetitions' figures by their benchmark's name, which is its number.
class Collector : public benchmark::BenchmarkReporter {
 public:
  Collector(Count count, std::size_t bodies) : _count(count), _figures(bodies) {}

  bool ReportContext(const Context& /*context*/) override { return true; }
  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& run : runs) {
      if (run.run_type != Run::RT_Iteration) continue;
      const double total = _count == Count::wall ? run.real_accumulated_time : run.cpu_accumulated_time;
      _figures.at(std::stoul(run.run_name.function_name)).push_back(total / static_cast<double>(run.iterations));
    }
  }
  std::vector<double> medians() const {
    std::vector<double> all;
    for (const auto& figures : _figures) all.push_back(median(figures));
    return all;
  }

 private:
  Count _count;
  std::vector<std::vector<double>> _figures;
};

}  // namespace

std::vector<double> medians(Count count, const std::vector<Body>& bodies) {
  for (std::size_t index = 0; index < bodies.size(); ++index) {
    auto* const benchmark = benchmark::RegisterBenchmark(std::to_string(index).c_str(), bodies[index]);
    benchmark->Repetitions(kRepetitions)->MinTime(kSeconds);
    if (count == Count::wall) benchmark->UseRealTime();
  }
  Collector collector(count, bodies.size());
  benchmark::RunSpecifiedBenchmarks(&collector);
  benchmark::ClearRegisteredBenchmarks();
  return collector.medians();
}

void compare(Report& report, const std::string& metric, double goal, Count count, const Body& ours,
             const Body& reference) {
  const std::vector<double> both = medians(count, {ours, reference});
  report.add({metric, both[0], both[1], Unit::seconds, goal});
}

std::pair<double, double> medianTurns(int turns, const std::function<double()>& ours,
                                      const std::function<double()>& reference) {
  std::vector<double> ourFigures;
  std::vector<double> referenceFigures;
  for (int turn = 0; turn < turns; ++turn) {
    // Who goes first changes: what one leaves behind (memory just freed, say) would always meet the same other.
    if (turn % 2 == 0) ourFigures.push_back(ours());
    referenceFigures.push_back(reference());
    if (turn % 2 != 0) ourFigures.push_back(ours());
  }
  return {median(ourFigures), median(referenceFigures)};
}

double median(std::vector<double> figures) {
  const auto middle = figures.begin() + static_cast<long>(figures.size() / 2);
  std::nth_element(figures.begin(), middle, figures.end());
  return *middle;
}
