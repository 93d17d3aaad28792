// Appends CBOR items (RFC 8949, definite lengths, the shortest heads) to a byte buffer. The caller
// keeps counts right; single and double floats keep their width, so that the kinds stay apart.
#pragma once

#include <cstdint>
#include <span>
#include <string_view>
#include <vector>

namespace vx {

class CborWriter {
 public:
  explicit CborWriter(std::vector<uint8_t>& out) : out_(out) {}
  void array(uint64_t count) { head(0x80, count); }
  void dictionary(uint64_t count) { head(0xA0, count); }
  void integer(int64_t value);
  void unsignedInteger(uint64_t value) { head(0x00, value); }
  void singleFloat(float value);
  void doubleFloat(double value);
  void boolean(bool value) { out_.push_back(value ? 0xF5 : 0xF4); }
  void null() { out_.push_back(0xF6); }
  void string(std::string_view value);                    // bytes that are not UTF-8 become U+FFFD
  void stringHead(uint64_t bytes) { head(0x60, bytes); }  // the bytes follow, from the caller
  void date(double secondsSince1970);                     // 1970 when not finite
  void encoded(std::span<const uint8_t> item) { out_.insert(out_.end(), item.begin(), item.end()); }

 private:
  void head(uint8_t major, uint64_t argument);
  std::vector<uint8_t>& out_;
};

}  // namespace vx
