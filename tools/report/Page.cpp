#include "tools/report/Page.h"

#include <sqlite3.h>
#include <sys/random.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <ctime>
#include <map>
#include <set>
#include <utility>
#include <vector>

#include "Statistics/VXReportingUtility.h"
#include "tools/report/PageParts.h"
#include "tools/report/PageText.h"

namespace vx::report {

namespace {

constexpr int64_t kMostSessions = 5000;
constexpr std::size_t kMostMessages = 100000;
constexpr std::size_t kMostMessageBytes = std::size_t{24} << 20;
constexpr int64_t kMostRows = 2000;  // of each other table
constexpr std::size_t kLongPayload = 2000;
constexpr int64_t kMostKeys = 60;  // of a long payload
constexpr int kMostBuckets = 120;
constexpr int kSteps[] = {1,     2,     5,      10,     15,      30,     60,    120,
                          300,   600,   900,    1800,   3600,    7200,   10800, 21600,
                          43200, 86400, 172800, 604800, 1209600, 2592000};

class PageData {
 public:
  PageData(StoreReader& store, const PageChoice& choice) : store_(store), choice_(choice) {}

  // The value of the element "data", and elements for the messages of each session.
  std::string make() {
    choose();
    out_ = "{\"made\":" + std::to_string(std::time(nullptr)) + ",\"store\":";
    appendPageString(out_, store_.path());
    out_ += ",\"choice\":";
    appendPageString(out_, choice_.asGiven);
    addTotals();
    addOverTime();
    addMessages();
    addTable("sessions",
             "SELECT relay_session, CAST(session_id AS TEXT), application, service_type, uid, "
             "started, ended,"
             " ended_how, messages, bytes FROM temp.chosen WHERE NOT alone"
             " ORDER BY started DESC, relay_session DESC LIMIT " +
                 std::to_string(kMostSessions));
    addTable(
        "drivers",
        "SELECT d.relay_session, d.counter, d.growth FROM driver_statistics d JOIN temp.chosen c"
        " ON c.relay_session = d.relay_session ORDER BY d.id DESC LIMIT 20000");
    addTable("orientation",
             "SELECT v.relay_session, v.key, v.text, t.number FROM summary_values v"
             " JOIN summary_values t ON t.id = v.id AND t.key = v.key || '_time' AND t.position = "
             "v.position"
             " JOIN temp.chosen c ON c.relay_session = v.relay_session"
             " WHERE v.key IN ('device_orientation', 'ui_orientation') AND t.number IS NOT NULL"
             " ORDER BY v.id, v.key, v.position LIMIT 20000");
    addHaptics();
    addTable("uptimes", "SELECT time, process, seconds FROM client_uptimes WHERE time >= " +
                            since() + " ORDER BY seconds DESC LIMIT " + std::to_string(kMostRows));
    addTable("losses",
             "SELECT time, cause, table_name, rows, meaning, detail FROM losses WHERE time >= " +
                 since() + " ORDER BY id DESC LIMIT " + std::to_string(kMostRows));
    out_ += '}';
    return std::move(out_);
  }
  std::string messageElements() const {
    std::string elements;
    for (const auto& [session, rows] : messages_) {
      elements += "<script type=\"application/json\" id=\"m" + std::to_string(session) + "\">[";
      for (auto row = rows.rbegin(); row != rows.rend(); ++row)
        elements.append(row == rows.rbegin() ? "" : ",\n").append(*row);
      elements += "]</script>\n";
    }
    return elements;
  }

 private:
  std::string since() const { return std::to_string(choice_.since); }

  // What the page is about, in a table of its own: the choice is made once.
  void choose() {
    run("CREATE TEMP TABLE chosen(relay_session INTEGER PRIMARY KEY, session_id INTEGER, "
        "application,"
        " service_type, uid, started, ended, ended_how, messages, bytes, alone)");
    Statement sessions = store_.query(
        "INSERT INTO temp.chosen SELECT relay_session, session_id, application, service_type, uid, "
        "started, ended,"
        " ended_how, messages, bytes, 0 FROM sessions WHERE (?1 IS NULL OR application = ?1)"
        " AND (?2 IS NULL OR relay_session = ?2) AND (started >= ?3 OR ended >= ?3"
        " OR relay_session IN (SELECT relay_session FROM relay_messages WHERE time >= ?3))");
    bindChoice(sessions);
    finish(sessions);
    Statement alone = store_.query(
        "INSERT INTO temp.chosen SELECT s.id, -1, 'Unknown', s.service_name, s.uid, s.time, NULL, "
        "NULL, 1, 0, 1"
        " FROM relay_sessions s WHERE s.batch_event IS NULL AND (?1 IS NULL OR ?1 = 'Unknown')"
        " AND ?2 IS NULL AND s.time >= ?3");
    bindChoice(alone);
    finish(alone);
  }
  void bindChoice(Statement& statement) {
    if (choice_.application)
      statement.bind(std::string_view(*choice_.application));
    else
      statement.bindNull();
    statement.bind(choice_.session).bind(choice_.since);
  }
  void run(const std::string& sql) {
    Statement statement = store_.query(sql);
    finish(statement);
  }
  void finish(Statement& statement) {
    while (statement.row()) {
    }
    store_.check(statement);
  }

  // Of the messages that are shown or counted.
  static std::string fromMessages() {
    return " FROM relay_messages m JOIN temp.chosen c ON c.relay_session = m.relay_session";
  }

  void addTotals() {
    Statement row = store_.query(
        "SELECT count(*), count(DISTINCT application), ifnull(sum(ended IS NULL), 0) FROM "
        "temp.chosen WHERE NOT alone");
    row.row();
    out_ += ",\"sessionCount\":" + row.text(0) + ",\"applicationCount\":" + row.text(1) +
            ",\"openCount\":" + row.text(2);
    Statement messages =
        store_.query("SELECT count(*), ifnull(sum(length(CAST(m.payload AS BLOB))), 0)" +
                     fromMessages() + " WHERE m.time >= " + since());
    messages.row();
    out_ += ",\"messageCount\":" + messages.text(0) + ",\"messageBytes\":" + messages.text(1);
    Statement losses =
        store_.query("SELECT ifnull(sum(rows), 0), count(*) FROM losses WHERE time >= " + since());
    losses.row();
    out_ += ",\"lostRows\":" + losses.text(0) + ",\"lossCount\":" + losses.text(1);
  }

  void addOverTime() {
    Statement range = store_.query("SELECT min(m.time), max(m.time)" + fromMessages() +
                                   " WHERE m.time >= " + since());
    range.row();
    if (range.isNull(0)) {
      out_ += ",\"over\":null";
      return;
    }
    const auto* step = std::ranges::find_if(kSteps, [&](int seconds) {
      return (range.real(1) - range.real(0)) / seconds < kMostBuckets - 1;
    });
    if (step == std::end(kSteps)) --step;
    const double first = std::floor(range.real(0) / *step) * *step;
    out_ += ",\"over\":{\"first\":" + std::to_string(static_cast<int64_t>(first)) +
            ",\"step\":" + std::to_string(*step) + ",\"counts\":";
    appendRows("SELECT CAST((m.time - " + std::to_string(first) + ") / " + std::to_string(*step) +
               " AS INTEGER), c.service_type, count(*)" + fromMessages() +
               " WHERE m.time >= " + since() + " GROUP BY 1, 2 ORDER BY 1, 2");
    out_ += '}';
  }

  // The newest, until there are enough. Each as [milliseconds since 1970, kind, payload].
  void addMessages() {
    Statement rows = store_.query(
        "SELECT m.relay_session, m.time, m.category, m.type, CASE WHEN json_valid(m.payload) THEN "
        "m.payload"
        " ELSE json_object('malformed', CAST(m.payload AS TEXT)) END" +
        fromMessages() + " WHERE NOT c.alone AND m.time >= " + since() +
        " AND NOT (m.category = 65535 AND m.type = 65535) ORDER BY m.id DESC LIMIT " +
        std::to_string(kMostMessages));
    std::map<std::pair<int64_t, int64_t>, std::size_t> kinds;
    std::size_t bytes = 0;
    std::size_t count = 0;
    while (bytes < kMostMessageBytes && rows.row()) {
      const std::size_t kind =
          kinds.try_emplace({rows.integer(2), rows.integer(3)}, kinds.size()).first->second;
      std::string row = "[" + std::to_string(std::llround(rows.real(1) * 1000)) + "," +
                        std::to_string(kind) + ",";
      appendPayload(row, rows.text(4));
      bytes += row.size() + 1;
      ++count;
      messages_[rows.integer(0)].push_back(std::move(row) + "]");
    }
    if (bytes < kMostMessageBytes) store_.check(rows);
    out_ += ",\"shownMessages\":" + std::to_string(count) + ",\"kinds\":[";
    std::vector<std::string> names(kinds.size());
    for (const auto& [codes, kind] : kinds) {
      names[kind] = VXReportingCategoryName(static_cast<uint16_t>(codes.first)) + " " +
                    std::string(VXReportingMessageTypeName(static_cast<MessageType>(codes.second)));
    }
    for (std::size_t i = 0; i < names.size(); ++i) {
      if (i > 0) out_ += ',';
      appendPageString(out_, names[i]);
    }
    out_ += ']';
  }

  // A long one is shortened: its first entries, and the beginning of each.
  void appendPayload(std::string& out, const std::string& payload) {
    if (payload.size() <= kLongPayload) return appendPageJson(out, payload);
    Statement entries = store_.query("SELECT key, value FROM json_each(?)");
    entries.bind(std::string_view(payload));
    std::set<std::string> keys;  // shortened, two may be one
    out += '{';
    int64_t left = kMostKeys;
    while (left > 0 && entries.row()) {
      std::string key;
      appendPageString(key, entries.text(0), 100);
      if (!keys.insert(key).second) continue;
      if (left-- < kMostKeys) out += ',';
      out += key + ":";
      if (entries.type(1) == SQLITE_TEXT)
        appendPageString(out, entries.text(1));
      else
        appendPageJson(out, entries.isNull(1) ? "null" : entries.text(1));
    }
    out += '}';
  }

  void addHaptics() {
    std::string where = " WHERE time >= " + since();
    std::string bound;
    if (choice_.session) {
      where +=
          " AND EXISTS (SELECT 1 FROM temp.chosen c WHERE c.application = h.application"
          " AND h.time BETWEEN c.started AND ifnull(c.ended, 1e18))";
    } else if (choice_.application) {
      where += " AND h.application IN (SELECT application FROM temp.chosen)";
    }
    addTable(
        "haptics",
        "SELECT ifnull(h.application, 'Unknown'), sum(h.engine_on), count(*) FROM haptics_runs h" +
            where + " GROUP BY 1 ORDER BY 2 DESC LIMIT " + std::to_string(kMostRows));
  }

  void addTable(const std::string& name, const std::string& sql) {
    out_ += ",\n\"" + name + "\":";
    appendRows(sql);
  }
  void appendRows(const std::string& sql) {
    Statement rows = store_.query(sql);
    out_ += '[';
    for (bool first = true; rows.row(); first = false) {
      out_ += first ? "[" : ",[";
      for (int i = 0; i < rows.columns(); ++i) {
        if (i > 0) out_ += ',';
        if (rows.isNull(i))
          out_ += "null";
        else if (rows.type(i) == SQLITE_INTEGER ||
                 (rows.type(i) == SQLITE_FLOAT && std::isfinite(rows.real(i))))
          appendPageJson(out_, rows.text(i));
        else
          appendPageString(out_, rows.text(i));
      }
      out_ += ']';
    }
    out_ += ']';
    store_.check(rows);
  }

  StoreReader& store_;
  const PageChoice& choice_;
  std::string out_;
  std::map<int64_t, std::vector<std::string>> messages_;  // by session, newest first
};

// What no client can have written: the page's own scripts bear it, and nothing else may run.
std::string randomWord() {
  std::array<unsigned char, 16> bytes{};
  if (getrandom(bytes.data(), bytes.size(), 0) != static_cast<ssize_t>(bytes.size()))
    throw Failure("the system has no random numbers");
  std::string word;
  for (const unsigned char byte : bytes) {
    word += "0123456789abcdef"[byte >> 4];
    word += "0123456789abcdef"[byte & 15];
  }
  return word;
}

}  // namespace

std::string pageOf(StoreReader& store, const PageChoice& choice) {
  const PageParts parts = pageParts();
  PageData data(store, choice);
  const std::string json = data.make();
  const std::string messages = data.messageElements();
  const std::string nonce = randomWord();
  const std::pair<std::string_view, std::string_view> places[] = {
      {"NONCE", nonce},         {"STYLE", parts.style},           {"SCRIPT", parts.script},
      {"CHARTS", parts.charts}, {"LICENCE", parts.chartsLicence}, {"DATA", json},
      {"MESSAGES", messages}};
  std::string page;
  page.reserve(json.size() + messages.size() + parts.charts.size() + (std::size_t{1} << 17));
  std::string_view rest = parts.html;
  for (std::size_t at = rest.find("@@"); at != std::string_view::npos; at = rest.find("@@")) {
    const std::size_t end = rest.find("@@", at + 2);
    const std::string_view name = rest.substr(at + 2, end - at - 2);
    page += rest.substr(0, at);
    page += std::ranges::find(places, name, &std::pair<std::string_view, std::string_view>::first)
                ->second;
    rest.remove_prefix(end + 2);
  }
  return page.append(rest);
}

}  // namespace vx::report
