// Whatever the orientation's file and the messages about its sensor hold: a word of bounded length,
// or none.
#include <sys/socket.h>
#include <systemd/sd-bus.h>

#include <algorithm>
#include <cstdlib>

#include "platform/linux/device/InterfaceStateFile.h"
#include "platform/linux/device/SensorProxyMessages.h"

using namespace vx::lnx;

static sd_bus* const bus = [] {
  sd_bus* made = nullptr;
  int ends[2];
  if (sd_bus_new(&made) < 0 || socketpair(AF_UNIX, SOCK_STREAM, 0, ends) < 0 ||
      sd_bus_set_fd(made, ends[0], ends[0]) < 0 || sd_bus_start(made) < 0)
    std::abort();
  return made;
}();
// What one byte adds to a message: a value, the opening of a container, or a closing.
static constexpr std::pair<char, const char*> kSteps[] = {
    {'s', kSensorName}, {'s', kProperty}, {'s', "left-up"}, {'s', ""},
    {'i', "1234"},      {'a', "{sv}"},    {'e', "sv"},      {'v', "s"},
    {'v', "a{sv}"},     {'v', "i"},       {'a', "s"},       {'r', "ss"},
    {'v', "v"},         {0, ""},          {0, ""},          {0, ""}};

static sd_bus_message* messageOf(std::string_view bytes) {
  sd_bus_message* message = nullptr;
  if (sd_bus_message_new_signal(bus, &message, "/", "a.b", "C") < 0) std::abort();
  for (std::size_t at = 0; at < bytes.size(); ++at) {
    const auto step = static_cast<uint8_t>(bytes[at]);
    const auto [type, contents] = kSteps[step % 16];
    const std::string text(bytes.substr(at + 1, step & 127));
    if (step >= 128)
      (void)sd_bus_message_append_basic(message, 's', text.c_str()), at += text.size();
    else if (type == 0)
      (void)sd_bus_message_close_container(message);
    else if (type == 's' || type == 'i')
      (void)sd_bus_message_append_basic(message, type, contents);
    else
      (void)sd_bus_message_open_container(message, type, contents);
  }
  while (sd_bus_message_close_container(message) >= 0) {
  }
  if (sd_bus_message_seal(message, 1, 0) < 0) return sd_bus_message_unref(message);
  return message;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  const std::string_view word = orientationWord(text);
  if (word != orientationWord(word) || word.size() > size) __builtin_trap();
  sd_bus_message* const message = messageOf(text);
  if (message == nullptr) return 0;
  for (const auto read : {propertyIn, changedPropertyIn}) {
    if (read(message).size() > kMaxSensorWordBytes) __builtin_trap();
    sd_bus_message_rewind(message, 1);
  }
  (void)ownerIn(message);
  sd_bus_message_unref(message);
  return 0;
}
