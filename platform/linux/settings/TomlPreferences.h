// Preferences domains as TOML files.
#pragma once

#include <map>
#include <memory>
#include <string>

#include "base/Mutex.h"
#include "base/Status.h"
#include "platform/Preferences.h"

namespace vx::lnx {

// <folder>/<domain>.toml, read afresh at each open. A file that cannot be read or does not parse
// keeps the last good values of its domain and is complained of once per state, with line and
// column. Thread-safe; a file is at most 1 MiB.
class TomlPreferences final : public Preferences {
 public:
  explicit TomlPreferences(std::string folder) : folder_(std::move(folder)) {}
  std::unique_ptr<PreferencesDomain> open(std::string_view domain) override;
  std::string fileOf(std::string_view domain) const {
    return folder_ + "/" + std::string(domain) + ".toml";
  }

  struct Values;  // what a file held

 private:
  struct Known {
    std::shared_ptr<const Values> values;
    std::string complaint;  // the last one, so that it is made once
  };
  static Result<std::shared_ptr<const Values>> read(const std::string& path);

  const std::string folder_;
  Mutex mutex_;
  std::map<std::string, Known, std::less<>> known_
      GUARDED_BY(mutex_);  // as many as there are domains in use
};

}  // namespace vx::lnx
