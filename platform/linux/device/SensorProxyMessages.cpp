#include "platform/linux/device/SensorProxyMessages.h"

#include <systemd/sd-bus.h>

#include <cstring>

namespace vx::lnx {

// The variant that is next, if it holds a string.
static std::string readWord(sd_bus_message* message) {
  const char* word = nullptr;
  if (sd_bus_message_read(message, "v", "s", &word) < 0) return {};
  return {word, strnlen(word, kMaxSensorWordBytes)};
}

std::string propertyIn(sd_bus_message* answer) {
  return sd_bus_message_get_error(answer) == nullptr ? readWord(answer) : std::string();
}

std::string changedPropertyIn(sd_bus_message* signal) {
  const char* interface = nullptr;
  std::string word;
  if (sd_bus_message_read(signal, "s", &interface) < 0 || std::strcmp(interface, kSensorName) != 0)
    return word;
  if (sd_bus_message_enter_container(signal, 'a', "{sv}") < 0) return word;
  while (sd_bus_message_enter_container(signal, 'e', "sv") > 0) {
    const char* key = nullptr;
    if (sd_bus_message_read(signal, "s", &key) < 0) break;
    if (std::strcmp(key, kProperty) == 0)
      word = readWord(signal);
    else if (sd_bus_message_skip(signal, "v") < 0)
      break;
    if (sd_bus_message_exit_container(signal) < 0) break;
  }
  return word;
}

std::optional<bool> ownerIn(sd_bus_message* signal) {
  const char* name = nullptr;
  const char* before = nullptr;
  const char* after = nullptr;
  if (sd_bus_message_read(signal, "sss", &name, &before, &after) < 0 ||
      std::strcmp(name, kSensorName) != 0)
    return std::nullopt;
  return *after != '\0';
}

}  // namespace vx::lnx
