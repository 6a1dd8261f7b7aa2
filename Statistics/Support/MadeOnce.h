#pragma once

#include <atomic>
#include <memory>

namespace ostrel {

/// Something that somebody makes at some time, and that stays then: who only wants to
/// look takes no lock. Two do not make it at once.
template <typename T>
class MadeOnce {
 public:
  MadeOnce() = default;
  MadeOnce(const MadeOnce&) = delete;
  MadeOnce& operator=(const MadeOnce&) = delete;
  ~MadeOnce() { std::unique_ptr<T>(made_.load(std::memory_order_acquire)).reset(); }

  /// None until it is made. Any thread.
  T* get() const { return made_.load(std::memory_order_acquire); }

  /// While there is none.
  T& set(std::unique_ptr<T> made) {
    made_.store(made.get(), std::memory_order_release);
    return *made.release();
  }

 private:
  std::atomic<T*> made_{nullptr};
};

}  // namespace ostrel
