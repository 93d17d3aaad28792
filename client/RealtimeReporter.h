// Reports from a thread that must never wait, as one that renders audio.
//
//   using Kind = vx::RealtimeReporter::Kind;
//   vx::RealtimeReporter reporter({{{"frames", Kind::Integer}, {"peak", Kind::Double}},
//                                  0x20000003, 0, {{42}}}, 1024);
//   ...
//   reporter.send({frames, peak});  // on the audio thread
//   ...
//   reporter.process(client);       // now and then, on the thread that the client belongs to
#pragma once

#include <atomic>
#include <bit>
#include <concepts>
#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "client/ReportingClient.h"

namespace vx {

// A ring of numbers between two threads: one calls send(), one calls process(); whoever destroys it
// sees to it that neither does. Owned by the caller. Bounded by its capacity: what does not fit is
// counted and gone. All memory is allocated and touched by the constructor; on a system that pages
// memory out, lock it (mlockall).
// NOLINTNEXTLINE(clang-analyzer-optin.performance.Padding): the threads' variables lie apart
class RealtimeReporter {
 public:
  enum class Kind : uint8_t { Integer, Double, Boolean };
  struct Key {
    std::string name;
    Kind kind = Kind::Double;
  };
  // What all messages have in common. Without identifiers they go to every started session.
  struct Shape {
    std::vector<Key> keys;
    uint32_t category = 0;
    uint16_t type = 0;
    std::optional<std::vector<int64_t>> reporterIDs;
  };

  // A number on its way. One that is not of its key's kind becomes it: true is 1, fractions are cut
  // off.
  class Number {
   public:
    // NOLINTBEGIN(google-explicit-constructor): numbers convert
    Number(std::same_as<bool> auto value) : word_(value ? 1 : 0), kind_(Kind::Boolean) {}
    template <std::integral T>
      requires(!std::same_as<T, bool>)
    Number(T value) : word_(static_cast<uint64_t>(value)), kind_(Kind::Integer) {}
    Number(std::floating_point auto value)
        : word_(std::bit_cast<uint64_t>(static_cast<double>(value))), kind_(Kind::Double) {}
    // NOLINTEND(google-explicit-constructor)

   private:
    friend class RealtimeReporter;
    uint64_t wordAs(Kind kind) const noexcept { return kind == kind_ ? word_ : converted(kind); }
    uint64_t converted(Kind kind) const noexcept;

    uint64_t word_;
    Kind kind_;
  };

  // Holds at least `capacity` messages that were not processed yet.
  RealtimeReporter(Shape shape, std::size_t capacity);
  RealtimeReporter(const RealtimeReporter&) = delete;
  RealtimeReporter& operator=(const RealtimeReporter&) = delete;

  // One number for each key, in the keys' order. Neither allocates nor locks nor makes a system
  // call, and takes a bounded number of steps whatever the other thread does. False when the ring
  // is full, or there are not as many numbers as keys; both are counted.
  bool send(std::span<const Number> numbers) noexcept {
    return push(numbers.size(), [&](std::size_t i) { return numbers[i].wordAs(kinds_[i]); });
  }
  bool send(std::initializer_list<Number> numbers) noexcept {
    return send(std::span<const Number>(numbers.begin(), numbers.size()));
  }
  // The same for words that are of their keys' kinds already: 64-bit integers, the bits of doubles.
  bool sendWords(std::span<const uint64_t> words) noexcept {
    return push(words.size(), [&](std::size_t i) { return words[i]; });
  }

  // Gives the client what has been sent so far. What it does not take now (not connected, its
  // buffer is full) stays here. Never blocks; allocates.
  ClientStatus process(ReportingClient& client);

  // Of any thread.
  uint64_t dropped() const {
    return dropped_.load(std::memory_order_relaxed);
  }  // the ring was full
  // As many numbers as there are no keys, or larger than a frame.
  uint64_t refused() const { return refused_.load(std::memory_order_relaxed); }

 private:
  template <class WordOf>
  bool push(std::size_t count, const WordOf& wordOf) noexcept {
    if (count != kinds_.size()) return increment(refused_);
    const uint64_t head = head_.load(std::memory_order_relaxed);
    if (head - tailSeen_ > mask_) {
      tailSeen_ = tail_.load(std::memory_order_acquire);
      if (head - tailSeen_ > mask_) return increment(dropped_);
    }
    uint64_t* const slot = &words_[(head & mask_) * count];
    for (std::size_t i = 0; i < count; ++i) slot[i] = wordOf(i);
    head_.store(head + 1, std::memory_order_release);
    return true;
  }
  static bool increment(std::atomic<uint64_t>& counter) noexcept {
    counter.fetch_add(1, std::memory_order_relaxed);
    return false;
  }
  Payload messageAt(uint64_t number) const;

  static_assert(std::atomic<uint64_t>::is_always_lock_free);
  // What one thread writes lies apart from what the other does.
  alignas(64) std::atomic<uint64_t> head_{0};  // of the sending thread: messages sent
  uint64_t tailSeen_ = 0;
  std::atomic<uint64_t> dropped_{0};
  std::atomic<uint64_t> refused_{0};
  const uint64_t mask_;  // of a message's number: its place
  std::vector<uint64_t> words_;
  std::vector<Kind> kinds_;
  alignas(64) std::atomic<uint64_t> tail_{0};  // of the other: messages given to the client
  bool processing_ = false;
  const Shape shape_;
};

}  // namespace vx
