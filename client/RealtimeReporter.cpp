#include "client/RealtimeReporter.h"

#include <algorithm>
#include <utility>

namespace vx {

uint64_t RealtimeReporter::Number::converted(Kind kind) const noexcept {
  const auto integer = static_cast<int64_t>(word_);
  const auto real = std::bit_cast<double>(word_);
  switch (kind) {
    case Kind::Double:
      return std::bit_cast<uint64_t>(static_cast<double>(integer));
    case Kind::Boolean:
      return kind_ == Kind::Double ? static_cast<uint64_t>(real != 0) : word_;
    case Kind::Integer:
      break;
  }
  if (kind_ == Kind::Boolean || real != real) return kind_ == Kind::Boolean ? word_ : 0;
  if (real >= 0x1p63) return static_cast<uint64_t>(INT64_MAX);
  return static_cast<uint64_t>(static_cast<int64_t>(std::max(real, -0x1p63)));
}

RealtimeReporter::RealtimeReporter(Shape shape, std::size_t capacity)
    : mask_(std::bit_ceil(std::max<std::size_t>(capacity, 1)) - 1),
      words_((mask_ + 1) * shape.keys.size() + 1),
      shape_(std::move(shape)) {
  for (const Key& key : shape_.keys) kinds_.push_back(key.kind);
}

Payload RealtimeReporter::messageAt(uint64_t number) const {
  PayloadBuilder message;
  const uint64_t* word = &words_[(number & mask_) * kinds_.size()];
  for (const Key& key : shape_.keys) {
    switch (key.kind) {
      case Kind::Integer:
        message.set(key.name, static_cast<int64_t>(*word));
        break;
      case Kind::Double:
        message.set(key.name, std::bit_cast<double>(*word));
        break;
      case Kind::Boolean:
        message.set(key.name, *word != 0);
        break;
    }
    ++word;
  }
  return message.build();
}

ClientStatus RealtimeReporter::process(ReportingClient& client) {
  if (processing_) return {};  // by a callback of the client
  struct Processing {
    explicit Processing(bool& flag) : flag_(flag) { flag_ = true; }
    ~Processing() { flag_ = false; }
    bool& flag_;
  } const processing(processing_);
  const uint64_t head = head_.load(std::memory_order_acquire);
  for (uint64_t next = tail_.load(std::memory_order_relaxed); next != head; ++next) {
    const Payload message = messageAt(next);
    ClientStatus status =
        shape_.reporterIDs
            ? client.sendMessageAsync(message, shape_.category, shape_.type, *shape_.reporterIDs)
            : client.sendMessageAsync(message, shape_.category, shape_.type);
    if (status.code == ClientStatus::Code::TooLarge)
      (void)increment(refused_);
    else if (!status.ok())
      return status;
    tail_.store(next + 1, std::memory_order_release);
  }
  return {};
}

}  // namespace vx
