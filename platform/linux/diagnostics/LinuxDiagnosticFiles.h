// The diagnostic-logs directory on disk.
#pragma once

#include <sys/types.h>

#include <optional>
#include <set>
#include <string>

#include "base/Mutex.h"
#include "base/Status.h"
#include "base/UniqueFd.h"
#include "platform/DiagnosticFiles.h"

namespace vx::lnx {

// Everything below the logs directory is hostile ground: folders of mode 01777, in which anybody
// may plant links, FIFOs or folders. Each component is opened by itself without following links,
// files are made under a fresh random name (O_EXCL) and renamed over whatever stands there, so
// nothing planted is ever opened, written or truncated. Where the name is another user's already,
// the sticky bit makes that an error. What a crash left half-written goes the first time a folder
// is asked for. Thread-safe.
class LinuxDiagnosticFiles final : public DiagnosticFiles {
 public:
  explicit LinuxDiagnosticFiles(std::string logsDirectory)
      : logsDirectory_(std::move(logsDirectory)) {}
  std::string logsDirectory() override { return logsDirectory_; }
  std::optional<Error> createDirectory(const std::string& path, unsigned mode) override;
  std::unique_ptr<AtomicFile> createAtomically(const std::string& directory,
                                               const std::string& name,
                                               std::optional<Error>& error) override;

 private:
  // Creates what is missing when `mode` is given.
  Result<UniqueFd> openDirectory(const std::string& path, std::optional<mode_t> mode) const;
  void removeLeftovers(int directoryFd, const std::string& path);

  const std::string logsDirectory_;
  Mutex mutex_;
  std::set<std::string> tidied_ GUARDED_BY(mutex_);  // the few folders the service writes to
};

}  // namespace vx::lnx
