// Visits what a session received, in order.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string_view>
#include <vector>

#include "Statistics/Service/VXReportingRows.h"

namespace vx {

// One row. Views, good until the next one is asked for.
struct VXReportingRow {
  std::optional<MessageKind> kind;  // none for what is no message
  uint64_t count = 0;               // of the kind, with this one
  // Rows of one shape have the same kind and the same keys in the same order. kNoShape: the
  // dictionary instead of keys and values.
  uint32_t shape = VXReportingRows::kNoShape;
  std::span<const std::string_view> keys;
  std::span<const Value> values;
  Payload dictionary;

  Payload payload() const;  // a copy, or what is referred to
};

// Nothing may be appended meanwhile. Lives for one visit.
class VXReportingRowReader {
 public:
  explicit VXReportingRowReader(const VXReportingRows& rows);
  // Null after the last one.
  const VXReportingRow* next();

 private:
  using Format = VXReportingRowFormat;
  // What the newest row of a shape has. A double in its short form is written out beside them.
  struct Shape {
    std::vector<Value> values;
    std::vector<std::array<uint8_t, 9>> doubles;
  };

  bool nextBlock();
  uint64_t number();
  void beginShape();
  void readCount();
  const VXReportingRow* row(uint32_t shape);
  const VXReportingRow* whole(std::optional<MessageKind> kind, Payload dictionary);
  void countMessage(std::optional<MessageKind> kind);

  const VXReportingRows& rows_;
  std::size_t block_ = 0;  // the next one
  const uint8_t* at_ = nullptr;
  const uint8_t* end_ = nullptr;
  std::vector<Shape> shapes_;     // as far as they have come
  std::vector<uint64_t> counts_;  // by kind
  VXReportingRow row_;
};

}  // namespace vx
