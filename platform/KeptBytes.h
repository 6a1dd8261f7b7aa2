#pragma once

#include <cstddef>
#include <memory>
#include <unordered_map>

#include "platform/ValueBuffer.h"

namespace ostrel {

/// What one list keeps in the name of the accounts of its entries. Gives it back at
/// its end. One thread at a time.
class KeptBytes {
 public:
  KeptBytes() = default;
  KeptBytes(const KeptBytes&) = delete;
  KeptBytes& operator=(const KeptBytes&) = delete;
  ~KeptBytes() {
    for (const auto& [account, bytes] : sums_) account->discard(bytes);
  }

  /// False when the account refuses. No account refuses nothing.
  bool keep(const std::shared_ptr<PayloadAccount>& account, std::size_t bytes) {
    if (!account) return true;
    if (!account->keep(bytes)) return false;
    // Nearly always the account of the entry before.
    if (last_ == nullptr || last_->first != account) {
      last_ = &*sums_.try_emplace(account, /*bytes=*/0).first;
    }
    last_->second += bytes;
    return true;
  }

  /// Takes back the latest `keep`.
  void undo(const std::shared_ptr<PayloadAccount>& account, std::size_t bytes) {
    if (!account) return;
    last_->second -= bytes;
    account->discard(bytes);
  }

 private:
  using Sums = std::unordered_map<std::shared_ptr<PayloadAccount>, std::size_t>;

  Sums sums_;
  Sums::value_type* last_ = nullptr;  // In `sums_`, whose elements stay in their place.
};

}  // namespace ostrel
