#include "platform/linux/settings/TomlPreferences.h"

#include <toml++/toml.h>

#include <algorithm>
#include <cerrno>
#include <sstream>

#include "platform/Log.h"
#include "platform/linux/settings/TomlText.h"

namespace vx::lnx {

struct TomlPreferences::Values {
  toml::table table;
};

namespace {

class TomlDomain final : public PreferencesDomain {
 public:
  explicit TomlDomain(std::shared_ptr<const TomlPreferences::Values> values)
      : values_(std::move(values)) {}

  bool hasObject(std::string_view key) const override { return find(key) != nullptr; }
  std::optional<std::string> string(std::string_view key) const override {
    const toml::node* node = find(key);
    if (node == nullptr || node->is_table() || node->is_array()) return std::nullopt;
    if (auto text = node->value_exact<std::string>()) return text;
    if (const auto flag = node->value_exact<bool>()) return *flag ? "1" : "0";
    std::ostringstream out;
    out << toml::node_view<const toml::node>(*node);
    return out.str();
  }
  bool boolean(std::string_view key) const override {
    const toml::node* node = find(key);
    if (node == nullptr) return false;
    if (const auto flag = node->value_exact<bool>()) return *flag;
    if (const auto number = node->value_exact<int64_t>()) return *number != 0;
    if (const auto real = node->value_exact<double>()) return *real != 0;
    std::string text = node->value_exact<std::string>().value_or("");
    std::transform(text.begin(), text.end(), text.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return text == "true" || text == "yes" || text == "1";
  }

 private:
  const toml::node* find(std::string_view key) const {
    return values_ != nullptr ? values_->table.get(key) : nullptr;
  }
  const std::shared_ptr<const TomlPreferences::Values> values_;
};

}  // namespace

// What is not there is empty; what cannot be read or parsed is a failure.
Result<std::shared_ptr<const TomlPreferences::Values>> TomlPreferences::read(
    const std::string& path) {
  const Result<std::string> text = readTomlText(path);
  if (!text.ok()) {
    const int code = text.status().code();
    if (code != ENOENT && code != ENOTDIR) return text.status();
    return std::shared_ptr<const Values>(std::make_shared<Values>());
  }
  try {
    return std::make_shared<const Values>(Values{toml::parse(*text, path)});
  } catch (const toml::parse_error& failure) {
    return Status::failure(complaintOf(path, failure));
  }
}

std::unique_ptr<PreferencesDomain> TomlPreferences::open(std::string_view domain) {
  const Result<std::shared_ptr<const Values>> read = TomlPreferences::read(fileOf(domain));
  const std::string& complaint = read.status().text();
  std::shared_ptr<const Values> values;
  bool isNew = false;
  {
    MutexLock lock(mutex_);
    Known& known = known_[std::string(domain)];
    isNew = known.complaint != complaint;
    known.complaint = complaint;
    if (read.ok()) known.values = *read;
    values = known.values;
  }
  if (isNew && !complaint.empty()) {
    VX_LOG(nullptr, Error, "preferences keep their last good values: %s", complaint.c_str());
  }
  return std::make_unique<TomlDomain>(std::move(values));
}

}  // namespace vx::lnx
