#include "platform/linux/ConfigurationCheck.h"

#include <toml++/toml.h>

#include <algorithm>
#include <array>
#include <cctype>
#include <cerrno>
#include <string_view>

#include "platform/linux/PlatformConfiguration.h"
#include "platform/linux/settings/TomlText.h"

namespace vx::lnx {

namespace {

struct Preference {
  std::string_view key;
  bool isText = false;  // otherwise a boolean
};
constexpr std::array<Preference, 5> kPreferences{{{"disable_reporting"},
                                                  {"device_name", true},
                                                  {"reporting_server_verbose"},
                                                  {"reporting_session_verbose"},
                                                  {"reporting_driver_verbose"}}};

// What the service would make of the value without a word; empty when it means what it says.
std::string faultOf(const Preference& preference, const toml::node& node) {
  if (preference.isText)
    return node.is_table() || node.is_array() ? "counts as absent: must be a text" : "";
  if (node.is_boolean() || node.is_number()) return "";
  std::string text = node.value_exact<std::string>().value_or("?");
  std::transform(text.begin(), text.end(), text.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  for (const char* known : {"true", "yes", "1", "false", "no", "0", ""}) {
    if (text == known) return "";
  }
  return "counts as false: must be true or false";
}

void checkPreferences(const std::string& path, std::vector<std::string>& complaints) {
  const Result<std::string> text = readTomlText(path);
  if (!text.ok()) {
    const int code = text.status().code();
    if (code != ENOENT && code != ENOTDIR) complaints.push_back(text.status().text());
    return;
  }
  try {
    const toml::table table = toml::parse(*text, path);
    for (const auto& [key, node] : table) {
      const auto known = std::find_if(kPreferences.begin(), kPreferences.end(),
                                      [&](const Preference& p) { return p.key == key.str(); });
      const std::string fault =
          known != kPreferences.end() ? faultOf(*known, node) : "unknown key: nobody looks at it";
      if (!fault.empty()) {
        complaints.push_back(path + ":" + std::to_string(node.source().begin.line) + ": " +
                             std::string(key.str()) + ": " + fault);
      }
    }
  } catch (const toml::parse_error& failure) {
    complaints.push_back(complaintOf(path, failure));
  }
}

}  // namespace

std::vector<std::string> checkConfiguration(const std::string& folder) {
  std::vector<std::string> complaints;
  (void)PlatformConfiguration::load({"", "", folder, ""}, complaints);
  checkPreferences(folder + "/preferences/com.quorvel.sonik.toml", complaints);
  return complaints;
}

}  // namespace vx::lnx
