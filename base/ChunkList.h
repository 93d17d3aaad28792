// An array that grows by chunks which are never moved and which it keeps for the next use.
#pragma once

#include <algorithm>
#include <cstddef>
#include <memory>
#include <new>
#include <utility>
#include <vector>

namespace vx {

// Unlike a vector, growing moves nothing and asks for no memory larger than a chunk, which the
// allocator would fetch from the kernel page by page each time. Not thread-safe.
template <class T, std::size_t kPerChunk>
class ChunkList {
 public:
  static_assert((kPerChunk & (kPerChunk - 1)) == 0, "a power of two");

  ChunkList() = default;
  ChunkList(const ChunkList&) = delete;
  ChunkList& operator=(const ChunkList&) = delete;
  ~ChunkList() { clear(); }

  std::size_t size() const { return size_; }
  bool empty() const { return size_ == 0; }
  std::size_t capacity() const { return chunks_.size() * kPerChunk; }
  T& operator[](std::size_t i) { return *at(i); }
  const T& operator[](std::size_t i) const { return *at(i); }

  void push_back(T value) {
    if (size_ == capacity()) chunks_.push_back(std::unique_ptr<Chunk>(new Chunk));
    ::new (static_cast<void*>(place(size_))) T(std::move(value));
    ++size_;
  }
  // Keeps the chunks.
  void clear() {
    for (std::size_t i = 0; i < size_; ++i) at(i)->~T();
    size_ = 0;
  }
  // Lets go of chunks that are not in use, as far as there are more than `capacity` needs.
  void shrink(std::size_t capacity) {
    const std::size_t used = (size_ + kPerChunk - 1) / kPerChunk;
    const std::size_t kept = std::max(used, (capacity + kPerChunk - 1) / kPerChunk);
    if (chunks_.size() > kept) chunks_.resize(kept);
  }
  void swap(ChunkList& other) {
    chunks_.swap(other.chunks_);
    std::swap(size_, other.size_);
  }

 private:
  struct Chunk {
    alignas(T) std::byte bytes[kPerChunk * sizeof(T)];
  };
  std::byte* place(std::size_t i) const {
    return chunks_[i / kPerChunk]->bytes + i % kPerChunk * sizeof(T);
  }
  T* at(std::size_t i) const { return std::launder(reinterpret_cast<T*>(place(i))); }

  std::vector<std::unique_ptr<Chunk>> chunks_;
  std::size_t size_ = 0;
};

}  // namespace vx
