#pragma once

#include <algorithm>
#include <cstddef>
#include <memory>
#include <unordered_map>
#include <utility>

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
    if (first_) first_->discard(ofFirst_.taken);
    if (!others_) return;
    for (const auto& [account, sum] : *others_) account->discard(sum.taken);
  }

  /// False when the account refuses. No account refuses nothing.
  bool keep(const std::shared_ptr<PayloadAccount>& account, std::size_t bytes) {
    if (!account) return true;
    if (account == first_) return add(*account, ofFirst_, bytes);
    std::shared_ptr<PayloadAccount> keeper = keeperOf(account);
    if (!first_) {
      if (!add(*account, ofFirst_, bytes)) return false;
      first_ = account;
      keeperOfFirst_ = keeper.get();
      return true;
    }
    if (keeper.get() == keeperOfFirst_) return add(*account, ofFirst_, bytes);
    if (!others_) others_ = std::make_unique<Sums>();
    const auto sum = others_->try_emplace(std::move(keeper)).first;
    if (add(*account, sum->second, bytes)) return true;
    if (sum->second.taken == 0) others_->erase(sum);
    return false;
  }

  /// Takes back the latest `keep`.
  void undo(const std::shared_ptr<PayloadAccount>& account, std::size_t bytes) {
    if (!account) return;
    const auto keeper = keeperOf(account);
    Sum& sum = keeper.get() == keeperOfFirst_ ? ofFirst_ : others_->at(keeper);
    sum.used -= bytes;
    sum.taken -= bytes;
    account->discard(bytes);
  }

  /// The least that is taken from an account, as long as that has it.
  static constexpr std::size_t kUnit = 1024;
  static constexpr std::size_t inUnits(std::size_t bytes) {
    return (bytes + kUnit - 1) / kUnit * kUnit;
  }

 private:
  struct Sum {
    std::size_t used = 0;
    std::size_t taken = 0;  // From the account.
  };
  using Sums = std::unordered_map<std::shared_ptr<PayloadAccount>, Sum>;

  // A list takes a little ahead, a 64th of what it uses, in whole units: the account is
  // one for all threads, and asking it for each entry costs 40 ns.
  static constexpr std::size_t kShareAhead = 64;
  static constexpr std::size_t kMostAhead = 64 * 1024;

  static bool add(PayloadAccount& account, Sum& sum, std::size_t bytes) {
    if (sum.taken - sum.used < bytes && !takeMore(account, sum, bytes)) return false;
    sum.used += bytes;
    return true;
  }

  static bool takeMore(PayloadAccount& account, Sum& sum, std::size_t bytes) {
    const std::size_t missing = bytes - (sum.taken - sum.used);
    const std::size_t wanted =
        sum.taken + missing + std::min(sum.used / kShareAhead, kMostAhead);
    const std::size_t ahead = inUnits(wanted) - (sum.taken + missing);
    if (account.keep(missing + ahead)) {
      sum.taken += missing + ahead;
      return true;
    }
    if (ahead == 0 || !account.keep(missing)) return false;
    sum.taken += missing;
    return true;
  }

  static std::shared_ptr<PayloadAccount> keeperOf(
      const std::shared_ptr<PayloadAccount>& account) {
    auto keeper = account->accountOfKept();
    return keeper ? keeper : account;
  }

  // Nearly all lists have entries of one account only. Of many of one user none but the
  // first is held on to.
  std::shared_ptr<PayloadAccount> first_;
  const PayloadAccount* keeperOfFirst_ = nullptr;
  Sum ofFirst_;
  std::unique_ptr<Sums> others_;
};

}  // namespace ostrel
