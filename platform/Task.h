#pragma once

#include <cstddef>
#include <new>
#include <type_traits>
#include <utility>

namespace ostrel {

/// A callable without arguments that is called once at most, and moves but does not
/// copy. Callables of up to `InlineSize` bytes are kept inside, so that making one
/// allocates nothing.
template <typename Result, std::size_t InlineSize>
class OneShot {
 public:
  static constexpr std::size_t kInlineSize = InlineSize;

  OneShot() = default;

  template <typename F>
  requires(!std::is_same_v<std::decay_t<F>, OneShot> &&
           std::is_invocable_r_v<Result, std::decay_t<F>&>)
      OneShot(F&& callable) {  // Implicit, so that a lambda is one.
    using Callable = std::decay_t<F>;
    if constexpr (fits<Callable>()) {
      new (storage_) Callable(std::forward<F>(callable));
      operations_ = &kInlineOperations<Callable>;
    } else {
      new (storage_) Callable*(new Callable(std::forward<F>(callable)));
      operations_ = &kHeapOperations<Callable>;
    }
  }

  OneShot(OneShot&& other) noexcept { take(other); }
  OneShot& operator=(OneShot&& other) noexcept {
    if (this != &other) {
      reset();
      take(other);
    }
    return *this;
  }
  OneShot(const OneShot&) = delete;
  OneShot& operator=(const OneShot&) = delete;
  ~OneShot() { reset(); }

  explicit operator bool() const { return operations_ != nullptr; }

  /// Must not be empty.
  Result operator()() { return operations_->run(storage_); }

 private:
  struct Operations {
    Result (*run)(void*);
    void (*move)(void* from, void* to) noexcept;
    void (*destroy)(void*) noexcept;
  };

  template <typename Callable>
  static constexpr bool fits() {
    return sizeof(Callable) <= kInlineSize &&
           alignof(Callable) <= alignof(std::max_align_t) &&
           std::is_nothrow_move_constructible_v<Callable>;
  }

  template <typename Callable>
  static constexpr Operations kInlineOperations = {
      [](void* at) -> Result { return (*static_cast<Callable*>(at))(); },
      [](void* from, void* to) noexcept {
        new (to) Callable(std::move(*static_cast<Callable*>(from)));
        static_cast<Callable*>(from)->~Callable();
      },
      [](void* at) noexcept { static_cast<Callable*>(at)->~Callable(); }};

  template <typename Callable>
  static constexpr Operations kHeapOperations = {
      [](void* at) -> Result { return (**static_cast<Callable**>(at))(); },
      [](void* from, void* to) noexcept {
        new (to) Callable*(*static_cast<Callable**>(from));
      },
      [](void* at) noexcept { delete *static_cast<Callable**>(at); }};

  void take(OneShot& other) noexcept {
    if (other.operations_ == nullptr) return;
    other.operations_->move(other.storage_, storage_);
    operations_ = std::exchange(other.operations_, nullptr);
  }

  void reset() noexcept {
    if (operations_ != nullptr) operations_->destroy(storage_);
    operations_ = nullptr;
  }

  alignas(std::max_align_t) std::byte storage_[kInlineSize];
  const Operations* operations_ = nullptr;
};

/// A piece of work. The size holds the largest step of the message path.
using Task = OneShot<void, 120>;

}  // namespace ostrel
