// What a dictionary is, slowly and by the book: the decoder takes what this takes, and nothing
// else.
#include <cmath>
#include <set>
#include <string>

#include "propertylist/CborReader.h"
#include "propertylist/Payload.h"

namespace {

namespace cbor = vx::cbor;

struct Book {
  std::span<const uint8_t> rest;
  bool head(uint8_t& major, uint8_t& info, uint64_t& argument) {
    if (rest.empty()) return false;
    major = rest[0] >> 5;
    argument = info = rest[0] & 31;
    const std::size_t bytes = info < 24 ? 0 : std::size_t{1} << (info - 24);
    if (info > 27 || rest.size() < 1 + bytes) return false;
    if (bytes > 0) argument = 0;
    for (std::size_t i = 1; i <= bytes; ++i) argument = argument << 8 | rest[i];
    rest = rest.subspan(1 + bytes);
    return true;
  }
  bool text(uint64_t length, std::string& out) {
    if (length > rest.size()) return false;
    out.assign(rest.begin(), rest.begin() + static_cast<std::ptrdiff_t>(length));
    rest = rest.subspan(length);
    for (std::size_t i = 0; i < out.size();) {
      const auto byte = [&](std::size_t at) {
        return static_cast<uint8_t>(at < out.size() ? out[at] : 0);
      };
      const uint8_t lead = byte(i);
      const std::size_t size = lead < 0x80       ? 1
                               : lead >> 5 == 6  ? 2
                               : lead >> 4 == 14 ? 3
                               : lead >> 3 == 30 ? 4
                                                 : 0;
      uint32_t point = size == 1 ? lead : lead & (0x7Fu >> size);
      for (std::size_t n = 1; n < size; ++n) {
        if (byte(i + n) >> 6 != 2) return false;
        point = point << 6 | (byte(i + n) & 63);
      }
      constexpr uint32_t kLeast[] = {0, 0, 0x80, 0x800, 0x10000};
      if (size == 0 || point < kLeast[size] || point > 0x10FFFF || point >> 11 == 0x1B)
        return false;
      i += size;
    }
    return true;
  }
  bool value(int depth, bool mustBeDictionary = false, bool inDate = false) {
    uint8_t major, info;
    uint64_t argument;
    std::string string;
    if (!head(major, info, argument) || (mustBeDictionary && major != cbor::kMap)) return false;
    const bool floating = major == cbor::kSimple && info >= 25;
    if (inDate && major > cbor::kNegative && !floating) return false;
    if (major == cbor::kNegative) return argument >> 63 == 0;
    if (major == cbor::kText) return text(argument, string);
    if (major == cbor::kTag) return argument == 1 && value(depth, false, true);
    if (floating) {
      const cbor::Head number{static_cast<uint8_t>(major << 5 | info), argument, nullptr};
      return !inDate || std::isfinite(cbor::floatingOf(number));
    }
    if (major == cbor::kSimple) return info == 20 || info == 21;
    if (major < cbor::kArray) return major == cbor::kUnsigned;
    if (depth == vx::Payload::kMaxNesting || argument > rest.size()) return false;
    const bool dictionary = major == cbor::kMap;
    std::set<std::string> keys;
    for (uint64_t i = 0, length = 0; i < argument; ++i) {
      if (dictionary && !(head(major, info, length) && major == cbor::kText &&
                          text(length, string) && keys.insert(string).second))
        return false;
      if (!value(depth + 1)) return false;
    }
    return true;
  }
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  Book book{{data, size}};
  const bool valid = book.value(0, true) && book.rest.empty();
  if (vx::Payload::decode({data, size}).has_value() != valid) __builtin_trap();
  return 0;
}
