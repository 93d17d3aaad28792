#include "Statistics/Service/VXReportingRowScan.h"

#include <bit>
#include <cmath>

#include "base/Bytes.h"
#include "propertylist/CborReader.h"

namespace vx {

bool VXReportingRowScan::run() {
  for (const AggregateMemory::Block& block : rows_.blocks_) {
    if (at_ != nullptr) rows_.before_ += static_cast<uint64_t>(rows_.end_ - rows_.at_);
    rows_.at_ = block.bytes;
    rows_.end_ = block.bytes + block.size;
    at_ = block.bytes;
    end_ = at_ + std::min<uint64_t>(left_, block.size);
    left_ -= static_cast<uint64_t>(end_ - at_);
    if (at_ == end_ || !runBlock()) return false;
  }
  if (left_ != 0 || at_ == nullptr) return false;
  rows_.at_ += end_ - rows_.at_;
  return true;
}

bool VXReportingRowScan::runBlock() {
  while (at_ != end_) {
    const uint8_t tag = *at_++;
    if (tag == Format::kEndOfBlock) break;
    if (!runRecord(tag)) return false;
  }
  return true;
}

bool VXReportingRowScan::runRecord(uint8_t tag) {
  switch (tag) {
    case Format::kShape:
      return beginShape();
    case Format::kCount:
      return readCount();
    case Format::kWhole:
      return readWhole();
    case Format::kReference:
      return false;  // what it refers to has gone
    case Format::kFarRow: {
      const std::optional<uint64_t> shape = number();
      return shape && *shape < Format::kMostShapes && readRow(Format::kShapesByTag + *shape);
    }
    default:
      return readRow(tag - uint64_t{Format::kFirstRow});
  }
}

std::optional<uint64_t> VXReportingRowScan::number() {
  uint64_t number = 0;
  const uint8_t* const after = Format::readNumber(at_, end_, number);
  if (after == nullptr) return std::nullopt;
  at_ = after;
  return number;
}

std::optional<VXReportingRowScan::Bytes> VXReportingRowScan::item() {
  const std::optional<Value> value = Value::validate({at_, end_});
  if (!value) return std::nullopt;
  at_ += value->encoded().size();
  return value->encoded();
}

bool VXReportingRowScan::readKind(std::optional<MessageKind>& kind) {
  const std::optional<uint64_t> read = number();
  if (!read || *read > kMessageKinds) return false;
  kind = Format::kindOf(*read);
  return true;
}

bool VXReportingRowScan::beginShape() {
  std::optional<MessageKind> kind;
  if (!readKind(kind)) return false;
  const std::optional<uint64_t> count = number();
  if (!count || *count > Format::kMostKeys || rows_.shapes_.size() == Format::kMostShapes)
    return false;
  std::vector<Bytes> keys;
  PayloadBuilder distinct;
  while (keys.size() < *count) {
    const std::optional<Bytes> key = item();
    if (!key || key->front() >> 5 != cbor::kText) return false;
    distinct.set(cbor::text(key->data()), true);
    keys.push_back(*key);
  }
  if (distinct.size() != keys.size()) return false;
  rows_.addShape(kind, keys);
  return true;
}

bool VXReportingRowScan::readCount() {
  const std::optional<uint64_t> kind = number();
  const std::optional<uint64_t> count = number();
  if (!kind || *kind >= kMessageKinds || !count) return false;
  rows_.kindFor(static_cast<MessageKind>(*kind)).count = *count;
  return true;
}

bool VXReportingRowScan::readWhole() {
  std::optional<MessageKind> kind;
  if (!readKind(kind)) return false;
  const std::optional<Bytes> dictionary = item();
  if (!dictionary || dictionary->front() >> 5 != cbor::kMap) return false;
  rows_.mayHoldNonFinite_ = rows_.mayHoldNonFinite_ || cbor::anyNonFinite(dictionary->data(), at_);
  addRow(kind, VXReportingRows::kNoShape);
  return true;
}

bool VXReportingRowScan::readRow(uint64_t index) {
  if (index >= rows_.shapes_.size()) return false;
  VXReportingRows::Shape& shape = rows_.shapes_[index];
  for (VXReportingRows::Column& column : shape.columns) {
    if (at_ == end_) return false;
    if (*at_ == Format::kSame) {
      if (column.last.empty()) return false;
      ++at_;
      continue;
    }
    if (*at_ == Format::kShortDouble) {
      if (static_cast<std::size_t>(end_ - at_) < Format::kShortDoubleBytes) return false;
      column.last = {at_, Format::kShortDoubleBytes};
      at_ += Format::kShortDoubleBytes;
      const float value = std::bit_cast<float>(loadWord<uint32_t>(column.last.data() + 1));
      rows_.mayHoldNonFinite_ = rows_.mayHoldNonFinite_ || !std::isfinite(value);
      continue;
    }
    const std::optional<Bytes> value = item();
    if (!value) return false;
    column.last = *value;
    rows_.mayHoldNonFinite_ = rows_.mayHoldNonFinite_ || cbor::anyNonFinite(value->data(), at_);
  }
  addRow(shape.kind, static_cast<uint32_t>(index));
  return true;
}

void VXReportingRowScan::addRow(std::optional<MessageKind> kind, uint32_t shape) {
  VXReportingRows::Kind& of = rows_.kindFor(kind);
  if (shape != VXReportingRows::kNoShape) of.shape = shape;
  ++of.count;
  ++rows_.rows_;
  rows_.messages_ += kind ? 1 : 0;
}

}  // namespace vx
