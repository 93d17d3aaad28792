#include "tools/report/Timeline.h"

#include <cmath>
#include <cstdlib>

#include "Statistics/VXReportingUtility.h"
#include "propertylist/JsonWriter.h"

namespace vx::report {

namespace {

constexpr int kSessionTrack = 1;
constexpr int kMessagesTrack = 2;
constexpr int kOrientationTrack = 3;

// Events of one process, which stands for the session. Times are microseconds since it began.
class Trace {
 public:
  explicit Trace(double began) : began_(began) {}
  void name(const char* what, int track, std::string_view name) {
    begin("M", what, track);
    out_ += ",\"args\":{\"name\":";
    appendJsonString(out_, name);
    out_ += "}}";
  }
  void instant(int track, std::string_view name, double time, const std::string& details) {
    begin("i", name, track);
    out_ +=
        ",\"s\":\"t\",\"ts\":" + microseconds(time) + ",\"args\":{\"payload\":" + details + "}}";
  }
  void counter(std::string_view name, double time, const std::string& value) {
    begin("C", name, kMessagesTrack);
    out_ += ",\"ts\":" + microseconds(time) + ",\"args\":{\"value\":" + value + "}}";
  }
  void whole(std::string_view name, double end) {
    begin("X", name, kSessionTrack);
    out_ += ",\"ts\":0,\"dur\":" + microseconds(end) + ",\"args\":{}}";
  }
  std::string finish(const std::string& about) {
    return "{\"traceEvents\":[" + out_ + "\n],\"displayTimeUnit\":\"ms\",\"otherData\":" + about +
           "}\n";
  }
  std::string microseconds(double time) const {
    return std::to_string(std::llround((time - began_) * 1e6));
  }

 private:
  void begin(const char* phase, std::string_view name, int track) {
    out_ += std::string(out_.empty() ? "\n" : ",\n") + "{\"ph\":\"" + phase + "\",\"name\":";
    appendJsonString(out_, name);
    out_ += ",\"pid\":1,\"tid\":" + std::to_string(track);
  }

  const double began_;
  std::string out_;
};

void addMessages(StoreReader& store, int64_t session, Trace& trace) {
  Statement rows = store.query(
      "SELECT time, category, type, payload FROM session_messages WHERE relay_session = ?"
      " ORDER BY id");
  rows.bind(session);
  while (rows.row()) {
    const auto category = static_cast<uint16_t>(rows.integer(1));
    const auto type = static_cast<MessageType>(rows.integer(2));
    const std::string name = category == 0xFFFF ? "summary"
                                                : VXReportingCategoryName(category) + "." +
                                                      std::string(VXReportingMessageTypeName(type));
    trace.instant(kMessagesTrack, name, rows.real(0), rows.text(3));
  }
  store.check(rows);
}

void addCounters(StoreReader& store, int64_t session, Trace& trace) {
  Statement rows = store.query(
      "SELECT m.time, k.key, k.value FROM session_messages m, json_each(m.payload) k"
      " WHERE m.relay_session = ? AND m.category <> 65535 AND k.type IN ('integer', 'real')"
      " ORDER BY m.id");
  rows.bind(session);
  while (rows.row()) {
    if (std::isfinite(rows.real(2))) trace.counter(rows.text(1), rows.real(0), rows.text(2));
  }
  store.check(rows);
}

// Nobody relays a change of orientation: the summary says which there were, and after how long.
void addOrientation(StoreReader& store, int64_t session, double began, Trace& trace) {
  Statement rows = store.query(
      "SELECT v.key, v.text, t.number FROM summary_values v JOIN summary_values t"
      " ON t.id = v.id AND t.position = v.position AND t.key = v.key || '_time'"
      " WHERE v.relay_session = ?1 AND t.relay_session = ?1"
      " AND v.key IN ('device_orientation', 'ui_orientation') AND t.number IS NOT NULL"
      " ORDER BY t.number");
  rows.bind(session);
  while (rows.row()) {
    std::string text;
    appendJsonString(text, rows.text(1));
    trace.instant(kOrientationTrack, rows.text(0) + " " + rows.text(1), began + rows.real(2), text);
  }
  store.check(rows);
}

}  // namespace

std::string timelineOf(StoreReader& store, int64_t relaySession) {
  Statement facts = store.query(
      "SELECT started, ifnull(ended, (SELECT max(time) FROM relay_messages WHERE relay_session = "
      "?1)),"
      " session_id, application, service_type, started_utc, ended_how FROM sessions"
      " WHERE relay_session = ?1");
  facts.bind(relaySession);
  if (!facts.row()) throw Failure("the session is gone");
  const double began = facts.real(0);
  Trace trace(began);
  const std::string title = facts.text(4) + " session " + facts.text(2) + " of " + facts.text(3);
  trace.name("process_name", kSessionTrack, title);
  trace.name("thread_name", kSessionTrack, "session");
  trace.name("thread_name", kMessagesTrack, "messages");
  trace.name("thread_name", kOrientationTrack, "orientation");
  trace.whole(title, facts.isNull(1) ? began : facts.real(1));
  addMessages(store, relaySession, trace);
  addCounters(store, relaySession, trace);
  addOrientation(store, relaySession, began, trace);
  std::string about = "{\"relay_session\":" + std::to_string(relaySession) + ",\"application\":";
  appendJsonString(about, facts.text(3));
  about += ",\"started_utc\":\"" + facts.text(5) + "\",\"ended_how\":";
  appendJsonString(about, facts.text(6));
  return trace.finish(about + "}");
}

}  // namespace vx::report
