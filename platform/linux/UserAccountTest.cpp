#include "platform/linux/UserAccount.h"

#include <gtest/gtest.h>

#include <memory>
#include <thread>
#include <vector>

namespace ostrel {
namespace {

std::shared_ptr<ServiceAccount> serviceWith(std::size_t sessions, std::size_t keptBytes) {
  return std::shared_ptr<ServiceAccount>(
      new ServiceAccount{Share(sessions), Share(keptBytes)});
}

TEST(Share, GivesWhatIsThereAndNoMore) {
  Share share(100);
  EXPECT_TRUE(share.take(99));
  EXPECT_TRUE(share.take(1));
  EXPECT_FALSE(share.take(1));
  share.give(1);
  EXPECT_FALSE(share.take(2));
  EXPECT_TRUE(share.take(1));
  EXPECT_EQ(share.used(), 100u);
}

TEST(Share, IsNotFooledByAnAmountThatOverflows) {
  Share share(100);
  EXPECT_TRUE(share.take(50));
  EXPECT_FALSE(share.take(SIZE_MAX - 10));
  EXPECT_EQ(share.used(), 50u);
}

TEST(Share, IsExactAmongThreads) {
  constexpr std::size_t kMost = 1000;
  Share share(kMost);
  std::atomic<std::size_t> taken{0};
  std::vector<std::thread> threads;
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&] {
      for (int j = 0; j < 1000; ++j) {
        if (share.take(1)) ++taken;
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(taken, kMost);
  EXPECT_EQ(share.used(), kMost);
}

TEST(RequestBudget, IsExceededBeyondItsBytes) {
  RequestBudget budget(100);
  budget.take(99);
  EXPECT_FALSE(budget.isExceeded());
  budget.take(1);
  EXPECT_FALSE(budget.isExceeded());
  budget.take(1);
  EXPECT_TRUE(budget.isExceeded());
}

TEST(RequestBudget, TellsAWaiterOnceWhenHalfIsFree) {
  RequestBudget budget(100);
  budget.take(101);
  EXPECT_TRUE(budget.await());
  EXPECT_FALSE(budget.give(50).tellsWaiter) << "51 are used";
  EXPECT_TRUE(budget.give(1).tellsWaiter);
  EXPECT_FALSE(budget.give(1).tellsWaiter) << "nobody waits any more";
}

TEST(RequestBudget, SaysWhenAnythingIsUnderWayAndWhenNothingIs) {
  RequestBudget budget(100);
  EXPECT_TRUE(budget.take(1));
  EXPECT_FALSE(budget.take(1));
  EXPECT_FALSE(budget.give(1).isLast);
  EXPECT_TRUE(budget.give(1).isLast);
  EXPECT_TRUE(budget.take(1));
}

TEST(RequestBudget, BeginsAndEndsNothingWithNoBytes) {
  RequestBudget budget(100);
  EXPECT_FALSE(budget.give(0).isLast);
  EXPECT_FALSE(budget.take(0));
  EXPECT_TRUE(budget.take(1));
  EXPECT_FALSE(budget.give(0).isLast);
  EXPECT_TRUE(budget.give(1).isLast);
}

TEST(RequestBudget, DoesNotLetWaitWhenHalfIsFreeAlready) {
  RequestBudget budget(100);
  budget.take(50);
  EXPECT_FALSE(budget.await());
}

TEST(UserAccount, TakesSessionsUpToTheUsersShareAndTheServices) {
  const auto service = serviceWith(/*sessions=*/5, /*keptBytes=*/0);
  const UserAccount::Limits limits{/*queuedBytes=*/0, /*sessions=*/3, /*keptBytes=*/0};
  UserAccount one(limits, service);
  UserAccount two(limits, service);
  EXPECT_TRUE(one.takeSession());
  EXPECT_TRUE(one.takeSession());
  EXPECT_TRUE(one.takeSession());
  EXPECT_FALSE(one.takeSession()) << "the user's share";
  EXPECT_TRUE(two.takeSession());
  EXPECT_TRUE(two.takeSession());
  EXPECT_FALSE(two.takeSession()) << "the service's";
  EXPECT_EQ(two.sessions(), 2u) << "nothing is taken by a refusal";
  one.giveSessions(3);
  EXPECT_TRUE(two.takeSession());
  EXPECT_EQ(two.sessionsOfAll(), 3u);
}

TEST(UserAccount, TakesFewerSessionsWhereThereIsMuchElse) {
  UserAccount::Limits limits{/*queuedBytes=*/1000, /*sessions=*/4, /*keptBytes=*/0};
  limits.sessionsInNeed = 2;
  limits.memoryBesideSessions = 100;
  UserAccount user(limits, serviceWith(/*sessions=*/10, /*keptBytes=*/0));
  user.changeUnread(0, 60);
  user.queued().take(41);
  EXPECT_TRUE(user.takeSession());
  EXPECT_TRUE(user.takeSession()) << "so many there may be in any case";
  EXPECT_FALSE(user.takeSession());
  user.queued().give(1);
  EXPECT_TRUE(user.takeSession()) << "100 are not too much";
  user.queued().take(1);
  EXPECT_FALSE(user.takeSession());
  user.giveSessions(2);
  EXPECT_TRUE(user.takeSession());
}

TEST(UserAccount, KeepsBytesUpToTheUsersShareAndTheServices) {
  const auto service = serviceWith(/*sessions=*/0, /*keptBytes=*/1500);
  const UserAccount::Limits limits{/*queuedBytes=*/0, /*sessions=*/0, /*keptBytes=*/1000};
  UserAccount one(limits, service);
  UserAccount two(limits, service);
  EXPECT_TRUE(one.keep(999));
  EXPECT_TRUE(one.keep(1));
  EXPECT_FALSE(one.keep(1));
  EXPECT_TRUE(two.keep(499));
  EXPECT_FALSE(two.keep(2));
  EXPECT_TRUE(two.keep(1));
  one.discard(1000);
  EXPECT_EQ(one.keptBytes(), 0u);
  EXPECT_TRUE(two.keep(500));
}

TEST(UserAccount, MayLeaveTwiceItsShareUntaken) {
  UserAccount::Limits limits{/*queuedBytes=*/100, /*sessions=*/10, /*keptBytes=*/1000};
  limits.unreadBytes = 500;
  const UserAccount user(limits, serviceWith(/*sessions=*/10, /*keptBytes=*/1000));
  EXPECT_TRUE(user.mayLeaveUntaken(0));
  EXPECT_TRUE(user.mayLeaveUntaken(999));
  EXPECT_TRUE(user.mayLeaveUntaken(1000));
  EXPECT_FALSE(user.mayLeaveUntaken(1001));
}

TEST(UserAccount, HasItsPartOfTheServicesShareWhateverTheOthersHave) {
  constexpr std::size_t kPart = 3;
  constexpr std::size_t kAll = kPart * limits::kUsersInReserve;
  const auto service = serviceWith(/*sessions=*/kAll, /*keptBytes=*/kAll);
  const UserAccount::Limits limits{/*queuedBytes=*/0, /*sessions=*/kAll,
                                   /*keptBytes=*/kAll};
  UserAccount big(limits, service);
  UserAccount little(limits, service);
  for (std::size_t i = 0; i < kAll; ++i) EXPECT_TRUE(big.takeSession());
  EXPECT_TRUE(big.keep(kAll));
  for (std::size_t i = 0; i < kPart; ++i) {
    EXPECT_TRUE(little.takeSession()) << i;
    EXPECT_TRUE(little.keep(1)) << i;
  }
  EXPECT_FALSE(little.takeSession());
  EXPECT_FALSE(little.keep(1));
  EXPECT_FALSE(big.takeSession());
  little.giveSessions(kPart);
  little.discard(kPart);
  EXPECT_FALSE(big.keep(1));
  EXPECT_EQ(little.sessionsOfAll(), kAll);
}

class CrowdedUser : public testing::Test {
 protected:
  static UserAccount::Limits limits() {
    UserAccount::Limits limits{/*queuedBytes=*/800, /*sessions=*/10, /*keptBytes=*/0};
    limits.unreadBytes = 800;
    limits.userInfoBytes = 800;
    limits.halfFrameBytes = 800;
    limits.memory = 5 * limits::kSessionBytes;
    return limits;
  }
  UserAccount user{limits(), serviceWith(/*sessions=*/10, /*keptBytes=*/0)};
};

TEST_F(CrowdedUser, HasMoreThanItsMemory) {
  for (int i = 0; i < 4; ++i) EXPECT_TRUE(user.takeSession());
  user.changeUnread(0, limits::kSessionBytes - 1);
  EXPECT_FALSE(user.isCrowded());
  user.queued().take(1);
  EXPECT_FALSE(user.isCrowded());
  user.changeHalfFrames(0, 1);
  EXPECT_TRUE(user.isCrowded());
}

TEST_F(CrowdedUser, HasPartOfEachShare) {
  user.queued().take(201);
  user.changeUnread(0, 101);
  user.changeHalfFrames(0, 401);
  user.adapt();
  EXPECT_FALSE(user.queued().isExceeded());
  EXPECT_FALSE(user.hasManyUnread());
  EXPECT_FALSE(user.hasManyHalfFrames());
  EXPECT_TRUE(user.hasRoomForInfo(101));

  for (int i = 0; i < 5; ++i) EXPECT_TRUE(user.takeSession());
  user.adapt();
  EXPECT_TRUE(user.queued().isExceeded());
  EXPECT_TRUE(user.hasManyUnread());
  EXPECT_TRUE(user.hasManyHalfFrames());
  EXPECT_FALSE(user.hasRoomForInfo(101));
  EXPECT_TRUE(user.hasRoomForInfo(100));
}

TEST_F(CrowdedUser, TellsWhoWaitsWhenItIsNotAnyMore) {
  for (int i = 0; i < 6; ++i) EXPECT_TRUE(user.takeSession());
  user.queued().take(201);
  user.adapt();
  EXPECT_TRUE(user.queued().await());
  user.giveSessions(6);
  EXPECT_TRUE(user.adapt());
  EXPECT_FALSE(user.adapt());
}

/// Two users, and what the service lets all have together.
class MemoryOfUsers : public testing::Test {
 protected:
  static constexpr std::size_t kMost = 1600;
  static constexpr std::size_t kReserve = kMost / limits::kUsersInReserve;
  static constexpr std::size_t kPlenty = 100'000;

  static UserAccount::Limits limits() {
    UserAccount::Limits limits{/*queuedBytes=*/kPlenty, /*sessions=*/10, /*keptBytes=*/0};
    limits.unreadBytes = limits.userInfoBytes = limits.halfFrameBytes = kPlenty;
    limits.memory = kPlenty;
    return limits;
  }
  /// More of each kind but user infos.
  static void grow(UserAccount& user, std::size_t before, std::size_t now) {
    user.queued().take(now - before);
    user.changeUnread(before, now);
    user.changeHalfFrames(before, now);
  }
  static void expectTooMuch(UserAccount& user, bool isTooMuch, std::size_t bytes) {
    EXPECT_EQ(user.queued().isExceeded(), isTooMuch) << bytes;
    EXPECT_EQ(user.hasManyUnread(), isTooMuch) << bytes;
    EXPECT_EQ(user.hasManyHalfFrames(), isTooMuch) << bytes;
  }
  void shareOut() {
    MemoryUse used = big.memoryUse();
    for (std::size_t i = 0; i < kMemoryKinds; ++i) used[i] += little.memoryUse()[i];
    service->memory.set(used);
    big.adapt();
    little.adapt();
  }

  const std::shared_ptr<ServiceAccount> service{new ServiceAccount{
      Share(10), Share(0), MemoryOfAll({kMost, kMost, kMost, kMost, kPlenty})}};
  UserAccount big{limits(), service};
  UserAccount little{limits(), service};
};

TEST_F(MemoryOfUsers, IsSharedOutBeyondTheTotalOfEachKind) {
  grow(little, 0, kReserve);
  little.accountOfInfos()->charge(kReserve);
  const std::size_t most = kMost - kReserve;
  std::size_t before = 0;
  for (const std::size_t bytes : {most - 1, most, most + 1}) {
    grow(big, before, bytes);
    big.accountOfInfos()->charge(bytes - before);
    shareOut();
    expectTooMuch(big, bytes > most, bytes);
    EXPECT_EQ(big.hasRoomForInfo(1), bytes <= most) << bytes;
    before = bytes;
  }
}

TEST_F(MemoryOfUsers, LeavesOneWithLittleItsReserve) {
  grow(big, 0, 2 * kMost);
  big.accountOfInfos()->charge(2 * kMost);
  std::size_t before = 0;
  for (const std::size_t bytes : {kReserve - 1, kReserve, kReserve + 1}) {
    grow(little, before, bytes);
    shareOut();
    expectTooMuch(little, bytes > kReserve, bytes);
    EXPECT_EQ(little.hasRoomForInfo(bytes), bytes <= kReserve) << bytes;
    before = bytes;
  }
}

TEST_F(MemoryOfUsers, CrowdsWhoHasMuchOfAllKindsTogether) {
  const std::size_t reserve = kPlenty / limits::kUsersInReserve;
  for (const std::size_t total : {kPlenty - 1, kPlenty, kPlenty + 1}) {
    service->memory.set({0, 0, 0, 0, total});
    big.changeUnread(0, reserve + 1);
    EXPECT_EQ(big.isCrowded(), total > kPlenty) << total;
    big.changeUnread(reserve + 1, reserve);
    EXPECT_FALSE(big.isCrowded()) << "it has no more than its reserve";
    big.changeUnread(reserve, 0);
  }
}

TEST_F(MemoryOfUsers, IsWhatEachMayHaveAgainWhenItIsLess) {
  big.queued().take(kMost + 1);
  shareOut();
  EXPECT_TRUE(big.queued().await());
  big.queued().give(1);
  shareOut();
  EXPECT_FALSE(big.queued().isExceeded());
}

TEST(UserAccount, IsIdleWhileNothingOfTheUserIsLeft) {
  UserAccount account({1000, 10, 1000}, serviceWith(10, 1000));
  const auto expectBusyBetween = [&](const auto& begin, const auto& end) {
    EXPECT_TRUE(account.isIdle());
    begin();
    EXPECT_FALSE(account.isIdle());
    end();
    EXPECT_TRUE(account.isIdle());
  };
  expectBusyBetween([&] { account.queued().take(1); }, [&] { account.queued().give(1); });
  expectBusyBetween([&] { account.takeSession(); }, [&] { account.giveSessions(1); });
  expectBusyBetween([&] { account.keep(1); }, [&] { account.discard(1); });
  expectBusyBetween([&] { account.changeUnread(/*before=*/0, /*now=*/1); },
                    [&] { account.changeUnread(/*before=*/1, /*now=*/0); });
  expectBusyBetween([&] { account.changeHalfFrames(/*before=*/0, /*now=*/1); },
                    [&] { account.changeHalfFrames(/*before=*/1, /*now=*/0); });
  expectBusyBetween([&] { account.addBusyProcess(); },
                    [&] { account.removeBusyProcess(); });
  expectBusyBetween([&] { account.addLargeRequest(); },
                    [&] { account.removeLargeRequest(); });
  // Whoever has it may charge it.
  std::shared_ptr<PayloadAccount> infos;
  expectBusyBetween([&] { infos = account.accountOfInfos(); }, [&] { infos.reset(); });
}

}  // namespace
}  // namespace ostrel
