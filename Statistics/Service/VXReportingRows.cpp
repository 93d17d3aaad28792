#include "Statistics/Service/VXReportingRows.h"

#include <array>
#include <bit>
#include <cstring>
#include <utility>

#include "Statistics/Service/VXReportingRowScan.h"
#include "base/Bytes.h"
#include "propertylist/CborReader.h"

namespace vx {

namespace {

// A session of few messages takes little, one of many takes blocks that cost nothing to find.
constexpr std::size_t kFirstBlock = 480;
constexpr std::size_t kBlockGrowth = 4;
constexpr std::size_t kLargestBlock = (64 << 10) - 32;

// Most keys and values are short: a call would cost more than the work.
bool same(const uint8_t* a, const uint8_t* b, std::size_t size) {
  if (size >= 8) {
    for (std::size_t i = 0; i + 8 < size; i += 8)
      if (loadWord<uint64_t>(a + i) != loadWord<uint64_t>(b + i)) return false;
    return loadWord<uint64_t>(a + size - 8) == loadWord<uint64_t>(b + size - 8);
  }
  if (size >= 4)
    return loadWord<uint32_t>(a) == loadWord<uint32_t>(b) &&
           loadWord<uint32_t>(a + size - 4) == loadWord<uint32_t>(b + size - 4);
  for (; size > 0; --size)
    if (*a++ != *b++) return false;
  return true;
}

template <typename Word>
void copyWord(uint8_t* to, const uint8_t* from) {
  std::memcpy(to, from, sizeof(Word));
}

uint8_t* copy(uint8_t* to, const uint8_t* from, std::size_t size) {
  if (size > 32) {
    std::memcpy(to, from, size);
  } else if (size >= 8) {
    for (std::size_t i = 0; i + 8 < size; i += 8) copyWord<uint64_t>(to + i, from + i);
    copyWord<uint64_t>(to + size - 8, from + size - 8);
  } else if (size >= 4) {
    copyWord<uint32_t>(to, from);
    copyWord<uint32_t>(to + size - 4, from + size - 4);
  } else {
    for (std::size_t i = 0; i < size; ++i) to[i] = from[i];
  }
  return to + size;
}

// Sizes of the items that their first byte tells; 0 for the others.
constexpr std::array<uint8_t, 256> kItemBytes = [] {
  std::array<uint8_t, 256> sizes{};
  for (unsigned initial = 0; initial < 256; ++initial) {
    const unsigned major = initial >> 5;
    const unsigned info = initial & 31;
    if (info > 27 || (info > 23 && major == cbor::kText)) continue;
    const unsigned head = info < 24 ? 1 : 1 + (1u << (info - 24));
    if (major <= cbor::kNegative || major == cbor::kSimple)
      sizes[initial] = static_cast<uint8_t>(head);
    else if (major == cbor::kText)
      sizes[initial] = static_cast<uint8_t>(1 + info);
  }
  return sizes;
}();

const uint8_t* endOfItem(const uint8_t* at) {
  const uint8_t size = kItemBytes[*at];
  return size != 0 ? at + size : cbor::skip(at);
}

uint64_t fingerprintOf(std::optional<MessageKind> kind,
                       std::span<const std::span<const uint8_t>> keys) {
  uint64_t fingerprint = VXReportingRowFormat::numberOf(kind) << 16 | keys.size();
  for (const std::span<const uint8_t> key : keys) {
    forEachWord(key.data(), key.size(), [&](uint64_t word) {
      fingerprint = (std::rotl(fingerprint, 23) ^ word) * 0x9E3779B97F4A7C15u;
    });
  }
  return fingerprint;
}

// A double that a single holds, in its short form.
bool shorten(const uint8_t* item, uint8_t (&out)[VXReportingRowFormat::kShortDoubleBytes]) {
  const double value = std::bit_cast<double>(cbor::bigEndian(item + 1, 27));
  const float single = static_cast<float>(value);
  // To the bit: -0 and the kinds of NaN stay what they are.
  if (std::bit_cast<uint64_t>(static_cast<double>(single)) != std::bit_cast<uint64_t>(value))
    return false;
  out[0] = VXReportingRowFormat::kShortDouble;
  const auto bits = std::bit_cast<uint32_t>(single);
  std::memcpy(out + 1, &bits, sizeof bits);
  return true;
}

}  // namespace

VXReportingRows::~VXReportingRows() {
  for (const Share& share : shares_) memory_.charge(share.payer, -share.bytes);
  memory_.release(blocks_);
}

void VXReportingRows::chargeTo(AggregateMemory::Payer payer) {
  const int64_t more = static_cast<int64_t>(memoryBytes() + shapeBytes_) - charged_;
  if (more == 0) return;
  charged_ += more;
  if (shares_.empty() || shares_.back().payer != payer) {
    const auto found = std::ranges::find(shares_, payer, &Share::payer);
    if (found == shares_.end())
      shares_.push_back({payer, 0});
    else
      std::swap(*found, shares_.back());
  }
  shares_.back().bytes += more;
  memory_.charge(payer, more);
}

// ---------------------------------------------------------------------------------------------------------------------
// Rows

void VXReportingRows::append(std::optional<MessageKind> kind, uint64_t count,
                             const Payload& payload) {
  Kind& of = countMessage(kind, count);
  const Bytes dictionary = payload.encoded();
  if (of.shape == kNoShape || !appendAs(of.shape, dictionary)) {
    if (!appendAsOther(of, dictionary)) appendWhole(kind, dictionary);
  }
  mayHoldNonFinite_ = mayHoldNonFinite_ || payload.mayHoldNonFinite();
  ++rows_;
  messages_ += kind ? 1 : 0;
}

void VXReportingRows::appendReference(MessageKind kind, uint64_t count, Payload payload) {
  (void)countMessage(kind, count);
  uint8_t* at = reserve(1 + 2 * Format::kMaxNumberBytes);
  surviving_ = std::min(surviving_, offset());
  *at++ = Format::kReference;
  at = Format::writeNumber(at, Format::numberOf(kind));
  at_ = Format::writeNumber(at, references_.size());
  mayHoldNonFinite_ = mayHoldNonFinite_ || payload.mayHoldNonFinite();
  references_.push_back(std::move(payload));
  ++rows_;
  ++messages_;
}

VXReportingRows::Kind& VXReportingRows::kindFor(std::optional<MessageKind> kind) {
  if (kind_ >= kinds_.size() || kinds_[kind_].kind != kind) {
    const auto found = std::ranges::find(kinds_, kind, &Kind::kind);
    kind_ = static_cast<std::size_t>(found - kinds_.begin());
    if (found == kinds_.end()) kinds_.push_back({.kind = kind});
  }
  return kinds_[kind_];
}

// Its count is said where it is not one more than before.
VXReportingRows::Kind& VXReportingRows::countMessage(std::optional<MessageKind> kind,
                                                     uint64_t count) {
  Kind& found = kindFor(kind);
  if (kind && count != ++found.count) {
    found.count = count;
    uint8_t* at = reserve(1 + 2 * Format::kMaxNumberBytes);
    *at++ = Format::kCount;
    at = Format::writeNumber(at, *kind);
    at_ = Format::writeNumber(at, count - 1);
  }
  return found;
}

void VXReportingRows::appendWhole(std::optional<MessageKind> kind, Bytes dictionary) {
  uint8_t* at = reserve(1 + Format::kMaxNumberBytes + dictionary.size());
  *at++ = Format::kWhole;
  at = Format::writeNumber(at, Format::numberOf(kind));
  at_ = copy(at, dictionary.data(), dictionary.size());
}

// ---------------------------------------------------------------------------------------------------------------------
// Shapes

// False, and nothing is appended, when the dictionary is of another shape.
bool VXReportingRows::appendAs(uint32_t index, Bytes dictionary) {
  Shape& shape = shapes_[index];
  const cbor::Head head = cbor::head(dictionary.data());
  if (head.argument != shape.columns.size()) return false;
  const uint8_t* const end = dictionary.data() + dictionary.size();
  std::array<const uint8_t*, Format::kMostKeys + 1> values;  // the first of each, after its key
  const uint8_t* at = head.next;
  std::size_t i = 0;
  for (const Column& column : shape.columns) {
    const std::size_t size = column.key.size();
    if (static_cast<std::size_t>(end - at) < size || !same(at, column.key.data(), size))
      return false;
    values[i++] = at += size;
    at = endOfItem(at);
  }

  uint8_t* out = reserve(Format::kMaxTagBytes + dictionary.size() - shape.keyBytes);
  if (index < Format::kShapesByTag) {
    *out++ = static_cast<uint8_t>(Format::kFirstRow + index);
  } else {
    *out++ = Format::kFarRow;
    out = Format::writeNumber(out, index - Format::kShapesByTag);
  }
  i = 0;
  for (Column& column : shape.columns) {
    const uint8_t* item = values[i++];
    auto size = static_cast<std::size_t>(endOfItem(item) - item);
    uint8_t shortened[Format::kShortDoubleBytes];
    if (*item == cbor::kDouble && shorten(item, shortened)) {
      item = shortened;
      size = sizeof shortened;
    }
    if (size > 1 && size == column.last.size() && same(item, column.last.data(), size)) {
      *out++ = Format::kSame;
      continue;
    }
    column.last = {out, size};
    out = copy(out, item, size);
  }
  at_ = out;
  return true;
}

// Another shape of the kind, be it a new one.
bool VXReportingRows::appendAsOther(Kind& kind, Bytes dictionary) {
  const cbor::Head head = cbor::head(dictionary.data());
  if (head.argument > Format::kMostKeys) return false;
  std::array<Bytes, Format::kMostKeys> items;
  const uint8_t* at = head.next;
  for (uint64_t i = 0; i < head.argument; ++i) {
    const uint8_t* const value = endOfItem(at);
    items[i] = {at, value};
    at = endOfItem(value);
  }
  const std::span<const Bytes> keys(items.data(), head.argument);
  const auto found = std::ranges::find(fingerprints_, fingerprintOf(kind.kind, keys));
  const auto shape = static_cast<uint32_t>(found - fingerprints_.begin());
  if (found == fingerprints_.end()) {
    if (shapes_.size() == Format::kMostShapes) return false;
    appendShape(kind.kind, keys);
  } else if (shapes_[shape].kind != kind.kind) {
    return false;  // two that have one fingerprint
  }
  if (!appendAs(shape, dictionary)) return false;
  kind.shape = shape;
  return true;
}

void VXReportingRows::appendShape(std::optional<MessageKind> kind, std::span<const Bytes> keys) {
  std::size_t size = 1 + 2 * Format::kMaxNumberBytes;
  for (const Bytes key : keys) size += key.size();
  uint8_t* out = reserve(size);
  *out++ = Format::kShape;
  out = Format::writeNumber(out, Format::numberOf(kind));
  out = Format::writeNumber(out, keys.size());
  std::vector<Bytes> kept;
  for (const Bytes key : keys) {
    kept.emplace_back(out, key.size());
    out = copy(out, key.data(), key.size());
  }
  addShape(kind, kept);
  at_ = out;
}

// The keys are in the stream.
void VXReportingRows::addShape(std::optional<MessageKind> kind, std::span<const Bytes> keys) {
  shapes_.resize(fingerprints_.size());  // the last may be one that there was no memory for
  Shape& shape = shapes_.emplace_back();
  shape.kind = kind;
  for (const Bytes key : keys) {
    shape.columns.push_back({.key = key, .last = {}});
    shape.keys.push_back(cbor::text(key.data()));
    shape.keyBytes += key.size();
  }
  fingerprints_.push_back(fingerprintOf(kind, keys));
  shapeBytes_ += sizeof(Shape) + keys.size() * (sizeof(Column) + sizeof(std::string_view));
}

// ---------------------------------------------------------------------------------------------------------------------
// Memory

// Where a record of at most so many bytes goes.
uint8_t* VXReportingRows::reserve(std::size_t bytes) {
  if (static_cast<std::size_t>(end_ - at_) < bytes) [[unlikely]]
    beginBlock(bytes);
  return at_;
}

void VXReportingRows::beginBlock(std::size_t bytes) {
  if (aggregate_ == 0) aggregate_ = memory_.nameAggregate();
  const std::size_t usual =
      blocks_.empty() ? kFirstBlock
                      : std::min(kBlockGrowth * std::max(block().size, kFirstBlock), kLargestBlock);
  const AggregateMemory::Block next =
      memory_.acquire(aggregate_, static_cast<uint32_t>(blocks_.size()), std::max(usual, bytes));
  if (at_ != end_) *at_ = Format::kEndOfBlock;
  before_ += block().size;
  if (!next.survives) surviving_ = std::min(surviving_, before_);
  blocks_.push_back(next);
  at_ = next.bytes;
  end_ = at_ + next.size;
}

Result<std::unique_ptr<VXReportingRows>> VXReportingRows::restore(AggregateMemory& memory,
                                                                  uint64_t aggregate,
                                                                  uint64_t bytes) {
  auto rows = std::make_unique<VXReportingRows>(memory);
  rows->aggregate_ = aggregate;
  rows->blocks_ = memory.find(aggregate, bytes);
  if (!VXReportingRowScan(*rows, bytes).run())
    return Status::failure("what was kept of a session cannot be read");
  return rows;
}

}  // namespace vx
