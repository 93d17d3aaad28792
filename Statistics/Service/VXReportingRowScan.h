// Reads what another process left.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <vector>

#include "Statistics/Service/VXReportingRows.h"

namespace vx {

// Takes every record of the first `bytes` bytes into rows that have blocks and nothing else, and
// believes none of them. Lives for one restore.
class VXReportingRowScan {
 public:
  VXReportingRowScan(VXReportingRows& rows, uint64_t bytes) : rows_(rows), left_(bytes) {}
  // False when they are not what rows look like.
  bool run();

 private:
  using Format = VXReportingRowFormat;
  using Bytes = std::span<const uint8_t>;

  bool runBlock();
  bool runRecord(uint8_t tag);
  std::optional<uint64_t> number();
  // The next value; none when there is no valid one.
  std::optional<Bytes> item();
  bool beginShape();
  bool readCount();
  bool readWhole();
  bool readRow(uint64_t shape);
  bool readKind(std::optional<MessageKind>& kind);
  void addRow(std::optional<MessageKind> kind, uint32_t shape);

  VXReportingRows& rows_;
  uint64_t left_;  // bytes, from the begin of the next block
  const uint8_t* at_ = nullptr;
  const uint8_t* end_ = nullptr;
};

}  // namespace vx
