#include "wire/FrameReader.h"

#include <algorithm>
#include <cstring>

namespace vx::wire {

uint8_t* ReadBuffers::bytes() {
  // Not initialised: pages that no read has touched cost nothing.
  if (bytes_ == nullptr) bytes_ = std::make_unique_for_overwrite<uint8_t[]>(kBytes);
  return bytes_.get();
}

std::span<uint8_t> FrameReader::space() {
  const std::size_t had = unread();
  readsToShared_ = had <= ReadBuffers::kBytes - ReadBuffers::kReadBytes;
  if (!readsToShared_) return spaceOfItsOwn();
  uint8_t* const to = shared_.bytes();
  if (had != 0) std::memmove(to, data() + begin_, had);
  if (inShared_) {
    begin_ = 0;
    end_ = had;
  }
  return {to + had, ReadBuffers::kReadBytes};
}

// Inside a large frame.
std::span<uint8_t> FrameReader::spaceOfItsOwn() {
  const std::size_t had = unread();
  if (inShared_)
    own_.assign(data() + begin_, data() + end_);
  else
    own_.erase(own_.begin(), own_.begin() + static_cast<std::ptrdiff_t>(begin_));
  inShared_ = false;
  begin_ = 0;
  end_ = had;
  // All of it now: growing step by step would take twice as much.
  own_.reserve(kLengthBytes + std::min(nextLength(), limit_) + ReadBuffers::kReadBytes);
  own_.resize(had + ReadBuffers::kReadBytes);
  return {own_.data() + had, ReadBuffers::kReadBytes};
}

void FrameReader::received(std::size_t bytes) {
  if (bytes == 0) return;  // a read that took nothing changes nothing
  if (readsToShared_ && !inShared_) {
    end_ = unread();
    begin_ = 0;
    inShared_ = true;
    if (own_.capacity() > ReadBuffers::kBytes) own_ = {};  // was for a large frame
  }
  end_ += bytes;
}

void FrameReader::keepRest() {
  if (inShared_) {
    if (unread() != 0 && own_.capacity() == 0) own_.swap(shared_.spare_);
    const uint8_t* const from = data() + begin_;
    own_.assign(from, from + unread());
    end_ -= begin_;
    begin_ = 0;
    inShared_ = false;
  }
  if (unread() == 0) clear();
}

void FrameReader::clear() {
  begin_ = end_ = 0;
  inShared_ = false;
  if (own_.capacity() == 0) return;
  if (own_.capacity() <= ReadBuffers::kBytes && shared_.spare_.capacity() < own_.capacity())
    own_.swap(shared_.spare_);
  own_ = {};
}

}  // namespace vx::wire
