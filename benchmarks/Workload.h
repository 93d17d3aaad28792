// The message that everything is measured with: 8 entries (3 integers, 2 doubles, 2 strings of 16
// characters, 1 boolean), keys of 12 to 20 characters, about 192 bytes of CBOR.
#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

#include "propertylist/Payload.h"

namespace vx::bench {

// Payloads differ from one another in their numbers and strings, not in their size by more than a
// few bytes.
Payload workloadPayload(uint64_t seed);
// As many different ones, to be sent in turn.
std::vector<Payload> workloadPayloads(std::size_t count);

inline constexpr std::size_t kEntriesPerPayload = 8;
inline constexpr uint32_t kWorkloadCategory = 0x08000003;  // Session, Playback
inline constexpr uint16_t kWorkloadType = 0;               // Generic

// The bytes of one sendMessage call with this payload and no id list, and of its reply, as they
// cross the socket.
std::size_t callBytes(const Payload& payload);
inline constexpr std::size_t kReplyBytes = 4 + 1 + 1 + 5 + 1;

}  // namespace vx::bench
