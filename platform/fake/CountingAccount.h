#pragma once

#include <cstddef>
#include <cstdint>
#include <limits>
#include <memory>
#include <utility>

#include "platform/Value.h"

namespace ostrel {

/// An account that knows what it bears. One thread.
class CountingAccount final : public PayloadAccount {
 public:
  CountingAccount() = default;
  /// Keeps so many bytes and no more.
  explicit CountingAccount(std::size_t mostKept) : mostKept_(mostKept) {}

  void charge(std::size_t bytes) noexcept override {
    charged_ += bytes;
    ++timesCharged_;
  }
  void relieve(std::size_t bytes) noexcept override { relieved_ += bytes; }
  bool keep(std::size_t bytes) noexcept override {
    if (bytes > mostKept_ - kept_) return false;
    kept_ += bytes;
    return true;
  }
  void discard(std::size_t bytes) noexcept override { kept_ -= bytes; }

  std::size_t timesCharged() const { return timesCharged_; }
  /// Both since the account was made.
  std::size_t charged() const { return charged_; }
  std::size_t relieved() const { return relieved_; }
  /// What is charged now.
  std::size_t bytes() const { return charged_ - relieved_; }
  std::size_t kept() const { return kept_; }

 private:
  const std::size_t mostKept_ = std::numeric_limits<std::size_t>::max();
  std::size_t timesCharged_ = 0;
  std::size_t charged_ = 0;
  std::size_t relieved_ = 0;
  std::size_t kept_ = 0;
};

/// The dictionary in a buffer that the account bears.
inline Dictionary chargedTo(std::shared_ptr<PayloadAccount> account,
                            const Dictionary& plain) {
  ValueBuffer buffer = ValueBuffer::copyOf(plain.value().bytes(), std::move(account));
  const std::uint8_t* const item = std::as_const(buffer).data();
  return Dictionary(std::move(buffer), item);
}

}  // namespace ostrel
