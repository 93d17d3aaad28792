#include "Statistics/Service/VXReportingRowReader.h"

#include <bit>
#include <cstring>

#include "propertylist/CborReader.h"

namespace vx {

namespace {

// Big-endian, as an item has it.
void writeDouble(const uint8_t* shortened, std::array<uint8_t, 9>& out) {
  const auto value = static_cast<double>(std::bit_cast<float>(loadWord<uint32_t>(shortened + 1)));
  out[0] = cbor::kDouble;
  const uint64_t bits = __builtin_bswap64(std::bit_cast<uint64_t>(value));
  std::memcpy(out.data() + 1, &bits, sizeof bits);
}

}  // namespace

Payload VXReportingRow::payload() const {
  if (shape == VXReportingRows::kNoShape) return dictionary;
  PayloadBuilder builder;
  for (std::size_t i = 0; i < keys.size(); ++i) builder.set(keys[i], values[i]);
  return builder.build();
}

VXReportingRowReader::VXReportingRowReader(const VXReportingRows& rows) : rows_(rows) {}

const VXReportingRow* VXReportingRowReader::next() {
  for (;;) {
    if (at_ == end_) {
      if (!nextBlock()) return nullptr;
      continue;
    }
    const uint8_t tag = *at_++;
    switch (tag) {
      case Format::kEndOfBlock:
        at_ = end_;
        break;
      case Format::kShape:
        beginShape();
        break;
      case Format::kCount:
        readCount();
        break;
      case Format::kWhole: {
        const auto kind = Format::kindOf(number());
        const uint8_t* const item = at_;
        at_ = cbor::skip(at_);
        return whole(kind, Payload::copyOf(Value::ofValidated({item, at_})));
      }
      case Format::kReference: {
        const auto kind = Format::kindOf(number());
        return whole(kind, rows_.references_[number()]);
      }
      case Format::kFarRow:
        return row(Format::kShapesByTag + static_cast<uint32_t>(number()));
      default:
        return row(tag - uint32_t{Format::kFirstRow});
    }
  }
}

bool VXReportingRowReader::nextBlock() {
  if (block_ == rows_.blocks_.size()) return false;
  const AggregateMemory::Block& block = rows_.blocks_[block_++];
  at_ = block.bytes;
  end_ = block_ == rows_.blocks_.size() ? rows_.at_ : block.bytes + block.size;
  return true;
}

uint64_t VXReportingRowReader::number() {
  uint64_t number = 0;
  const uint8_t* const after = Format::readNumber(at_, end_, number);
  at_ = after != nullptr ? after : end_;
  return number;
}

void VXReportingRowReader::beginShape() {
  (void)number();
  for (uint64_t keys = number(); keys > 0; --keys) at_ = cbor::skip(at_);
  const std::size_t columns = rows_.shapes_[shapes_.size()].columns.size();
  shapes_.emplace_back().doubles.resize(columns);
}

void VXReportingRowReader::readCount() {
  const auto kind = static_cast<MessageKind>(number());
  if (kind >= counts_.size()) counts_.resize(std::size_t{kind} + 1);
  counts_[kind] = number();
}

void VXReportingRowReader::countMessage(std::optional<MessageKind> kind) {
  row_.kind = kind;
  if (!kind) return;
  if (*kind >= counts_.size()) counts_.resize(std::size_t{*kind} + 1);
  row_.count = ++counts_[*kind];
}

const VXReportingRow* VXReportingRowReader::whole(std::optional<MessageKind> kind,
                                                  Payload dictionary) {
  countMessage(kind);
  row_.shape = VXReportingRows::kNoShape;
  row_.keys = {};
  row_.values = {};
  row_.dictionary = std::move(dictionary);
  return &row_;
}

const VXReportingRow* VXReportingRowReader::row(uint32_t index) {
  Shape& shape = shapes_[index];
  const VXReportingRows::Shape& kept = rows_.shapes_[index];
  const std::size_t columns = kept.columns.size();
  const bool first = shape.values.size() < columns;  // which has every value
  for (std::size_t i = 0; i < columns; ++i) {
    const uint8_t* const item = at_;
    if (*item == Format::kSame) {
      ++at_;
      continue;
    }
    std::span<const uint8_t> bytes;
    if (*item == Format::kShortDouble) {
      at_ += Format::kShortDoubleBytes;
      writeDouble(item, shape.doubles[i]);
      bytes = shape.doubles[i];
    } else {
      at_ = cbor::skip(item);
      bytes = {item, at_};
    }
    if (first)
      shape.values.push_back(Value::ofValidated(bytes));
    else
      shape.values[i] = Value::ofValidated(bytes);
  }
  countMessage(kept.kind);
  row_.shape = index;
  row_.keys = kept.keys;
  row_.values = shape.values;
  return &row_;
}

}  // namespace vx
