#include "tools/report/AccountText.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <ctime>
#include <string_view>

#include "tools/report/Command.h"

namespace vx::report {

namespace {

// What only grows: whole dictionaries, and single figures.
constexpr std::array<std::string_view, 12> kCounters = {"service.messages.",
                                                        "endpoint.",
                                                        "inspect.",
                                                        "left_out.",
                                                        "store.ledger_rows.",
                                                        "store.rows_committed",
                                                        "store.commits",
                                                        "store.write_failures",
                                                        "durability.snapshots",
                                                        "durability.journal_entries",
                                                        "durability.unrecorded",
                                                        "durability.journal_full"};

bool isCounter(const std::string& name) {
  return std::ranges::any_of(kCounters, [&](std::string_view counter) {
    return counter.ends_with('.') ? name.starts_with(counter) : name == counter;
  });
}

void collect(const std::string& prefix, const DictionaryView& dictionary,
             std::vector<Figure>& out) {
  for (const auto& [key, value] : dictionary) {
    const std::string name = prefix + std::string(key);
    if (value.isDictionary())
      collect(name + ".", value.asDictionary(), out);
    else if (value.isNumber() || value.kind() == ValueKind::Boolean ||
             value.kind() == ValueKind::Date)
      out.push_back({name, value.asDouble(), isCounter(name)});
  }
}

std::string format(const char* format, double value) {
  char text[64];
  std::snprintf(text, sizeof text, format, value);
  return text;
}

double numberIn(const Payload& account, std::string_view key) {
  const auto value = account.find(key);
  return value ? value->asDouble() : 0;
}

std::string durationText(double seconds) {
  const auto whole = static_cast<int64_t>(seconds);
  char text[64];
  std::snprintf(text, sizeof text, "%lldd %02lld:%02lld:%02lld",
                static_cast<long long>(whole / 86400), static_cast<long long>(whole / 3600 % 24),
                static_cast<long long>(whole / 60 % 60), static_cast<long long>(whole % 60));
  return text;
}

std::string valueText(const std::string& name, const Value& value) {
  if (value.kind() == ValueKind::Date) return utcText(value.asDouble());
  if (value.kind() == ValueKind::Boolean) return value.asBool() ? "yes" : "no";
  if (value.isNumber() && name.ends_with("bytes")) return bytesText(value.asDouble());
  return printable(value.text());
}

// "store.bytes" and a value a line.
void describe(const std::string& prefix, const DictionaryView& dictionary, double seconds,
              std::vector<std::vector<std::string>>& rows) {
  for (const auto& [key, value] : dictionary) {
    const std::string name = prefix + std::string(key);
    if (value.isDictionary()) {
      describe(name + ".", value.asDictionary(), seconds, rows);
      continue;
    }
    const bool counts = isCounter(name);
    if (counts && value.asDouble() == 0) continue;
    rows.push_back({"  " + printable(name.substr(name.find('.') + 1)), valueText(name, value),
                    counts && seconds > 0 ? format("%.3f/s", value.asDouble() / seconds) : ""});
  }
}

}  // namespace

std::string utcText(double secondsSince1970, bool withMilliseconds) {
  const auto whole = static_cast<std::time_t>(std::floor(secondsSince1970));
  std::tm parts{};
  char text[64];
  if (gmtime_r(&whole, &parts) == nullptr ||
      std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S", &parts) == 0)
    return format("%.3f", secondsSince1970);
  if (!withMilliseconds) return text;
  const double fraction = secondsSince1970 - static_cast<double>(whole);
  return text + format("%.3f", std::min(fraction, 0.999)).substr(1);
}

std::string bytesText(double bytes) {
  static constexpr const char* kUnits[] = {"B", "KiB", "MiB", "GiB", "TiB"};
  std::size_t unit = 0;
  while (bytes >= 1024 && unit + 1 < std::size(kUnits)) {
    bytes /= 1024;
    ++unit;
  }
  return format(unit == 0 ? "%.0f " : "%.1f ", bytes) + kUnits[unit];
}

std::string tableText(const std::vector<std::vector<std::string>>& rows) {
  std::vector<std::size_t> widths;
  for (const auto& row : rows) {
    widths.resize(std::max(widths.size(), row.size()));
    for (std::size_t i = 0; i < row.size(); ++i) widths[i] = std::max(widths[i], row[i].size());
  }
  std::string text;
  for (const auto& row : rows) {
    std::string line;
    for (std::size_t i = 0; i < row.size(); ++i)
      line += row[i] + std::string(widths[i] + 2 - row[i].size(), ' ');
    line.erase(line.find_last_not_of(' ') + 1);
    text += line + "\n";
  }
  return text;
}

std::vector<Figure> figuresOf(const Payload& account) {
  std::vector<Figure> figures;
  collect("", account.view(), figures);
  return figures;
}

std::string statusText(const Payload& account) {
  const double seconds = numberIn(account, "uptime_seconds");
  const auto version = account.find("version");
  std::string text = "vxreporting " + (version ? printable(version->asString()) : "") + ", pid " +
                     std::to_string(static_cast<int64_t>(numberIn(account, "pid"))) + ", up " +
                     durationText(seconds) + ", since " + utcText(numberIn(account, "started")) +
                     " UTC\n";
  for (const auto& [key, value] : account) {
    if (!value.isDictionary() || key == "configuration") continue;
    std::vector<std::vector<std::string>> rows;
    describe(std::string(key) + ".", value.asDictionary(), seconds, rows);
    text += "\n" + printable(key) + (rows.empty() ? ": nothing\n" : "\n") + tableText(rows);
  }
  return text;
}

std::string metricsText(const Payload& account) {
  std::string text = "# TYPE vxreporting_info gauge\nvxreporting_info{version=\"";
  const auto version = account.find("version");
  for (const char c : version ? version->asString() : std::string_view()) {
    if (c != '"' && c != '\\' && c != '\n') text += c;
  }
  text += "\"} 1\n";
  for (const Figure& figure : figuresOf(account)) {
    std::string name = "vxreporting_" + figure.name + (figure.isCounter ? "_total" : "");
    for (char& c : name) {
      const bool fits = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9');
      if (!fits) c = '_';
    }
    text += "# TYPE " + name + (figure.isCounter ? " counter\n" : " gauge\n") + name + " " +
            format("%.17g", figure.value) + "\n";
  }
  return text;
}

std::string ratesText(const Payload& before, const Payload& now) {
  const double seconds = numberIn(now, "uptime_seconds") - numberIn(before, "uptime_seconds");
  std::vector<std::vector<std::string>> rows;
  const std::vector<Figure> earlier = figuresOf(before);
  for (const Figure& figure : figuresOf(now)) {
    const auto then = std::ranges::find(earlier, figure.name, &Figure::name);
    const double moved = figure.value - (then != earlier.end() ? then->value : 0);
    if (figure.isCounter && moved > 0 && seconds > 0)
      rows.push_back({"  " + printable(figure.name), format("%.1f/s", moved / seconds)});
  }
  return rows.empty() ? "  nothing moves\n" : tableText(rows);
}

}  // namespace vx::report
