// What the store holds, as text: its ledger, and rows for other programs.
#include <sqlite3.h>

#include <charconv>
#include <cmath>
#include <cstdio>
#include <string>

#include "platform/linux/store/StoreViews.h"
#include "propertylist/JsonWriter.h"
#include "tools/report/StoreReader.h"

namespace vx::report {

namespace {

constexpr std::size_t kWrittenAtOnce = 1 << 16;

int printLedger(const Words& words) {
  const Options options(words, {"--store=", "--since="});
  (void)options.words(0, 0);
  StoreReader store(options);
  Statement rows = store.query(
      "SELECT time_utc, cause, ifnull(table_name, '-'), rows, meaning, detail FROM losses"
      " WHERE time >= ? ORDER BY id");
  rows.bind(store.since());
  int64_t count = 0;
  while (rows.row()) {
    if (count++ == 0)
      std::printf("%-23s  %-20s %-16s %9s  %s\n", "UTC", "CAUSE", "TABLE", "ROWS", "MEANING");
    std::printf("%-23s  %-20s %-16s %9lld  %s (%s)\n", rows.text(0).c_str(),
                printable(rows.text(1)).c_str(), printable(rows.text(2)).c_str(),
                static_cast<long long>(rows.integer(3)), printable(rows.text(4)).c_str(),
                printable(rows.text(5)).c_str());
  }
  store.check(rows);
  if (count == 0) std::puts("The ledger is empty: nothing was removed, left out or lost.");
  return 0;
}

void appendNumber(std::string& out, const Statement& rows, int column) {
  char digits[32];
  const bool whole = rows.type(column) == SQLITE_INTEGER;
  const auto end = whole ? std::to_chars(digits, digits + sizeof digits, rows.integer(column))
                         : std::to_chars(digits, digits + sizeof digits, rows.real(column));
  out.append(digits, end.ptr);
}

// RFC 4180.
void appendCsvRow(std::string& out, const Statement& rows) {
  for (int i = 0; i < rows.columns(); ++i) {
    if (i > 0) out += ',';
    if (rows.type(i) == SQLITE_INTEGER || rows.type(i) == SQLITE_FLOAT) {
      appendNumber(out, rows, i);
      continue;
    }
    const std::string text = rows.text(i);
    if (text.find_first_of(",\"\r\n") == std::string::npos) {
      out += text;
      continue;
    }
    out += '"';
    for (const char c : text) out.append(c == '"' ? 2 : 1, c);
    out += '"';
  }
  out += "\r\n";
}

void appendJsonRow(std::string& out, const Statement& rows) {
  for (int i = 0; i < rows.columns(); ++i) {
    const std::string_view name = rows.name(i);
    out += i == 0 ? '{' : ',';
    appendJsonString(out, name);
    out += ':';
    if (rows.isNull(i))
      out += "null";
    else if (rows.type(i) == SQLITE_INTEGER ||
             (rows.type(i) == SQLITE_FLOAT && std::isfinite(rows.real(i))))
      appendNumber(out, rows, i);
    else if (name == "payload")
      out += rows.text(i);  // the view's are JSON
    else
      appendJsonString(out, rows.text(i));
  }
  out += "}\n";
}

const lnx::StoreView& viewOf(const std::string& name) {
  for (const lnx::StoreView& view : lnx::storeViews()) {
    if (name == view.name) return view;
  }
  throw UsageError();
}

int exportRows(const Words& words) {
  const Options options(words, {"--store=", "--since=", "--name=", "--csv", "--jsonl"});
  if (options.has("--csv") == options.has("--jsonl")) throw UsageError();
  const Words& named = options.words(0, 1);
  const std::string view = viewOf(named.empty() ? "analytics_events" : named[0]).name;
  if (options.has("--name") && view != "analytics_events") throw UsageError();
  StoreReader store(options);
  const std::string time = view == "sessions" ? "started" : "time";
  Statement rows = store.query("SELECT * FROM " + view + " WHERE " + time + " >= ?" +
                               (options.has("--name") ? " AND name GLOB ?" : "") + " ORDER BY " +
                               (view == "sessions" ? "relay_session" : "id"));
  const std::string name = options.value("--name").value_or("");
  rows.bind(store.since());
  if (options.has("--name")) rows.bind(std::string_view(name));
  std::string out;
  const bool csv = options.has("--csv");
  for (int i = 0; csv && i < rows.columns(); ++i)
    out += std::string(i > 0 ? "," : "") + rows.name(i);
  if (csv) out += "\r\n";
  while (rows.row()) {
    (csv ? appendCsvRow : appendJsonRow)(out, rows);
    if (out.size() < kWrittenAtOnce) continue;
    if (std::fwrite(out.data(), 1, out.size(), stdout) != out.size()) break;  // main says so
    out.clear();
  }
  if (std::ferror(stdout) == 0) store.check(rows);
  std::fwrite(out.data(), 1, out.size(), stdout);
  return 0;
}

constexpr Command kCommands[] = {
    {"ledger", "[--since TIME] [--store FILE]", "what is not in the store (any more), and why",
     "Prints the rows of the ledger, oldest first.\n\n" VX_SINCE_HELP VX_STORE_HELP, printLedger},
    {"export", "--csv|--jsonl [--since TIME] [--name PATTERN] [--store FILE] [VIEW]",
     "rows for other programs",
     "Prints the rows of a view, by default of analytics_events: as CSV with a line of names, or\n"
     "as one JSON object a line. The views and their columns: docs/store.md.\n\n"
     "  VIEW           session_messages, analytics_events, sessions, summary_values,\n"
     "                 driver_statistics, client_uptimes, haptics_runs or losses\n"
     "  --name PATTERN of analytics_events those of such a name; * stands for "
     "anything\n" VX_SINCE_HELP VX_STORE_HELP,
     exportRows},
};

}  // namespace

std::span<const Command> storeCommands() { return kCommands; }

}  // namespace vx::report
