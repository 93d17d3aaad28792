// Submitted work, and lists of it.
#pragma once

#include <cstdint>
#include <utility>

#include "platform/WorkQueue.h"
#include "platform/linux/execution/CauseScope.h"
#include "platform/linux/execution/FreeList.h"

namespace vx::lnx {

// One submitted piece of work. Singly linked, so that a queue is two pointers.
struct WorkItem {
  explicit WorkItem(Work w) : cause(Cause::take()), work(std::move(w)) {}
  // Of work that is dropped at the end, the call is not done: it is found again in the journal.
  ~WorkItem() {
    if (work) cause.ticket.abandon();
  }
  void run() {
    const CauseScope scope(cause);
    work();
    work = nullptr;
  }
  WorkItem* next = nullptr;
  Cause cause;
  uint32_t charged = 0;  // bytes, to the account of the cause
  Work work;
#ifndef __SANITIZE_ADDRESS__  // which would not see a use of an item that is done with
  static void* operator new(std::size_t) { return FreeList<WorkItem>::allocate(); }
  static void operator delete(void* place) { FreeList<WorkItem>::release(place); }
#endif
};

static_assert(sizeof(WorkItem) == 96, "one for each message");

// Items in order. Owns them until they are popped. Not thread-safe.
class ItemList {
 public:
  ItemList() = default;
  ItemList(ItemList&& other) noexcept
      : head_(std::exchange(other.head_, nullptr)), tail_(std::exchange(other.tail_, nullptr)) {}
  ItemList& operator=(ItemList&&) = delete;
  ~ItemList();

  bool empty() const { return head_ == nullptr; }
  void push(WorkItem* item);
  // The caller deletes it. The list must not be empty.
  WorkItem* pop();
  // Puts `front`'s items before these.
  void prepend(ItemList& front);

 private:
  WorkItem* head_ = nullptr;
  WorkItem* tail_ = nullptr;
};

}  // namespace vx::lnx
