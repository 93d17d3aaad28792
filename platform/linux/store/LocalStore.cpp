#include "platform/linux/store/LocalStore.h"

#include <chrono>
#include <utility>

#include "platform/Log.h"
#include "platform/linux/store/StoreFile.h"

namespace vx::lnx {

Result<std::unique_ptr<LocalStore>> LocalStore::open(const std::string& stateDirectory,
                                                     const StoreOptions& options, Clock& clock) {
  Result<UniqueFd> lock = lockStore(stateDirectory);
  if (!lock.ok()) return lock.status();
  const std::string path = stateDirectory + "/telemetry.db";
  std::string damage;
  OpenedStore opened = openStoreDatabase(path);
  if (opened.fault == StoreFault::Damaged) {
    const Result<std::string> aside = moveAside(path);
    if (!aside.ok()) return aside.status();
    damage = opened.status.text() + "; now " + *aside;
    opened = openStoreDatabase(path);
  }
  if (!opened.status.ok()) return opened.status;
  return std::unique_ptr<LocalStore>(new LocalStore(
      std::move(*lock), path, std::move(opened.database), std::move(damage), options, clock));
}

LocalStore::LocalStore(UniqueFd lock, std::string path, Database database, std::string damage,
                       const StoreOptions& options, Clock& clock)
    : clock_(clock),
      lock_(std::move(lock)),
      damage_(std::move(damage)),
      writer_(std::move(path), std::move(database), options, clock),
      backend_(writer_.queue(), clock) {}

void LocalStore::start() {
  if (!damage_.empty()) {
    VX_LOG(nullptr, Error, "the store was damaged and a fresh one is begun: %s", damage_.c_str());
    writer_.noteAtStart({"moved_aside", "", 0, damage_});
  }
  writer_.start();
}

double LocalStore::now() const {
  return std::chrono::duration<double>(clock_.now().time_since_epoch()).count();
}

void LocalStore::sendEventLazy(std::string_view name, Function<Payload()> builder,
                               const Payload& message) {
  // The builder holds a message, most likely one that the relay holds too: counted by a typical
  // size.
  constexpr std::size_t kTypicalEventBytes = 128;
  (void)writer_.queue().append({now(), AnalyticsRecord{name, message, std::move(builder)}},
                               kTypicalEventBytes);
}

void LocalStore::logRegisteredEvent(int64_t clientIdentifier, std::string_view eventName,
                                    const Payload& record, const Payload*) {
  const std::size_t bytes = record.encoded().size();
  (void)writer_.queue().append(
      {now(), PowerRecord{clientIdentifier, std::string(eventName), record}}, bytes);
}

}  // namespace vx::lnx
