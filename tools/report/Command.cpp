#include "tools/report/Command.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>

namespace vx::report {

Options::Options(const Words& all, std::initializer_list<std::string_view> names) {
  const auto known = [&](std::string_view name) { return std::ranges::count(names, name) > 0; };
  for (std::size_t i = 1; i < all.size(); ++i) {
    const std::string& word = all[i];
    if (!word.starts_with("-") || word == "-" || (word[1] >= '0' && word[1] <= '9')) {
      words_.push_back(word);
      continue;
    }
    const std::size_t equals = word.find('=');
    const std::string name = word.substr(0, equals);
    if (known(name + "=")) {
      if (equals == std::string::npos && i + 1 == all.size()) throw UsageError();
      given_[name] = equals == std::string::npos ? all[++i] : word.substr(equals + 1);
    } else if (known(name) && equals == std::string::npos) {
      given_[name];
    } else {
      throw UsageError();
    }
  }
}

std::optional<std::string> Options::value(const std::string& name) const {
  const auto found = given_.find(name);
  return found == given_.end() ? std::nullopt : std::optional<std::string>(found->second);
}

const Words& Options::words(std::size_t fewest, std::size_t most) const {
  if (words_.size() < fewest || words_.size() > most) throw UsageError();
  return words_;
}

int64_t numberOf(const std::string& text) {
  char* end = nullptr;
  errno = 0;
  const long long value = std::strtoll(text.c_str(), &end, 0);
  if (end == text.c_str() || *end != '\0' || errno == ERANGE) throw UsageError();
  return value;
}

std::string printable(std::string_view text) {
  std::string out;
  bool controls = false;  // terminals know those from U+0080 to U+009F too
  for (std::size_t i = 0; i < text.size(); ++i) {
    const auto byte = static_cast<unsigned char>(text[i]);
    const bool second = controls;
    controls =
        byte == 0xC2 && i + 1 < text.size() && static_cast<unsigned char>(text[i + 1]) < 0xA0;
    if (!controls && !second && byte >= 0x20 && byte != 0x7F) {
      out += text[i];
      continue;
    }
    char escaped[5];
    std::snprintf(escaped, sizeof escaped, "\\x%02X", byte);
    out += escaped;
  }
  return out;
}

}  // namespace vx::report
