#include "Statistics/Service/VXReportingSession.h"

#include <algorithm>
#include <cmath>
#include <stdexcept>
#include <utility>

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
constexpr int32_t kDeviceClassWithoutOrientation = 6;
constexpr const char* kReportingSubdirectory = "/Audio/Reporting";
constexpr const char* kDateFormat = "%Y%m%d-%H%M%S%z";
constexpr unsigned kDirectoryMode = 0777;

constexpr std::string_view kSavedType = "type";
constexpr std::string_view kSavedStarted = "started";
constexpr std::string_view kSavedPresent = "present";
constexpr std::string_view kSavedAggregate = "aggregate";
constexpr std::string_view kSavedBytes = "bytes";
constexpr std::string_view kSavedLeftOut = "left out";
constexpr std::string_view kSavedCounts = "counts";  // kind, count, kind, count...
// What one client's call may be, and beside it what else a record says.
constexpr std::size_t kMostPieceBytes = std::size_t{512} << 10;

// What a session takes that has received nothing: itself, its queue, its place in the map.
constexpr std::size_t kSessionBytes = 1024;

// Seconds since `start`, to the nearest millisecond, halves away from zero.
double secondsSince(Date start) {
  const double d = std::chrono::duration<double>(start - platform().clock.now()).count();
  return std::round(d * 1000.0) / -1000.0;
}

// Of a summary file: a stop that is run again writes the same file once more.
std::string fileDate() {
  static constexpr std::string_view kDate = "file date";
  const std::optional<Payload> answer =
      platform().inputs.once(kDate, []() -> std::optional<Payload> {
        const std::chrono::duration<double> now = platform().clock.now().time_since_epoch();
        return PayloadBuilder().set(kDate, PayloadDate{now.count()}).build();
      });
  const std::optional<Value> asked = answer ? answer->find(kDate) : std::nullopt;
  return platform().clock.formatLocal(
      asked ? dateFromSeconds(asked->asDouble()) : platform().clock.now(), kDateFormat);
}

}  // namespace

const LogScope* sessionLogScope() { return VXReportingProcessState::current().sessionLogScope(); }

VXReportingUserInfo::VXReportingUserInfo()
    : payer_(platform().aggregates.account().payer), charged_(kSessionBytes) {
  platform().aggregates.charge(payer_, charged_);
}

VXReportingUserInfo::~VXReportingUserInfo() {
  MutexLock lock(mutex_);
  platform().aggregates.charge(payer_, -charged_);
}

bool VXReportingUserInfo::merge(const Payload& entries) {
  MutexLock lock(mutex_);
  const std::size_t size = entries_.encodedSizeWith(entries);
  if (size > kMostBytes) return false;
  entries_.merge(entries);
  whole_.reset();
  if (const std::optional<Value> application = entries.find(kHostApplicationDisplayIDKey))
    application_ = PayloadBuilder().set(kHostApplicationDisplayIDKey, *application).build();
  const auto charge = static_cast<int64_t>(kSessionBytes + entries_.memoryBytes() + size +
                                           application_.encoded().size());
  platform().aggregates.charge(payer_, charge - std::exchange(charged_, charge));
  return true;
}

Payload VXReportingUserInfo::snapshot() const {
  MutexLock lock(mutex_);
  if (!whole_) whole_ = entries_.build();
  return *whole_;
}

std::vector<Payload> VXReportingUserInfo::pieces(std::size_t bytes) const {
  const Payload all = snapshot();
  if (all.encoded().size() <= bytes) return {all};
  std::vector<Payload> pieces;
  PayloadBuilder piece;
  std::size_t size = 0;
  for (const auto& [key, value] : all) {
    const std::size_t more = key.size() + value.encoded().size();
    if (size > 0 && size + more > bytes) {
      pieces.push_back(piece.build());
      piece = PayloadBuilder();
      size = 0;
    }
    piece.set(key, value);
    size += more;
  }
  pieces.push_back(piece.build());
  return pieces;
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

bool VXReportingSession::setConfiguration(const std::optional<Payload>& configuration) {
  return mergeIntoUserInfo(configuration);
}

void VXReportingSession::updateDefaults(const std::optional<Payload>& defaults) {
  (void)mergeIntoUserInfo(defaults);
}

bool VXReportingSession::mergeIntoUserInfo(const std::optional<Payload>& entries) {
  serviceQueue()->assertIsCurrent();
  if (!entries || userInfo_->merge(*entries)) return true;
  VX_LOG(sessionLogScope(), Error,
         "reporter %lli: its user information would be larger than %zu bytes; left as it is",
         static_cast<long long>(reporterID_), VXReportingUserInfo::kMostBytes);
  return false;
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
  received_.renew();
  startedAt_ = platform().clock.now();
  acceptedAtStart_ = acceptedMessages();
  relayOutcome_.state.store(RelayState::SettingUp, std::memory_order_relaxed);
  platform().trace.emit(kTraceStarted, 0, 0, 0, 0);
  if (shouldReportOrientation()) registerOrientationHandlers();
  relaySetUp_ = std::make_shared<RelaySetUp>();
  // The set-up holds the user information itself, not a copy: what is merged before it runs is seen
  // by it.
  vyrReportingQueue_->async([self = shared_from_this(), name = serviceName_, type = serviceType(),
                             done = vyrReportingSessionStarted(),
                             setUp = relaySetUp_] { self->setUpRelay(name, type, done, setUp); });
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
    // As large as all that was received, and about to be dropped with it: not worth a copy.
    deliver(*summary, kCategoryUndefined, kMessageTypeUnknown, Keep::Reference, nullptr);
  }
  writeSummaryJson();
  tellLeftOut();
  vyrReportingQueue_->async([self = shared_from_this()] { self->flushRelay(); });
  // Letting go of what millions of messages left takes its time: not on the queue that serves
  // everybody.
  vyrReportingQueue_->async([contents = received_.removeAll()]() mutable {
    if (contents == nullptr) return;
    const std::size_t bytes = contents->memoryBytes();
    contents.reset();
    platform().threading.memoryWasFreed(bytes);
  });
  started_ = false;
}

// ---------------------------------------------------------------------------------------------------------------------
// Saved and restored

// What was received lies in memory that survives by itself: only its name is saved. Orientation is
// not watched for a client that is gone, nor are drivers asked.
SavedSession VXReportingSession::savedState(bool& complete) const {
  serviceQueue()->assertIsCurrent();
  SavedSession saved;
  saved.reporterID = reporterID_;
  ArrayBuilder counts;
  for (const KindCount& known : messageTypeCounts_) counts.add(known.kind).add(known.count);
  PayloadBuilder facts;
  const VXReportingAggregate::State received = received_.state();
  facts.set(kSavedType, serviceType())
      .set(kSavedStarted, started_)
      .set(kSavedCounts, counts)
      .set(kSavedPresent, received.present)
      .set(kSavedAggregate, received.aggregate)
      .set(kSavedBytes, received.bytes)
      .set(kSavedLeftOut, leftOut_);
  saved.facts = facts.build();
  if (received_.unrecordedBytes() > 0) complete = false;
  saved.information = userInfo_->pieces(kMostPieceBytes);
  if (started_ && relaySetUp_ != nullptr) {
    saved.relay = [setUp = relaySetUp_] {
      MutexLock lock(setUp->mutex);
      return setUp->origin;
    };
  }
  return saved;
}

std::shared_ptr<VXReportingSession> VXReportingSession::restored(
    ReporterID reporterID, std::vector<int32_t> processIdentifiers, const Payload& facts,
    bool& whole) {
  const auto number = [&](std::string_view key) {
    const std::optional<Value> value = facts.find(key);
    return value ? value->asUInt64() : 0;
  };
  const std::optional<Value> type = facts.find(kSavedType);
  const std::optional<Value> started = facts.find(kSavedStarted);
  const std::optional<Value> counts = facts.find(kSavedCounts);
  if (!type || !started || !counts || counts->asArray().size() % 2 != 0) return nullptr;
  auto session = initWithID(reporterID, std::move(processIdentifiers));
  const auto code = static_cast<ServiceType>(type->asUInt64());
  session->serviceType_.store(code, std::memory_order_relaxed);
  session->serviceName_ = VXReportingServiceTypeName(code);
  session->started_ = started->asBool();
  session->leftOut_ = number(kSavedLeftOut);
  std::optional<uint64_t> kind;
  for (const Value& item : counts->asArray()) {
    if (!kind) {
      kind = item.asUInt64();
      if (*kind >= kMessageKinds) return nullptr;
    } else {
      session->messageTypeCounts_.push_back({static_cast<MessageKind>(*kind), item.asUInt64()});
      kind.reset();
    }
  }
  const Status received = session->received_.restore({.present = number(kSavedPresent) != 0,
                                                      .aggregate = number(kSavedAggregate),
                                                      .bytes = number(kSavedBytes)});
  if (!received.ok()) {
    VX_LOG(sessionLogScope(), Error, "reporter %lli: %s", static_cast<long long>(reporterID),
           received.text().c_str());
    whole = false;
  }
  return session;
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

std::string VXReportingSession::messageIdForCategory(MessageCategory category, MessageType type) {
  const KindCount issued = nextIdentifier(category, type);
  return messageIdentifier(issued.kind, issued.count);
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

void VXReportingSession::onLeftOut() {
  if (leftOut_++ > 0) return;
  VX_LOG(sessionLogScope(), Error,
         "reporter %lli: its summary leaves out messages from here on, because whoever sends them "
         "makes the service hold too much already",
         static_cast<long long>(reporterID_));
  platform().aggregates.leftOut(reporterID_, 0);
}

void VXReportingSession::tellLeftOut() {
  if (leftOut_ == 0) return;
  VX_LOG(sessionLogScope(), Error, "reporter %lli: its summary leaves out %llu messages",
         static_cast<long long>(reporterID_), static_cast<unsigned long long>(leftOut_));
  platform().aggregates.leftOut(reporterID_, leftOut_);
  leftOut_ = 0;
}

void VXReportingSession::sendMessage(const Payload& message, MessageCategory category,
                                     MessageType type, Sync, MessageReply reply) {
  deliver(message, category, type, Keep::Copy, std::move(reply));
}

void VXReportingSession::deliver(const Payload& message, MessageCategory category, MessageType type,
                                 Keep keep, MessageReply reply) {
  static constexpr const char* kFunction = "sendMessage";
  serviceQueue()->assertIsCurrent();
  if (platform().log.isLogEnabled(5, sessionLogScope())) {
    VX_LOG_AS(kFunction, sessionLogScope(), Debug, "sending message for session owned by %lli",
              static_cast<long long>(reporterID_));
  }
  Payload normalised = normalizePayloadKeys(message);
  const KindCount identifier = nextIdentifier(category, type);
  if (keep == Keep::Copy) {
    if (!received_.appendMessage(identifier.kind, identifier.count, normalised)) onLeftOut();
  } else {
    received_.appendReference(identifier.kind, identifier.count, normalised);
  }
  platform().trace.emit(kTraceMessage, 0, 0, 0, 0);
  // What the client sent goes along only where it is another object: a count less to keep.
  std::optional<Payload> asSent;
  if (!normalised.isSameObject(message)) asSent = message;
  // Behind a set-up it may wait for long; where the call was recorded it must not.
  if (keep == Keep::Copy && relaySetUp_ != nullptr && !relaySetUp_->isOver) {
    normalised = PayloadBuilder(normalised).build();
    if (asSent) asSent = PayloadBuilder(*asSent).build();
  }
  const std::size_t holds = normalised.encoded().size();
  vyrReportingQueue_->async(
      [self = shared_from_this(), normalised = std::move(normalised), asSent = std::move(asSent),
       category, type, startedNow = started_] {
        self->relayMessage(normalised, asSent ? *asSent : normalised, category, type, startedNow);
      },
      holds);
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
      identifier, this, [self = shared_from_this()](int64_t orientation) {
        self->orientationChanged("device", "device_orientation", orientation);
      });
  notifier.registerInterfaceOrientationHandler(
      identifier, this, [self = shared_from_this()](int64_t orientation) {
        self->orientationChanged("ui", "ui_orientation", orientation);
      });
}

void VXReportingSession::unregisterOrientationHandlers() {
  const std::optional<std::string> identifier = orientationCallbackID();
  if (!identifier) return;
  OrientationNotifier& notifier = platform().orientation;
  notifier.unregisterDeviceOrientationHandler(*identifier, this);
  notifier.unregisterInterfaceOrientationHandler(*identifier, this);
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
  received_.appendToFlat(
      PayloadBuilder().set(key, name).set(std::string(key) + "_time", time).build());
}

// ---------------------------------------------------------------------------------------------------------------------
// Summary

std::optional<Payload> VXReportingSession::createSummaryEventForSession() const {
  serviceQueue()->assertIsCurrent();
  if (received_.flatSize() == 0) return std::nullopt;
  VXReportingSummaryEvent event(serviceType());
  received_.forEach([&](const VXReportingRow& row) { event.add(row); });
  try {
    return event.build();
  } catch (const std::length_error& tooLarge) {
    VX_LOG(sessionLogScope(), Error, "no summary event for reporter %lli: %s",
           static_cast<long long>(reporterID_), tooLarge.what());
    return std::nullopt;
  }
}

// The first number of the nested aggregate that JSON has no form for.
std::optional<Error> VXReportingSession::checkNested() const {
  std::optional<Error> found;
  const auto check = [&](const Payload& payload) {
    if (!found) found = checkJson(payload);
  };
  if (!received_.mayHoldNonFinite()) {
    received_.forEachHeader(check);
    return found;
  }
  received_.forEach(check, [&](const VXReportingRow& row) {
    if (!found && row.kind) check(row.payload());
  });
  return found;
}

void VXReportingSession::writeSummaryJson() {
  serviceQueue()->assertIsCurrent();
  const std::string date = fileDate();  // each stop asks: what comes after it keeps its place
  if (!VXReportingIsInternalBuild()) return;
  if (!received_.isPresent() || received_.nestedSize() == 0) return;
  const Payload information = userInfo_->snapshot();
  received_.insertHeader(information);
  const std::optional<Error> unserialisable = checkNested();
  if (unserialisable) {
    VX_LOG(sessionLogScope(), Error, "dataWithJSONObject: %s",
           unserialisable->description().c_str());
  }

  DiagnosticFiles& files = platform().diagnosticFiles;
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
    received_.forEach([&](const Payload& header) { writer.element(header); },
                      [&](const VXReportingRow& row) {
                        if (row.kind) writer.message(row);
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
  if (!received_.isPresent()) return std::nullopt;
  std::vector<Payload> all;
  received_.forEach([&](const VXReportingRow& row) { all.push_back(row.payload()); });
  return all;
}

std::optional<std::vector<Payload>> VXReportingSession::nestedAggregatedPayloadData() const {
  if (!received_.isPresent()) return std::nullopt;
  std::vector<Payload> all;
  received_.forEach([&](const Payload& header) { all.push_back(header); },
                    [&](const VXReportingRow& row) {
                      if (!row.kind) return;
                      const std::string identifier = messageIdentifier(*row.kind, row.count);
                      all.push_back(PayloadBuilder().set(identifier, row.payload()).build());
                    });
  return all;
}

std::string VXReportingSession::description() const {
  return "<VXReportingSession " + std::to_string(reporterID_) + ">";
}

}  // namespace vx
