// Cuts a stream of bytes into frames, for the service's connections and for the client library.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>
#include <vector>

#include "wire/Protocol.h"

namespace vx::wire {

// Where the readers of one thread put what they read. Made when it is first needed.
class ReadBuffers {
 public:
  static constexpr std::size_t kReadBytes = 64 << 10;  // the most that one read takes
  // One read, behind as many bytes that the read before has left over.
  static constexpr std::size_t kBytes = 2 * kReadBytes;

 private:
  friend class FrameReader;
  uint8_t* bytes();

  std::unique_ptr<uint8_t[]> bytes_;
  // Of a reader that has nothing left over, for the next one that has. At most kBytes.
  std::vector<uint8_t> spare_;
};

// Reads are made into a buffer that all readers of a thread share; frames are used where they lie
// in it, without a copy. What is left, a part of a frame or frames that must wait, moves to memory
// of the reader's own only when others are about to read (keepRest):
//
//   shared   | left over before | <- space(), the bytes of this read -> |
//            | frame | frame | frame | part of a fr|
//   own                              | part of a fr|   kept; copied in front of the next read
//
// A frame larger than a read is gathered in the reader's own memory, which reads then go to:
//
//   own      | the frame as far as it has come     | <- space() -> |
//
// So an idle connection holds no memory, and a stream of small frames is copied only where a read
// has cut one.
//
// Owned by one end of a connection and confined to that one's thread. Bounds: a frame that may be
// `limit` bytes and one read.
class FrameReader {
 public:
  enum class Next : uint8_t { Frame, Incomplete, TooLarge };

  explicit FrameReader(ReadBuffers& shared) : shared_(shared) {}
  void setLimit(std::size_t bytes) { limit_ = bytes; }

  // Where the next bytes of the stream go: ReadBuffers::kReadBytes. Ends what next() has given.
  std::span<uint8_t> space();
  // That so many of them have come.
  void received(std::size_t bytes);

  // Takes the next frame; its body is valid until space(), keepRest() or clear().
  Next next(std::span<const uint8_t>& body) {
    if (unread() < kLengthBytes) return Next::Incomplete;
    const std::size_t length = nextLength();
    if (length > limit_) return Next::TooLarge;
    if (unread() - kLengthBytes < length) return Next::Incomplete;
    body = {data() + begin_ + kLengthBytes, length};
    begin_ += kLengthBytes + length;
    return Next::Frame;
  }
  // Whether next() has something to say without another read.
  bool hasNext() const {
    if (unread() < kLengthBytes) return false;
    const std::size_t length = nextLength();
    return length > limit_ || unread() - kLengthBytes >= length;
  }
  // The length that stands in front; there must be kLengthBytes of it.
  std::size_t nextLength() const {
    const uint8_t* const at = data() + begin_;
    return std::size_t{at[0]} | std::size_t{at[1]} << 8 | std::size_t{at[2]} << 16 |
           std::size_t{at[3]} << 24;
  }
  std::size_t unread() const { return end_ - begin_; }

  // Others may read now: what is left moves out of the shared buffer.
  void keepRest();
  void clear();

 private:
  const uint8_t* data() const { return inShared_ ? shared_.bytes_.get() : own_.data(); }
  std::span<uint8_t> spaceOfItsOwn();

  ReadBuffers& shared_;
  std::vector<uint8_t> own_;  // may be larger than what is in it
  bool inShared_ = false;     // where the unread bytes are, and
  std::size_t begin_ = 0;     // from where
  std::size_t end_ = 0;       // to where
  bool readsToShared_ = false;
  std::size_t limit_ = kMaxFrameBytes;
};

}  // namespace vx::wire
