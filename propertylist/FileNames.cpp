#include "propertylist/FileNames.h"

#include <cstdint>

#include "propertylist/Utf8.h"

namespace vx {

namespace {

constexpr std::size_t kMaxBytes = 120;
constexpr std::size_t kHashDigits = 16;
constexpr std::size_t kMaxKept = kMaxBytes - 2 - kHashDigits;  // in front of "%~" and the hash

bool isPlain(uint8_t c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '.' ||
         c == '-' || c == '_';
}

void appendHex(std::string& out, uint64_t value, int digits) {
  for (int shift = 4 * (digits - 1); shift >= 0; shift -= 4)
    out += "0123456789ABCDEF"[value >> shift & 15];
}

// 64-bit FNV-1a.
uint64_t hashOf(std::string_view text) {
  uint64_t hash = 0xCBF29CE484222325u;
  for (const char c : text) hash = (hash ^ static_cast<uint8_t>(c)) * 0x100000001B3u;
  return hash;
}

// Appends the encoding of the character at `at` and returns how many bytes of the text it took.
std::size_t appendEncoded(std::string& out, const uint8_t* at, const uint8_t* end) {
  const std::size_t length = utf8SequenceLength(at, end);
  const bool control = length == 2 && at[0] == 0xC2 && at[1] < 0xA0;  // U+0080 to U+009F
  if (length > 1 && !control) {
    out.append(reinterpret_cast<const char*>(at), length);
    return length;
  }
  if (isPlain(*at)) {
    out += static_cast<char>(*at);
  } else {
    out += '%';
    appendHex(out, *at, 2);
  }
  return 1;
}

}  // namespace

std::string encodeFileNameComponent(std::string_view text) {
  if (text.empty()) return "%";
  std::string name;
  std::size_t kept = 0;  // what stays when the name turns out too long
  const uint8_t* at = bytesOf(text);
  const uint8_t* const end = at + text.size();
  if (*at == '.') {
    name = "%2E";
    ++at;
  }
  while (at < end && name.size() <= kMaxBytes) {
    if (name.size() <= kMaxKept) kept = name.size();
    at += appendEncoded(name, at, end);
  }
  if (name.size() <= kMaxBytes) return name;
  name.resize(kept);
  name += "%~";
  appendHex(name, hashOf(text), kHashDigits);
  return name;
}

}  // namespace vx
