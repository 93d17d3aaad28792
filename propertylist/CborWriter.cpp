#include "propertylist/CborWriter.h"

#include <bit>
#include <cmath>

#include "propertylist/CborReader.h"
#include "propertylist/Utf8.h"

namespace vx {

namespace {

constexpr uint8_t kDateTag = 0xC1;

template <typename Word>
uint8_t* storeBigEndian(uint8_t* at, Word word) {
  if constexpr (sizeof word == 2) word = __builtin_bswap16(word);
  if constexpr (sizeof word == 4) word = __builtin_bswap32(word);
  if constexpr (sizeof word == 8) word = __builtin_bswap64(word);
  std::memcpy(at, &word, sizeof word);
  return at + sizeof word;
}

}  // namespace

void CborWriter::head(uint8_t major, uint64_t argument) {
  uint8_t bytes[9];
  uint8_t* end = bytes + 1;
  if (argument < 24) {
    out_.push_back(static_cast<uint8_t>(major | argument));
    return;
  }
  if (argument <= 0xFF) {
    bytes[0] = major | 24;
    end = storeBigEndian(end, static_cast<uint8_t>(argument));
  } else if (argument <= 0xFFFF) {
    bytes[0] = major | 25;
    end = storeBigEndian(end, static_cast<uint16_t>(argument));
  } else if (argument <= 0xFFFFFFFF) {
    bytes[0] = major | 26;
    end = storeBigEndian(end, static_cast<uint32_t>(argument));
  } else {
    bytes[0] = major | 27;
    end = storeBigEndian(end, argument);
  }
  out_.insert(out_.end(), bytes, end);
}

void CborWriter::integer(int64_t value) {
  if (value >= 0)
    head(0x00, static_cast<uint64_t>(value));
  else
    head(0x20, ~static_cast<uint64_t>(value));  // -1 - value
}

void CborWriter::singleFloat(float value) {
  uint8_t bytes[5] = {cbor::kSingle};
  storeBigEndian(bytes + 1, std::bit_cast<uint32_t>(value));
  out_.insert(out_.end(), bytes, bytes + sizeof bytes);
}

void CborWriter::doubleFloat(double value) {
  uint8_t bytes[9] = {cbor::kDouble};
  storeBigEndian(bytes + 1, std::bit_cast<uint64_t>(value));
  out_.insert(out_.end(), bytes, bytes + sizeof bytes);
}

void CborWriter::string(std::string_view value) {
  if (!isUtf8(value)) return string(wellFormedUtf8(value));
  head(0x60, value.size());
  out_.insert(out_.end(), value.begin(), value.end());
}

void CborWriter::date(double secondsSince1970) {
  out_.push_back(kDateTag);
  if (!std::isfinite(secondsSince1970)) return integer(0);
  if (std::abs(secondsSince1970) < 0x1p53 && std::trunc(secondsSince1970) == secondsSince1970)
    integer(static_cast<int64_t>(secondsSince1970));
  else
    doubleFloat(secondsSince1970);
}

}  // namespace vx
