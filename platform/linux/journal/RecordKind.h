// What this service records. The journal itself keeps any number.
#pragma once

#include <cstdint>

namespace vx::lnx {

// What is in a record of each kind is drawn in recovery/Records.h. Numbers are in files: they keep
// their meaning.
enum class RecordKind : uint8_t {
  Accepted = 1,  // a connection
  Call = 2,      // of an operation, but for the two that end a session
  StopCall = 3,
  DestroyCall = 4,
  EndedInterrupted = 5,  // a connection
  EndedOrderly = 6,
  EndedServiceStopped = 7,
  EndedCrashed = 8,  // by the process that found it open in the journal
  PreferencesChanged = 9,
  ClientState = 10,  // parts of a snapshot
  SessionState = 11,
  RelayState = 12,
  ServiceState = 14,    // part of a snapshot
  DelayedMessage = 15,  // a call's, which waits for so long that it has a record of its own
  ServiceBegan = 13,    // what comes next was recorded by a process that knew nothing of what was
};

}  // namespace vx::lnx
