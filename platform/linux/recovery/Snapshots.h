// Cuts the journal while clients stay: from time to time it gets the state that all calls before
// have left, and then those calls need not be kept any longer.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <unordered_map>
#include <vector>

#include "base/Clock.h"
#include "base/Function.h"
#include "platform/ServiceState.h"
#include "platform/linux/ipc/SocketListener.h"
#include "platform/linux/journal/Journal.h"
#include "platform/linux/journal/RecordKind.h"
#include "platform/linux/recovery/Records.h"

namespace vx::lnx {

using RecordedConnection = SocketListener::Recorded;

// Owned by the platform; lives on the interactive thread. A snapshot is begun when kBytesBetween
// bytes have been recorded since the one before (twice that one's size, if it is larger), when the
// journal has no capacity or somebody has no share of it left, and when it is quiet and
// kWorthwhileBytes could be given back. What the service answers is kept in memory until all calls
// before are done; then it is written, and counts. Bounds: one snapshot at a time, and the state of
// the clients that there are.
class Snapshots {
 public:
  static constexpr uint64_t kBytesBetween = uint64_t{8} << 20;
  static constexpr uint64_t kWorthwhileBytes = uint64_t{1} << 20;
  static constexpr std::chrono::seconds kQuiet{5};

  struct Means {
    Journal& journal;
    Clock& clock;
    // ServiceListenerDelegate::saveState.
    Function<bool(Function<void(SavedService)>)> save;
    // By the objects that they export; all that may be among the clients of a state that is asked
    // for now.
    Function<std::unordered_map<const ExportedObject*, RecordedConnection>()> connections;
    // Some have to wait for the next one although there is capacity.
    Function<bool()> crowded;
    Function<void()> commitSoon;  // what the store holds: somebody waits
    Function<void()> freed;       // there may be capacity again; or cannotCut()
    Function<void()> began;       // around what must not be forgotten meanwhile
    Function<void()> taken;       // the state is that of now
    Function<void()> completed;
  };
  struct Counters {
    uint64_t completed = 0;
    uint64_t failed = 0;
    uint64_t bytes = 0;                   // of the last one
    std::chrono::nanoseconds longest{0};  // that one held up its thread, in one piece
  };

  explicit Snapshots(Means means) : means_(std::move(means)) {}
  Snapshots(const Snapshots&) = delete;
  Snapshots& operator=(const Snapshots&) = delete;

  // After every pass of the event loop.
  void afterPass();
  // Begins one with the next pass whatever there is to gain: what is recorded is not all that
  // happened.
  void demand() { demanded_ = true; }
  // When it wants to be woken: never while there is nothing to do.
  std::optional<Monotonic> nextDue() const;
  void onDue();

  // There is no capacity, and none that a snapshot could make: what there is to keep is too much.
  // To wait would be for ever.
  bool cannotCut() const { return cannotCut_; }
  bool isUnderWay() const { return state_ != State::Idle; }
  const Counters& counters() const { return counters_; }

 private:
  enum class State : uint8_t { Idle, Asked, Waiting };
  struct Part {
    RecordKind kind = RecordKind::ServiceState;
    uint64_t connection = 0;
    std::vector<uint8_t> head;
    Payload content;
    // Of a RelayState: the origin that it stands for.
    Function<std::optional<WorkOrigin>()> relay;
    RecordedRelayState relayState;
  };

  bool isTight() const { return !means_.journal.hasCapacity() || means_.crowded(); }
  void watchCapacity();
  bool isWanted();
  void begin();
  void saved(SavedService service);
  void add(SavedClient& client);
  Part& addPart(RecordKind kind, uint64_t connection, std::vector<uint8_t> head);
  void complete();
  Status write(Part& part);
  void giveUp();

  Means means_;
  Counters counters_;
  State state_ = State::Idle;
  bool demanded_ = false;
  bool urged_ = false;
  bool cannotCut_ = false;
  uint64_t seenBytes_ = 0;  // recorded by the pass before
  uint64_t bytesThen_ = 0;  // of them, before the last snapshot was begun, and its own
  Monotonic lastRecorded_{};
  Monotonic notBefore_{};              // after one that failed
  std::optional<Monotonic> nextLook_;  // for capacity
  std::unordered_map<const ExportedObject*, RecordedConnection> connections_;
  std::vector<Part> parts_;
};

}  // namespace vx::lnx
