// The table of figures: each with its floor, its ratio and what it must reach; as text, as JSON,
// against an earlier run.
#pragma once

#include <optional>
#include <string>
#include <vector>

namespace vx::bench {

struct Metric {
  std::string name;
  double value = 0;
  std::string unit;
  std::optional<double> floor;  // in the same unit
  std::optional<double> ratio;  // value over floor, or what `reach` speaks of
  std::string reach;            // for people: "ratio <= 1.6 [1.25]"
  bool reached = true;
  std::string what;
};

double median(std::vector<double> values);
double percentile(std::vector<double> values, double p);  // p in 0..1

class Results {
 public:
  // `least`: the figure must be at least `limit`, otherwise at most. Judged on the ratio when there
  // is a floor.
  void add(Metric metric, double limit, double aim, bool atLeast);
  void note(std::string name, double value, std::string unit, std::string what);  // without a limit
  const std::vector<Metric>& metrics() const { return metrics_; }
  bool allReached() const;
  void print() const;
  void printComparison(const std::string& earlierFile) const;
  void writeJson(const std::string& path) const;

 private:
  std::vector<Metric> metrics_;
};

}  // namespace vx::bench
