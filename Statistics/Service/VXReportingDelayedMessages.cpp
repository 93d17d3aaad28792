#include "Statistics/Service/VXReportingDelayedMessages.h"

#include <algorithm>
#include <limits>

#include "Statistics/Service/VXReportingSession.h"
#include "platform/Platform.h"

namespace vx {

namespace {

constexpr std::chrono::seconds kLongest{60};  // whatever the wall clock does
constexpr std::string_view kCategory = "category";
constexpr std::string_view kType = "type";
constexpr std::string_view kServiceType = "service type";
constexpr std::string_view kDue = "due";

template <class Number>
bool readNumber(const Payload& from, std::string_view key, Number& number) {
  const std::optional<Value> value = from.find(key);
  if (!value || value->kind() != ValueKind::Integer) return false;
  const int64_t wide = value->asInt64();
  if (wide < 0 || wide > std::numeric_limits<Number>::max()) return false;
  number = static_cast<Number>(wide);
  return true;
}

}  // namespace

void VXReportingDelayedMessages::add(VXReportingDelayedMessage message) {
  std::unique_ptr<WorkCause> cause =
      platform().workQueues.takeCause(message.message.encoded().size());
  if (cause == nullptr) return;  // it went out before
  message.message = PayloadBuilder(message.message).build();
  platform().inputs.keepDelayed(facts(message), message.message, *cause);
  add(std::move(message), std::move(cause));
}

void VXReportingDelayedMessages::add(VXReportingDelayedMessage message,
                                     std::unique_ptr<WorkCause> cause) {
  // The time of the service, which is not that of the call when it is run again.
  platform().workQueues.withoutCause([&] {
    Clock& clock = platform().clock;
    const Monotonic now = clock.monotonic();
    const Monotonic due =
        now + std::clamp<std::chrono::nanoseconds>(message.due - clock.now(), {}, kLongest);
    bool atOnce = false;
    {
      MutexLock lock(mutex_);
      bytes_ += message.message.encoded().size();
      waiting_.emplace(Key{due, next_++}, Waiting{std::move(message), std::move(cause)});
      atOnce = isTooMuch() || atOnce_;
    }
    wakeBy(atOnce ? now : due);
  });
}

// One wake-up leads to the next. They are not taken back, so one that is queued already is left to
// do: one that finds nothing due has cost next to nothing.
void VXReportingDelayedMessages::wakeBy(Monotonic due) {
  {
    MutexLock lock(mutex_);
    if (wake_ && *wake_ <= due) return;
    wake_ = due;
  }
  platform().workQueues.background().asyncAfter(due - platform().clock.monotonic(),
                                                [weak = weak_from_this(), due] {
                                                  const auto self = weak.lock();
                                                  if (self == nullptr) return;
                                                  {
                                                    MutexLock lock(self->mutex_);
                                                    if (self->wake_ == due) self->wake_.reset();
                                                  }
                                                  self->sendDue(due);
                                                });
}

void VXReportingDelayedMessages::sendAllFromNow() {
  {
    MutexLock lock(mutex_);
    atOnce_ = true;
  }
  sendDue(Monotonic::max());
}

void VXReportingDelayedMessages::sendDue(Monotonic until) {
  for (;;) {
    Waiting next;
    std::optional<Monotonic> later;
    {
      MutexLock lock(mutex_);
      if (waiting_.empty()) return;
      if (const Monotonic due = waiting_.begin()->first.first;
          due > until && !isTooMuch() && !atOnce_) {
        later = due;
      } else {
        next = std::move(waiting_.begin()->second);
        waiting_.erase(waiting_.begin());
        bytes_ -= next.message.message.encoded().size();
      }
    }
    if (later) return wakeBy(*later);
    const VXReportingDelayedMessage& message = next.message;
    next.cause->run([&message] {
      VXReportingSession::sendSingleMessageNow(message.message, message.category, message.type,
                                               message.serviceType, message.reply);
    });
  }
}

void VXReportingDelayedMessages::keepAgain() {
  MutexLock lock(mutex_);
  for (auto& [key, waiting] : waiting_)
    platform().inputs.keepDelayed(facts(waiting.message), waiting.message.message, *waiting.cause);
}

std::size_t VXReportingDelayedMessages::size() const {
  MutexLock lock(mutex_);
  return waiting_.size();
}

Payload VXReportingDelayedMessages::facts(const VXReportingDelayedMessage& message) {
  return PayloadBuilder()
      .set(kCategory, message.category)
      .set(kType, message.type)
      .set(kServiceType, message.serviceType)
      .set(kDue, PayloadDate{secondsSince1970(message.due)})
      .build();
}

std::optional<VXReportingDelayedMessage> VXReportingDelayedMessages::fromFacts(const Payload& facts,
                                                                               Payload message) {
  const std::optional<Value> due = facts.find(kDue);
  VXReportingDelayedMessage read;
  if (!due || due->kind() != ValueKind::Date || !readNumber(facts, kCategory, read.category) ||
      !readNumber(facts, kType, read.type) || !readNumber(facts, kServiceType, read.serviceType))
    return std::nullopt;
  read.message = std::move(message);
  read.due = dateFromSeconds(due->asDouble());
  return read;
}

}  // namespace vx
