// Whatever another process left: it is refused, or every row of it is a valid payload and another
// one can be appended.
#include <algorithm>

#include "Statistics/Service/VXReportingRowReader.h"

namespace {

// The bytes in blocks of one size.
class Left final : public vx::AggregateMemory {
 public:
  Left(std::span<const uint8_t> bytes, std::size_t blockBytes)
      : bytes_(bytes.begin(), bytes.end()), blockBytes_(blockBytes) {}
  uint64_t nameAggregate() override { return 1; }
  Block acquire(uint64_t, uint32_t, std::size_t bytes) override {
    return {new uint8_t[bytes], bytes, false};
  }
  void release(std::span<const Block> blocks) override {
    for (const Block& block : blocks)
      if (!block.survives) delete[] block.bytes;
  }
  std::vector<Block> find(uint64_t, std::size_t) override {
    std::vector<Block> blocks;
    for (std::size_t at = 0; at < bytes_.size(); at += blockBytes_)
      blocks.push_back({&bytes_[at], std::min(blockBytes_, bytes_.size() - at), true});
    return blocks;
  }
  void snapshotBegan() override {}
  void snapshotCompleted() override {}

 private:
  std::vector<uint8_t> bytes_;
  const std::size_t blockBytes_;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  Left left({data + 1, size - 1}, 16 * (std::size_t{*data} + 1));
  const auto rows = vx::VXReportingRows::restore(left, 1, size - 1);
  if (!rows.ok()) return 0;
  const vx::Payload more = vx::PayloadBuilder().set("a", 1).set("b", "x").build();
  for (int i = 0; i < 2; ++i) (*rows)->append(vx::MessageKind{1}, 7, more);
  vx::VXReportingRowReader reader(**rows);
  std::size_t count = 0;
  while (const vx::VXReportingRow* row = reader.next()) {
    if (!vx::Payload::decode(row->payload().encoded())) __builtin_trap();
    if (row->shape != vx::VXReportingRows::kNoShape && row->payload().size() != row->keys.size())
      __builtin_trap();
    if (++count == (*rows)->rows() && row->payload() != more) __builtin_trap();
  }
  if (count != (*rows)->rows()) __builtin_trap();
  return 0;
}
