// One mapped file of blocks.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "base/Status.h"
#include "base/UniqueFd.h"

namespace vx::lnx {

// Of this host only, in its byte order:
//
//   | FileHeader, padded to kFirstBlock | block | block | ...
//
// and a block
//
//   | BlockHeader | what its owner has in it |
//
// The file is allocated whole: a hole in a file system that has become full would be a SIGBUS.
// Owned by AggregateSegments, under its lock; what lies in a block is its owner's.
class AggregateSegment {
 public:
  struct BlockHeader {
    uint64_t aggregate;  // written last when a block is taken, first when it is free: 0
    uint32_t ordinal;
    uint32_t taken;  // when, as AggregateSegments counts; of no use to another process
    uint64_t padding[2];
  };
  // A block in a segment.
  struct Place {
    AggregateSegment* segment = nullptr;
    uint32_t index = 0;
  };
  static constexpr std::size_t kFirstBlock = 4096;
  // Up to 64 KiB blocks have the sizes that are powers of two; larger ones are made to measure.
  static constexpr std::size_t kSmallest = 512;
  static constexpr std::size_t kLargestShared = 64 << 10;
  static std::size_t fileBytes(std::size_t blockBytes, uint32_t blocks) {
    return kFirstBlock + blockBytes * blocks;
  }

  // After the name of a file that is being made.
  static constexpr std::string_view kNew = ".new";
  // A new file, which is removed again where that fails; its blocks are free.
  static Result<std::unique_ptr<AggregateSegment>> create(const std::string& path,
                                                          std::size_t blockBytes, uint32_t blocks);
  // One of an earlier process, of this user alone. No block is free; those that nobody had then are
  // to be made so.
  static Result<std::unique_ptr<AggregateSegment>> adopt(const std::string& path);
  ~AggregateSegment();
  AggregateSegment(const AggregateSegment&) = delete;
  AggregateSegment& operator=(const AggregateSegment&) = delete;

  const std::string& path() const { return path_; }
  const uint8_t* base() const { return base_; }
  std::size_t bytes() const { return fileBytes(blockBytes_, blocks_); }
  std::size_t blockBytes() const { return blockBytes_; }
  uint32_t blocks() const { return blocks_; }
  bool hasFree() const { return !free_.empty(); }
  bool isUnused() const { return free_.size() == blocks_; }

  BlockHeader& header(uint32_t index) {
    return *reinterpret_cast<BlockHeader*>(base_ + kFirstBlock + index * blockBytes_);
  }
  uint8_t* contents(uint32_t index) { return reinterpret_cast<uint8_t*>(&header(index) + 1); }
  std::size_t capacity() const { return blockBytes_ - sizeof(BlockHeader); }
  uint32_t indexOf(const uint8_t* contents) const {
    return static_cast<uint32_t>(static_cast<std::size_t>(contents - base_ - kFirstBlock) /
                                 blockBytes_);
  }
  // One that is free.
  uint32_t take();
  void makeFree(uint32_t index);

 private:
  struct FileHeader {
    static constexpr uint64_t kMagic = 0x3152474741585600;  // "\0VXAGGR1"
    static constexpr uint32_t kVersion = 1;
    uint64_t magic;
    uint32_t version;
    uint32_t blocks;
    uint64_t blockBytes;
  };
  AggregateSegment(std::string path, uint8_t* base, std::size_t blockBytes, uint32_t blocks)
      : path_(std::move(path)), base_(base), blockBytes_(blockBytes), blocks_(blocks) {}
  static Result<std::unique_ptr<AggregateSegment>> map(const std::string& path, const UniqueFd& fd,
                                                       std::size_t blockBytes, uint32_t blocks);

  const std::string path_;
  uint8_t* const base_;
  const std::size_t blockBytes_;
  const uint32_t blocks_;
  std::vector<uint32_t> free_;
};
static_assert(sizeof(AggregateSegment::BlockHeader) == 32);

}  // namespace vx::lnx
