// The recorded inputs of a replay: answers come from the journal.
#pragma once

#include <cstdint>
#include <unordered_map>

#include "platform/RecordedInputs.h"
#include "platform/linux/journal/JournalReader.h"

namespace vx::lnx {

// Thread-safe: immutable. Outside of a recorded call there are no answers.
class ReplayInputs final : public RecordedInputs {
 public:
  // `contents` outlives it.
  explicit ReplayInputs(const JournalContents& contents);
  std::optional<Payload> once(std::string_view what,
                              const Function<std::optional<Payload>()>& source) override;
  bool decide(std::string_view what, bool now) override;

 private:
  std::optional<Payload> find(uint64_t call, uint32_t place, std::string_view what) const;

  std::unordered_map<uint64_t, const JournalContents::Record*> noted_;  // by call
  uint64_t decided_ = 0;  // the last call of which something was
};

}  // namespace vx::lnx
