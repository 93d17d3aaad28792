// The store's queue and the one thread that empties it into the database.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <unordered_map>
#include <utility>
#include <variant>
#include <vector>

#include "base/ChunkList.h"
#include "base/Clock.h"
#include "base/Function.h"
#include "base/Mutex.h"
#include "platform/VyrReporting.h"
#include "platform/linux/store/LocalStore.h"
#include "platform/linux/store/StoreSchema.h"
#include "propertylist/Payload.h"

namespace vx::lnx {

// The row of a relay session, known to the writer's thread once it has inserted it.
struct RelayRow {
  int64_t id = 0;
};

struct RelayOpenRecord {
  std::shared_ptr<RelayRow> row;
  std::unique_ptr<std::pair<VyrSessionInfo, Payload>> information;  // session and user information
};
struct RelayMessageRecord {
  std::shared_ptr<RelayRow> row;
  Payload payload;
  uint16_t category = 0;
  uint16_t type = 0;
};
struct AnalyticsRecord {
  std::string_view name;  // of unlimited life
  Payload message;        // what the built dictionary is expected to begin with; may be empty
  Function<Payload()> builder;
};
struct PowerRecord {
  int64_t clientIdentifier = 0;
  std::string name;
  Payload record;
};
struct FlushRecord {
  Function<void(std::optional<Error>)> completion;
};

struct StoreRecord {
  using What =
      std::variant<RelayOpenRecord, RelayMessageRecord, AnalyticsRecord, PowerRecord, FlushRecord>;
  // An event whose message is in the same batch as a relay message is written right behind that
  // one, and shares its text. A relay message names the first such event, each event the next one.
  enum class Sharing : uint8_t { No, Held, Shares, Written };
  static constexpr uint32_t kNone = UINT32_MAX;

  StoreRecord(double when, What whatever) : time(when), what(std::move(whatever)) {}
  double time;  // seconds since 1970
  uint32_t nextSharer = kNone;
  Sharing sharing = Sharing::No;
  What what;
};
static_assert(sizeof(StoreRecord) <= 128, "a record a message: two cache lines");

// Owned by the local store. append() and the questions are thread-safe; everything else belongs to
// the writer's thread. What is not yet committed is bounded by queueBytes, by way of the listener:
// see LocalStore.
//
// A message goes to the relay and, with one entry more, to analytics: the text they have in common
// is written once, with the relay's row (see the view analytics_events). That is nearly half of
// what would reach the flash otherwise.
class StoreWriter {
 public:
  StoreWriter(std::string path, Database database, const StoreOptions& options, Clock& clock);
  ~StoreWriter();
  StoreWriter(const StoreWriter&) = delete;
  StoreWriter& operator=(const StoreWriter&) = delete;

  // Something worth a row in the ledger that happened before the writer began.
  void noteAtStart(std::string event, std::string detail);
  void start();

  // `bytes`: what the record holds besides itself. False once closed.
  bool append(StoreRecord record, std::size_t bytes);
  // Runs on the writer's thread at once, before anything that waits to be written.
  void runSoon(Function<void()> job);

  bool isCongested() const { return congested_.load(std::memory_order_relaxed); }
  void setDrainedHandler(Function<void()> handler) { drained_ = std::move(handler); }
  bool close(Monotonic deadline);
  LocalStore::Counters counters() const;
  double now() const {
    return std::chrono::duration<double>(clock_.now().time_since_epoch()).count();
  }

 private:
  struct Statements {
    Statement relaySession;
    Statement relayMessage;
    Statement analytics;
    Statement addName;
    Statement findName;
    Statement power;
    Statement ledger;
  };
  struct LedgerNote {
    std::string event;
    std::string table;
    int64_t rows = 0;
    std::string detail;
  };

  using Records = ChunkList<StoreRecord, 256>;

  static constexpr std::size_t kRowsPerCommit = 1000;
  static constexpr std::size_t kBytesPerCommit = 1 << 20;

  void threadMain();
  void checkDatabase();
  void prepareStatements();
  bool waitForBatch();  // false: closed and empty
  void runJobs();
  void writeBatch();
  // Finds the relay message of each event of the batch.
  void pairEventsWithMessages();
  // Young events without one: it is likely to come with the next batch.
  void holdUnpairedEvents();
  // Writes records [first, last) in one transaction. SQLITE_OK or the error after which everything
  // was rolled back.
  int writeTransaction(std::size_t first, std::size_t last);
  int writeRecord(const StoreRecord& record);
  int writeRelayMessage(const StoreRecord& record, const RelayMessageRecord& message);
  // json_ as it may be stored in a table: a text larger than mostText_ is left out and noted.
  const std::string& storable(const char* table);
  // Behind `message` in row `messageRow`, whose text it shares; or by itself, when there is none.
  int writeEvent(double time, const AnalyticsRecord& event, int64_t messageRow,
                 const Payload* message);
  // The identifier of an event name. SQLITE_OK or an error.
  int nameRow(std::string_view name, int64_t& row);
  int writeRelaySession(double time, const RelayOpenRecord& record);
  int writeLedger(const LedgerNote& note);
  // False: the store is closing and time is up.
  bool waitBeforeRetry(int code);
  void committed(std::size_t first, std::size_t last);
  void applyRetention();
  struct Removed {
    int64_t rows = 0;
    int64_t sharers = 0;  // events that went with their messages
  };
  int64_t lastOfOldest(const std::string& table);
  int64_t removeUpTo(const std::string& table, int64_t last, std::optional<double> before);
  Removed removeMessagesUpTo(int64_t last, std::optional<double> before);
  void note(LedgerNote note) { notes_.push_back(std::move(note)); }

  const std::string path_;
  const StoreOptions options_;
  const std::size_t mostText_;  // of one payload
  Clock& clock_;
  Function<void()> drained_;
  std::atomic<uint64_t> rowsCommitted_{0};
  std::atomic<uint64_t> commits_{0};
  std::atomic<uint64_t> writeFailures_{0};
  std::atomic<uint64_t> rowsLost_{0};

  Mutex mutex_;
  CondVar wake_;
  CondVar ended_;
  Records pending_ GUARDED_BY(mutex_);
  std::size_t pendingBytes_ GUARDED_BY(mutex_) = 0;
  std::size_t heldBytes_ GUARDED_BY(mutex_) = 0;  // all that is not committed, pending_ included
  Monotonic firstPending_ GUARDED_BY(mutex_);
  std::vector<Function<void()>> jobs_ GUARDED_BY(mutex_);
  bool urgent_ GUARDED_BY(mutex_) = false;  // a flush waits
  enum class Sleep : uint8_t { Awake, UntilCommit, UntilWork };
  Sleep sleep_ GUARDED_BY(mutex_) = Sleep::Awake;
  bool closing_ GUARDED_BY(mutex_) = false;
  bool finished_ GUARDED_BY(mutex_) = false;
  std::atomic<bool> congested_{false};
  Monotonic closeDeadline_ GUARDED_BY(mutex_);

  // The writer's thread.
  Database database_;
  Statements statements_;
  Records batch_;
  std::size_t batchBytes_ = 0;
  std::vector<StoreRecord> heldEvents_;  // join the next batch
  Monotonic heldSince_{};
  std::vector<uint32_t> messageSlots_;  // open addressing: index in batch_ by a payload's identity
  std::unordered_map<std::string_view, int64_t> nameRows_;  // as many as there are event names
  uint64_t rowsInTransaction_ = 0;
  std::vector<LedgerNote> notes_;
  std::string json_;
  bool failing_ = false;
  bool mayHold_ = false;  // nobody waits for the end of this batch
  std::chrono::milliseconds backoff_{0};
  std::size_t commitsSinceRetention_ = 0;
  Monotonic lastAgeCheck_{};
  std::thread thread_;
};

}  // namespace vx::lnx
