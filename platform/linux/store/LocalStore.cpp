#include "platform/linux/store/LocalStore.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>

#include "platform/Log.h"
#include "platform/linux/store/StoreWriter.h"

namespace vx::lnx {

namespace {

constexpr const char* kStoreBackend = "store";

std::string because(const std::string& what) { return what + ": " + std::strerror(errno); }

struct HierarchyToken final : VyrSecureHierarchyToken {
  std::array<uint8_t, 16> bytes{};
  std::array<uint8_t, 16> parent{};  // zeros: none
};

// Which back ends the configuration names; read by every send.
struct Backends {
  std::vector<std::string> names;
  bool hasStore = false;
};

Error noStore() { return {"com.quorvel.vyr", 1, "the back end \"store\" is not configured"}; }
Error closed() { return {"com.quorvel.vyr", 2, "the store is closed"}; }

// One relay session of the store. Owned by whoever made it; refers to a writer that outlives all of
// them. Thread-safe.
class StoreRelaySession final : public VyrReportingSession {
 public:
  StoreRelaySession(StoreWriter& writer, const Backends& backends, std::shared_ptr<RelayRow> row,
                    int64_t sessionID)
      : writer_(writer), backends_(backends), row_(std::move(row)), sessionID_(sessionID) {}

  std::string description() const override {
    return "<VyrReportingSession " + std::to_string(sessionID_) + ">";
  }

  void startConfigurationWithCompletionHandler(
      Function<void(std::optional<BackendList>)> handler) override {
    writer_.runSoon([names = backends_.names, handler = std::move(handler)] {
      handler(names.empty() ? std::nullopt : std::optional<BackendList>(names));
    });
  }

  bool sendMessageWithCategory(uint16_t category, uint16_t type, const Payload& payload,
                               std::optional<Error>& error) override {
    if (!backends_.hasStore) {
      error = noStore();
      return false;
    }
    const std::size_t bytes = payload.encoded().size();
    if (writer_.append({writer_.now(), RelayMessageRecord{row_, payload, category, type}}, bytes))
      return true;
    error = closed();
    return false;
  }

  void flushMessagesWithCompletion(Function<void(std::optional<Error>)> handler) override {
    if (!handler) handler = [](const std::optional<Error>&) {};
    const auto shared = std::make_shared<Function<void(std::optional<Error>)>>(std::move(handler));
    FlushRecord flush{[shared](const std::optional<Error>& error) { (*shared)(error); }};
    if (!writer_.append({writer_.now(), std::move(flush)}, 0)) (*shared)(closed());
  }

 private:
  StoreWriter& writer_;
  const Backends& backends_;
  const std::shared_ptr<RelayRow> row_;
  const int64_t sessionID_;
};

class SqliteStore final : public LocalStore,
                          public VyrReporting,
                          public AnalyticsEventService,
                          public PowerEventLog {
 public:
  SqliteStore(int lockFd, std::string path, Database database, const StoreOptions& options,
              Clock& clock)
      : lockFd_(lockFd), writer_(std::move(path), std::move(database), options, clock) {
    setBackends({kStoreBackend});
  }
  ~SqliteStore() override { ::close(lockFd_); }

  void setDamage(std::string note) { damage_ = std::move(note); }
  void start() override {
    if (!damage_.empty()) {
      VX_LOG(nullptr, Error, "the store was damaged and a fresh one is begun: %s", damage_.c_str());
      writer_.noteAtStart("moved_aside", damage_);
    }
    writer_.start();
  }

  VyrReporting& relay() override { return *this; }
  AnalyticsEventService& analytics() override { return *this; }
  PowerEventLog& power() override { return *this; }
  bool isCongested() const override { return writer_.isCongested(); }
  void setDrainedHandler(Function<void()> handler) override {
    writer_.setDrainedHandler(std::move(handler));
  }
  void setBackends(std::vector<std::string> names) override {
    backends_.hasStore = std::find(names.begin(), names.end(), kStoreBackend) != names.end();
    backends_.names = std::move(names);
  }
  bool close(Monotonic deadline) override { return writer_.close(deadline); }
  Counters counters() const override { return writer_.counters(); }

  std::shared_ptr<const VyrSecureHierarchyToken> newSecureHierarchyTokenFromParentToken(
      const VyrSecureHierarchyToken* parent) override {
    auto token = std::make_shared<HierarchyToken>();
    if (getrandom(token->bytes.data(), token->bytes.size(), 0) < 0) token->bytes = {};
    if (const auto* known = dynamic_cast<const HierarchyToken*>(parent))
      token->parent = known->bytes;
    return token;
  }

  std::shared_ptr<VyrReportingSession> initWithSessionInfo(
      const VyrSessionInfo& sessionInfo, const Payload& userInfo,
      const std::vector<std::string>&) override {
    auto row = std::make_shared<RelayRow>();
    int64_t sessionID = 0;
    for (const auto& [key, value] : sessionInfo) {
      if (key == kVyrReportingSessionInfoSessionID && std::holds_alternative<int64_t>(value)) {
        sessionID = std::get<int64_t>(value);
      }
    }
    if (backends_.hasStore) open(row, sessionInfo, userInfo);
    return std::make_shared<StoreRelaySession>(writer_, backends_, std::move(row), sessionID);
  }

  bool sendOneMessageWithSessionInfo(const VyrSessionInfo& sessionInfo, const Payload& userInfo,
                                     uint16_t category, uint16_t type, const Payload& payload,
                                     std::optional<Error>& error) override {
    if (!backends_.hasStore) {
      error = noStore();
      return false;
    }
    auto row = std::make_shared<RelayRow>();
    const std::size_t bytes = payload.encoded().size();
    if (open(row, sessionInfo, userInfo) &&
        writer_.append({writer_.now(), RelayMessageRecord{std::move(row), payload, category, type}},
                       bytes)) {
      return true;
    }
    error = closed();
    return false;
  }

  void sendEventLazy(std::string_view name, Function<Payload()> builder,
                     const Payload& message) override {
    // The builder holds a message, most likely one that the relay holds too: counted by a typical
    // size.
    constexpr std::size_t kTypicalEventBytes = 128;
    (void)writer_.append({writer_.now(), AnalyticsRecord{name, message, std::move(builder)}},
                         kTypicalEventBytes);
  }

  void logRegisteredEvent(int64_t clientIdentifier, std::string_view eventName,
                          const Payload& record, const Payload*) override {
    const std::size_t bytes = record.encoded().size();
    (void)writer_.append(
        {writer_.now(), PowerRecord{clientIdentifier, std::string(eventName), record}}, bytes);
  }

 private:
  bool open(const std::shared_ptr<RelayRow>& row, const VyrSessionInfo& info,
            const Payload& userInfo) {
    VyrSessionInfo kept = info;
    std::erase_if(kept, [](const auto& entry) {
      return entry.first == kVyrReportingSessionInfoHierarchyToken;
    });
    return writer_.append(
        {writer_.now(), RelayOpenRecord{row, std::make_unique<std::pair<VyrSessionInfo, Payload>>(
                                                 std::move(kept), userInfo)}},
        userInfo.encoded().size() + 256);
  }

  const int lockFd_;
  std::string damage_;  // what was found and moved aside when the store was opened
  Backends backends_;   // set before any traffic
  StoreWriter writer_;
};

int lockStore(const std::string& directory, std::string& problem) {
  if (mkdir(directory.c_str(), 0750) != 0 && errno != EEXIST) {
    problem = because("cannot create the state directory " + directory);
    return -1;
  }
  const std::string path = directory + "/telemetry.lock";
  const int fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0640);
  if (fd < 0) {
    problem =
        because("cannot open " + path) + " (set STATE_DIRECTORY to a folder that can be written)";
    return -1;
  }
  if (flock(fd, LOCK_EX | LOCK_NB) != 0) {
    problem = "another vxreportingd uses the store in " + directory +
              "; stop it, or set STATE_DIRECTORY to a folder of its own";
    ::close(fd);
    return -1;
  }
  return fd;
}

}  // namespace

std::unique_ptr<LocalStore> LocalStore::open(const std::string& stateDirectory,
                                             const StoreOptions& options, Clock& clock,
                                             std::string& problem) {
  const int lockFd = lockStore(stateDirectory, problem);
  if (lockFd < 0) return nullptr;
  const std::string path = stateDirectory + "/telemetry.db";
  Database database;
  std::string note;
  OpenOutcome outcome = openStoreDatabase(path, database, problem);
  if (outcome == OpenOutcome::Damaged) {
    database.reset();
    const std::string why = problem;
    const std::string aside = moveAside(path, problem);
    if (!aside.empty()) {
      note = why + "; now " + aside;
      outcome = openStoreDatabase(path, database, problem);
    }
  }
  if (outcome != OpenOutcome::Ready) {
    ::close(lockFd);
    return nullptr;
  }
  auto store = std::make_unique<SqliteStore>(lockFd, path, std::move(database), options, clock);
  store->setDamage(std::move(note));
  return store;
}

}  // namespace vx::lnx
