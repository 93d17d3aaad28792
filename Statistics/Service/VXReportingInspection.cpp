// What the service, its clients and its sessions say of themselves, and what is told of messages.
#include <algorithm>
#include <utility>

#include "Statistics/Service/VXReportingServiceDelegate.h"
#include "Statistics/VXReportingProcessState.h"
#include "platform/Platform.h"

namespace vx {

namespace {

// Of one answer, and of what is shown of one message or configuration in it.
constexpr std::size_t kMostSessions = 256;
constexpr std::size_t kMostInFull = 8;
constexpr std::size_t kMostShownBytes = 16 << 10;
constexpr std::size_t kMostConfigurationBytes = 64 << 10;
constexpr std::size_t kMostText = 256;

constexpr const char* kFateNames[VXReportingActivity::kFates] = {
    "delivered", "standalone", "unknown_session", "reporting_off", "drivers"};

PayloadDate dateOf(Date date) { return {secondsSince1970(date)}; }

// A client may have put a megabyte there. Cut between characters.
std::string shortened(std::string text) {
  if (text.size() <= kMostText) return text;
  std::size_t end = kMostText;
  while (end > 0 && (static_cast<unsigned char>(text[end]) & 0xC0) == 0x80) --end;
  return text.substr(0, end) + "…";
}

void setBounded(PayloadBuilder& facts, std::string_view key, const Payload& dictionary,
                std::size_t mostBytes) {
  if (dictionary.encoded().size() <= mostBytes)
    facts.set(key, dictionary);
  else
    facts.set(std::string(key) + "_left_out_bytes", dictionary.encoded().size());
}

}  // namespace

// ---------------------------------------------------------------------------------------------------------------------
// Messages

void VXReportingActivity::tell(Fate fate, const Payload& message, MessageCategory category,
                               MessageType type, ReporterID reporterID,
                               const VXReportingSession* session) {
  std::erase_if(watchers_, [](const auto& watcher) { return watcher.expired(); });
  for (const std::weak_ptr<MessageWatcher>& weak : watchers_) {
    const std::shared_ptr<MessageWatcher> watcher = weak.lock();
    if (watcher == nullptr || !watcher->wants(reporterID, category)) continue;
    PayloadBuilder told;
    told.set("time", dateOf(platform().clock.now()))
        .set("fate", kFateNames[static_cast<std::size_t>(fate)])
        .set("kind", messageKindName(messageKind(category, type), '_'))
        .set("category", category)
        .set("type", type)
        .set("session", reporterID);
    if (session != nullptr)
      told.set("service_type", VXReportingServiceTypeName(session->serviceType()));
    setBounded(told, "message", message, kMostShownBytes);
    watcher->routed(told.build());
  }
}

// ---------------------------------------------------------------------------------------------------------------------
// Sessions

std::string_view VXReportingSession::relayStateName() const {
  switch (relayOutcome_.state.load(std::memory_order_relaxed)) {
    case RelayState::None:
      return "none";
    case RelayState::SettingUp:
      return "setting_up";
    case RelayState::Open:
      return "open";
    case RelayState::NoBackend:
      return "no_backend";
    case RelayState::Test:
      return "nothing_is_relayed";
    case RelayState::Ended:
      return "ended";
  }
  return "";
}

Payload VXReportingSession::inspect(Detail detail) const {
  serviceQueue()->assertIsCurrent();
  const auto count = [](const std::atomic<uint64_t>& counter) {
    return counter.load(std::memory_order_relaxed);
  };
  const Payload information = userInfo_->snapshot();
  const VXReportingAggregate::State held = received_.state();
  PayloadBuilder facts;
  facts.set("session", reporterID_)
      .set("service_type", VXReportingServiceTypeName(serviceType()))
      .set("application", shortened(VXReportingHostApplicationDisplayID(information).text()))
      .set("started", started_);
  if (started_ && startedAt_) facts.set("since", dateOf(*startedAt_));
  facts.set("messages", acceptedMessages())
      .set("bytes_held", held.bytes + received_.unrecordedBytes())
      .set("relay", relayStateName());
  if (detail == Detail::Line) return facts.build();

  PayloadBuilder kinds;
  for (const KindCount& kind : messageTypeCounts_)
    kinds.set(messageKindName(kind.kind, '_'), kind.count);
  facts.set("messages_by_kind", kinds.build());
  setBounded(facts, "configuration", information, kMostConfigurationBytes);

  const RelayOutcome& outcome = relayOutcome_;
  const uint64_t accepted = acceptedMessages() - acceptedAtStart_;
  PayloadBuilder leftOut;
  leftOut.set("sent_alone_not_started", count(outcome.alone))
      .set("test_service_type", count(outcome.notAllowed))
      .set("no_relay_session", count(outcome.noRelay))
      .set("refused_by_relay", count(outcome.refused));
  const uint64_t relayed = count(outcome.relayed);
  const uint64_t gone = relayed + count(outcome.alone) + count(outcome.notAllowed) +
                        count(outcome.noRelay) + count(outcome.refused);
  PayloadBuilder ledger;
  ledger.set("accepted", accepted)
      .set("aggregated", received_.flatSize())
      .set("waiting_for_relay", accepted - std::min(accepted, gone))
      .set("relayed", relayed)
      .set("left_out", leftOut.build());
  const std::shared_ptr<const std::atomic<uint64_t>> stored = [this] {
    MutexLock lock(fieldsMutex_);
    return storedMessages_;
  }();
  if (stored != nullptr) {
    ledger.set("stored", count(*stored))
        .set("waiting_for_commit", relayed - std::min(relayed, count(*stored)));
  }
  facts.set("since_last_start", ledger.build());
  return facts.build();
}

uint64_t VXReportingSession::acceptedMessages() const {
  uint64_t sum = 0;
  for (const KindCount& kind : messageTypeCounts_) sum += kind.count;
  return sum;
}

// ---------------------------------------------------------------------------------------------------------------------
// The service

void VXReportingServiceDelegate::totals(Answer answer) {
  serviceQueue()->async([self = shared_from_this(), answer = std::move(answer)] {
    std::size_t sessions = 0;
    std::size_t started = 0;
    for (const auto& client : self->clients_) {
      for (const auto& [reporterID, session] : client->clientReportingSessionMap()) {
        ++sessions;
        if (session->started()) ++started;
      }
    }
    PayloadBuilder messages;
    for (std::size_t i = 0; i < VXReportingActivity::kFates; ++i)
      messages.set(kFateNames[i], self->activity_.count(static_cast<VXReportingActivity::Fate>(i)));
    answer(PayloadBuilder()
               .set("reporting", self->isReportingEnabled())
               .set("clients", self->clients_.size())
               .set("sessions", sessions)
               .set("sessions_started", started)
               .set("delayed_messages", VXReportingProcessState::current().delayedMessages().size())
               .set("delayed_messages_bound", VXReportingDelayedMessages::kMostMessages)
               .set("watchers", self->activity_.watchers())
               .set("messages", messages.build())
               .build());
  });
}

void VXReportingServiceDelegate::clients(Function<void(std::vector<Client>)> answer) {
  serviceQueue()->async([self = shared_from_this(), answer = std::move(answer)] {
    std::vector<Client> all;
    for (const auto& client : self->clients_) {
      PayloadBuilder facts;
      facts.set("sessions", client->clientReportingSessionMap().size());
      if (const auto name = client->clientProcessName()) facts.set("process", shortened(*name));
      if (const auto since = client->clientStartDate()) facts.set("since", dateOf(*since));
      all.push_back({client.get(), facts.build()});
    }
    answer(std::move(all));
  });
}

void VXReportingServiceDelegate::sessions(std::size_t first, Answer answer) {
  serviceQueue()->async([self = shared_from_this(), first, answer = std::move(answer)] {
    ArrayBuilder listed;
    std::size_t place = 0;
    for (const auto& client : self->clients_) {
      const auto& sessions = client->clientReportingSessionMap();
      if (place + sessions.size() <= first) {
        place += sessions.size();
        continue;
      }
      for (const auto& [reporterID, session] : sessions) {
        if (place++ < first || listed.size() == kMostSessions) continue;
        listed.add(self->withClient(*client, session->inspect(VXReportingSession::Detail::Line)));
      }
    }
    PayloadBuilder all;
    if (first + listed.size() < place) all.set("next", first + listed.size());
    answer(all.set("total", place).set("sessions", listed).build());
  });
}

void VXReportingServiceDelegate::session(int64_t reporterID, Answer answer) {
  serviceQueue()->async([self = shared_from_this(), reporterID, answer = std::move(answer)] {
    ArrayBuilder listed;
    for (const auto& client : self->clients_) {
      const auto& sessions = client->clientReportingSessionMap();
      const auto found = sessions.find(reporterID);
      if (found == sessions.end() || listed.size() == kMostInFull) continue;
      listed.add(
          self->withClient(*client, found->second->inspect(VXReportingSession::Detail::Full)));
    }
    answer(PayloadBuilder().set("sessions", listed).build());
  });
}

Payload VXReportingServiceDelegate::withClient(const VXReportingServerInstance& client,
                                               const Payload& facts) const {
  PayloadBuilder all;
  all.set("pid", client.processIdentifier());
  if (const auto name = client.clientProcessName()) all.set("process", shortened(*name));
  return all.merge(facts).build();
}

void VXReportingServiceDelegate::watch(std::weak_ptr<MessageWatcher> watcher) {
  serviceQueue()->async([self = shared_from_this(), watcher = std::move(watcher)]() mutable {
    self->activity_.watch(std::move(watcher));
  });
}

}  // namespace vx
