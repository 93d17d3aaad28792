#include "base/FileReading.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "base/UniqueFd.h"

namespace vx {

Result<std::string> readRegularFile(const std::string& path, std::size_t maxBytes) {
  const auto tooLarge = [&] {
    return Status::posix(path + " is larger than " + std::to_string(maxBytes) + " bytes", EFBIG);
  };
  // O_NONBLOCK: opening a FIFO must not wait for its writer.
  const UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  struct stat status {};
  if (!fd || fstat(fd.get(), &status) != 0) return Status::lastError(path);
  if (!S_ISREG(status.st_mode))
    return Status::posix(path + " is not a regular file",
                         S_ISDIR(status.st_mode) ? EISDIR : EINVAL);
  if (static_cast<uint64_t>(status.st_size) > maxBytes) return tooLarge();
  std::string text(maxBytes + 1, '\0');
  std::size_t had = 0;
  ssize_t got = 0;
  while (had < text.size() && (got = read(fd.get(), text.data() + had, text.size() - had)) > 0) {
    had += static_cast<std::size_t>(got);
  }
  if (got < 0) return Status::lastError(path);
  if (had > maxBytes) return tooLarge();
  text.resize(had);
  text.shrink_to_fit();
  return text;
}

}  // namespace vx
