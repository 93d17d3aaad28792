#include "platform/linux/store/LocalStore.h"

#include <algorithm>
#include <utility>

namespace vx::lnx {

Result<std::unique_ptr<LocalStore>> LocalStore::open(
    const std::string& stateDirectory, const StoreOptions& options, Clock& clock,
    const std::optional<JournalEpoch>& epochOfJournal) {
  auto beginning = std::make_unique<StoreBeginning>(stateDirectory, epochOfJournal);
  Status refused;
  if (!beginning->lock(refused)) return refused;
  return std::unique_ptr<LocalStore>(new LocalStore(std::move(beginning), options, clock));
}

LocalStore::LocalStore(std::unique_ptr<StoreBeginning> beginning, const StoreOptions& options,
                       Clock& clock)
    : writer_(std::move(beginning), options, clock), backend_(writer_.queue()) {}

void LocalStore::beginReplay(ReplayedCalls calls) {
  writer_.queue().setReplaying(true);
  writer_.queue().runSoon(
      [this, calls = std::move(calls)]() mutable { writer_.expectKnownRows(std::move(calls)); });
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
                               const Payload& message, std::size_t holds) {
  // The relay may hold the message too, or not: it is counted for both.
  constexpr std::size_t kTypicalEventBytes = 128;
  (void)writer_.queue().append(AnalyticsRecord{name, message, std::move(builder)},
                               std::max(kTypicalEventBytes, message.encoded().size() + holds));
}

void LocalStore::logRegisteredEvent(int64_t clientIdentifier, std::string_view eventName,
                                    const Payload& record, const Payload*) {
  const std::size_t bytes = record.encoded().size();
  (void)writer_.queue().append(PowerRecord{clientIdentifier, std::string(eventName), record},
                               bytes);
}

}  // namespace vx::lnx
