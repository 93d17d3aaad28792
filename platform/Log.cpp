#include "platform/Log.h"

#include <cstdarg>
#include <cstdio>
#include <string>

namespace vx {

void writeLogLine(const LogScope* scope, LogLevel level, const LogSite& site, const char* format,
                  ...) {
  char stackText[512];
  const int prefix =
      std::snprintf(stackText, sizeof stackText, "%s:%d:%s: ", site.file, site.line, site.function);
  if (prefix < 0 || static_cast<std::size_t>(prefix) >= sizeof stackText) return;
  const std::size_t room = sizeof stackText - static_cast<std::size_t>(prefix);
  std::va_list arguments;
  va_start(arguments, format);
  std::va_list again;
  va_copy(again, arguments);
  const int length = std::vsnprintf(stackText + prefix, room, format, arguments);
  va_end(arguments);
  if (length >= 0 && static_cast<std::size_t>(length) < room) {
    platform().log.write(
        scope, level, site,
        {stackText, static_cast<std::size_t>(prefix) + static_cast<std::size_t>(length)},
        static_cast<std::size_t>(prefix));
  } else if (length >= 0) {
    std::string text(stackText, static_cast<std::size_t>(prefix));
    text.resize(static_cast<std::size_t>(prefix) + static_cast<std::size_t>(length) + 1);
    std::vsnprintf(text.data() + prefix, static_cast<std::size_t>(length) + 1, format, again);
    text.pop_back();
    platform().log.write(scope, level, site, text, static_cast<std::size_t>(prefix));
  }
  va_end(again);
}

}  // namespace vx
