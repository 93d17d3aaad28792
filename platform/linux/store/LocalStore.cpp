#include "platform/linux/store/LocalStore.h"

#include <sys/random.h>

#include <utility>

#include "platform/Log.h"
#include "platform/linux/store/KnownRows.h"
#include "platform/linux/store/StoreFile.h"

namespace vx::lnx {

namespace {

JournalEpoch randomEpoch() {
  JournalEpoch epoch{};
  (void)getrandom(epoch.data(), epoch.size(), 0);  // never short for so few
  return epoch;
}

}  // namespace

Result<std::unique_ptr<LocalStore>> LocalStore::open(
    const std::string& stateDirectory, const StoreOptions& options, Clock& clock,
    const std::optional<JournalEpoch>& epochIfNew) {
  Result<UniqueFd> lock = lockStore(stateDirectory);
  if (!lock.ok()) return lock.status();
  const std::string path = stateDirectory + "/telemetry.db";
  std::string damage;
  const JournalEpoch fresh = epochIfNew ? *epochIfNew : randomEpoch();
  OpenedStore opened = openStoreDatabase(path, fresh);
  if (opened.fault == StoreFault::Damaged) {
    const Result<std::string> aside = moveAside(path);
    if (!aside.ok()) return aside.status();
    damage = opened.status.text() + "; now " + *aside;
    opened = openStoreDatabase(path, fresh);
  }
  if (!opened.status.ok()) return opened.status;
  return std::unique_ptr<LocalStore>(
      new LocalStore(std::move(*lock), path, std::move(opened), std::move(damage), options, clock));
}

LocalStore::LocalStore(UniqueFd lock, std::string path, OpenedStore opened, std::string damage,
                       const StoreOptions& options, Clock& clock)
    : lock_(std::move(lock)),
      epoch_(opened.epoch),
      lastCall_(KnownRows::lastCall(opened.database.get())),
      damage_(std::move(damage)),
      writer_(std::move(path), std::move(opened), options, clock),
      backend_(writer_.queue()) {}

void LocalStore::start() {
  if (!damage_.empty()) {
    VX_LOG(nullptr, Error, "the store was damaged and a fresh one is begun: %s", damage_.c_str());
    writer_.noteAtStart({"moved_aside", "", 0, damage_});
  }
  writer_.start();
}

void LocalStore::beginReplay(ReplayedCalls calls) {
  writer_.queue().setReplaying(true);
  writer_.queue().runSoon([this, calls = std::move(calls)] { writer_.expectKnownRows(calls); });
}

void LocalStore::endReplay(Function<void()> committed) {
  (void)writer_.queue().append(ReplayEndRecord(), 0);
  FlushHandler flushed = [committed = std::move(committed)](const std::optional<Error>& error) {
    if (!error) committed();
  };
  (void)writer_.queue().appendFlush(flushed);
  writer_.queue().setReplaying(false);
}

void LocalStore::sendEventLazy(std::string_view name, Function<Payload()> builder,
                               const Payload& message) {
  // The builder holds a message, most likely one that the relay holds too: counted by a typical
  // size.
  constexpr std::size_t kTypicalEventBytes = 128;
  (void)writer_.queue().append(AnalyticsRecord{name, message, std::move(builder)},
                               kTypicalEventBytes);
}

void LocalStore::logRegisteredEvent(int64_t clientIdentifier, std::string_view eventName,
                                    const Payload& record, const Payload*) {
  const std::size_t bytes = record.encoded().size();
  (void)writer_.queue().append(PowerRecord{clientIdentifier, std::string(eventName), record},
                               bytes);
}

}  // namespace vx::lnx
