#include "benchmarks/Results.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include "propertylist/JsonWriter.h"

namespace vx::bench {

double median(std::vector<double> values) { return percentile(std::move(values), 0.5); }

double percentile(std::vector<double> values, double p) {
  if (values.empty()) return 0;
  const auto at = static_cast<std::size_t>(p * static_cast<double>(values.size() - 1) + 0.5);
  std::nth_element(values.begin(), values.begin() + static_cast<std::ptrdiff_t>(at), values.end());
  return values[at];
}

namespace {

std::string number(double value) {
  char text[32];
  const double size = std::fabs(value);
  if (size >= 1000)
    std::snprintf(text, sizeof text, "%.0f", value);
  else if (size >= 10)
    std::snprintf(text, sizeof text, "%.1f", value);
  else
    std::snprintf(text, sizeof text, "%.3f", value);
  return text;
}

std::string plain(double value) {
  char text[32];
  std::snprintf(text, sizeof text, "%g", value);
  return text;
}

// The value behind `"key": ` in the object that names the metric; enough for the files writeJson
// makes.
std::optional<double> earlierValue(const std::string& json, const std::string& name,
                                   const std::string& key) {
  const std::size_t at = json.find("\"name\": \"" + name + "\"");
  if (at == std::string::npos) return std::nullopt;
  const std::size_t end = json.find('}', at);
  const std::size_t value = json.find("\"" + key + "\": ", at);
  if (value == std::string::npos || value > end) return std::nullopt;
  const char* text = json.c_str() + value + key.size() + 4;
  if (*text == 'n') return std::nullopt;
  return std::strtod(text, nullptr);
}

}  // namespace

void Results::add(Metric metric, double limit, double aim, bool atLeast) {
  if (metric.floor && !metric.ratio) metric.ratio = metric.value / *metric.floor;
  const double judged = metric.ratio.value_or(metric.value);
  metric.reached = atLeast ? judged >= limit : judged <= limit;
  metric.reach = std::string(metric.ratio ? "ratio " : "") + (atLeast ? ">= " : "<= ") +
                 plain(limit) + " [" + plain(aim) + "]";
  metrics_.push_back(std::move(metric));
}

void Results::note(std::string name, double value, std::string unit, std::string what) {
  Metric metric;
  metric.name = std::move(name);
  metric.value = value;
  metric.unit = std::move(unit);
  metric.what = std::move(what);
  metrics_.push_back(std::move(metric));
}

bool Results::allReached() const {
  return std::all_of(metrics_.begin(), metrics_.end(), [](const Metric& m) { return m.reached; });
}

void Results::print() const {
  std::printf("\n%-30s %12s %-8s %12s %8s  %-22s %s\n", "metric", "value", "unit", "floor", "ratio",
              "reach [aim]", "");
  for (const Metric& m : metrics_) {
    std::printf("%-30s %12s %-8s %12s %8s  %-22s %s\n", m.name.c_str(), number(m.value).c_str(),
                m.unit.c_str(), m.floor ? number(*m.floor).c_str() : "-",
                m.ratio ? number(*m.ratio).c_str() : "-", m.reach.c_str(),
                m.reach.empty() ? "" : (m.reached ? "ok" : "SHORT"));
  }
}

void Results::printComparison(const std::string& earlierFile) const {
  std::ifstream file(earlierFile);
  if (!file) throw std::runtime_error("cannot read " + earlierFile);
  std::stringstream content;
  content << file.rdbuf();
  const std::string json = content.str();
  std::printf("\nAgainst %s (ratios where there is a floor, values otherwise):\n",
              earlierFile.c_str());
  for (const Metric& m : metrics_) {
    const std::string key = m.ratio ? "ratio" : "value";
    const std::optional<double> before = earlierValue(json, m.name, key);
    const double now = m.ratio.value_or(m.value);
    if (!before)
      std::printf("%-30s %10s -> %10s\n", m.name.c_str(), "-", number(now).c_str());
    else
      std::printf("%-30s %10s -> %10s  %+.1f %%\n", m.name.c_str(), number(*before).c_str(),
                  number(now).c_str(), *before != 0 ? (now / *before - 1) * 100 : 0.0);
  }
}

void Results::writeJson(const std::string& path) const {
  std::string out = "{\"metrics\": [\n";
  auto value = [](std::optional<double> v) {
    if (!v || !std::isfinite(*v)) return std::string("null");
    char text[32];
    std::snprintf(text, sizeof text, "%.9g", *v);
    return std::string(text);
  };
  for (const Metric& m : metrics_) {
    out += "  {\"name\": ";
    appendJsonString(out, m.name);
    out += ", \"value\": " + value(m.value) + ", \"unit\": ";
    appendJsonString(out, m.unit);
    out += ", \"floor\": " + value(m.floor) + ", \"ratio\": " + value(m.ratio) + ", \"reach\": ";
    appendJsonString(out, m.reach);
    out += std::string(", \"reached\": ") + (m.reached ? "true" : "false") + ", \"what\": ";
    appendJsonString(out, m.what);
    out += &m == &metrics_.back() ? "}\n" : "},\n";
  }
  out += "]}\n";
  std::ofstream file(path);
  file << out;
  if (!file.flush()) throw std::runtime_error("cannot write " + path);
}

}  // namespace vx::bench
