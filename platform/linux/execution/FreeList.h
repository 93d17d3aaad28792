// A free list for objects that one thread makes and another destroys.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <new>
#include <utility>

namespace vx::lnx {

// Memory for objects of type T that are done with, for the next ones: its operator new and operator
// delete. To the general allocator an object that moves between threads is the expensive case, so
// each thread keeps a few for its own use and hands a chain of them to whoever runs out.
// Thread-safe; bounded by about kMaxShared and what the threads keep.
template <class T>
class FreeList {
 public:
  static void* allocate() {
    static_assert(sizeof(T) >= sizeof(Node) && alignof(T) >= alignof(Node));
    static_assert(alignof(T) <= __STDCPP_DEFAULT_NEW_ALIGNMENT__);
    if (own_ == nullptr) {
      own_ = shared_.exchange(nullptr, std::memory_order_acquire);
      if (own_ == nullptr) return ::operator new(sizeof(T));
      sharedCount_.store(0, std::memory_order_relaxed);
    }
    Node* const node = own_;
    own_ = node->next;
    if (ownCount_ > 0) --ownCount_;
    return node;
  }
  static void release(void* place) {
    Node* const node = ::new (place) Node{own_};
    own_ = node;
    if (ownCount_ == 0) ownLast_ = node;  // nothing that was counted comes after it
    if (++ownCount_ >= kChain) handOver();
  }
  // Frees what the calling thread keeps; before it ends.
  static void clearThread() {
    clear(std::exchange(own_, nullptr));
    ownCount_ = 0;
  }
  // And what no thread keeps: little, but each of them holds on to a page.
  static void clearAll() {
    clearThread();
    clear(shared_.exchange(nullptr, std::memory_order_acquire));
    sharedCount_.store(0, std::memory_order_relaxed);
  }

 private:
  struct Node {
    Node* next;
  };
  static constexpr uint32_t kChain = 64;
  static constexpr uint32_t kMaxShared = 4096;

  static void clear(Node* nodes) {
    while (nodes != nullptr) ::operator delete(std::exchange(nodes, nodes->next));
  }
  // The counted ones at the front of the own list.
  static void handOver() {
    Node* const first = own_;
    own_ = ownLast_->next;
    ownLast_->next = nullptr;
    ownCount_ = 0;
    if (sharedCount_.fetch_add(kChain, std::memory_order_relaxed) >= kMaxShared) {
      sharedCount_.fetch_sub(kChain, std::memory_order_relaxed);
      return clear(first);
    }
    // Nodes are only ever taken all at once, so a list that looks unchanged is unchanged.
    ownLast_->next = shared_.load(std::memory_order_relaxed);
    while (!shared_.compare_exchange_weak(ownLast_->next, first, std::memory_order_release,
                                          std::memory_order_relaxed)) {
    }
  }

  static inline constinit thread_local Node* own_ = nullptr;
  static inline constinit thread_local Node* ownLast_ = nullptr;  // the last of the counted ones
  static inline constinit thread_local uint32_t ownCount_ = 0;    // released here, not taken again
  static inline constinit std::atomic<Node*> shared_{nullptr};
  static inline constinit std::atomic<uint32_t> sharedCount_{0};
};

}  // namespace vx::lnx
