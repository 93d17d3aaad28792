// What a session received, as rows of values.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string_view>
#include <vector>

#include "Statistics/Service/VXReportingRowFormat.h"
#include "Statistics/VXReportingUtility.h"
#include "base/Status.h"
#include "platform/AggregateMemory.h"

namespace vx {

// An append-only store of dictionaries, in blocks of AggregateMemory that grow with it. Owned by an
// aggregate, under its lock; may be destroyed on any thread. Bounded by what clients send while
// the session is started.
class VXReportingRows {
 public:
  static constexpr uint32_t kNoShape = UINT32_MAX;

  explicit VXReportingRows(AggregateMemory& memory) : memory_(memory) {}
  VXReportingRows(const VXReportingRows&) = delete;
  VXReportingRows& operator=(const VXReportingRows&) = delete;
  ~VXReportingRows();

  // Copies the dictionary. A row without a kind is no message, and its count means nothing.
  void append(std::optional<MessageKind> kind, uint64_t count, const Payload& payload);
  // Keeps a reference, to what is too large for a copy. Such a row does not survive the process.
  void appendReference(MessageKind kind, uint64_t count, Payload payload);

  // What was appended since the last time is paid for by him.
  void chargeTo(AggregateMemory::Payer payer);

  std::size_t rows() const { return rows_; }
  std::size_t messages() const { return messages_; }
  bool mayHoldNonFinite() const { return mayHoldNonFinite_; }
  std::size_t memoryBytes() const { return before_ + block().size; }

  // The name of the memory; 0 before the first row.
  uint64_t aggregate() const { return aggregate_; }
  // How long the stream is, and how much of it survives the process.
  uint64_t offset() const {
    return before_ + static_cast<uint64_t>(blocks_.empty() ? 0 : at_ - blocks_.back().bytes);
  }
  uint64_t bytes() const { return std::min(surviving_, offset()); }

  // What an earlier process had in so many bytes of that memory. Whatever lies there: rows that can
  // be read, or an error.
  static Result<std::unique_ptr<VXReportingRows>> restore(AggregateMemory& memory,
                                                          uint64_t aggregate, uint64_t bytes);

 private:
  friend class VXReportingRowReader;
  friend class VXReportingRowScan;
  using Format = VXReportingRowFormat;
  using Bytes = std::span<const uint8_t>;

  struct Column {
    Bytes key;   // its item
    Bytes last;  // of the newest row that does not have the same as the row before
  };
  struct Shape {
    std::optional<MessageKind> kind;
    std::size_t keyBytes = 0;
    std::vector<Column> columns;
    std::vector<std::string_view> keys;
  };
  struct Kind {
    std::optional<MessageKind> kind;
    uint32_t shape = kNoShape;  // of its last row
    uint64_t count = 0;         // of its last message
  };

  struct Share {
    AggregateMemory::Payer payer = 0;
    int64_t bytes = 0;
  };

  AggregateMemory::Block block() const {
    return blocks_.empty() ? AggregateMemory::Block{} : blocks_.back();
  }
  Kind& kindFor(std::optional<MessageKind> kind);
  Kind& countMessage(std::optional<MessageKind> kind, uint64_t count);
  uint8_t* reserve(std::size_t bytes);
  void beginBlock(std::size_t bytes);
  bool appendAs(uint32_t shape, Bytes dictionary);
  bool appendAsOther(Kind& kind, Bytes dictionary);
  void appendShape(std::optional<MessageKind> kind, std::span<const Bytes> keys);
  void addShape(std::optional<MessageKind> kind, std::span<const Bytes> keys);
  void appendWhole(std::optional<MessageKind> kind, Bytes dictionary);

  AggregateMemory& memory_;
  uint64_t aggregate_ = 0;
  std::vector<AggregateMemory::Block> blocks_;
  uint8_t* at_ = nullptr;  // where the next record goes, in the last block
  uint8_t* end_ = nullptr;
  uint64_t before_ = 0;  // bytes of the blocks before the last
  uint64_t surviving_ = UINT64_MAX;
  std::vector<Shape> shapes_;
  std::vector<uint64_t> fingerprints_;  // of the shapes
  std::vector<Kind> kinds_;             // bounded by the number of kinds, some hundreds
  std::size_t kind_ = 0;                // the one used last
  std::vector<Payload> references_;
  std::size_t shapeBytes_ = 0;  // beside the stream
  std::vector<Share> shares_;   // of those who pay, the last one of late
  int64_t charged_ = 0;
  std::size_t rows_ = 0;
  std::size_t messages_ = 0;
  bool mayHoldNonFinite_ = false;
};

}  // namespace vx
