// The local store: one SQLite file, written by one thread, fed through one bounded queue.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "base/Clock.h"
#include "base/Function.h"
#include "base/Status.h"
#include "platform/EventServices.h"
#include "platform/linux/RelayBackend.h"
#include "platform/linux/store/Database.h"
#include "platform/linux/store/StoreBackend.h"
#include "platform/linux/store/StoreOptions.h"
#include "platform/linux/store/StoreWriter.h"

namespace vx::lnx {

// Thread-safe. Owned by the platform. Appending never blocks and never drops: what waits is on the
// accounts of those who caused it, from whose clients the listener reads no more beyond a bound.
class LocalStore final : public AnalyticsEventService, public PowerEventLog {
 public:
  using Counters = StoreCounters;

  // Locks <state>/telemetry.lock and opens or creates <state>/telemetry.db. Fails only when another
  // process has it: whatever else is wrong is tried again before each write, and rows wait. The
  // quick check runs on the writer's thread before its first write, so start-up does not wait for
  // it. `epochOfJournal`: see StoreBeginning.
  static Result<std::unique_ptr<LocalStore>> open(
      const std::string& stateDirectory, const StoreOptions& options, Clock& clock,
      const std::optional<JournalEpoch>& epochOfJournal = std::nullopt);

  // Within which (call, place) names a row. The same as long as this object lives.
  const JournalEpoch& epoch() const { return writer_.epoch(); }
  // See KnownRows; 0 when the store cannot be read yet.
  uint64_t lastCall() const { return writer_.lastCall(); }
  // The word for how a session ended, by the call whose work ended it; before start().
  void setEndWord(EndWord word) { writer_.setEndWord(word); }

  // What is appended until endReplay() comes from recorded calls: rows of theirs that are there
  // already are not written again, and new ones bear the time of their call. Nothing else may be
  // appended meanwhile. `committed`: told once all of it is, on the writer's thread; never when
  // that does not happen.
  void beginReplay(ReplayedCalls calls);
  void endReplay(Function<void()> committed);

  // A row of the ledger; before start().
  void noteAtStart(LedgerNote note) { writer_.noteAtStart(std::move(note)); }
  // A row of the ledger, with what is committed next. From any thread.
  void note(LedgerNote note) { writer_.note(std::move(note)); }
  // Starts the writer. Logs, so the platform must be installed; what is appended before is kept.
  void start() { writer_.start(); }
  // Once clients do not wait for a replay to be committed: the writer lets others go first.
  void yieldToOthers() { writer_.yieldToOthers(); }

  // Load is over.
  void giveBackMemory() { writer_.giveBackMemory(); }

  RelayBackend& relayBackend() { return backend_; }
  void sendEventLazy(std::string_view name, Function<Payload()> builder, const Payload& message,
                     std::size_t holds) override;
  void logRegisteredEvent(int64_t clientIdentifier, std::string_view eventName,
                          const Payload& record, const Payload* options) override;

  // What waits is committed as soon as it can be. `committed`: told then, on the writer's thread.
  void commitSoon(Function<void()> committed = nullptr) {
    FlushHandler flushed = [committed = std::move(committed)](const std::optional<Error>& error) {
      if (!error && committed) committed();
    };
    (void)writer_.queue().appendFlush(flushed);
  }
  // Of those who pay for what waits; outlives this. Before any traffic.
  void setAccounts(UserAccounts& accounts) { writer_.queue().setAccounts(accounts); }

  // Commits what is queued and ends the writer. False when rows were lost because the store could
  // not be written by the deadline; counters() and the log say how many.
  bool close(Monotonic deadline) { return writer_.close(deadline); }
  Counters counters() const { return writer_.counters(); }
  StoreAccount account() const { return writer_.account(); }
  // See StoreWriter.
  void erase(ErasureSelection which, std::string summaries, StoreWriter::ErasureHandler done) {
    writer_.erase(std::move(which), std::move(summaries), std::move(done));
  }
  // The same in steps, for a stop that gives a slow disk more time: accepts nothing any more; waits
  // (false: not yet); what is not committed by now stays with the journal, and who waits for it to
  // be committed gets the error. progress() changes whenever something is committed.
  void stopAccepting() { writer_.stopAccepting(); }
  bool waitUntilEnded(Monotonic until) { return writer_.waitUntilEnded(until); }
  void giveUp() { writer_.giveUp(); }
  // Of max_bytes and the slack, what the files do not take; once the writer has ended.
  uint64_t bytesLeft() const { return writer_.bytesLeft(); }
  uint64_t progress() const { return writer_.progress(); }

 private:
  LocalStore(std::unique_ptr<StoreBeginning> beginning, const StoreOptions& options, Clock& clock);

  StoreWriter writer_;
  StoreBackend backend_;
};

}  // namespace vx::lnx
