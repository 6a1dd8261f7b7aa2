#pragma once

#include <cstddef>
#include <new>
#include <type_traits>
#include <utility>

namespace ostrel {

/// A piece of work that runs once at most: a move-only callable without
/// arguments. Callables of up to `kInlineSize` bytes are kept inside, so that
/// queueing one allocates nothing; the size holds the largest step of the
/// message path.
class Task {
 public:
  static constexpr std::size_t kInlineSize = 120;

  Task() = default;

  template <typename F>
  requires(!std::is_same_v<std::decay_t<F>, Task> &&
           std::is_invocable_v<std::decay_t<F>&>)
      Task(F&& callable) {  // Implicit, so that a lambda is a task.
    using Callable = std::decay_t<F>;
    if constexpr (fits<Callable>()) {
      new (storage_) Callable(std::forward<F>(callable));
      operations_ = &kInlineOperations<Callable>;
    } else {
      new (storage_) Callable*(new Callable(std::forward<F>(callable)));
      operations_ = &kHeapOperations<Callable>;
    }
  }

  Task(Task&& other) noexcept { take(other); }
  Task& operator=(Task&& other) noexcept {
    if (this != &other) {
      reset();
      take(other);
    }
    return *this;
  }
  Task(const Task&) = delete;
  Task& operator=(const Task&) = delete;
  ~Task() { reset(); }

  explicit operator bool() const { return operations_ != nullptr; }

  /// Must not be empty.
  void operator()() { operations_->run(storage_); }

 private:
  struct Operations {
    void (*run)(void*);
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
      [](void* at) { (*static_cast<Callable*>(at))(); },
      [](void* from, void* to) noexcept {
        new (to) Callable(std::move(*static_cast<Callable*>(from)));
        static_cast<Callable*>(from)->~Callable();
      },
      [](void* at) noexcept { static_cast<Callable*>(at)->~Callable(); }};

  template <typename Callable>
  static constexpr Operations kHeapOperations = {
      [](void* at) { (**static_cast<Callable**>(at))(); },
      [](void* from, void* to) noexcept {
        new (to) Callable*(*static_cast<Callable**>(from));
      },
      [](void* at) noexcept { delete *static_cast<Callable**>(at); }};

  void take(Task& other) noexcept {
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

}  // namespace ostrel
