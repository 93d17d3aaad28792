// Whatever a counter or status file holds: what is taken for a number is that number again when it
// is written, and a status line gives what its number alone gives.
#include <string>

#include "platform/linux/device/CounterChannels.h"

using vx::lnx::parseCounter;
using vx::lnx::parseStatus;

static void require(bool holds) {
  if (!holds) __builtin_trap();
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  const auto value = parseCounter(text);
  if (value.ok()) {
    const auto again = parseCounter(std::to_string(*value));
    require(again.ok() && *again == *value && text.find('\0') == text.npos);
  } else {
    require(value.status().code() == EINVAL || value.status().code() == ERANGE);
  }
  for (const char* key : {"delay", "avail", "hw_ptr"}) {
    const auto status = parseStatus(text, key);
    const std::string line = std::string(key) + "  : " + std::string(text);
    const auto first = parseStatus(line, key);
    if (text.find('\n') == text.npos && !text.starts_with(' ')) require(first.ok() == value.ok());
    if (!status.ok() && status.status().code() == ENOENT) continue;
    require(text.starts_with("closed") || text.find(key) != text.npos);
  }
  return 0;
}
