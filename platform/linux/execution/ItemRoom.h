// Where the executor's items come from and go back to.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <new>
#include <utility>

namespace vx::lnx {

// An item is made by one thread and done with on another: to the general allocator that is the dear
// case, so each thread keeps a few for its own use and hands a chain of them to whoever runs out.
// Thread-safe; bounded by about kMostShared and what the threads keep.
class ItemRoom {
 public:
  static void* take(std::size_t size) {
    if (own_ == nullptr) {
      own_ = shared_.exchange(nullptr, std::memory_order_acquire);
      if (own_ == nullptr) return ::operator new(size);
      sharedCount_.store(0, std::memory_order_relaxed);
    }
    Room* const room = own_;
    own_ = room->next;
    if (ownCount_ > 0) --ownCount_;
    return room;
  }
  static void give(void* place) {
    Room* const room = ::new (place) Room{own_};
    own_ = room;
    if (ownCount_ == 0) ownLast_ = room;  // nothing that was counted is behind it
    if (++ownCount_ >= kChain) handOver();
  }
  // What the calling thread keeps; before it ends.
  static void leave() {
    while (own_ != nullptr) ::operator delete(std::exchange(own_, own_->next));
    ownCount_ = 0;
  }

 private:
  struct Room {
    Room* next;
  };
  static constexpr uint32_t kChain = 64;
  static constexpr uint32_t kMostShared = 4096;

  // The counted ones at the front of the own list.
  static void handOver() {
    Room* const first = own_;
    own_ = ownLast_->next;
    ownLast_->next = nullptr;
    ownCount_ = 0;
    if (sharedCount_.fetch_add(kChain, std::memory_order_relaxed) >= kMostShared) {
      sharedCount_.fetch_sub(kChain, std::memory_order_relaxed);
      for (Room* room = first; room != nullptr;) ::operator delete(std::exchange(room, room->next));
      return;
    }
    // Rooms are only ever taken all at once, so a list that looks unchanged is unchanged.
    ownLast_->next = shared_.load(std::memory_order_relaxed);
    while (!shared_.compare_exchange_weak(ownLast_->next, first, std::memory_order_release,
                                          std::memory_order_relaxed)) {
    }
  }

  static thread_local Room* own_;
  static thread_local Room* ownLast_;      // the last of the counted ones
  static thread_local uint32_t ownCount_;  // given back here and not taken again
  static std::atomic<Room*> shared_;
  static std::atomic<uint32_t> sharedCount_;
};
inline constinit thread_local ItemRoom::Room* ItemRoom::own_ = nullptr;
inline constinit thread_local ItemRoom::Room* ItemRoom::ownLast_ = nullptr;
inline constinit thread_local uint32_t ItemRoom::ownCount_ = 0;
inline constinit std::atomic<ItemRoom::Room*> ItemRoom::shared_{nullptr};
inline constinit std::atomic<uint32_t> ItemRoom::sharedCount_{0};

}  // namespace vx::lnx
