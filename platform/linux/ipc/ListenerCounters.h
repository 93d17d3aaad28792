// What the service endpoint has taken, refused and cut, for the log.
#pragma once

#include <cstdint>
#include <string>

namespace vx::lnx {

// One line per counter: the field, and its name in the log, in the log's order.
#define VX_LISTENER_COUNTERS(X)                      \
  X(accepted, "accepted")                            \
  X(calls, "calls")                                  \
  X(refusedConnections, "refused_connections")       \
  X(descriptorExhaustions, "descriptor_exhaustions") \
  X(malformedFrames, "malformed_frames")             \
  X(oversizedFrames, "oversized_frames")             \
  X(unknownOperations, "unknown_operations")         \
  X(wrongArguments, "wrong_arguments")               \
  X(tooManySessions, "too_many_sessions")            \
  X(tooMuchMemory, "too_much_memory")                \
  X(callsGivenUp, "calls_given_up")                  \
  X(tooManyIdentifiers, "too_many_identifiers")      \
  X(notPermitted, "not_permitted")                   \
  X(unsupportedVersions, "unsupported_versions")     \
  X(secondReplies, "second_replies")                 \
  X(abandonedCalls, "abandoned_calls")               \
  X(oversizedReplies, "oversized_replies")           \
  X(slowClientsCut, "slow_clients_cut")              \
  X(readingPauses, "reading_pauses")

// Owned by SocketListener; interactive thread only.
struct ListenerCounters {
#define VX_COUNTER_FIELD(field, name) uint64_t field = 0;
  VX_LISTENER_COUNTERS(VX_COUNTER_FIELD)
#undef VX_COUNTER_FIELD

  uint64_t workBegun() const { return accepted + refusedConnections + calls; }
  // "accepted=3 calls=17 ..."
  std::string text() const;
};

}  // namespace vx::lnx
