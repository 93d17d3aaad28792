#include "platform/linux/execution/SpareMemory.h"

#include <sys/mman.h>

#include <atomic>
#include <cstddef>
#include <new>

namespace vx::lnx {

namespace {

// The allocator asks for a MiB at once where its heap cannot grow.
constexpr std::size_t kBytes = 4 << 20;

constinit std::atomic<void*> spare{nullptr};

void giveUp() {
  if (void* const kept = spare.exchange(nullptr)) munmap(kept, kBytes);
  throw std::bad_alloc();
}

}  // namespace

void SpareMemory::keep() {
  if (spare.load(std::memory_order_relaxed) != nullptr) return;
  void* const kept =
      mmap(nullptr, kBytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  if (kept == MAP_FAILED) return;
  spare.store(kept);
  std::set_new_handler(giveUp);
}

}  // namespace vx::lnx
