// A move-only callable with capacity for 48 bytes of captures, so that queueing work costs no
// allocation of its own. std::function must copy, and allocates beyond 16 bytes;
// std::move_only_function is C++23.
#pragma once

#include <cstddef>
#include <cstdint>
#include <new>
#include <type_traits>
#include <utility>

namespace vx {

template <class Signature>
class Function;

template <class R, class... Args>
class Function<R(Args...)> {
 public:
  static constexpr std::size_t kInlineBytes = 48;

  Function() noexcept = default;
  // Reads as "no callable".
  // NOLINTNEXTLINE(google-explicit-constructor)
  Function(std::nullptr_t) noexcept {}
  Function(Function&& other) noexcept { moveFrom(other); }
  Function& operator=(Function&& other) noexcept {
    if (this != &other) {
      reset();
      moveFrom(other);
    }
    return *this;
  }
  Function& operator=(std::nullptr_t) noexcept {
    reset();
    return *this;
  }
  // Lambdas convert; the constraint keeps copies and moves away from here.
  // NOLINTBEGIN(google-explicit-constructor,bugprone-forwarding-reference-overload)
  template <class F, class D = std::decay_t<F>>
    requires(!std::is_same_v<D, Function> && !std::is_same_v<D, std::nullptr_t> &&
             std::is_invocable_r_v<R, D&, Args...>)
  Function(F&& callable) {
    if constexpr (fits<D>()) {
      ::new (static_cast<void*>(storage_)) D(std::forward<F>(callable));
      table_ = &kInlineTable<D>;
    } else {
      ::new (static_cast<void*>(storage_)) D*(new D(std::forward<F>(callable)));
      table_ = &kHeapTable<D>;
    }
  }
  // NOLINTEND(google-explicit-constructor,bugprone-forwarding-reference-overload)
  Function(const Function&) = delete;
  Function& operator=(const Function&) = delete;
  ~Function() { reset(); }

  explicit operator bool() const noexcept { return table_ != nullptr; }
  // Calling an empty Function is a programming error.
  R operator()(Args... args) const { return table_->call(storage_, std::forward<Args>(args)...); }

 private:
  struct Table {
    R (*call)(void*, Args&&...);
    void (*move)(void* from, void* to) noexcept;
    void (*destroy)(void*) noexcept;
  };
  template <class D>
  static constexpr bool fits() {
    return sizeof(D) <= kInlineBytes && alignof(D) <= alignof(std::max_align_t) &&
           std::is_nothrow_move_constructible_v<D>;
  }
  template <class D>
  static D* at(void* p) {
    return std::launder(reinterpret_cast<D*>(p));
  }
  template <class D>
  static constexpr Table kInlineTable = {
      [](void* p, Args&&... args) -> R { return (*at<D>(p))(std::forward<Args>(args)...); },
      [](void* from, void* to) noexcept {
        ::new (to) D(std::move(*at<D>(from)));
        at<D>(from)->~D();
      },
      [](void* p) noexcept { at<D>(p)->~D(); }};
  template <class D>
  static constexpr Table kHeapTable = {
      [](void* p, Args&&... args) -> R { return (**at<D*>(p))(std::forward<Args>(args)...); },
      [](void* from, void* to) noexcept { ::new (to) D*(*at<D*>(from)); },
      [](void* p) noexcept { delete *at<D*>(p); }};

  void moveFrom(Function& other) noexcept {
    table_ = other.table_;
    if (table_ != nullptr) {
      table_->move(other.storage_, storage_);
      other.table_ = nullptr;
    }
  }
  void reset() noexcept {
    if (table_ != nullptr) {
      const Table* table = table_;
      table_ = nullptr;
      table->destroy(storage_);
    }
  }

  alignas(std::max_align_t) mutable std::byte storage_[kInlineBytes];
  const Table* table_ = nullptr;
};

}  // namespace vx
