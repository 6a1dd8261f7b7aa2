#include "platform/KeptBytes.h"

#include <gtest/gtest.h>

#include <optional>
#include <vector>

namespace ostrel {
namespace {

class LimitedAccount final : public PayloadAccount {
 public:
  explicit LimitedAccount(std::size_t most) : most_(most) {}
  void charge(std::size_t) noexcept override {}
  void relieve(std::size_t) noexcept override {}
  bool keep(std::size_t bytes) noexcept override {
    ++calls;
    if (bytes > most_ - kept) return false;
    kept += bytes;
    return true;
  }
  void discard(std::size_t bytes) noexcept override { kept -= bytes; }

  std::size_t kept = 0;
  int calls = 0;

 private:
  const std::size_t most_;
};

constexpr std::size_t kPlenty = std::size_t{1} << 40;
constexpr std::size_t kEntry = 200;
constexpr std::size_t kUnit = KeptBytes::kUnit;

TEST(KeptBytes, AreWholeKilobytesForAShortList) {
  const auto account = std::make_shared<LimitedAccount>(kPlenty);
  KeptBytes kept;
  constexpr std::size_t kLong = 64 * 1024;
  for (std::size_t bytes = 128; bytes <= kLong; bytes += 128) {
    ASSERT_TRUE(kept.keep(account, 128));
    ASSERT_GE(account->kept, bytes);
    ASSERT_LE(account->kept, bytes + 2 * kUnit);
    ASSERT_EQ(account->kept % kUnit, 0u);
  }
  EXPECT_LE(account->calls, static_cast<int>(kLong / kUnit));
}

TEST(KeptBytes, AreTakenALittleAheadByALongList) {
  const auto account = std::make_shared<LimitedAccount>(kPlenty);
  KeptBytes kept;
  for (std::size_t count = 1; count <= 100'000; ++count) {
    ASSERT_TRUE(kept.keep(account, kEntry));
    ASSERT_GE(account->kept, count * kEntry);
    ASSERT_LE(account->kept, count * kEntry + count * kEntry / 64 + kUnit);
    ASSERT_LE(account->kept, count * kEntry + 64 * 1024 + kUnit);
  }
  EXPECT_LT(account->calls, 2'000);
}

TEST(KeptBytes, UseWhatIsLeftToTheLastByte) {
  for (const std::size_t left : {kEntry - 1, kEntry, kEntry + 1}) {
    const auto account = std::make_shared<LimitedAccount>(10'000 * kEntry + left);
    KeptBytes kept;
    for (int i = 0; i < 10'000; ++i) ASSERT_TRUE(kept.keep(account, kEntry));
    EXPECT_EQ(kept.keep(account, kEntry), left >= kEntry);
    EXPECT_FALSE(kept.keep(account, kEntry));
    EXPECT_TRUE(kept.keep(account, left % kEntry));
    EXPECT_EQ(account->kept, 10'000 * kEntry + left);
  }
}

TEST(KeptBytes, AreGivenBackToEachAccountAtTheEnd) {
  std::vector<std::shared_ptr<LimitedAccount>> accounts;
  for (int i = 0; i < 4; ++i) {
    accounts.push_back(std::make_shared<LimitedAccount>(kPlenty));
  }
  {
    KeptBytes kept;
    for (std::size_t i = 0; i < 20'000; ++i) {
      ASSERT_TRUE(kept.keep(accounts[i % 7 % 4], kEntry));
    }
    ASSERT_TRUE(kept.keep(nullptr, kEntry));
    for (const auto& account : accounts) EXPECT_GE(account->kept, 2'000 * kEntry);
  }
  for (const auto& account : accounts) {
    EXPECT_EQ(account->kept, 0u);
    EXPECT_EQ(account.use_count(), 1);
  }
}

TEST(KeptBytes, AreTakenBackOneByOne) {
  const auto first = std::make_shared<LimitedAccount>(kPlenty);
  const auto second = std::make_shared<LimitedAccount>(kPlenty);
  {
    KeptBytes kept;
    for (const auto& account : {first, second}) {
      for (int i = 0; i < 1'000; ++i) ASSERT_TRUE(kept.keep(account, kEntry));
      const std::size_t before = account->kept;
      ASSERT_TRUE(kept.keep(account, 100'000));
      kept.undo(account, 100'000);
      EXPECT_LE(account->kept, before + 1'001 * kEntry / 64);
      EXPECT_GE(account->kept, 1'000 * kEntry);
    }
    kept.undo(nullptr, kEntry);
  }
  EXPECT_EQ(first->kept, 0u);
  EXPECT_EQ(second->kept, 0u);
}

/// One connection of a user.
class AccountOfUser final : public PayloadAccount {
 public:
  explicit AccountOfUser(std::shared_ptr<LimitedAccount> user) : user_(std::move(user)) {}
  void charge(std::size_t) noexcept override {}
  void relieve(std::size_t) noexcept override {}
  bool keep(std::size_t bytes) noexcept override { return user_->keep(bytes); }
  void discard(std::size_t bytes) noexcept override { user_->discard(bytes); }
  std::shared_ptr<PayloadAccount> accountOfKept() noexcept override { return user_; }

 private:
  const std::shared_ptr<LimitedAccount> user_;
};

TEST(KeptBytes, HoldOnToNoneOfManyAccountsOfAUserButTheFirst) {
  const auto user = std::make_shared<LimitedAccount>(kPlenty);
  const auto other = std::make_shared<LimitedAccount>(kPlenty);
  {
    KeptBytes kept;
    std::vector<std::weak_ptr<PayloadAccount>> accounts;
    for (int i = 0; i < 1000; ++i) {
      const auto account = std::make_shared<AccountOfUser>(i % 2 == 0 ? user : other);
      accounts.push_back(account);
      ASSERT_TRUE(kept.keep(account, kEntry));
      ASSERT_TRUE(kept.keep(account, kEntry));
      kept.undo(account, kEntry);
    }
    for (const auto& each : {user, other}) {
      EXPECT_GE(each->kept, 500 * kEntry);
      EXPECT_LE(each->kept, 500 * kEntry + 500 * kEntry / 64 + 2 * kUnit);
    }
    EXPECT_FALSE(accounts[0].expired());
    for (std::size_t i = 1; i < accounts.size(); ++i) EXPECT_TRUE(accounts[i].expired());
  }
  EXPECT_EQ(user->kept, 0u);
  EXPECT_EQ(other->kept, 0u);
}

TEST(KeptBytes, HoldOnToNoAccountThatRefusedAll) {
  const auto first = std::make_shared<LimitedAccount>(0);
  const auto second = std::make_shared<LimitedAccount>(kEntry);
  const auto third = std::make_shared<LimitedAccount>(0);
  KeptBytes kept;
  EXPECT_FALSE(kept.keep(first, kEntry));
  EXPECT_TRUE(kept.keep(second, kEntry));
  EXPECT_FALSE(kept.keep(third, kEntry));
  EXPECT_EQ(first.use_count(), 1);
  EXPECT_EQ(second.use_count(), 2);
  EXPECT_EQ(third.use_count(), 1);
}

}  // namespace
}  // namespace ostrel
