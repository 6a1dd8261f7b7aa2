#pragma once

#include <atomic>
#include <cstdint>
#include <utility>

#include "platform/ValueBuffer.h"

namespace ostrel {

/// What a request costs for as long as anything is under way that it caused. The thread
/// that hands the request over bears it meanwhile; whatever steps are queued by a thread
/// that bears it bear it too, and so does the thread that runs them: from the request to
/// the last step that came of it, over any number of queues.
class Burden {
 public:
  Burden(const Burden&) = delete;
  Burden& operator=(const Burden&) = delete;

  void retain() noexcept { references_.fetch_add(1, std::memory_order_relaxed); }
  void release() noexcept {
    if (references_.fetch_sub(1, std::memory_order_acq_rel) == 1) delete this;
  }

  /// The calling thread's, or none.
  static Burden* current() noexcept { return current_; }
  /// The number of the user whose client caused what the calling thread does, if it bears
  /// anything; else `PayloadAccount::kNobody`.
  static std::int64_t currentUser() noexcept {
    return current_ != nullptr ? current_->user_ : PayloadAccount::kNobody;
  }

  /// The calling thread bears it until the scope ends, then what it bore before.
  class Scope {
   public:
    explicit Scope(Burden* burden) noexcept : before_(std::exchange(current_, burden)) {}
    ~Scope() { current_ = before_; }
    Scope(const Scope&) = delete;
    Scope& operator=(const Scope&) = delete;

   private:
    Burden* const before_;
  };

 protected:
  /// `user` is the number of who caused it.
  explicit Burden(std::int64_t user) : user_(user) {}
  virtual ~Burden() = default;

 private:
  static inline thread_local Burden* current_ = nullptr;

  const std::int64_t user_;
  std::atomic<std::uint32_t> references_{0};
};

/// One of those who bear a burden, or none.
class BurdenShare {
 public:
  BurdenShare() = default;
  explicit BurdenShare(Burden* burden) noexcept : burden_(burden) {
    if (burden_ != nullptr) burden_->retain();
  }
  BurdenShare(BurdenShare&& other) noexcept
      : burden_(std::exchange(other.burden_, nullptr)) {}
  BurdenShare& operator=(BurdenShare other) noexcept {
    std::swap(burden_, other.burden_);
    return *this;
  }
  ~BurdenShare() {
    if (burden_ != nullptr) burden_->release();
  }

  /// Of the calling thread's.
  static BurdenShare current() noexcept { return BurdenShare(Burden::current()); }

  explicit operator bool() const { return burden_ != nullptr; }
  Burden* get() const { return burden_; }

 private:
  Burden* burden_ = nullptr;
};

}  // namespace ostrel
