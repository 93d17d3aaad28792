#include "platform/linux/FileReading.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace vx::lnx {

Error posixError(int errnoValue, const std::string& what) {
  return {kPosixErrorDomain, errnoValue, what + ": " + std::strerror(errnoValue)};
}

std::optional<std::string> readRegularFile(const std::string& path, std::size_t maxBytes, Error& error) {
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
    if (got < 0) error = posixError(errno, path);
    else if (had > maxBytes) error = posixError(EFBIG, path + " is larger than " + std::to_string(maxBytes) + " bytes");
    else content = text.substr(0, had);
  }
  close(fd);
  return content;
}

}  // namespace vx::lnx
