#include "platform/linux/recovery/Recovery.h"

#include <algorithm>
#include <thread>
#include <utility>

#include "platform/linux/execution/CauseScope.h"
#include "platform/linux/recovery/Records.h"

namespace vx::lnx {

namespace {

constexpr std::chrono::milliseconds kLookAgain{1};
constexpr std::chrono::seconds kBackgroundTime{10};

}  // namespace

Recovery::Recovery(RecoveryMeans means, JournalContents contents)
    : means_(std::move(means)),
      contents_(std::move(contents)),
      platform_(means_.live, means_.backends, inputs_) {}

ReplayedCalls Recovery::calls() const {
  ReplayedCalls calls{.first = contents_.next.call,
                      .end = contents_.next.call,
                      .sessionsFrom = contents_.next.call};
  for (const Record& record : contents_.records) {
    const auto kind = static_cast<RecordKind>(record.kind);
    if (kind == RecordKind::RelayState || (kind == RecordKind::DelayedMessage && !record.done))
      calls.earlierSessions.push_back(record.connection);
    if (record.type == EntryType::Snapshot) continue;
    calls.sessionsFrom = std::min(calls.sessionsFrom, record.call);
    if (!record.done) calls.first = std::min(calls.first, record.call);
  }
  return calls;
}

RecoveryOutcome Recovery::run(const MakeDelegate& makeDelegate) {
  installPlatform(&platform_.services());
  makeDelegate_ = &makeDelegate;
  beginService();
  for (const Record& record : contents_.records)
    if (record.type == EntryType::Snapshot) restore(record);
  for (const Record& record : contents_.records) {
    if (record.type == EntryType::Snapshot) continue;
    lastTime_ = std::max(lastTime_, record.time);
    runRecord(record);
  }
  endOpenConnections();
  (void)append(RecordKind::ServiceBegan, 0);
  delegate_.reset();
  runInteractive();
  (void)means_.executor.drain(means_.live.clock.monotonic() + kBackgroundTime);
  installPlatform(&means_.live);
  return outcome_;
}

// ---------------------------------------------------------------------------------------------------------------------
// Records

// A process that begins has no clients, and knows no preferences before they change.
void Recovery::beginService() {
  connections_.clear();
  delegate_.reset();
  runInteractive();
  delegate_ = (*makeDelegate_)();
}

void Recovery::runRecord(const Record& record) {
  const Cause cause{means_.journal.resume(record.place), {}};
  {
    const CauseScope scope(cause);
    switch (static_cast<RecordKind>(record.kind)) {
      case RecordKind::Accepted:
        accept(record);
        break;
      case RecordKind::Call:
      case RecordKind::StopCall:
      case RecordKind::DestroyCall:
        call(record);
        break;
      case RecordKind::EndedInterrupted:
      case RecordKind::EndedOrderly:
      case RecordKind::EndedServiceStopped:
      case RecordKind::EndedCrashed:
        end(record);
        break;
      case RecordKind::PreferencesChanged:
        platform_.notify({reinterpret_cast<const char*>(record.head.data()), record.head.size()});
        break;
      case RecordKind::DelayedMessage:
        delayed(record);
        break;
      case RecordKind::ServiceBegan:
        beginService();
        return;
      default:
        ++outcome_.unreadable;
        return;
    }
  }
  ++outcome_.calls;
  outcome_.undone += record.done ? 0 : 1;
  runInteractive();
  waitForStore();
}

void Recovery::accept(const Record& record) {
  const std::optional<RecordedClient> client = readAccepted(record.head);
  if (!client) {
    ++outcome_.unreadable;
    return;
  }
  const auto connection = std::make_shared<RecoveredConnection>(client->pid, client->uid);
  if (delegate_->listener(means_.live.serviceListener, connection))
    connections_.emplace(record.call, connection);
}

// One whose connection was not recorded, or is over, has nobody to make it.
void Recovery::call(const Record& record) {
  const auto found = connections_.find(record.connection);
  if (found == connections_.end()) return;
  const std::shared_ptr<ExportedObject> object = found->second->exportedObject();
  const InterfaceDescription* const interface = found->second->interface();
  if (object == nullptr || interface == nullptr) return;
  Result<RecordedCall> call = readCall(record.head, record.dictionary, *interface);
  if (!call.ok()) {
    ++outcome_.unreadable;
    return;
  }
  call->operation->invoke(*object, call->arguments, Reply());
}

void Recovery::end(const Record& record) {
  const auto found = connections_.find(record.connection);
  if (found == connections_.end()) return;
  const std::shared_ptr<RecoveredConnection> connection = std::move(found->second);
  connections_.erase(found);
  if (record.kind == static_cast<uint8_t>(RecordKind::EndedInterrupted)) connection->interrupt();
  connection->invalidate();
}

// Where its call is run again, that makes it wait again: then this record has had its time, as one
// has that another took the place of.
void Recovery::delayed(const Record& record) {
  if (record.done || isUndone(record.connection)) return;
  std::optional<RecordedDelay> delay = readDelayed(record.head);
  if (!delay || !record.dictionary) {
    ++outcome_.unreadable;
    return;
  }
  if (!delayed_.emplace(record.connection, delay->position.place).second) return;
  const JournalTicket* const call = CauseScope::current();
  if (call == nullptr) return;
  auto cause =
      std::make_unique<HeldCause>(Cause{*call, delay->position}, means_.executor.accounts(),
                                  record.dictionary->encoded().size());
  if (!delegate_->restoreDelayed(delay->facts, *record.dictionary, std::move(cause)))
    ++outcome_.unreadable;
}

bool Recovery::isUndone(uint64_t call) const {
  const auto found = std::ranges::lower_bound(contents_.records, call, {}, &Record::call);
  return found != contents_.records.end() && found->call == call && !found->done;
}

// ---------------------------------------------------------------------------------------------------------------------
// The snapshot

// All that it stands for was done before.
void Recovery::restore(const Record& record) {
  Cause cause{means_.journal.resume(record.place), {}};
  if (record.kind == static_cast<uint8_t>(RecordKind::RelayState)) {
    if (const std::optional<RecordedRelayState> state = readRelayState(record.head))
      cause.position = state->position;
  }
  const CauseScope scope(cause);
  if (!restorePart(record)) ++outcome_.unreadable;
  runInteractive();
}

bool Recovery::restorePart(const Record& record) {
  switch (static_cast<RecordKind>(record.kind)) {
    case RecordKind::ServiceState: {
      const std::optional<Payload> facts = Payload::decode(record.head);
      return facts && delegate_->restoreService(*facts);
    }
    case RecordKind::ClientState:
      return restoreClient(record);
    case RecordKind::SessionState:
      return restoreSession(record);
    case RecordKind::RelayState:
      return restoreRelay(record);
    default:
      return false;
  }
}

bool Recovery::restoreClient(const Record& record) {
  const std::optional<RecordedClientState> state = readClientState(record.head);
  if (!state) return false;
  const auto connection =
      std::make_shared<RecoveredConnection>(state->client.pid, state->client.uid);
  if (!delegate_->listener(means_.live.serviceListener, connection)) return false;
  runInteractive();
  connections_.emplace(record.connection, connection);
  ++outcome_.restored;
  const std::shared_ptr<ExportedObject> object = connection->exportedObject();
  return object != nullptr && delegate_->restoreClient(*object, state->facts);
}

bool Recovery::restoreSession(const Record& record) {
  const std::optional<RecordedSessionState> state = readSessionState(record.head);
  const auto found = connections_.find(record.connection);
  if (!state || found == connections_.end()) return false;
  const std::shared_ptr<ExportedObject> object = found->second->exportedObject();
  ++outcome_.restored;
  return object != nullptr && delegate_->restoreSession(*object, state->reporterID, state->facts,
                                                        record.dictionary.value_or(Payload()));
}

bool Recovery::restoreRelay(const Record& record) {
  const std::optional<RecordedRelayState> state = readRelayState(record.head);
  if (!state) return false;
  const auto found = connections_.find(state->connection);
  if (found == connections_.end()) return false;
  const std::shared_ptr<ExportedObject> object = found->second->exportedObject();
  return object != nullptr && delegate_->restoreRelay(*object, state->reporterID);
}

// ---------------------------------------------------------------------------------------------------------------------
// The end

// Recorded before it happens: a recovery that is begun again finds the same end, under the same
// number, of the same time.
void Recovery::endOpenConnections() {
  while (!connections_.empty()) {
    const auto [number, connection] = *connections_.begin();
    connections_.erase(connections_.begin());
    {
      const Cause cause = append(RecordKind::EndedCrashed, number, connection->user());
      const CauseScope scope(cause);
      connection->invalidate();
    }
    ++outcome_.ended;
    runInteractive();
    waitForStore();
  }
}

Cause Recovery::append(RecordKind kind, uint64_t connection, uint32_t user) {
  Result<JournalAppended> appended = means_.journal.appendEnd({.kind = static_cast<uint8_t>(kind),
                                                               .time = lastTime_,
                                                               .connection = connection,
                                                               .user = user});
  Cause cause;
  if (appended.ok()) cause.ticket = std::move(appended->ticket);
  return cause;
}

void Recovery::runInteractive() {
  while (means_.executor.runInteractive(1024)) {
  }
}

// One that does not keep up even so holds more than it should: no more than the journal does.
void Recovery::waitForStore() {
  while (means_.executor.accounts().isTooMuchWaiting() &&
         means_.live.clock.monotonic() < means_.patience)
    std::this_thread::sleep_for(kLookAgain);
}

}  // namespace vx::lnx
