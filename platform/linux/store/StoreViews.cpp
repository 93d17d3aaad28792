#include "platform/linux/store/StoreViews.h"

namespace vx::lnx {

namespace {

// The column's text if it is JSON. What is not must not fail the whole query of somebody who wants
// one key of it: it becomes the only value of a dictionary.
std::string json(const std::string& column) {
  return "CASE WHEN json_valid(" + column + ") THEN " + column +
         " ELSE json_object('malformed', CAST(" + column + " AS TEXT)) END";
}

// Of a column that may be no JSON; NULL then.
std::string entry(const std::string& column, const std::string& key) {
  return "CASE WHEN json_valid(" + column + ") THEN json_extract(" + column + ", '$." + key +
         "') END";
}

// Seconds since 1970 as text that sorts, and compares with date('now') and datetime('now').
std::string utc(const std::string& seconds) {
  return "strftime('%Y-%m-%d %H:%M:%f', " + seconds + ", 'unixepoch')";
}

// A session's own columns, of relay_sessions as s. An event says "Unknown" where there is no
// application, so these do.
const std::string kOfSession =
    "s.session_id, ifnull(" + entry("s.user_info", "HostApplicationDisplayID") +
    ", 'Unknown') AS application,"
    " CASE WHEN s.service_name LIKE '%\\_session' ESCAPE '\\'"
    " THEN substr(s.service_name, 1, length(s.service_name) - 8) ELSE s.service_name END"
    " AS service_type";

const std::string kSessionMessages =
    "  SELECT m.id, m.time, " + utc("m.time") + " AS time_utc, m.relay_session, " + kOfSession +
    ",\n         m.category, m.type, " + json("m.payload") +
    " AS payload\n"
    "  FROM relay_messages m JOIN relay_sessions s ON s.id = m.relay_session";

// An event says what a relay message says and a little more: it lies in that message's row, which
// keeps what its text has after the message's (`,"k":1}`). Otherwise it is an entry with its whole
// text; one of the second schema may name a message.
const std::string kAnalyticsEvents =
    "  SELECT id, time, " + utc("time") + " AS time_utc, name, " + json("payload") +
    " AS payload, relay_session FROM (\n"
    R"sql(    SELECT m.id, m.time + m.event_microseconds / 1e6 AS time,
           (SELECT n.name FROM event_names n WHERE n.id = m.event_name) AS name,
           substr(m.payload, 1, length(m.payload) - 1) || m.event_tail AS payload, m.relay_session
    FROM relay_messages m WHERE m.event_name IS NOT NULL
    UNION ALL
    SELECT e.id, e.time, (SELECT n.name FROM event_names n WHERE n.id = e.name) AS name,
           CASE WHEN e.message IS NULL THEN e.payload
                ELSE (SELECT substr(m.payload, 1, length(m.payload) - 1) FROM relay_messages m WHERE m.id = e.message)
                     || e.payload END AS payload, e.relay_session
    FROM analytics_entries e))sql";

// A standalone message has a row in relay_sessions without being a session.
const std::string kSessions = "  SELECT s.id AS relay_session, " + kOfSession +
                              ", s.client_name AS client, s.uid,\n         s.time AS started, " +
                              utc("s.time") + " AS started_utc, s.ended_at AS ended, " +
                              utc("s.ended_at") +
                              R"sql( AS ended_utc,
         s.ended_at - s.time AS seconds, s.ended_how, ifnull(m.messages, 0) AS messages, ifnull(m.bytes, 0) AS bytes
  FROM relay_sessions s LEFT JOIN
    (SELECT relay_session, count(*) AS messages, sum(length(CAST(payload AS BLOB))) AS bytes
     FROM relay_messages GROUP BY relay_session) m ON m.relay_session = s.id
  WHERE s.batch_event IS NOT NULL)sql";

// The summary joins the values of each key with commas. Quoted as JSON, those become the commas of
// an array. That key is in every summary, and first: a client may send the summary's category too.
const std::string kSummaryValues =
    "  SELECT m.id, m.time, " + utc("m.time") +
    R"sql( AS time_utc, m.relay_session, s.session_id, k.key, p.key + 1 AS position, p.value AS text,
         CASE WHEN json_valid(p.value) THEN CASE WHEN json_type(p.value) IN ('integer', 'real')
              THEN CAST(p.value AS REAL) END END AS number
  FROM relay_messages m JOIN relay_sessions s ON s.id = m.relay_session,
       json_each(CASE WHEN json_valid(m.payload) THEN m.payload ELSE '{}' END) k,
       json_each('[' || replace(json_quote(k.value), ',', '","') || ']') p
  WHERE m.category = 65535 AND m.type = 65535 AND k.type = 'text'
        AND m.payload LIKE '{"VX_Session_Summary_Event":"%')sql";

// One row per counter that moved. The same category may come from a client, under the name of
// another event: its lower 16 bits are all that the relay is told.
const std::string kDriverStatistics = "  SELECT m.id, m.time, " + utc("m.time") +
                                      " AS time_utc, m.relay_session, " + kOfSession +
                                      R"sql(,
         k.key AS counter, k.value AS growth
  FROM relay_messages m JOIN relay_sessions s ON s.id = m.relay_session,
       json_each(CASE WHEN json_valid(m.payload) THEN m.payload ELSE '{}' END) k
  WHERE m.category = 9 AND m.type = 0 AND k.type = 'integer' AND (m.event_name IS NULL
        OR m.event_name = (SELECT id FROM event_names WHERE name = 'com.quorvel.sonik.ChannelReporting.Generic')))sql";

const std::string kClientUptimes =
    "  SELECT id, time, time_utc, json_extract(payload, '$.processName') AS process,\n"
    "         json_extract(payload, '$.seconds') AS seconds\n"
    "  FROM analytics_events WHERE name = 'com.quorvel.sonik.vxreportingclientuptime'";

const std::string kHapticsRuns = "  SELECT id, time, " + utc("time") + " AS time_utc, " +
                                 entry("record", "ApplicationName") + " AS application, " +
                                 entry("record", "EngineOnDuration") +
                                 " AS engine_on\n"
                                 "  FROM power_records WHERE name = 'Lumo_Haptics'";

// The ledger with what each of its words means.
const std::string kLosses = "  SELECT id, time, " + utc("time") +
                            R"sql( AS time_utc, event AS cause, table_name, rows, detail,
         CASE event
           WHEN 'removed_for_age' THEN 'older than the configuration keeps'
           WHEN 'removed_for_size' THEN 'the oldest, to keep the file within its size'
           WHEN 'erased' THEN 'a person asked to have it removed'
           WHEN 'left_out' THEN 'one payload is too large for a row'
           WHEN 'moved_aside' THEN 'the file was damaged; what could be read was taken over'
           WHEN 'beside_newer' THEN 'the file belongs to a newer version; another one is used beside it'
           WHEN 'store_lost' THEN 'the file was deleted, replaced or cut short under the service'
           WHEN 'log_lost' THEN 'the log of the file was deleted under the service; nothing is missing'
           WHEN 'log_held' THEN 'a reader kept the log from being written back; nothing is missing'
           WHEN 'journal_damaged' THEN 'a file of recorded calls cannot be read in full'
           WHEN 'journal_moved_aside' THEN 'running recorded calls again ended the service twice'
           WHEN 'journal_full' THEN 'calls were accepted that would not have survived the process'
           WHEN 'journal_absent' THEN 'calls were accepted that would not have survived the process'
           WHEN 'recovery_incomplete' THEN 'some recorded calls could not be understood'
         END AS meaning
  FROM store_ledger)sql";

}  // namespace

std::span<const StoreView> storeViews() {
  static const StoreView kViews[] = {{"session_messages", kSessionMessages},
                                     {"analytics_events", kAnalyticsEvents},
                                     {"sessions", kSessions},
                                     {"summary_values", kSummaryValues},
                                     {"driver_statistics", kDriverStatistics},
                                     {"client_uptimes", kClientUptimes},
                                     {"haptics_runs", kHapticsRuns},
                                     {"losses", kLosses}};
  return kViews;
}

}  // namespace vx::lnx
