#include "tools/report/PageText.h"

#include "propertylist/JsonWriter.h"
#include "propertylist/Utf8.h"

namespace vx::report {

namespace {

constexpr std::size_t kExactDigits = 15;  // of a double

// JSON with nothing in it that means something to HTML or ends a line of a script.
void appendHarmless(std::string& out, std::string_view json) {
  for (std::size_t i = 0; i < json.size(); ++i) {
    const std::string_view rest = json.substr(i, 3);
    if (json[i] == '<') {
      out += "\\u003c";
    } else if (rest == "\xE2\x80\xA8" || rest == "\xE2\x80\xA9") {
      out += rest.back() == '\xA8' ? "\\u2028" : "\\u2029";
      i += 2;
    } else {
      out += json[i];
    }
  }
}

std::size_t endOfString(std::string_view json, std::size_t begin) {
  for (std::size_t i = begin + 1; i < json.size(); ++i) {
    if (json[i] == '\\')
      ++i;
    else if (json[i] == '"')
      return i + 1;
  }
  return json.size();
}

}  // namespace

void appendPageString(std::string& out, std::string_view text, std::size_t most) {
  std::size_t characters = 0;
  std::size_t cut = text.size();
  for (std::size_t i = 0; i < text.size(); ++i) {
    const bool begins = (static_cast<unsigned char>(text[i]) & 0xC0) != 0x80;
    if (begins && characters++ == most) cut = i;
  }
  std::string shown(text.substr(0, cut));
  if (cut < text.size()) shown += "\u2026 (" + std::to_string(characters) + " characters)";
  std::string json;
  appendJsonString(json, shown);
  appendHarmless(out, json);
}

void appendPageJson(std::string& out, std::string_view json) {
  for (std::size_t i = 0; i < json.size();) {
    if (json[i] == '"') {
      const std::size_t end = endOfString(json, i);
      appendHarmless(out, json.substr(i, end - i));
      i = end;
      continue;
    }
    const std::size_t end = json.find_first_not_of("0123456789", i + (json[i] == '-' ? 1 : 0));
    const std::string_view digits =
        json.substr(i, (end == std::string_view::npos ? json.size() : end) - i);
    const char next = i + digits.size() < json.size() ? json[i + digits.size()] : '\0';
    const bool whole = next != '.' && next != 'e' && next != 'E';
    const bool begins =
        i == 0 || std::string_view(".eE+").find(json[i - 1]) == std::string_view::npos;
    if (digits.size() > kExactDigits && whole && begins) {
      out.append("\"").append(digits).append("\"");
      i += digits.size();
    } else {
      const std::size_t length = digits.empty() ? 1 : digits.size();
      appendHarmless(out, json.substr(i, length));
      i += length;
    }
  }
}

}  // namespace vx::report
