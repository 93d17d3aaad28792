#include "platform/linux/execution/WorkItem.h"

namespace vx::lnx {

ItemList::~ItemList() {
  while (!empty()) delete pop();
}

void ItemList::push(WorkItem* item) {
  if (tail_ != nullptr)
    tail_->next = item;
  else
    head_ = item;
  tail_ = item;
}

WorkItem* ItemList::pop() {
  WorkItem* item = head_;
  head_ = item->next;
  if (head_ == nullptr) tail_ = nullptr;
  item->next = nullptr;
  return item;
}

void ItemList::prepend(ItemList& front) {
  if (front.empty()) return;
  front.tail_->next = head_;
  if (tail_ == nullptr) tail_ = front.tail_;
  head_ = front.head_;
  front.head_ = front.tail_ = nullptr;
}

}  // namespace vx::lnx
