// The spine of the service: the service-wide delegate, and the server instance that each client
// gets.
#pragma once

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Statistics/Service/VXReportingActivity.h"
#include "Statistics/Service/VXReportingReporterIndex.h"
#include "Statistics/Service/VXReportingServiceProtocol.h"
#include "Statistics/Service/VXReportingSession.h"
#include "Statistics/VXReportingDriverUtility.h"
#include "Statistics/VXReportingUtility.h"
#include "base/Mutex.h"
#include "platform/ScopedLog.h"
#include "platform/ServiceListener.h"
#include "platform/WorkQueue.h"

namespace vx {

class VXReportingServerInstance;

// ---------------------------------------------------------------------------------------------------------------------
// VXReportingServiceDelegateProtocol

// How a server instance reaches service-wide state. Called on the service queue, all but
// isReportingEnabled.
class VXReportingServiceDelegateProtocol {
 public:
  using Clients = std::vector<std::shared_ptr<VXReportingServerInstance>>;
  virtual ~VXReportingServiceDelegateProtocol() = default;
  virtual std::optional<Payload> getDefaults() = 0;
  virtual const Clients& getAllClients() = 0;  // the array itself
  virtual bool isReportingEnabled() = 0;
  // Across clients, the first registered one that holds the identifier. None for 0 and while
  // reporting is off.
  virtual std::shared_ptr<VXReportingSession> findReportingSessionForID(ReporterID reporterID) = 0;
  virtual std::shared_ptr<DriverSnapShot> getSnapShot() = 0;
  virtual std::optional<Payload> getDriverStatisticsRelativeToSnapShot(
      const std::shared_ptr<DriverSnapShot>& snapShot) = 0;
  virtual void removeClient(const std::shared_ptr<VXReportingServerInstance>& client) = 0;
  virtual VXReportingActivity& activity() = 0;
};

// ---------------------------------------------------------------------------------------------------------------------
// VXReportingServerInstance

// One connected client: the object exported over its connection. Owned by the connection and, while
// registered, by the delegate's list. Front halves run on the connection's queue, all work on the
// service queue, which alone changes the session map. The number of sessions is bounded by the
// connection.
class VXReportingServerInstance final
    : public VXReportingServiceProtocol,
      public std::enable_shared_from_this<VXReportingServerInstance> {
 public:
  // In ascending order of the identifier, which is this service's "map order".
  using SessionMap = std::map<ReporterID, std::shared_ptr<VXReportingSession>>;
  enum class Lookup : uint8_t { OwnMap, AcrossAllClients };

  static std::shared_ptr<VXReportingServerInstance> initWithPID(
      int32_t processIdentifier, std::weak_ptr<VXReportingServiceDelegateProtocol> delegate);
  ~VXReportingServerInstance() override;

  void createReportingSession(ReporterID reporterID, BooleanReply reply) override;
  void setServiceType(ServiceType type, ReporterID reporterID, BooleanReply reply) override;
  void getServiceNameForReporterID(ReporterID reporterID, ServiceTypeReply reply) override;
  void setConfiguration(std::optional<Payload> configuration, ReporterID reporterID,
                        BooleanReply reply) override;
  void startReportingSessionForID(ReporterID reporterID, BooleanReply reply) override;
  void sendMessage(Payload message, MessageCategory category, MessageType type,
                   std::optional<std::vector<ReporterID>> reportingIDs, ErrorReply reply) override;
  void stopReportingSessionForID(ReporterID reporterID, BooleanReply reply) override;
  void destroyReportingSession(ReporterID reporterID, BooleanReply reply) override;
  void reporterID(ReporterID reporterID, DictionaryReply reply) override;
  void getAllReporters(NumbersReply reply) override;
  void killService(BooleanReply reply) override;

  // The own map knows neither the reporting switch nor the special role of 0; only the delegate's
  // lookup does.
  std::shared_ptr<VXReportingSession> findReportingSessionForID(ReporterID reporterID,
                                                                Lookup lookup);
  // The connection is gone: takes this client off the list, once, and stops its started sessions.
  void handleConnectionError();

  // On the service queue; `complete` becomes false where a session cannot be saved.
  SavedClient savedState(bool& complete);
  // Before any work of this client.
  bool restore(const Payload& facts);
  bool restoreSession(ReporterID reporterID, const Payload& facts, const Payload& information);
  bool restoreRelay(ReporterID reporterID);

  int32_t processIdentifier() const { return processIdentifier_; }
  const SessionMap& clientReportingSessionMap() const;
  // Written at registration, read by the connection's invalidation without a hop.
  std::optional<Date> clientStartDate() const;
  std::optional<std::string> clientProcessName() const;
  void setRegistration(Date startDate, std::optional<std::string> processName);
  // On the service queue, before any session: from here on until leaveIndex() it is found by them.
  void joinIndex(std::shared_ptr<VXReportingReporterIndex> index, uint64_t registration);
  void leaveIndex();

 private:
  VXReportingServerInstance(int32_t processIdentifier,
                            std::weak_ptr<VXReportingServiceDelegateProtocol> delegate);

  bool leaveClients();
  bool stopNext(SessionMap::iterator& next);
  void createSession(ReporterID reporterID);
  void keepSession(ReporterID reporterID, std::shared_ptr<VXReportingSession> session);
  void startSession(ReporterID reporterID, BooleanReply reply);
  void stopSession(ReporterID reporterID);
  void destroySession(ReporterID reporterID);
  void routeMessage(const Payload& message, MessageCategory category, MessageType type,
                    const std::optional<std::vector<ReporterID>>& reportingIDs,
                    const ErrorReply& reply);
  void routeToListed(VXReportingServiceDelegateProtocol& delegate, const Payload& message,
                     MessageCategory category, MessageType type,
                     const std::vector<ReporterID>& reportingIDs);
  void routeToStarted(VXReportingServiceDelegateProtocol& delegate, const Payload& message,
                      MessageCategory category, MessageType type);

  const int32_t processIdentifier_;
  const std::weak_ptr<VXReportingServiceDelegateProtocol> delegate_;
  SessionMap clientReportingSessionMap_;
  std::shared_ptr<VXReportingReporterIndex> index_;  // while it is registered
  uint64_t registration_ = 0;
  std::vector<VXReportingSession*> activeSessions_;  // those a message is being routed to
  mutable Mutex registrationMutex_;
  std::optional<Date> clientStartDate_ GUARDED_BY(registrationMutex_);
  std::optional<std::string> clientProcessName_ GUARDED_BY(registrationMutex_);
};

// ---------------------------------------------------------------------------------------------------------------------
// VXReportingServiceDelegate

// The service-wide object: the clients in order of registration, the preferences, the reporting
// switch, the driver utility. Owned by the process entry. `clients` and the preferences belong to
// the service queue.
class VXReportingServiceDelegate final
    : public ServiceListenerDelegate,
      public ServiceInspection,
      public VXReportingServiceDelegateProtocol,
      public std::enable_shared_from_this<VXReportingServiceDelegate> {
 public:
  static std::shared_ptr<VXReportingServiceDelegate> create();

  bool listener(ServiceListener& listener,
                const std::shared_ptr<ClientConnection>& connection) override;

  bool saveState(Function<void(SavedService)> saved) override;
  bool restoreService(const Payload& facts) override;
  bool restoreClient(ExportedObject& object, const Payload& facts) override;
  bool restoreSession(ExportedObject& object, int64_t reporterID, const Payload& facts,
                      const Payload& information) override;
  bool restoreRelay(ExportedObject& object, int64_t reporterID) override;
  bool restoreDelayed(const Payload& facts, const Payload& content,
                      std::unique_ptr<WorkCause> cause) override;

  ServiceInspection* inspection() override { return this; }
  void totals(Answer answer) override;
  void clients(Function<void(std::vector<Client>)> answer) override;
  void sessions(std::size_t first, Answer answer) override;
  void session(int64_t reporterID, Answer answer) override;
  void watch(std::weak_ptr<MessageWatcher> watcher) override;

  VXReportingActivity& activity() override { return activity_; }
  std::optional<Payload> getDefaults() override;
  const Clients& getAllClients() override;
  bool isReportingEnabled() override { return reportingEnabled_.load(std::memory_order_relaxed); }
  std::shared_ptr<VXReportingSession> findReportingSessionForID(ReporterID reporterID) override;
  std::shared_ptr<DriverSnapShot> getSnapShot() override;
  std::optional<Payload> getDriverStatisticsRelativeToSnapShot(
      const std::shared_ptr<DriverSnapShot>& snapShot) override;
  void removeClient(const std::shared_ptr<VXReportingServerInstance>& client) override;

  // The preferences as a dictionary: "device_name" when there is one, "disable_reporting" always
  // (the integer 0 when the domain does not hold it, a boolean when it does).
  static Payload VXReportingDefaults();
  void listenForDefaultsNotification();

 private:
  VXReportingServiceDelegate() = default;
  void init();
  SavedService savedState();
  Payload withClient(const VXReportingServerInstance& client, const Payload& facts) const;
  void preferencesChanged(int token);
  static void clientInvalidated(const std::weak_ptr<VXReportingServerInstance>& client,
                                int32_t processIdentifier);

  // Held for the set-up of a connection and for the lookup across clients; nested lookups re-enter.
  RecursiveMutex monitor_;
  Clients clients_;
  uint64_t registered_ = 0;  // clients so far
  std::shared_ptr<VXReportingReporterIndex> index_ = std::make_shared<VXReportingReporterIndex>();
  std::unique_ptr<VXReportingDriverUtility> driverUtility_;
  VXReportingActivity activity_;
  std::optional<Payload> defaults_;
  std::atomic<bool> reportingEnabled_{true};
};

// The one serial queue on which everything service-wide happens. Replaced when another delegate is
// created.
const std::shared_ptr<WorkQueue>& serviceQueue();
// The "vxrs" scope; null until a delegate has been created.
const LogScope* serverLogScope();

}  // namespace vx
