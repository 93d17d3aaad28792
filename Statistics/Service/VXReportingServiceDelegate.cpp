#include "Statistics/Service/VXReportingServiceDelegate.h"

#include <algorithm>
#include <utility>

#include "Statistics/VXReportingProcessState.h"
#include "platform/Log.h"

namespace vx {

namespace {

constexpr std::string_view kDomain = "com.quorvel.sonik";
constexpr std::string_view kPreferencesChanged = "com.quorvel.sonik.reporting";
constexpr std::string_view kDisableReporting = "disable_reporting";
constexpr std::string_view kDeviceName = "device_name";

// One per process; written while the service is being created, before any client exists.
std::shared_ptr<WorkQueue> theServiceQueue;
std::atomic<const LogScope*> theServerLogScope{nullptr};
std::atomic<int> preferencesToken{-1};

constexpr std::string_view kSavedReporting = "reporting";
constexpr std::string_view kSavedDefaults = "defaults";

constexpr std::string_view kProcessName = "process name";

std::optional<std::string> askProcessName(int32_t processIdentifier) {
  ProcessInfoQuery& query = platform().processInfo;
  if (processIdentifier == query.ownProcessIdentifier()) return query.ownProcessName();
  if (processIdentifier < 1) return std::nullopt;
  return query.shortCommandName(processIdentifier);
}

std::optional<std::string> processName(int32_t processIdentifier) {
  const std::optional<Payload> answer =
      platform().inputs.once(kProcessName, [&]() -> std::optional<Payload> {
        const std::optional<std::string> name = askProcessName(processIdentifier);
        if (!name) return std::nullopt;
        return PayloadBuilder().set(kProcessName, *name).build();
      });
  const std::optional<Value> name = answer ? answer->find(kProcessName) : std::nullopt;
  if (!name) return std::nullopt;
  return std::string(name->asString());
}

}  // namespace

const std::shared_ptr<WorkQueue>& serviceQueue() { return theServiceQueue; }
const LogScope* serverLogScope() { return theServerLogScope.load(std::memory_order_acquire); }

// ---------------------------------------------------------------------------------------------------------------------
// Creation

std::shared_ptr<VXReportingServiceDelegate> VXReportingServiceDelegate::create() {
  theServerLogScope.store(platform().log.registerScope(true, fourCharacterCode("vxrs"), "vxrs",
                                                       kDomain, "reporting_server_verbose", 31),
                          std::memory_order_release);
  std::shared_ptr<VXReportingServiceDelegate> delegate(new VXReportingServiceDelegate());
  delegate->init();
  return delegate;
}

void VXReportingServiceDelegate::init() {
  theServiceQueue = platform().workQueues.makeSerial("com.quorvel.sonik.reporting.server",
                                                     QualityOfService::UserInteractive);
  clients_.clear();
  reportingEnabled_.store(true);
  listenForDefaultsNotification();  // the preferences themselves are first read when it fires
  driverUtility_ = std::make_unique<VXReportingDriverUtility>();
}

// ---------------------------------------------------------------------------------------------------------------------
// Clients

bool VXReportingServiceDelegate::listener(ServiceListener&,
                                          const std::shared_ptr<ClientConnection>& connection) {
  const int32_t pid = connection->processIdentifier();
  VX_LOG(serverLogScope(), Default, "newConnection: %s", connection->description().c_str());
  {
    RecursiveMutexLock lock(monitor_);
    connection->setExportedInterface(vxReportingServiceInterface());
    connection->setExportedObject(VXReportingServerInstance::initWithPID(pid, weak_from_this()));
  }
  const std::weak_ptr<VXReportingServerInstance> weak =
      std::static_pointer_cast<VXReportingServerInstance>(connection->exportedObject());
  // Queued before the connection is resumed: registration runs before any operation of this client.
  serviceQueue()->async([self = shared_from_this(), weak, pid] {
    const std::shared_ptr<VXReportingServerInstance> client = weak.lock();
    if (client == nullptr) return;
    self->clients_.push_back(client);
    client->joinIndex(self->index_, self->registered_++);
    client->setRegistration(platform().clock.now(), processName(pid));
  });
  connection->setInterruptionHandler([weak] {
    VX_LOG_AS("listener", serverLogScope(), Default, "InterruptionHandler: connection exited");
    if (const auto client = weak.lock()) client->handleConnectionError();
  });
  connection->setInvalidationHandler([weak, pid] { clientInvalidated(weak, pid); });
  connection->resume();
  return true;
}

void VXReportingServiceDelegate::clientInvalidated(
    const std::weak_ptr<VXReportingServerInstance>& weak, int32_t pid) {
  static constexpr const char* kFunction = "listener";
  const std::shared_ptr<VXReportingServerInstance> client = weak.lock();
  if (client != nullptr) client->handleConnectionError();
  const Date now = platform().clock.now();
  const std::optional<Date> start = client != nullptr ? client->clientStartDate() : std::nullopt;
  const std::optional<std::string> name =
      client != nullptr ? client->clientProcessName() : std::nullopt;
  const std::string nameOrUnknown = name.value_or("unknown");

  std::optional<double> seconds;  // none stands for the integer -1
  if (!start) {
    VX_LOG_AS(kFunction, serverLogScope(), Default,
              "clientStartDate is nil. clientpid=%d clientprocessname=%s", pid,
              nameOrUnknown.c_str());
  } else {
    seconds = std::chrono::duration<double>(std::max(now, *start) - std::min(now, *start)).count();
    if (*start > now) {
      // The words stand for a start that lies after now; text and test do not match, and both stay
      // as they are.
      VX_LOG_AS(kFunction, serverLogScope(), Default,
                "clientStartDate is in the past. clientpid=%d clientprocessname=%s", pid,
                nameOrUnknown.c_str());
    }
  }
  VX_LOG_AS(kFunction, serverLogScope(), Default,
            "InvalidationHandler: connection exited process=%s uptime_sec=%d",
            nameOrUnknown.c_str(),
            static_cast<int32_t>(std::min<double>(seconds.value_or(-1), INT32_MAX)));
  if (!name) {
    VX_LOG_AS(kFunction, serverLogScope(), Default, "clientProcessName is nil. clientpid=%d", pid);
    return;
  }
  platform().analytics.sendEventLazy(
      "com.quorvel.sonik.vxreportingclientuptime",
      [name = *name, seconds] {
        PayloadBuilder event;
        event.set("processName", name);
        if (seconds)
          event.set("seconds", *seconds);
        else
          event.set("seconds", -1);
        return event.build();
      },
      Payload(), name->size());
}

const VXReportingServiceDelegate::Clients& VXReportingServiceDelegate::getAllClients() {
  serviceQueue()->assertIsCurrent();
  return clients_;
}

void VXReportingServiceDelegate::removeClient(
    const std::shared_ptr<VXReportingServerInstance>& client) {
  serviceQueue()->assertIsCurrent();
  if (std::erase(clients_, client) > 0) client->leaveIndex();
}

std::shared_ptr<VXReportingSession> VXReportingServiceDelegate::findReportingSessionForID(
    ReporterID reporterID) {
  serviceQueue()->assertIsCurrent();
  RecursiveMutexLock lock(monitor_);
  if (reporterID == 0) return nullptr;
  if (!isReportingEnabled()) return nullptr;
  if (const VXReportingServerInstance* const client = index_->firstHolder(reporterID)) {
    VX_LOG(serverLogScope(), Info, "found reporting session %lli for client %i",
           static_cast<long long>(reporterID), client->processIdentifier());
    return client->clientReportingSessionMap().at(reporterID);
  }
  VX_LOG(serverLogScope(), Error, "failed to find reporting session %lli",
         static_cast<long long>(reporterID));
  return nullptr;
}

// ---------------------------------------------------------------------------------------------------------------------
// Preferences

std::optional<Payload> VXReportingServiceDelegate::getDefaults() {
  serviceQueue()->assertIsCurrent();
  return defaults_;
}

Payload VXReportingServiceDelegate::VXReportingDefaults() {
  const std::unique_ptr<PreferencesDomain> domain = platform().preferences.open(kDomain);
  PayloadBuilder defaults;
  if (domain->hasObject(kDeviceName)) {
    // A value that has no text is left out: the dictionary must not receive an empty entry.
    if (const std::optional<std::string> name = domain->string(kDeviceName))
      defaults.set(kDeviceName, *name);
  }
  if (domain->hasObject(kDisableReporting))
    defaults.set(kDisableReporting, domain->boolean(kDisableReporting));
  else
    defaults.set(kDisableReporting, 0);  // an integer, not a boolean
  return defaults.build();
}

void VXReportingServiceDelegate::listenForDefaultsNotification() {
  int token = -1;
  const uint32_t status = platform().systemNotify.registerHandler(
      kPreferencesChanged, token, serviceQueue(), [weak = weak_from_this()](int fired) {
        if (const auto self = weak.lock()) self->preferencesChanged(fired);
      });
  preferencesToken.store(token);
  VX_LOG(serverLogScope(), Default, "notify setup result %i", static_cast<int>(status));
}

void VXReportingServiceDelegate::preferencesChanged(int token) {
  serviceQueue()->assertIsCurrent();
  static constexpr const char* kFunction = "listenForDefaultsNotification";
  if (token != preferencesToken.load()) return;
  VX_LOG_AS(kFunction, serverLogScope(), Default, "re-reading sonik defaults");
  std::optional<Payload> read = platform().inputs.once("preferences", VXReportingDefaults);
  if (!read) return;  // nor were they the first time
  defaults_ = std::move(read);
  VX_LOG_AS(kFunction, serverLogScope(), Info, "defaults %s", defaults_->text().c_str());
  for (const auto& client : clients_) {
    for (const auto& [reporterID, session] : client->clientReportingSessionMap())
      session->updateDefaults(defaults_);
  }
  if (const std::optional<Value> disabled = defaults_->find(kDisableReporting)) {
    reportingEnabled_.store(!disabled->asBool());
  }
}

// ---------------------------------------------------------------------------------------------------------------------
// Saved and restored

bool VXReportingServiceDelegate::saveState(Function<void(SavedService)> saved) {
  serviceQueue()->async(
      [self = shared_from_this(), saved = std::move(saved)] { saved(self->savedState()); });
  return true;
}

SavedService VXReportingServiceDelegate::savedState() {
  serviceQueue()->assertIsCurrent();
  SavedService saved;
  PayloadBuilder facts;
  facts.set(kSavedReporting, isReportingEnabled());
  if (defaults_) facts.set(kSavedDefaults, *defaults_);
  saved.facts = facts.build();
  for (const auto& client : clients_) saved.clients.push_back(client->savedState(saved.complete));
  VXReportingProcessState::current().delayedMessages().keepAgain();
  return saved;
}

bool VXReportingServiceDelegate::restoreService(const Payload& facts) {
  const std::optional<Value> reporting = facts.find(kSavedReporting);
  if (!reporting) return false;
  reportingEnabled_.store(reporting->asBool());
  if (const std::optional<Value> defaults = facts.find(kSavedDefaults))
    defaults_ = Payload::copyOf(*defaults);
  return true;
}

bool VXReportingServiceDelegate::restoreClient(ExportedObject& object, const Payload& facts) {
  return static_cast<VXReportingServerInstance&>(object).restore(facts);
}

bool VXReportingServiceDelegate::restoreSession(ExportedObject& object, int64_t reporterID,
                                                const Payload& facts, const Payload& information) {
  return static_cast<VXReportingServerInstance&>(object).restoreSession(reporterID, facts,
                                                                        information);
}

bool VXReportingServiceDelegate::restoreRelay(ExportedObject& object, int64_t reporterID) {
  return static_cast<VXReportingServerInstance&>(object).restoreRelay(reporterID);
}

bool VXReportingServiceDelegate::restoreDelayed(const Payload& facts, const Payload& content,
                                                std::unique_ptr<WorkCause> cause) {
  std::optional<VXReportingDelayedMessage> message =
      VXReportingDelayedMessages::fromFacts(facts, content);
  if (!message) return false;
  VXReportingProcessState::current().delayedMessages().add(std::move(*message), std::move(cause));
  return true;
}

// ---------------------------------------------------------------------------------------------------------------------
// Drivers

std::shared_ptr<DriverSnapShot> VXReportingServiceDelegate::getSnapShot() {
  serviceQueue()->assertIsCurrent();
  return driverUtility_->getSnapShot();
}

std::optional<Payload> VXReportingServiceDelegate::getDriverStatisticsRelativeToSnapShot(
    const std::shared_ptr<DriverSnapShot>& snapShot) {
  serviceQueue()->assertIsCurrent();
  return platform().inputs.once("driver statistics", [&] {
    return driverUtility_->getDriverStatisticsRelativeToSnapShot(snapShot);
  });
}

}  // namespace vx
