#include "platform/linux/settings/TomlText.h"

#include <algorithm>
#include <cerrno>
#include <string_view>

#include "base/FileReading.h"

namespace vx::lnx {

namespace {

constexpr std::size_t kMaxTomlBytes = 1 << 20;
constexpr int kMaxKeyParts = 16;

// First byte behind the string that begins at `at`, or the end of the text.
std::size_t skipTomlString(std::string_view text, std::size_t at) {
  const char quote = text[at];
  const bool multiline = text.substr(at, 3) == std::string(3, quote);
  const std::size_t quotes = multiline ? 3 : 1;
  for (at += quotes; at < text.size(); ++at) {
    if (quote == '"' && text[at] == '\\')
      ++at;
    else if (text[at] == '\n' && !multiline)
      return at;  // not closed: the parser will say so
    else if (text.substr(at, quotes) == std::string(quotes, quote))
      return at + quotes;
  }
  return text.size();
}

// The number of the first line with a key of too many parts, or 0. Counts dots between the
// characters that end a key or a value; a number has no more than one.
int lineNestedTooDeep(std::string_view text) {
  int line = 1;
  int dots = 0;
  std::size_t at = 0;
  while (at < text.size()) {
    const char c = text[at];
    if (c == '"' || c == '\'') {
      const std::size_t end = skipTomlString(text, at);
      for (; at < end; ++at) line += text[at] == '\n' ? 1 : 0;
      continue;
    }
    if (c == '#') {
      at = std::min(text.find('\n', at), text.size());
      continue;
    }
    if (c == '.') {
      if (++dots >= kMaxKeyParts) return line;
    } else if (std::string_view("\n=,[]{}").find(c) != std::string_view::npos) {
      dots = 0;
      line += c == '\n' ? 1 : 0;
    }
    ++at;
  }
  return 0;
}

}  // namespace

Result<std::string> readTomlText(const std::string& path) {
  Result<std::string> text = readRegularFile(path, kMaxTomlBytes);
  if (!text.ok()) return text;
  if (const int line = lineNestedTooDeep(*text)) {
    return Status::posix(path + ":" + std::to_string(line) + ": a key of more than " +
                             std::to_string(kMaxKeyParts) + " parts",
                         EINVAL);
  }
  return text;
}

}  // namespace vx::lnx
