#include "Statistics/Service/VXReportingSession.h"

#include <algorithm>

#include "platform/Log.h"

namespace vx {

namespace {

constexpr uint32_t kTraceCreated = 0x21042828;
constexpr uint32_t kTraceStarted = 0x2104282C;
constexpr uint32_t kTraceStopped = 0x21042830;
constexpr uint32_t kTraceGone = 0x21042834;
constexpr uint32_t kTraceMessage = 0x21042838;
constexpr std::size_t kManyMessages = 4096;  // a megabyte or so
constexpr std::chrono::seconds kUntilStored{2};

Mutex scopeMutex;
bool scopeRegistered GUARDED_BY(scopeMutex) = false;
std::atomic<const LogScope*> registeredScope{nullptr};

void registerScopeOnce() {
  MutexLock lock(scopeMutex);
  if (scopeRegistered) return;
  scopeRegistered = true;
  registeredScope.store(
      platform().log.registerScope(true, fourCharacterCode("vxrr"), "vxrr", "com.quorvel.sonik",
                                   "reporting_session_verbose", 31),
      std::memory_order_release);
}

}  // namespace

const LogScope* sessionLogScope() { return registeredScope.load(std::memory_order_acquire); }

namespace testing_hooks {
void forgetSessionLogScope() {
  MutexLock lock(scopeMutex);
  scopeRegistered = false;
  registeredScope.store(nullptr);
}
}  // namespace testing_hooks

void VXReportingUserInfo::merge(const Payload& entries) {
  MutexLock lock(mutex_);
  if (entries_.empty())
    entries_ = entries;
  else
    entries_ = PayloadBuilder(entries_).merge(entries).build();
}

// ---------------------------------------------------------------------------------------------------------------------
// Life

VXReportingSession::VXReportingSession(ReporterID reporterID,
                                       std::vector<int32_t> processIdentifiers)
    : reporterID_(reporterID), processIdentifiers_(std::move(processIdentifiers)) {}

std::shared_ptr<VXReportingSession> VXReportingSession::initWithID(
    ReporterID reporterID, std::vector<int32_t> processIdentifiers) {
  struct Constructible : VXReportingSession {
    Constructible(ReporterID id, std::vector<int32_t> pids)
        : VXReportingSession(id, std::move(pids)) {}
  };
  registerScopeOnce();
  auto session = std::make_shared<Constructible>(reporterID, std::move(processIdentifiers));
  session->vyrReportingQueue_ = platform().workQueues.makeSerial(
      "com.quorvel.sonik.session.vyrreporting", QualityOfService::Utility);
  VX_LOG(sessionLogScope(), Info, "created reporting session for ID: %lli",
         static_cast<long long>(reporterID));
  platform().trace.emit(kTraceCreated, 0, 0, 0, 0);
  return session;
}

VXReportingSession::~VXReportingSession() {
  platform().trace.emit(kTraceGone, 0, 0, 0, 0);
  VX_LOG_AS("dealloc", sessionLogScope(), Info, "deallocing this session %lli",
            static_cast<long long>(reporterID_));
}

void VXReportingSession::setServiceType(ServiceType type) {
  serviceType_.store(type, std::memory_order_relaxed);
  serviceName_ = VXReportingServiceTypeName(type);
  VX_LOG(sessionLogScope(), Info, "setting service type %s", std::string(serviceName_).c_str());
}

void VXReportingSession::setConfiguration(const std::optional<Payload>& configuration) {
  mergeIntoUserInfo(configuration);
}

void VXReportingSession::updateDefaults(const std::optional<Payload>& defaults) {
  mergeIntoUserInfo(defaults);
}

void VXReportingSession::mergeIntoUserInfo(const std::optional<Payload>& entries) {
  if (entries) userInfo_->merge(*entries);
}

void VXReportingSession::start() {
  VX_VERBOSE(sessionLogScope(), "starting session owned by %lli",
             static_cast<long long>(reporterID_));
  if (started_) {
    VX_LOG(sessionLogScope(), Info, "%lli is already started", static_cast<long long>(reporterID_));
    return;
  }
  started_ = true;
  aggregatedPayloadData_.renew();
  nestedAggregatedPayloadData_.renew();
  platform().trace.emit(kTraceStarted, 0, 0, 0, 0);
  if (shouldReportOrientation()) registerOrientationHandlers();
  // The set-up holds the user information itself, not a copy: what is merged before it runs is seen
  // by it.
  vyrReportingQueue_->async(
      [self = shared_from_this(), name = serviceName_, type = serviceType(),
       done = vyrReportingSessionStarted()] { self->setUpRelay(name, type, done); });
}

void VXReportingSession::stop() {
  VX_VERBOSE(sessionLogScope(), "ending session %lli", static_cast<long long>(reporterID_));
  if (shouldReportOrientation()) unregisterOrientationHandlers();
  if (!started_) return;
  VX_VERBOSE(sessionLogScope(), "ending session %lli", static_cast<long long>(reporterID_));
  platform().trace.emit(kTraceStopped, 0, 0, 0, 0);
  if (const std::optional<Payload> summary = createSummaryEventForSession()) {
    VX_LOG(sessionLogScope(), Default, "sending summary event for reporter %lli",
           static_cast<long long>(reporterID_));
    sendMessage(*summary, kCategoryUndefined, kMessageTypeUnknown, Sync::Yes, nullptr);
  }
  writeSummaryJson();
  vyrReportingQueue_->async([self = shared_from_this()] { self->flushRelay(); });
  const bool many = aggregatedPayloadData_.size() >= kManyMessages;
  auto flat = aggregatedPayloadData_.removeAll();
  auto nested = nestedAggregatedPayloadData_.removeAll();
  // Letting go of millions of messages takes its time: not on the queue that serves everybody.
  vyrReportingQueue_->async([flat = std::move(flat), nested = std::move(nested)]() mutable {
    flat = {};
    nested = {};
  });
  // The platform lets go of the last of them a moment later, when they are where they belong.
  if (many)
    vyrReportingQueue_->asyncAfter(kUntilStored, [] { platform().threading.memoryWasFreed(); });
  started_ = false;
}

// ---------------------------------------------------------------------------------------------------------------------
// Messages

VXReportingSession::KindCount VXReportingSession::nextIdentifier(MessageCategory category,
                                                                 MessageType type) {
  const MessageKind kind = messageKind(category, type);
  for (KindCount& known : messageTypeCounts_) {
    if (known.kind == kind) return {kind, ++known.count};
  }
  messageTypeCounts_.push_back({kind, 1});
  return {kind, 1};
}

std::string VXReportingSession::identifierText(MessageKind kind, uint64_t count) {
  return messageKindName(kind, '_') + "_" + std::to_string(count);
}

std::string VXReportingSession::messageIdForCategory(MessageCategory category, MessageType type) {
  const KindCount issued = nextIdentifier(category, type);
  return identifierText(issued.kind, issued.count);
}

Payload VXReportingSession::normalizePayloadKeys(const Payload& payload) {
  if (!payload.hasSpaceInKeys()) return payload;
  PayloadBuilder normalised;
  std::string key;
  for (const auto& [name, value] : payload) {
    key = name;
    std::replace(key.begin(), key.end(), ' ', '_');
    normalised.set(key, value);
  }
  return normalised.build();
}

void VXReportingSession::sendMessage(const Payload& message, MessageCategory category,
                                     MessageType type, Sync, MessageReply reply) {
  VX_VERBOSE(sessionLogScope(), "sending message for session owned by %lli",
             static_cast<long long>(reporterID_));
  Payload normalised = normalizePayloadKeys(message);
  const KindCount identifier = nextIdentifier(category, type);
  aggregatedPayloadData_.append(normalised);
  nestedAggregatedPayloadData_.append(
      {normalised, identifier.count & ((uint64_t{1} << 48) - 1), identifier.kind});
  platform().trace.emit(kTraceMessage, 0, 0, 0, 0);
  // What the client sent goes along only where it is another object: a count less to keep.
  std::optional<Payload> asSent;
  if (!normalised.isSameObject(message)) asSent = message;
  vyrReportingQueue_->async([self = shared_from_this(), normalised = std::move(normalised),
                             asSent = std::move(asSent), category, type, startedNow = started_] {
    self->relayMessage(normalised, asSent ? *asSent : normalised, category, type, startedNow);
  });
  if (reply) reply(std::nullopt);
}

// ---------------------------------------------------------------------------------------------------------------------
// Fields

std::optional<std::string> VXReportingSession::orientationCallbackID() const {
  MutexLock lock(fieldsMutex_);
  return orientationCallbackID_;
}

std::optional<Date> VXReportingSession::startDate() const {
  MutexLock lock(fieldsMutex_);
  return startDate_;
}

std::shared_ptr<VyrReportingSession> VXReportingSession::vyrReportingSession() const {
  MutexLock lock(fieldsMutex_);
  return vyrReportingSession_;
}

std::shared_ptr<const VyrSecureHierarchyToken> VXReportingSession::vyrReportingAgentToken() const {
  MutexLock lock(fieldsMutex_);
  return vyrReportingAgentToken_;
}

void VXReportingSession::setVyrReportingSession(std::shared_ptr<VyrReportingSession> session) {
  MutexLock lock(fieldsMutex_);
  vyrReportingSession_.swap(session);  // the old one goes after the lock
}

void VXReportingSession::setVyrReportingAgentToken(
    std::shared_ptr<const VyrSecureHierarchyToken> token) {
  MutexLock lock(fieldsMutex_);
  vyrReportingAgentToken_.swap(token);
}

std::optional<std::vector<Payload>> VXReportingSession::aggregatedPayloadData() const {
  if (!aggregatedPayloadData_.isPresent()) return std::nullopt;
  std::vector<Payload> all;
  aggregatedPayloadData_.forEach([&](const Payload& payload) { all.push_back(payload); });
  return all;
}

std::optional<std::vector<Payload>> VXReportingSession::nestedAggregatedPayloadData() const {
  if (!nestedAggregatedPayloadData_.isPresent()) return std::nullopt;
  std::vector<Payload> all;
  nestedAggregatedPayloadData_.forEach(
      [&](const Payload& header) { all.push_back(header); },
      [&](const VXReportingNestedEntry& entry) {
        all.push_back(PayloadBuilder()
                          .set(identifierText(static_cast<MessageKind>(entry.kind), entry.count),
                               entry.payload)
                          .build());
      });
  return all;
}

std::string VXReportingSession::description() const {
  return "<VXReportingSession " + std::to_string(reporterID_) + ">";
}

}  // namespace vx
