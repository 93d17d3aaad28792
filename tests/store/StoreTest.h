// What the store's tests have in common: a folder, queries, and records.
#pragma once

#include <chrono>
#include <string>
#include <utility>
#include <vector>

#include "platform/linux/journal/Journal.h"
#include "platform/linux/journal/JournalReader.h"
#include "platform/linux/store/Database.h"
#include "platform/linux/store/StoreFile.h"
#include "platform/linux/store/StoreRecord.h"
#include "tests/linux/FolderTest.h"

namespace vx::lnx {

using namespace std::chrono_literals;
using Rows = std::vector<std::string>;

class StoreTest : public FolderTest {
 protected:
  static Rows query(sqlite3* database, const std::string& sql) {
    Rows rows;
    auto add = [](void* out, int count, char** values, char**) {
      std::string line;
      for (int i = 0; i < count; ++i)
        line += (i > 0 ? "|" : "") + std::string(values[i] != nullptr ? values[i] : "null");
      static_cast<Rows*>(out)->push_back(line);
      return 0;
    };
    EXPECT_EQ(sqlite3_exec(database, sql.c_str(), add, &rows, nullptr), SQLITE_OK)
        << sqlite3_errmsg(database);
    return rows;
  }
  // The file, as somebody else sees it.
  Rows query(const std::string& sql) {
    sqlite3* opened = nullptr;
    sqlite3_open((folder + "/telemetry.db").c_str(), &opened);
    const Database other(opened);
    sqlite3_busy_timeout(opened, 20000);
    return query(opened, sql);
  }

  // A call that has been recorded, as those that cause rows are.
  JournalTicket recorded(double time = 7.5, uint8_t kind = 1) {
    if (journal == nullptr)
      journal = std::move(*Journal::open({.folder = folder + "/journal", .epoch = kEpoch}));
    return journal->append({.kind = kind, .time = time, .user = 1000})->ticket;
  }
  static auto within(const Cause& cause, const auto& work) {
    const CauseScope scope(cause);
    return work();
  }
  // How many of the recorded calls are not done.
  int undone() {
    journal.reset();
    const auto contents = JournalReader::read(folder + "/journal", kEpoch);
    int calls = 0;
    for (const auto& call : contents->records) calls += call.done ? 0 : 1;
    return calls;
  }

  static Payload numbered(int i) { return PayloadBuilder().set("i", i).build(); }
  // The payload with one entry more, as its event has it.
  static Payload tagged(const Payload& payload) {
    return PayloadBuilder(payload).set("app", "x\"y").build();
  }
  static VyrSessionInfo sessionInfo(int64_t id) {
    return {{kVyrReportingSessionInfoClientType, int32_t{19}},
            {kVyrReportingSessionInfoClientVersion, 2.5f},
            {kVyrReportingSessionInfoSessionID, id},
            {kVyrReportingSessionInfoBatchEvent, true},
            {kVyrReportingSessionInfoContainsRealtimeEvents, false}};
  }
  static Payload userInfo() {
    return PayloadBuilder()
        .set(kVyrReportingUserInfoClientName, "c")
        .set(kVyrReportingUserInfoServiceName, "s")
        .build();
  }
  static RelayOpenRecord opening(std::shared_ptr<RelayRow> of, VyrSessionInfo info,
                                 Payload user = userInfo()) {
    of->information =
        std::make_unique<std::pair<VyrSessionInfo, Payload>>(std::move(info), std::move(user));
    return {std::move(of)};
  }
  RelayMessageRecord message(Payload payload) { return {row, std::move(payload), 5, 7}; }
  static AnalyticsRecord event(std::string_view name, Payload built, Payload message = Payload()) {
    return {name, std::move(message), [built = std::move(built)] { return built; }};
  }
  static PowerRecord power(int i) { return {28, "n", numbered(i)}; }

  static constexpr JournalEpoch kEpoch{1, 2, 3};
  std::unique_ptr<Journal> journal;
  std::shared_ptr<RelayRow> row = std::make_shared<RelayRow>();
};

}  // namespace vx::lnx
