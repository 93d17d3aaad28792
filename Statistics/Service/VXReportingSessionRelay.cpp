// The session and the reporting relay: set-up, sends and flush, all on the session's own queue, and
// standalone messages on the background queue.
#include <algorithm>
#include <cstdlib>

#include "Statistics/Service/VXReportingSession.h"
#include "Statistics/VXReportingProcessState.h"
#include "platform/Log.h"

namespace vx {

namespace {

constexpr uint32_t kTraceMessage = 0x21042838;
constexpr int32_t kClientType = 19;
constexpr const char* kClientVersion = "2.0";
constexpr std::string_view kClientName = "com.quorvel.sonik";
// Seconds; parsed as single precision, then widened.
constexpr const char* kConfigurationTimeLimit = "9.0";
constexpr uint32_t kAlarmDelaySeconds = 60;  // exclusive

float clientVersion() { return std::strtof(kClientVersion, nullptr); }

// When a standalone message of that service type goes out; none for at once. Decided once,
// whatever happens to the process meanwhile.
std::optional<Date> standaloneDue(ServiceType serviceType, Date now) {
  static constexpr std::string_view kDue = "standalone due";
  const std::optional<Payload> answer =
      platform().inputs.once(kDue, [&]() -> std::optional<Payload> {
        if (serviceType != kServiceTypeAlarms) return std::nullopt;
        const std::chrono::duration<double> due =
            now.time_since_epoch() +
            std::chrono::seconds(platform().random.below(kAlarmDelaySeconds));
        return PayloadBuilder().set(kDue, PayloadDate{due.count()}).build();
      });
  const std::optional<Value> due = answer ? answer->find(kDue) : std::nullopt;
  if (!due) return std::nullopt;
  return dateFromSeconds(due->asDouble());
}

uint16_t relayCategory(MessageCategory category) {
  return static_cast<uint16_t>(category & 0xFFFF);
}

std::string listText(const VyrReportingSession::BackendList& backends) {
  std::string text = "(";
  for (const std::string& backend : backends) text += (text.size() > 1 ? ", " : "") + backend;
  return text + ")";
}

// The configuration-done flag and its condition. The completion handler may come after the set-up
// has given up, so both parties own them.
struct ConfigurationState {
  std::unique_ptr<Condition> condition = platform().threading.makeCondition();
  bool done = false;  // guarded by the condition's lock
};

}  // namespace

std::shared_ptr<VyrReportingSession> VXReportingSession::openRelay(std::string_view serviceName,
                                                                   ServiceType serviceTypeThen) {
  setVyrReportingAgentToken(
      platform().vyrReporting.newSecureHierarchyTokenFromParentToken(nullptr));
  const bool realtime = serviceTypeThen == kServiceTypeApiUsage;
  const VyrSessionInfo sessionInfo = {
      {kVyrReportingSessionInfoClientType, kClientType},
      {kVyrReportingSessionInfoClientVersion, clientVersion()},
      {kVyrReportingSessionInfoSessionID, int64_t{reporterID_}},
      {kVyrReportingSessionInfoBatchEvent, !realtime},
      {kVyrReportingSessionInfoHierarchyToken, vyrReportingAgentToken()},
      {kVyrReportingSessionInfoContainsRealtimeEvents, realtime},
  };
  PayloadBuilder userInformation;
  userInformation.set(kVyrReportingUserInfoClientName, kClientName);
  userInformation.set(kVyrReportingUserInfoServiceName, std::string(serviceName) + "_session");
  const Payload configured = userInfo_->snapshot();
  if (!configured.empty()) userInformation.merge(configured);
  std::shared_ptr<VyrReportingSession> relay =
      platform().vyrReporting.initWithSessionInfo(sessionInfo, userInformation.build(), {});
  setVyrReportingSession(relay);
  relayOutcome_.state.store(RelayState::Open, std::memory_order_relaxed);
  MutexLock lock(fieldsMutex_);
  storedMessages_ = relay->storedMessages();
  return relay;
}

void VXReportingSession::restoreRelay() { (void)openRelay(serviceName_, serviceType()); }

void VXReportingSession::setUpRelay(std::string_view serviceName, ServiceType serviceTypeThen,
                                    bool configurationDone,
                                    const std::shared_ptr<RelaySetUp>& setUp) {
  vyrReportingQueue_->assertIsCurrent();
  resetOutcome();
  if (serviceType() != kServiceTypeTest) {
    relayOrigin_ = platform().workQueues.currentOrigin();
    configureRelay(openRelay(serviceName, serviceTypeThen), configurationDone);
  }
  setUp->isOver = true;
  MutexLock lock(setUp->mutex);
  if (vyrReportingSession() != nullptr) setUp->origin = relayOrigin_;
}

void VXReportingSession::configureRelay(const std::shared_ptr<VyrReportingSession>& relay,
                                        bool configurationDone) {
  static constexpr const char* kFunction = "start";
  const auto state = std::make_shared<ConfigurationState>();
  state->done = configurationDone;
  relay->startConfigurationWithCompletionHandler(
      [state](std::optional<VyrReportingSession::BackendList> backends) {
        if (!backends) {
          VX_LOG_AS(kFunction, sessionLogScope(), Error,
                    "No backends found, this session won't get sent to the server");
          return;  // the waiter runs out of time
        }
        VX_LOG_AS(kFunction, sessionLogScope(), Default, "List of backends %s",
                  listText(*backends).c_str());
        state->condition->lock();
        state->done = true;
        state->condition->signal();
        state->condition->unlock();
      });
  bool foundBackends = false;
  {
    Blocking blocking(platform().workQueues);
    foundBackends = VXReportingUtilityWait(*state->condition, state->done,
                                           "waiting for vyrreportingd to find backends",
                                           "failed to find backend", sessionLogScope(),
                                           double{std::strtof(kConfigurationTimeLimit, nullptr)});
  }
  if (!foundBackends) {
    setVyrReportingSession(nullptr);
    setVyrReportingSessionStarted(false);
    relayOutcome_.state.store(RelayState::NoBackend, std::memory_order_relaxed);
  }
}

void VXReportingSession::resetOutcome() {
  const bool isTest = serviceType() == kServiceTypeTest;
  relayOutcome_.state.store(isTest ? RelayState::Test : RelayState::SettingUp,
                            std::memory_order_relaxed);
  for (std::atomic<uint64_t>* counter :
       {&relayOutcome_.relayed, &relayOutcome_.alone, &relayOutcome_.notAllowed,
        &relayOutcome_.noRelay, &relayOutcome_.refused})
    counter->store(0, std::memory_order_relaxed);
}

void VXReportingSession::relayMessage(const Payload& normalised, const Payload& message,
                                      MessageCategory category, MessageType type,
                                      bool startedThen) {
  vyrReportingQueue_->assertIsCurrent();
  static constexpr const char* kFunction = "sendMessage";
  if (!startedThen) {
    countOne(relayOutcome_.alone);
    if (platform().log.isLogEnabled(5, sessionLogScope())) {
      VX_LOG_AS(kFunction, sessionLogScope(), Debug,
                "session not started, will send as a single message");
    }
    sendSingleMessage(normalised, category, type, serviceType(), userInfo_->snapshot(), nullptr);
    return;
  }
  if (serviceType() == kServiceTypeTest) {
    countOne(relayOutcome_.notAllowed);
    VX_LOG_AS(kFunction, sessionLogScope(), Info, "transactions aren't allowed on this platform");
    return;
  }
  const std::shared_ptr<VyrReportingSession> relay = vyrReportingSession();
  if (relay == nullptr) {
    countOne(relayOutcome_.noRelay);
    const Error error{kGenericErrorDomain, -1, "No valid VyrReportingSession"};
    VX_LOG_AS(kFunction, sessionLogScope(), Error, "%s", error.reason.c_str());
    return;
  }
  std::optional<Error> sendError;
  if (relay->sendMessageWithCategory(relayCategory(category), type, normalised, sendError)) {
    countOne(relayOutcome_.relayed);
    if (platform().log.isLogEnabled(5, sessionLogScope())) {
      VX_LOG_AS(kFunction, sessionLogScope(), Debug,
                "VyrReportingAgent %s : message %s : category %i : type %i",
                relay->description().c_str(), message.text().c_str(), static_cast<int>(category),
                int{type});
    }
    return;
  }
  countOne(relayOutcome_.refused);
  // A failed send is silent. The line below looks at an error slot that belongs to this piece of
  // work and is always empty, not at the error the send returned; the silence is intended.
  const std::optional<Error> error;
  if (error)
    VX_LOG_AS(kFunction, sessionLogScope(), Error, "error sending message %s",
              error->description().c_str());
}

void VXReportingSession::flushRelay() {
  vyrReportingQueue_->assertIsCurrent();
  static constexpr const char* kFunction = "stop";
  if (serviceType() == kServiceTypeTest) return;
  relayOutcome_.state.store(RelayState::Ended, std::memory_order_relaxed);
  if (const std::shared_ptr<VyrReportingSession> relay = vyrReportingSession()) {
    relay->flushMessagesWithCompletion([](std::optional<Error> error) {
      if (error)
        VX_LOG_AS(kFunction, sessionLogScope(), Error, "flush error %s",
                  error->description().c_str());
    });
  }
  setVyrReportingSession(nullptr);
}

void VXReportingSession::sendSingleMessage(const Payload& message, MessageCategory category,
                                           MessageType type, ServiceType serviceType,
                                           const std::optional<Payload>&, MessageReply reply) {
  const Date now = platform().clock.now();
  const std::optional<Date> due = standaloneDue(serviceType, now);
  const std::chrono::nanoseconds delay =
      due ? std::max<std::chrono::nanoseconds>(*due - now, {}) : std::chrono::nanoseconds(0);
  VX_VERBOSE(sessionLogScope(), "sending single message after delta %lli for service %i",
             static_cast<long long>(std::chrono::round<std::chrono::seconds>(delay).count()),
             int{serviceType});
  if (delay.count() > 0) {
    return VXReportingProcessState::current().delayedMessages().add(
        {message, category, type, serviceType, *due, std::move(reply)});
  }
  platform().workQueues.background().async(
      [message, reply = std::move(reply), category, serviceType, type] {
        sendSingleMessageNow(message, category, type, serviceType, reply);
      },
      message.encoded().size());
}

void VXReportingSession::sendSingleMessageNow(const Payload& message, MessageCategory category,
                                              MessageType type, ServiceType serviceType,
                                              const MessageReply& reply) {
  static constexpr const char* kFunction = "sendSingleMessage";
  const bool verbose = platform().log.isLogEnabled(5, sessionLogScope());
  platform().trace.emit(kTraceMessage, 0, 0, 0, 0);
  if (verbose) VX_LOG_AS(kFunction, sessionLogScope(), Debug, "sending single message");
  const VyrSessionInfo sessionInfo = {
      {kVyrReportingSessionInfoClientType, kClientType},
      {kVyrReportingSessionInfoClientVersion, clientVersion()},
      {kVyrReportingSessionInfoSessionID, int32_t{-1}},
  };
  const Payload userInformation =
      PayloadBuilder()
          .set(kVyrReportingUserInfoClientName, kClientName)
          .set(kVyrReportingUserInfoServiceName, VXReportingServiceTypeName(serviceType))
          .build();
  std::optional<Error> error;
  const bool sent = platform().vyrReporting.sendOneMessageWithSessionInfo(
      sessionInfo, userInformation, relayCategory(category), type, normalizePayloadKeys(message),
      error);
  if (sent) {
    error.reset();
    if (verbose) {
      VX_LOG_AS(kFunction, sessionLogScope(), Debug, "message %s : category %i : type %i",
                message.text().c_str(), static_cast<int>(category), int{type});
    }
  } else if (error) {
    VX_LOG_AS(kFunction, sessionLogScope(), Error, "sendOneMessageWithSessionInfo %s",
              error->description().c_str());
  }
  if (reply) reply(error);
}

}  // namespace vx
