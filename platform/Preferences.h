// Preferences domains and system-wide named notifications.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/Function.h"
#include "platform/WorkQueue.h"

namespace vx {

// One domain as it stood when it was opened.
class PreferencesDomain {
 public:
  virtual ~PreferencesDomain() = default;
  // Whether the domain holds the key, whatever its value.
  virtual bool hasObject(std::string_view key) const = 0;
  // The value as a string (numbers and booleans in their usual text). None when absent or a table
  // or array.
  virtual std::optional<std::string> string(std::string_view key) const = 0;
  // True for true, a number other than 0, and the texts "true", "yes" and "1" in any case; false
  // for all else.
  virtual bool boolean(std::string_view key) const = 0;
};

class Preferences {
 public:
  virtual ~Preferences() = default;
  // Reads the latest stored values. A domain that does not exist opens empty.
  virtual std::unique_ptr<PreferencesDomain> open(std::string_view domain) = 0;
};

class SystemNotify {
 public:
  virtual ~SystemNotify() = default;
  static constexpr uint32_t kStatusOk = 0;
  // Calls the handler on `queue` with the notification's token each time the named notification
  // fires. Returns a status (0 is success) and sets the token.
  virtual uint32_t registerHandler(std::string_view name, int& token,
                                   std::shared_ptr<WorkQueue> queue,
                                   Function<void(int token)> handler) = 0;
};

}  // namespace vx
