#include "platform/linux/Inspection.h"

#include <unistd.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <utility>
#include <vector>

namespace vx::lnx {

namespace {

constexpr std::size_t kMostConnectionsListed = 256;
constexpr std::string_view kSummaries = "/Audio/Reporting";

int64_t milliseconds(std::chrono::nanoseconds time) {
  return std::chrono::duration_cast<std::chrono::milliseconds>(time).count();
}

Payload describe(const DevicePropertyOptions& device) {
  return PayloadBuilder()
      .set("internal_build", device.internalBuild)
      .set("device_class_number", device.deviceClassNumber)
      .build();
}

Payload describe(const LogOptions& log) {
  static constexpr const char* kDestinations[] = {"auto", "journal", "stderr"};
  static constexpr const char* kLevels[] = {"debug", "info", "default", "error"};
  PayloadBuilder all;
  all.set("destination", kDestinations[static_cast<std::size_t>(log.destination)]);
  all.set("level", kLevels[static_cast<std::size_t>(log.level)]);
  return all.set("burst", log.burst).set("refill_per_second", log.refillPerSecond).build();
}

Payload describe(const ListenerOptions& listener) {
  ArrayBuilder users;
  for (const uid_t user : listener.killAllowedUsers) users.add(user);
  return PayloadBuilder()
      .set("max_connections", listener.maxConnections)
      .set("max_connections_per_user", listener.maxConnectionsPerUser)
      .set("max_sessions_per_connection", listener.maxSessionsPerConnection)
      .set("max_identifiers", listener.maxIdentifiers)
      .set("max_calls_in_flight", listener.maxCallsInFlight)
      .set("max_frame_bytes", listener.maxFrameBytes)
      .set("max_unread_reply_bytes", listener.maxUnreadReplyBytes)
      .set("stalled_client_timeout_ms", listener.stalledClientTimeout.count())
      .set("kill_allowed_users", users)
      .build();
}

// As platform.toml would have to say it.
Payload describe(const PlatformConfiguration& c) {
  ArrayBuilder backends;
  for (const std::string& name : c.relay.backends) backends.add(name);
  const auto table = [] { return PayloadBuilder(); };
  return PayloadBuilder()
      .set("device", describe(c.device))
      .set("log", describe(c.log))
      .set("relay", table().set("backends", backends).build())
      .set("store", table()
                        .set("max_bytes", c.store.maxBytes)
                        .set("max_age_days", c.store.maxAgeDays)
                        .set("queue_bytes", c.memory.maxWaitingBytes)
                        .set("commit_interval_ms", c.store.commit.interval.count())
                        .build())
      .set("memory", table()
                         .set("max_user_bytes", c.memory.maxUserBytes)
                         .set("max_bytes", c.memory.maxBytes)
                         .set("max_user_waiting_bytes", c.memory.maxUserWaitingBytes)
                         .build())
      .set("listener", describe(c.listener))
      .set("inspect", table().set("group", c.inspect.group).build())
      .set("drivers",
           table().set("root", c.drivers.root).set("mapped", c.drivers.mapped.size()).build())
      .set("orientation", table()
                              .set("device_sensor", c.orientation.deviceSensor)
                              .set("interface_state_file", c.orientation.interfaceStateFile)
                              .build())
      .set("preferences", table()
                              .set("settle_ms", c.preferences.settle.count())
                              .set("poll_interval_ms", c.preferences.pollInterval.count())
                              .build())
      .build();
}

Payload describe(const ListenerCounters& counters) {
  PayloadBuilder all;
#define VX_COUNTER_ENTRY(field, name) all.set(name, counters.field);
  VX_LISTENER_COUNTERS(VX_COUNTER_ENTRY)
#undef VX_COUNTER_ENTRY
  return all.build();
}

Payload describe(const StoreAccount& store) {
  PayloadBuilder all;
  all.set("path", store.path)
      .set("bytes", store.fileBytes)
      .set("log_bytes", store.logBytes)
      .set("max_bytes", store.maxBytes)
      .set("rows_committed", store.counters.rowsCommitted)
      .set("commits", store.counters.commits)
      .set("write_failures", store.counters.writeFailures)
      .set("can_be_written", !store.failing);
  if (store.oldest) all.set("oldest", PayloadDate{*store.oldest});
  PayloadBuilder ledger;
  for (const auto& [cause, rows] : store.ledgerRows) ledger.set(cause, rows);
  return all.set("ledger_rows", ledger.build()).build();
}

Payload bounded(std::string_view unit, int64_t now, uint64_t bound) {
  return PayloadBuilder().set(unit, now).set("bound", bound).build();
}

std::optional<ErasureSelection> selectionOf(const Payload& asked) {
  ErasureSelection which;
  if (asked.size() != 1) return std::nullopt;
  if (const auto application = asked.find("application"); application && application->isString())
    which.application = std::string(application->asString());
  const auto user = asked.find("user");
  if (user && user->kind() == ValueKind::Integer && user->asInt64() >= 0 &&
      user->asInt64() <= int64_t{UINT32_MAX})
    which.user = static_cast<uint32_t>(user->asInt64());
  const auto before = asked.find("before");
  if (before && (before->isNumber() || before->kind() == ValueKind::Date) &&
      std::isfinite(before->asDouble()))
    which.before = before->asDouble();
  if (!which.application && !which.user && !which.before) return std::nullopt;
  return which;
}

}  // namespace

// ---------------------------------------------------------------------------------------------------------------------
// What a connection may ask

// Owned by its connection; interactive thread. What a follower has not been told yet is bounded:
// beyond kMostMessages or kMostBytes messages are left out, and counted. It is told no more often
// than every kPause, so that following costs a busy service little.
class Inspection::Inspector final : public ExportedObject,
                                    public MessageWatcher,
                                    public std::enable_shared_from_this<Inspector> {
 public:
  explicit Inspector(Inspection& inspection) : inspection_(inspection) {}

  void status(Reply reply) {
    if (ServiceInspection* service = inspection_.service()) {
      service->totals([this, self = shared_from_this(), reply = std::move(reply)](
                          const Payload& totals) { reply(inspection_.status(totals)); });
    }
  }
  void connections(int64_t first, Reply reply) {
    if (ServiceInspection* service = inspection_.service()) {
      service->clients([this, self = shared_from_this(), first = place(first),
                        reply = std::move(reply)](const std::vector<Client>& clients) {
        reply(inspection_.connections(first, clients));
      });
    }
  }
  void sessions(int64_t first, Reply reply) {
    if (ServiceInspection* service = inspection_.service())
      service->sessions(place(first), answerTo(std::move(reply)));
  }
  void session(int64_t session, Reply reply) {
    if (ServiceInspection* service = inspection_.service())
      service->session(session, answerTo(std::move(reply)));
  }
  void follow(int64_t session, std::optional<std::vector<int64_t>> categories, Reply reply) {
    ServiceInspection* const service = inspection_.service();
    if (service == nullptr) return;
    session_ = session;
    categories_ = std::move(categories);
    if (!following_) service->watch(weak_from_this());
    following_ = true;
    if (waiting_) tell();  // whoever asked before is not left without an answer
    waiting_ = std::move(reply);
    tellSoon();
  }
  void erase(const Payload& which, Reply reply) { inspection_.erase(which, std::move(reply)); }

  // MessageWatcher
  bool wants(int64_t session, uint32_t category) override {
    if (session_ != 0 && session != session_) return false;
    if (categories_ && std::ranges::find(*categories_, int64_t{category}) == categories_->end())
      return false;
    if (messages_.size() < kMostMessages && bytes_ < kMostBytes) return true;
    ++leftOut_;
    ++inspection_.notFollowed_;
    return false;
  }
  void routed(Payload message) override {
    bytes_ += message.encoded().size();
    messages_.push_back(std::move(message));
    tellSoon();
  }

 private:
  using Client = ServiceInspection::Client;
  static constexpr std::size_t kMostMessages = 256;
  static constexpr std::size_t kMostBytes = 128 << 10;  // and one message more
  static constexpr std::chrono::milliseconds kPause{100};

  static std::size_t place(int64_t first) {
    return first > 0 ? static_cast<std::size_t>(first) : 0;
  }
  static ServiceInspection::Answer answerTo(Reply reply) {
    return [reply = std::move(reply)](Payload answer) { reply(std::move(answer)); };
  }

  void tellSoon() {
    if (!waiting_ || telling_ || (messages_.empty() && leftOut_ == 0)) return;
    const auto since = inspection_.means_.clock.monotonic() - lastTold_;
    telling_ = true;
    const NoCause own;
    const auto later = [self = shared_from_this()] {
      self->telling_ = false;
      if (self->waiting_) self->tell();
    };
    if (since >= kPause)
      inspection_.queue_->async(later);
    else
      inspection_.queue_->asyncAfter(kPause - since, later);
  }
  void tell() {
    ArrayBuilder all;
    for (const Payload& message : messages_) all.add(message);
    messages_.clear();
    bytes_ = 0;
    lastTold_ = inspection_.means_.clock.monotonic();
    const Reply reply = std::move(*waiting_);
    waiting_.reset();
    reply(
        PayloadBuilder().set("messages", all).set("left_out", std::exchange(leftOut_, 0)).build());
  }

  Inspection& inspection_;
  bool following_ = false;
  int64_t session_ = 0;
  std::optional<std::vector<int64_t>> categories_;
  std::optional<Reply> waiting_;
  bool telling_ = false;  // it is queued
  Monotonic lastTold_{};
  std::vector<Payload> messages_;
  std::size_t bytes_ = 0;
  uint64_t leftOut_ = 0;
};

const InterfaceDescription& Inspection::interface() {
  static constexpr std::array kPlace = {ArgumentKind::Int64};
  static constexpr std::array kFollowed = {ArgumentKind::Int64, ArgumentKind::OptionalInt64Array};
  static constexpr std::array kWhich = {ArgumentKind::Dictionary};
  static constexpr auto of = [](ExportedObject& object) -> Inspector& {
    return static_cast<Inspector&>(object);
  };
  // The numbers are their places from 1 on: wire/InspectOperations.h.
  static constexpr std::array<OperationDescription, 6> kOperations = {{
      {.name = "status",
       .arguments = {},
       .reply = ReplyKind::Dictionary,
       .recorded = false,
       .invoke = [](ExportedObject& object, CallArguments&,
                    Reply reply) { of(object).status(std::move(reply)); }},
      {.name = "connections",
       .arguments = kPlace,
       .reply = ReplyKind::Dictionary,
       .recorded = false,
       .invoke = [](ExportedObject& object, CallArguments& arguments,
                    Reply reply) { of(object).connections(arguments.int64(0), std::move(reply)); }},
      {.name = "sessions",
       .arguments = kPlace,
       .reply = ReplyKind::Dictionary,
       .recorded = false,
       .invoke = [](ExportedObject& object, CallArguments& arguments,
                    Reply reply) { of(object).sessions(arguments.int64(0), std::move(reply)); }},
      {.name = "session",
       .arguments = kPlace,
       .reply = ReplyKind::Dictionary,
       .recorded = false,
       .invoke = [](ExportedObject& object, CallArguments& arguments,
                    Reply reply) { of(object).session(arguments.int64(0), std::move(reply)); }},
      {.name = "follow",
       .arguments = kFollowed,
       .reply = ReplyKind::Dictionary,
       .replyMayBeHeld = true,
       .recorded = false,
       .invoke =
           [](ExportedObject& object, CallArguments& arguments, Reply reply) {
             of(object).follow(arguments.int64(0), arguments.optionalInt64Array(1),
                               std::move(reply));
           }},
      {.name = "erase",
       .arguments = kWhich,
       .reply = ReplyKind::Dictionary,
       .recorded = false,
       .invoke = [](ExportedObject& object, CallArguments& arguments,
                    Reply reply) { of(object).erase(arguments.dictionary(0), std::move(reply)); },
       .privileged = true},
  }};
  static constexpr InterfaceDescription kInterface{.name = "VXInspectionProtocol",
                                                   .operations = kOperations};
  return kInterface;
}

// ---------------------------------------------------------------------------------------------------------------------
// The account

Inspection::Inspection(const Means& means)
    : means_(means),
      startedAt_(means.clock.now()),
      started_(means.clock.monotonic()),
      queue_(means.executor.makeSerial("com.quorvel.sonik.reporting.inspection",
                                       QualityOfService::UserInteractive)) {}

std::shared_ptr<ExportedObject> Inspection::makeObject() {
  return std::make_shared<Inspector>(*this);
}

ServiceInspection* Inspection::service() const {
  const std::shared_ptr<ServiceListenerDelegate> delegate = means_.listener.delegate();
  return delegate != nullptr ? delegate->inspection() : nullptr;
}

Payload Inspection::status(const Payload& service) const {
  const PlatformConfiguration& c = means_.configuration;
  const StoreAccount store = means_.store.account();
  const UserAccounts& accounts = means_.accounts;
  PayloadBuilder durability;
  durability.set("journal", means_.crashSafety.hasJournal())
      .set("journal_in_memory", means_.crashSafety.journalIsInMemory())
      .set("power_safe_within_ms", c.store.commit.interval.count())
      .set("commit_lag_ms", milliseconds(store.lag));
  for (const auto& [name, value] : means_.crashSafety.figures()) durability.set(name, value);
  PayloadBuilder queues;
  queues.set("relay", PayloadBuilder().set("items", means_.executor.utilityBacklog()).build())
      .set("store", PayloadBuilder()
                        .set("records", store.waitingRecords)
                        .set("bytes", store.waitingBytes)
                        .build())
      .set("waiting",
           bounded("bytes", accounts.total(MemoryKind::Waiting), c.memory.maxWaitingBytes))
      .set("delayed", PayloadBuilder().set("bytes", accounts.total(MemoryKind::Delayed)).build())
      .set("connections",
           bounded("connections", static_cast<int64_t>(means_.listener.connectionCount()),
                   c.listener.maxConnections))
      .set("inspectors", bounded("connections", static_cast<int64_t>(means_.endpoint.connections()),
                                 InspectEndpoint::kMostConnections));
  return PayloadBuilder()
      .set("version", VX_VERSION)
      .set("pid", getpid())
      .set("user", geteuid())
      .set("started", PayloadDate{secondsSince1970(startedAt_)})
      .set("uptime_seconds",
           std::chrono::duration<double>(means_.clock.monotonic() - started_).count())
      .set("configuration", describe(c))
      .set("durability", durability.build())
      .set("queues", queues.build())
      .set("store", describe(store))
      .set("service", service)
      .set("endpoint", describe(means_.listener.counters()))
      .set("inspect", describe(means_.endpoint.counters()))
      .set("left_out", PayloadBuilder()
                           .set("user_pauses", accounts.pauses())
                           .set("orientation_handlers", means_.orientation.refusedHandlers())
                           .set("log_lines", means_.log.droppedLines())
                           .set("not_followed", notFollowed_)
                           .build())
      .build();
}

Payload Inspection::connections(std::size_t first,
                                const std::vector<ServiceInspection::Client>& clients) {
  // In order of registration, as sessions are listed; those that are not registered yet come last.
  std::vector<std::pair<std::size_t, const SocketConnection*>> ordered;
  std::unordered_map<const ExportedObject*, std::size_t> places;
  for (std::size_t i = 0; i < clients.size(); ++i) places.emplace(clients[i].object, i);
  means_.listener.forEachConnection([&](const SocketConnection& connection) {
    const auto known = places.find(connection.exportedObject().get());
    ordered.emplace_back(known != places.end() ? known->second : clients.size(), &connection);
  });
  std::ranges::sort(ordered);
  ArrayBuilder listed;
  const std::size_t end = std::min(ordered.size(), first + kMostConnectionsListed);
  for (std::size_t i = first; i < end; ++i) {
    const auto& [place, connection] = ordered[i];
    PayloadBuilder facts;
    facts.set("pid", connection->processIdentifier()).set("user", connection->user());
    if (place < clients.size()) facts.merge(clients[place].facts);
    listed.add(facts.set("calls_in_flight", connection->callsInFlight())
                   .set("unread_reply_bytes", connection->unreadReplyBytes())
                   .set("reading_paused", connection->isReadingPaused())
                   .build());
  }
  PayloadBuilder all;
  if (end < ordered.size()) all.set("next", end);
  return all.set("total", ordered.size()).set("connections", listed).build();
}

void Inspection::erase(const Payload& which, Reply reply) {
  const std::optional<ErasureSelection> selection = selectionOf(which);
  if (!selection) {
    return reply(PayloadBuilder()
                     .set("error",
                          "erase takes one of application (text), user (number) and "
                          "before (date)")
                     .build());
  }
  means_.store.erase(
      *selection, means_.logsDirectory + std::string(kSummaries),
      [reply = std::move(reply)](const Result<Erased>& erased) {
        if (!erased.ok())
          return reply(PayloadBuilder().set("error", erased.status().text()).build());
        reply(PayloadBuilder()
                  .set("messages", erased->messages)
                  .set("events", erased->events)
                  .set("power_records", erased->powerRecords)
                  .set("sessions", erased->sessions)
                  .set("files", erased->files)
                  .build());
      });
}

}  // namespace vx::lnx
