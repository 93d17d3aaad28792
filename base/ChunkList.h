// An array that grows by chunks which are never moved and which it keeps for the next use.
#pragma once

#include <algorithm>
#include <cstddef>
#include <memory>
#include <new>
#include <span>
#include <utility>
#include <vector>

namespace vx {

// Unlike a vector, growing moves nothing and asks for no memory larger than a chunk, which the
// allocator would fetch from the kernel page by page each time. The first chunk holds kFirst
// elements, each further one kFactor times as many up to kLargest; an empty list owns none. Not
// thread-safe.
template <class T, std::size_t kLargest, std::size_t kFirst = kLargest, std::size_t kFactor = 1>
class ChunkList {
 public:
  static_assert((kLargest & (kLargest - 1)) == 0, "a power of two");
  static_assert(kFirst == kLargest || (kFirst < kLargest && kFactor > 1));
  static_assert(alignof(T) <= __STDCPP_DEFAULT_NEW_ALIGNMENT__);

  ChunkList() = default;
  ChunkList(ChunkList&& other) noexcept { swap(other); }
  ChunkList& operator=(ChunkList&& other) noexcept {
    ChunkList(std::move(other)).swap(*this);
    return *this;
  }
  ChunkList(const ChunkList&) = delete;
  ChunkList& operator=(const ChunkList&) = delete;
  ~ChunkList() { clear(); }

  std::size_t size() const { return filled_ - static_cast<std::size_t>(end_ - at_); }
  bool empty() const { return size() == 0; }
  T& operator[](std::size_t i)
    requires(kFirst == kLargest)
  {
    return *(first(i / kLargest) + i % kLargest);
  }
  const T& operator[](std::size_t i) const
    requires(kFirst == kLargest)
  {
    return *(first(i / kLargest) + i % kLargest);
  }

  void push_back(T value) { emplace_back(std::move(value)); }
  template <class... Arguments>
  T& emplace_back(Arguments&&... arguments) {
    if (at_ == end_) beginChunk();
    T* const made = ::new (static_cast<void*>(at_)) T(std::forward<Arguments>(arguments)...);
    ++at_;
    return *made;
  }
  // Copies all of them to the end; a run may lie in several chunks.
  void append(std::span<const T> values) {
    while (!values.empty()) {
      if (at_ == end_) beginChunk();
      const std::size_t count = std::min(values.size(), static_cast<std::size_t>(end_ - at_));
      at_ = std::uninitialized_copy_n(values.begin(), count, at_);
      values = values.subspan(count);
    }
  }
  // The elements in order, as one span for each chunk in use.
  template <class OnChunk>
  void forEachChunk(const OnChunk& onChunk) const {
    for (std::size_t i = 0; i < used_; ++i)
      onChunk(std::span<const T>(first(i), i + 1 < used_ ? end(i) : at_));
  }
  // Keeps the chunks.
  void clear() {
    for (std::size_t i = 0; i < used_; ++i) std::destroy(first(i), i + 1 < used_ ? end(i) : at_);
    used_ = filled_ = 0;
    at_ = end_ = nullptr;
  }
  // Frees chunks that are not in use, as far as there are more than `capacity` needs.
  void shrink(std::size_t capacity) {
    std::size_t kept = 0;
    for (std::size_t held = 0; kept < chunks_.size() && (kept < used_ || held < capacity); ++kept)
      held += capacityOf(kept);
    chunks_.resize(kept);
  }
  void swap(ChunkList& other) noexcept {
    chunks_.swap(other.chunks_);
    std::swap(used_, other.used_);
    std::swap(filled_, other.filled_);
    std::swap(at_, other.at_);
    std::swap(end_, other.end_);
  }

 private:
  static std::size_t capacityOf(std::size_t chunk) {
    std::size_t capacity = kFirst;
    for (; chunk > 0 && capacity < kLargest; --chunk) capacity *= kFactor;
    return std::min(capacity, kLargest);
  }
  T* first(std::size_t chunk) const {
    return std::launder(reinterpret_cast<T*>(chunks_[chunk].get()));
  }
  T* end(std::size_t chunk) const { return first(chunk) + capacityOf(chunk); }
  void beginChunk() {
    const std::size_t capacity = capacityOf(used_);
    if (used_ == chunks_.size())
      chunks_.push_back(std::unique_ptr<std::byte[]>(new std::byte[capacity * sizeof(T)]));
    at_ = reinterpret_cast<T*>(chunks_[used_].get());
    end_ = at_ + capacity;
    filled_ += capacity;
    ++used_;
  }

  std::vector<std::unique_ptr<std::byte[]>> chunks_;
  std::size_t used_ = 0;    // chunks; all but the last of them are full
  std::size_t filled_ = 0;  // elements, were the last one full too
  T* at_ = nullptr;         // where the next element goes, in the last chunk in use
  T* end_ = nullptr;
};

}  // namespace vx
