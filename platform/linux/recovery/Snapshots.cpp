#include "platform/linux/recovery/Snapshots.h"

#include <algorithm>
#include <utility>

#include "platform/Log.h"

namespace vx::lnx {

namespace {

constexpr std::chrono::milliseconds kLookAgain{200};  // for capacity, where there is none
constexpr std::chrono::seconds kAfterFailure{5};

}  // namespace

void Snapshots::afterPass() {
  const uint64_t bytes = means_.journal.bytesAppended();
  const bool recorded = bytes != std::exchange(seenBytes_, bytes);
  if (recorded && seenBytes_ - bytesThen_ >= kWorthwhileBytes)
    lastRecorded_ = means_.clock.monotonic();
  const bool tight = isTight();
  if (tight != nextLook_.has_value()) watchCapacity();
  if (state_ == State::Idle && (demanded_ || recorded || tight) && isWanted()) begin();
  if (state_ != State::Waiting) return;
  if (means_.journal.earlierCallsAreDone()) return complete();
  if (tight && !std::exchange(urged_, true)) means_.commitSoon();
}

void Snapshots::watchCapacity() {
  nextLook_.reset();
  if (isTight()) nextLook_ = means_.clock.monotonic() + kLookAgain;
}

bool Snapshots::isWanted() {
  if (notBefore_ > Monotonic() && means_.clock.monotonic() < notBefore_) return false;
  return demanded_ || isTight() ||
         seenBytes_ - bytesThen_ >= std::max(kBytesBetween, 2 * counters_.bytes);
}

std::optional<Monotonic> Snapshots::nextDue() const {
  if (nextLook_) return nextLook_;
  if (state_ != State::Idle) return std::nullopt;
  if (demanded_) return notBefore_;
  if (seenBytes_ - bytesThen_ < kWorthwhileBytes) return std::nullopt;
  return std::max(lastRecorded_ + kQuiet, notBefore_);
}

void Snapshots::onDue() {
  if (nextLook_) {
    urged_ = false;  // more may have come to the store
    if (means_.journal.lookForCapacity()) means_.freed();
    return watchCapacity();
  }
  if (state_ == State::Idle) begin();
}

void Snapshots::begin() {
  demanded_ = false;
  urged_ = false;
  if (const Status began = means_.journal.beginGeneration(); !began.ok()) return giveUp();
  bytesThen_ = seenBytes_ = means_.journal.bytesAppended();
  connections_ = means_.connections();
  means_.began();
  state_ = State::Asked;
  if (!means_.save([this](SavedService service) { saved(std::move(service)); })) giveUp();
}

void Snapshots::saved(SavedService service) {
  const Monotonic began = means_.clock.monotonic();
  means_.taken();
  // Better that a summary may lack something after a crash than that nobody is served.
  if (!service.complete && !isTight()) return giveUp();
  const std::span<const uint8_t> facts = service.facts.encoded();
  (void)addPart(RecordKind::ServiceState, 0, {facts.begin(), facts.end()});
  for (SavedClient& client : service.clients) add(client);
  connections_.clear();
  state_ = State::Waiting;
  counters_.longest = std::max(counters_.longest, means_.clock.monotonic() - began);
}

Snapshots::Part& Snapshots::addPart(RecordKind kind, uint64_t connection,
                                    std::vector<uint8_t> head) {
  Part& part = parts_.emplace_back();
  part.kind = kind;
  part.connection = connection;
  part.head = std::move(head);
  return part;
}

// One whose connection is not recorded is none whose calls could be run again.
void Snapshots::add(SavedClient& client) {
  const auto found = connections_.find(client.object);
  if (found == connections_.end()) return;
  const auto& [connection, pid, uid] = found->second;
  (void)addPart(RecordKind::ClientState, connection, writeClientState({pid, uid}, client.facts));
  for (SavedSession& session : client.sessions) {
    const std::vector<uint8_t> head = writeSessionState(session.reporterID, session.facts);
    for (const Payload& piece : session.information)
      addPart(RecordKind::SessionState, connection, head).content = piece;
    if (!session.relay) continue;
    Part& relay = addPart(RecordKind::RelayState, 0, {});
    relay.relay = std::move(session.relay);
    relay.relayState = {{}, connection, session.reporterID};
  }
}

void Snapshots::complete() {
  const Monotonic began = means_.clock.monotonic();
  const uint64_t before = means_.journal.bytesAppended();
  Status status;
  for (Part& part : parts_) {
    status = write(part);
    if (!status.ok()) break;
  }
  if (status.ok()) status = means_.journal.endSnapshot();
  if (!status.ok()) return giveUp();
  parts_.clear();
  state_ = State::Idle;
  cannotCut_ = false;
  ++counters_.completed;
  seenBytes_ = means_.journal.bytesAppended();
  counters_.bytes = seenBytes_ - before;
  bytesThen_ += counters_.bytes;  // they are nothing that another could make free
  counters_.longest = std::max(counters_.longest, means_.clock.monotonic() - began);
  means_.completed();
  if (means_.journal.lookForCapacity()) means_.freed();
}

Status Snapshots::write(Part& part) {
  JournalRecord record{.kind = static_cast<uint8_t>(part.kind), .connection = part.connection};
  if (part.relay) {
    const std::optional<WorkOrigin> origin = part.relay();
    if (!origin) return {};
    part.relayState.position = {origin->place, origin->depth};
    part.head = writeRelayState(part.relayState);
    record.connection = origin->call;
    record.time = origin->time;
    record.forEarlier = true;
  }
  record.head = part.head;
  if (!part.content.empty()) record.dictionary = part.content.validated();
  return means_.journal.appendToSnapshot(record).status();
}

// Nothing is cut; what was recorded still counts.
void Snapshots::giveUp() {
  if (counters_.failed++ == 0)
    VX_LOG(nullptr, Error, "the journal cannot be cut now; it is tried again");
  parts_.clear();
  connections_.clear();
  state_ = State::Idle;
  demanded_ = true;
  notBefore_ = means_.clock.monotonic() + kAfterFailure;
  if (!means_.journal.hasCapacity()) cannotCut_ = true;
  means_.freed();
}

}  // namespace vx::lnx
