// The device's diagnostic-logs directory: folders and files that appear whole or not at all.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/Error.h"

namespace vx {

// A file being written under a temporary name in its own directory. Destroying it without commit
// removes it.
class AtomicFile {
 public:
  virtual ~AtomicFile() = default;
  // Takes the text and leaves `text` empty, with as much room as there is to spare. What cannot be
  // written may become known only with a later call, or with commit().
  virtual std::optional<Error> take(std::string& text) = 0;
  std::optional<Error> write(std::string_view text) {
    std::string copy(text);
    return take(copy);
  }
  // Makes it durable and puts it in the place of whatever has its name. None on success.
  virtual std::optional<Error> commit() = 0;
};

class DiagnosticFiles {
 public:
  virtual ~DiagnosticFiles() = default;
  virtual std::string logsDirectory() = 0;
  // Creates the directory with all missing parents; an existing one is no failure. `mode` holds for
  // what it creates, whatever the process's umask.
  virtual std::optional<Error> createDirectory(const std::string& path, unsigned mode) = 0;
  // Null and an error on failure. `name` is one path component, made safe by
  // encodeFileNameComponent.
  virtual std::unique_ptr<AtomicFile> createAtomically(const std::string& directory,
                                                       const std::string& name,
                                                       std::optional<Error>& error) = 0;
};

}  // namespace vx
