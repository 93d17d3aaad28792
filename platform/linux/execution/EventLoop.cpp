#include "platform/linux/execution/EventLoop.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <cerrno>
#include <climits>

namespace vx::lnx {

EventLoop::EventLoop(Executor& executor, Clock& clock)
    : executor_(executor),
      clock_(clock),
      epollFd_(epoll_create1(EPOLL_CLOEXEC)),
      wakeFd_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
  epoll_event event{};
  event.events = EPOLLIN;
  event.data.ptr = nullptr;  // stands for the wake-up descriptor
  epoll_ctl(epollFd_.get(), EPOLL_CTL_ADD, wakeFd_.get(), &event);
  executor_.setInteractiveWaker([this] { wake(); });
}

Status EventLoop::add(int fd, uint32_t events, Source& source) {
  executor_.assertInteractiveThread();
  epoll_event event{};
  event.events = events;
  event.data.ptr = &source;
  if (epoll_ctl(epollFd_.get(), EPOLL_CTL_ADD, fd, &event) == 0) return {};
  return Status::lastError("cannot wait for a descriptor");
}

void EventLoop::modify(int fd, uint32_t events, Source& source) {
  executor_.assertInteractiveThread();
  epoll_event event{};
  event.events = events;
  event.data.ptr = &source;
  epoll_ctl(epollFd_.get(), EPOLL_CTL_MOD, fd, &event);
}

void EventLoop::remove(int fd, Source& source) {
  executor_.assertInteractiveThread();
  epoll_ctl(epollFd_.get(), EPOLL_CTL_DEL, fd, nullptr);
  for (std::size_t i = 0; i < eventCount_; ++i) {
    if (events_[i].data.ptr == &source) events_[i].data.ptr = nullptr;
  }
}

void EventLoop::addDeadline(Function<std::optional<Monotonic>()> next, Function<void()> due) {
  deadlines_.push_back({std::move(next), std::move(due)});
}

void EventLoop::addRound(Function<bool()> round) { rounds_.push_back(std::move(round)); }

void EventLoop::addPassEndHook(Function<void()> hook) { passEndHooks_.push_back(std::move(hook)); }

void EventLoop::wake() {
  const uint64_t one = 1;
  // A full counter means that a wake-up is pending already.
  [[maybe_unused]] const ssize_t written = write(wakeFd_.get(), &one, sizeof one);
}

std::optional<Monotonic> EventLoop::earliestDeadline() const {
  std::optional<Monotonic> earliest = executor_.nextInteractiveDue();
  for (const Deadline& deadline : deadlines_) {
    const std::optional<Monotonic> next = deadline.next();
    if (next && (!earliest || *next < *earliest)) earliest = next;
  }
  return earliest;
}

void EventLoop::runDueDeadlines() {
  if (!earliest_ || *earliest_ > clock_.monotonic()) return;
  for (const Deadline& deadline : deadlines_) {
    const std::optional<Monotonic> next = deadline.next();
    if (next && *next <= clock_.monotonic()) deadline.due();
  }
}

int EventLoop::timeoutMs(std::optional<Monotonic> deadline) const {
  if (!deadline) return -1;
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(*deadline - clock_.monotonic());
  if (left.count() <= 0) return 0;
  return left.count() > INT_MAX ? INT_MAX : static_cast<int>(left.count());
}

void EventLoop::run() {
  executor_.adoptInteractiveThread();
  stopped_.store(false, std::memory_order_release);
  while (!stopped_.load(std::memory_order_acquire)) runOnce(std::nullopt);
}

void EventLoop::runOnce(std::optional<Monotonic> deadline) {
  executor_.assertInteractiveThread();
  runDueDeadlines();
  bool moreWork = executor_.runInteractive(kItemsPerPass);
  for (const Function<bool()>& round : rounds_) moreWork = round() || moreWork;
  for (const Function<void()>& hook : passEndHooks_) hook();

  // Hooks may have queued work, and other threads may have since: prepareToSleep looks again.
  int timeout = 0;
  const bool sleep = !moreWork && executor_.prepareToSleep();
  earliest_ = earliestDeadline();
  if (sleep && !stopped_.load(std::memory_order_acquire)) {
    const bool ours = deadline && (!earliest_ || *deadline < *earliest_);
    timeout = timeoutMs(ours ? deadline : earliest_);
  }
  const int count =
      epoll_wait(epollFd_.get(), events_.data(), static_cast<int>(events_.size()), timeout);
  eventCount_ = count > 0 ? static_cast<std::size_t>(count) : 0;
  for (std::size_t i = 0; i < eventCount_; ++i) {
    auto* source = static_cast<Source*>(events_[i].data.ptr);
    if (source != nullptr) {
      source->onReady(events_[i].events);
    } else if (events_[i].events & EPOLLIN) {
      uint64_t count64 = 0;
      [[maybe_unused]] const ssize_t got = read(wakeFd_.get(), &count64, sizeof count64);
    }
  }
  eventCount_ = 0;
}

}  // namespace vx::lnx
