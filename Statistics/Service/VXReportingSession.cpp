#include "Statistics/Service/VXReportingSession.h"

#include <algorithm>
#include <cmath>
#include <stdexcept>

#include "Statistics/Service/VXReportingServiceDelegate.h"
#include "Statistics/Service/VXReportingSummaryEvent.h"
#include "Statistics/Service/VXReportingSummaryFile.h"
#include "Statistics/VXReportingProcessState.h"
#include "platform/Log.h"
#include "propertylist/JsonWriter.h"

namespace vx {

namespace {

constexpr uint32_t kTraceCreated = 0x21042828;
constexpr uint32_t kTraceStarted = 0x2104282C;
constexpr uint32_t kTraceStopped = 0x21042830;
constexpr uint32_t kTraceGone = 0x21042834;
constexpr uint32_t kTraceMessage = 0x21042838;
constexpr std::size_t kApproximateMessageBytes = 256;  // of a small one, with its entries
constexpr int32_t kDeviceClassWithoutOrientation = 6;
constexpr const char* kReportingSubdirectory = "/Audio/Reporting";
constexpr const char* kDateFormat = "%Y%m%d-%H%M%S%z";
constexpr unsigned kDirectoryMode = 0777;

// Seconds since `start`, to the nearest millisecond, halves away from zero.
double secondsSince(Date start) {
  const double d = std::chrono::duration<double>(start - platform().clock.now()).count();
  return std::round(d * 1000.0) / -1000.0;
}

}  // namespace

const LogScope* sessionLogScope() { return VXReportingProcessState::current().sessionLogScope(); }

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
  VXReportingProcessState::current().registerSessionLogScope();
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
  serviceQueue()->assertIsCurrent();
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
  serviceQueue()->assertIsCurrent();
  if (entries) userInfo_->merge(*entries);
}

void VXReportingSession::start() {
  serviceQueue()->assertIsCurrent();
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
  serviceQueue()->assertIsCurrent();
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
  // Destroying millions of messages takes its time: not on the queue that serves everybody.
  vyrReportingQueue_->async([flat = aggregatedPayloadData_.removeAll(),
                             nested = nestedAggregatedPayloadData_.removeAll()]() mutable {
    const std::size_t bytes = flat.size() * kApproximateMessageBytes;
    flat = {};
    nested = {};
    platform().threading.memoryWasFreed(bytes);
  });
  started_ = false;
}

// ---------------------------------------------------------------------------------------------------------------------
// Messages

VXReportingSession::KindCount VXReportingSession::nextIdentifier(MessageCategory category,
                                                                 MessageType type) {
  serviceQueue()->assertIsCurrent();
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
  serviceQueue()->assertIsCurrent();
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
// Orientation: changes while a long-form audio or telephony session is started, on internal builds

// Asked at start and again at stop, with the service type of the moment: a type changed in between
// leaves the handlers registered, or finds none to unregister. Intended.
bool VXReportingSession::shouldReportOrientation() const {
  return VXReportingIsInternalBuild() &&
         (serviceType() == kServiceTypeLongFormAudio || serviceType() == kServiceTypeTelephony) &&
         platform().deviceProperties.integer("DeviceClassNumber", 0) !=
             kDeviceClassWithoutOrientation;
}

void VXReportingSession::registerOrientationHandlers() {
  const std::string identifier = "VXReportingService " + std::to_string(reporterID_);
  {
    MutexLock lock(fieldsMutex_);
    orientationCallbackID_ = identifier;
    startDate_ = platform().clock.now();
  }
  OrientationNotifier& notifier = platform().orientation;
  notifier.registerDeviceOrientationHandler(
      identifier, [self = shared_from_this()](int64_t orientation) {
        self->orientationChanged("device", "device_orientation", orientation);
      });
  notifier.registerInterfaceOrientationHandler(
      identifier, [self = shared_from_this()](int64_t orientation) {
        self->orientationChanged("ui", "ui_orientation", orientation);
      });
}

void VXReportingSession::unregisterOrientationHandlers() {
  const std::optional<std::string> identifier = orientationCallbackID();
  if (!identifier) return;
  OrientationNotifier& notifier = platform().orientation;
  notifier.unregisterDeviceOrientationHandler(*identifier);
  notifier.unregisterInterfaceOrientationHandler(*identifier);
  MutexLock lock(fieldsMutex_);
  orientationCallbackID_.reset();
}

void VXReportingSession::orientationChanged(const char* mode, std::string_view key,
                                            int64_t orientation) {
  const std::string name = platform().orientation.orientationText(orientation);
  const std::optional<Date> began = startDate();
  const double time = began ? secondsSince(*began) : 0;
  if (platform().log.isLogEnabled(5, sessionLogScope())) {
    const Payload info = userInfo_->snapshot();
    const std::optional<Value> application = info.find(kHostApplicationDisplayIDKey);
    VX_LOG_AS(
        "start", sessionLogScope(), Debug,
        "Orientation handler callback mode=%s orientation=\"%s\" app=\"%s\", time=%s, id=\"%s\"",
        mode, name.c_str(), application ? application->text().c_str() : "(null)",
        PayloadBuilder().set("t", time).build().find("t")->text().c_str(),
        orientationCallbackID().value_or("(null)").c_str());
  }
  aggregatedPayloadData_.append(
      PayloadBuilder().set(key, name).set(std::string(key) + "_time", time).build());
}

// ---------------------------------------------------------------------------------------------------------------------
// Summary

std::optional<Payload> VXReportingSession::createSummaryEventForSession() const {
  serviceQueue()->assertIsCurrent();
  if (aggregatedPayloadData_.size() == 0) return std::nullopt;
  VXReportingSummaryEvent event(serviceType());
  aggregatedPayloadData_.forEach([&](const Payload& payload) { event.add(payload); });
  try {
    return event.build();
  } catch (const std::length_error& tooLarge) {
    VX_LOG(sessionLogScope(), Error, "no summary event for reporter %lli: %s",
           static_cast<long long>(reporterID_), tooLarge.what());
    return std::nullopt;
  }
}

void VXReportingSession::writeSummaryJson() {
  serviceQueue()->assertIsCurrent();
  if (!VXReportingIsInternalBuild()) return;
  if (!nestedAggregatedPayloadData_.isPresent() || nestedAggregatedPayloadData_.size() == 0) return;
  const Payload information = userInfo_->snapshot();
  nestedAggregatedPayloadData_.insertAtFront(information);

  std::optional<Error> unserialisable;
  auto check = [&](const Payload& payload) {
    if (!unserialisable) unserialisable = checkJson(payload);
  };
  nestedAggregatedPayloadData_.forEach(
      check, [&](const VXReportingNestedEntry& entry) { check(entry.payload); });
  if (unserialisable) {
    VX_LOG(sessionLogScope(), Error, "dataWithJSONObject: %s",
           unserialisable->description().c_str());
  }

  DiagnosticFiles& files = platform().diagnosticFiles;
  const std::string date = platform().clock.formatLocal(platform().clock.now(), kDateFormat);
  const std::string directory = files.logsDirectory() + kReportingSubdirectory;
  if (const std::optional<Error> error = files.createDirectory(directory, kDirectoryMode)) {
    VX_LOG(sessionLogScope(), Error, "can't create logging directory at %s: %s", directory.c_str(),
           error->description().c_str());
  }
  if (unserialisable) return;  // there is no text to write, and nothing more is said

  const std::string name = VXReportingSummaryFile::name(
      date, information.find(kHostApplicationDisplayIDKey), serviceType());
  std::optional<Error> error;
  if (const std::unique_ptr<AtomicFile> file = files.createAtomically(directory, name, error)) {
    VXReportingSummaryFile writer(*file);
    nestedAggregatedPayloadData_.forEach(
        [&](const Payload& header) { writer.element(header); },
        [&](const VXReportingNestedEntry& entry) {
          writer.namedElement(identifierText(static_cast<MessageKind>(entry.kind), entry.count),
                              entry.payload);
        });
    error = writer.finish();
  }
  if (error)
    VX_LOG(sessionLogScope(), Error, "jsonOutput writeToURL: %s", error->description().c_str());
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
