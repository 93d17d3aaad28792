#include "platform/linux/FileReading.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <string_view>

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

Error posixError(int errnoValue, const std::string& what) {
  return {kPosixErrorDomain, errnoValue, what + ": " + std::strerror(errnoValue)};
}

std::optional<std::string> readRegularFile(const std::string& path, std::size_t maxBytes,
                                           Error& error) {
  // O_NONBLOCK: opening a FIFO must not wait for its writer.
  const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
  if (fd < 0) {
    error = posixError(errno, path);
    return std::nullopt;
  }
  struct stat status {};
  std::optional<std::string> content;
  if (fstat(fd, &status) != 0) {
    error = posixError(errno, path);
  } else if (!S_ISREG(status.st_mode)) {
    error = posixError(S_ISDIR(status.st_mode) ? EISDIR : EINVAL, path + " is not a regular file");
  } else if (static_cast<uint64_t>(status.st_size) > maxBytes) {
    error = posixError(EFBIG, path + " is larger than " + std::to_string(maxBytes) + " bytes");
  } else {
    std::string text(maxBytes + 1, '\0');
    std::size_t had = 0;
    ssize_t got = 0;
    while (had < text.size() && (got = read(fd, text.data() + had, text.size() - had)) > 0) {
      had += static_cast<std::size_t>(got);
    }
    if (got < 0)
      error = posixError(errno, path);
    else if (had > maxBytes)
      error = posixError(EFBIG, path + " is larger than " + std::to_string(maxBytes) + " bytes");
    else
      content = text.substr(0, had);
  }
  close(fd);
  return content;
}

std::optional<std::string> readTomlText(const std::string& path, Error& error) {
  std::optional<std::string> text = readRegularFile(path, kMaxTomlBytes, error);
  if (!text) return std::nullopt;
  if (const int line = lineNestedTooDeep(*text)) {
    error = {kPosixErrorDomain, EINVAL,
             path + ":" + std::to_string(line) + ": a key of more than " +
                 std::to_string(kMaxKeyParts) + " parts"};
    return std::nullopt;
  }
  return text;
}

}  // namespace vx::lnx
