// The unit of reporting: one object per reporter identifier.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "Statistics/Service/VXReportingAggregate.h"
#include "Statistics/VXReportingDriverUtility.h"
#include "Statistics/VXReportingUtility.h"
#include "base/Clock.h"
#include "base/Error.h"
#include "base/Function.h"
#include "base/Mutex.h"
#include "platform/ScopedLog.h"
#include "platform/ServiceState.h"
#include "platform/VyrReporting.h"
#include "platform/WorkQueue.h"

namespace vx {

// A mutable dictionary that several owners share: configuration and service defaults merged. Keeps
// copies: what is merged may lie where it must not stay for long. Thread-safe.
class VXReportingUserInfo {
 public:
  // Of the whole, encoded.
  static constexpr std::size_t kMostBytes = std::size_t{1} << 20;
  // What it takes is on the account of whoever has it made, until it is gone.
  VXReportingUserInfo();
  ~VXReportingUserInfo();
  VXReportingUserInfo(const VXReportingUserInfo&) = delete;
  VXReportingUserInfo& operator=(const VXReportingUserInfo&) = delete;
  // Takes the time of what is new. False, and nothing changes, when it would become too large.
  bool merge(const Payload& entries);
  Payload snapshot() const;
  // Its "HostApplicationDisplayID" alone, which each event has: no event keeps the rest alive.
  Payload application() const {
    MutexLock lock(mutex_);
    return application_;
  }
  // In pieces of at most about `bytes`, but for an entry that is larger by itself.
  std::vector<Payload> pieces(std::size_t bytes) const;

 private:
  const AggregateMemory::Payer payer_;
  mutable Mutex mutex_;
  PayloadBuilder entries_ GUARDED_BY(mutex_);
  mutable std::optional<Payload> whole_ GUARDED_BY(mutex_);  // when it was asked for
  Payload application_ GUARDED_BY(mutex_);
  int64_t charged_ GUARDED_BY(mutex_);
};

// What a client configured, what it received while started, and its relay session. Owned by the
// server instance that created it; queued relay work and registered orientation handlers hold it
// too. Lives on the service queue, but for its relay work (its own serial queue) and its
// orientation handlers (the notifier's thread). Bounds nothing itself: the connections bound the
// number of sessions, and reading from clients pauses while too much relay work waits.
class VXReportingSession : public std::enable_shared_from_this<VXReportingSession> {
 public:
  using MessageReply = Function<void(const std::optional<Error>&)>;

  static std::shared_ptr<VXReportingSession> initWithID(ReporterID reporterID,
                                                        std::vector<int32_t> processIdentifiers);
  // Does not stop the session: the owner is expected to have done that.
  ~VXReportingSession();
  VXReportingSession(const VXReportingSession&) = delete;
  VXReportingSession& operator=(const VXReportingSession&) = delete;

  void setServiceType(ServiceType type);
  // Both merge into the user information; none does nothing. False: that would become too large.
  bool setConfiguration(const std::optional<Payload>& configuration);
  void updateDefaults(const std::optional<Payload>& defaults);
  void start();
  void stop();

  // Numbers, aggregates and relays a message. The reply, if any, is called before this returns and
  // says nothing of the relay. The sync flag is accepted and ignored: callers rely on the order of
  // the relay queue alone.
  enum class Sync : uint8_t { No, Yes };
  void sendMessage(const Payload& message, MessageCategory category, MessageType type, Sync sync,
                   MessageReply reply);
  void sendMessage(const Payload& message, MessageCategory category, MessageType type,
                   MessageReply reply) {
    sendMessage(message, category, type, Sync::No, std::move(reply));
  }
  // Sends a message that belongs to no started session, after a random delay for service type 4.
  // The user information is never used: what goes out is made from the service type alone.
  static void sendSingleMessage(const Payload& message, MessageCategory category, MessageType type,
                                ServiceType serviceType, const std::optional<Payload>& userInfo,
                                MessageReply reply);
  // What is left of that when the delay is over. On any thread.
  static void sendSingleMessageNow(const Payload& message, MessageCategory category,
                                   MessageType type, ServiceType serviceType,
                                   const MessageReply& reply);

  bool shouldReportOrientation() const;
  // Issues the next identifier of the kind: "Session_Setup_Start_1", "..._2". Numbering goes on
  // across restarts.
  std::string messageIdForCategory(MessageCategory category, MessageType type);
  // Every space in a key becomes "_"; of two keys that become the same, the later one's value
  // stays.
  static Payload normalizePayloadKeys(const Payload& payload);
  std::optional<Payload> createSummaryEventForSession() const;
  void writeSummaryJson();

  // What a session that is made anew in a later process must be given; `complete` becomes false
  // where some of it does not survive this one. And that session: none where the facts are none,
  // not whole where what it had received cannot be read.
  SavedSession savedState(bool& complete) const;
  static std::shared_ptr<VXReportingSession> restored(ReporterID reporterID,
                                                      std::vector<int32_t> processIdentifiers,
                                                      const Payload& facts, bool& whole);
  void restoreInformation(const Payload& entries) { (void)userInfo_->merge(entries); }
  // Opens the relay session again that set-up had opened, as work of that set-up.
  void restoreRelay();

  // Fields. Those that other queues see are guarded; the others belong to the service queue.
  bool started() const { return started_; }
  void setStarted(bool started) { started_ = started; }
  bool vyrReportingSessionStarted() const {
    return vyrReportingSessionStarted_.load(std::memory_order_relaxed);
  }
  void setVyrReportingSessionStarted(bool started) {
    vyrReportingSessionStarted_.store(started, std::memory_order_relaxed);
  }
  ServiceType serviceType() const { return serviceType_.load(std::memory_order_relaxed); }
  std::string_view serviceName() const { return serviceName_; }
  const std::shared_ptr<VXReportingUserInfo>& userInfo() const { return userInfo_; }
  const std::shared_ptr<DriverSnapShot>& driverSnapShot() const { return driverSnapShot_; }
  void setDriverSnapShot(std::shared_ptr<DriverSnapShot> snapShot) {
    driverSnapShot_ = std::move(snapShot);
  }
  // The pending start reply. The session keeps it and never calls it.
  bool hasTransactionCompleteBlock() const { return static_cast<bool>(transactionCompleteBlock_); }
  Function<void(bool)> takeTransactionCompleteBlock() {
    return std::move(transactionCompleteBlock_);
  }
  void setTransactionCompleteBlock(Function<void(bool)> block) {
    transactionCompleteBlock_ = std::move(block);
  }
  ReporterID reporterID() const { return reporterID_; }
  const std::vector<int32_t>& processIdentifiers() const { return processIdentifiers_; }
  std::optional<std::string> orientationCallbackID() const;
  std::optional<Date> startDate() const;
  std::shared_ptr<VyrReportingSession> vyrReportingSession() const;
  std::shared_ptr<const VyrSecureHierarchyToken> vyrReportingAgentToken() const;
  const std::shared_ptr<WorkQueue>& vyrReportingQueue() const { return vyrReportingQueue_; }
  // Copies, none when absent; a nested element as its one-entry dictionary.
  std::optional<std::vector<Payload>> aggregatedPayloadData() const;
  std::optional<std::vector<Payload>> nestedAggregatedPayloadData() const;
  std::string description() const;

  // What it says of itself to whoever looks into the service; in full with its configuration and
  // what became of its messages.
  enum class Detail : uint8_t { Line, Full };
  Payload inspect(Detail detail) const;

 private:
  struct KindCount {
    MessageKind kind;
    uint64_t count;
  };

  VXReportingSession(ReporterID reporterID, std::vector<int32_t> processIdentifiers);
  bool mergeIntoUserInfo(const std::optional<Payload>& entries);
  KindCount nextIdentifier(MessageCategory category, MessageType type);
  void onLeftOut();
  void tellLeftOut();
  enum class Keep : uint8_t { Copy, Reference };
  void deliver(const Payload& message, MessageCategory category, MessageType type, Keep keep,
               MessageReply reply);

  std::optional<Error> checkNested() const;

  void registerOrientationHandlers();
  void unregisterOrientationHandlers();
  void orientationChanged(const char* mode, std::string_view key, int64_t orientation);

  // What one set-up has come to. Written by its work, read when that is over.
  struct RelaySetUp {
    std::atomic<bool> isOver{false};
    Mutex mutex;
    std::optional<WorkOrigin> origin GUARDED_BY(mutex);  // of the relay session that is there
  };
  void setUpRelay(std::string_view serviceName, ServiceType serviceType, bool configurationDone,
                  const std::shared_ptr<RelaySetUp>& setUp);
  std::shared_ptr<VyrReportingSession> openRelay(std::string_view serviceName,
                                                 ServiceType serviceType);
  void configureRelay(const std::shared_ptr<VyrReportingSession>& relay, bool configurationDone);
  // What has become of the messages since the last start. Written by the relay queue alone, but for
  // the state's SettingUp; read from any thread.
  enum class RelayState : uint8_t { None, SettingUp, Open, NoBackend, Test, Ended };
  struct RelayOutcome {
    std::atomic<RelayState> state{RelayState::None};
    std::atomic<uint64_t> relayed{0};
    std::atomic<uint64_t> alone{0};       // not started: sent as single messages
    std::atomic<uint64_t> notAllowed{0};  // of the test service type
    std::atomic<uint64_t> noRelay{0};
    std::atomic<uint64_t> refused{0};
  };
  // Of one writer: needs no locked instruction.
  static void countOne(std::atomic<uint64_t>& counter) {
    counter.store(counter.load(std::memory_order_relaxed) + 1, std::memory_order_relaxed);
  }
  void resetOutcome();
  std::string_view relayStateName() const;
  uint64_t acceptedMessages() const;

  void relayMessage(const Payload& normalised, const Payload& message, MessageCategory category,
                    MessageType type, bool startedThen);
  void flushRelay();
  void setVyrReportingSession(std::shared_ptr<VyrReportingSession> session);
  void setVyrReportingAgentToken(std::shared_ptr<const VyrSecureHierarchyToken> token);

  bool started_ = false;
  std::atomic<bool> vyrReportingSessionStarted_{false};  // the relay queue writes it too
  std::atomic<ServiceType> serviceType_{kServiceTypeUnknown};
  const ReporterID reporterID_;
  const std::vector<int32_t> processIdentifiers_;
  std::string_view serviceName_ = "unknown";
  const std::shared_ptr<VXReportingUserInfo> userInfo_ = std::make_shared<VXReportingUserInfo>();
  std::shared_ptr<DriverSnapShot> driverSnapShot_;
  Function<void(bool)> transactionCompleteBlock_;
  VXReportingAggregate received_;             // what aggregatedPayloadData and its nested form show
  uint64_t leftOut_ = 0;                      // messages that it has not taken
  std::vector<KindCount> messageTypeCounts_;  // bounded by the number of kinds, some hundreds
  std::shared_ptr<WorkQueue> vyrReportingQueue_;
  std::shared_ptr<RelaySetUp> relaySetUp_;  // of the last start
  std::optional<WorkOrigin> relayOrigin_;   // belongs to the relay queue
  std::optional<Date> startedAt_;           // for inspect() alone, as acceptedAtStart_ is
  uint64_t acceptedAtStart_ = 0;
  RelayOutcome relayOutcome_;

  mutable Mutex fieldsMutex_;  // the references below, each read and replaced as a whole
  std::optional<std::string> orientationCallbackID_ GUARDED_BY(fieldsMutex_);
  std::optional<Date> startDate_ GUARDED_BY(fieldsMutex_);
  std::shared_ptr<VyrReportingSession> vyrReportingSession_ GUARDED_BY(fieldsMutex_);
  std::shared_ptr<const VyrSecureHierarchyToken> vyrReportingAgentToken_ GUARDED_BY(fieldsMutex_);
  std::shared_ptr<const std::atomic<uint64_t>> storedMessages_ GUARDED_BY(fieldsMutex_);
};

// The "vxrr" scope, once a session has been created; null before.
const LogScope* sessionLogScope();

}  // namespace vx
