#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <thread>
#include <vector>

#include "Statistics/CoreTestFixture.h"
#include "Statistics/Support/AtomicProperty.h"
#include "Statistics/Support/MadeOnce.h"
#include "Statistics/Support/Monitored.h"
#include "Statistics/Support/MutableDictionary.h"

namespace ostrel {
namespace {

constexpr int kThreads = 4;
constexpr int kRounds = 1000;

void onThreads(const std::function<void(int)>& action) {
  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; ++i) threads.emplace_back(action, i);
  for (std::thread& thread : threads) thread.join();
}

TEST(AtomicProperty, HoldsWhatWasSetLast) {
  AtomicProperty<std::string> property("first");
  EXPECT_EQ(property.get(), "first");

  property.set("second");

  EXPECT_EQ(property.get(), "second");
}

TEST(AtomicProperty, BeginsWithTheDefault) {
  const AtomicProperty<std::optional<int>> property;

  EXPECT_EQ(property.get(), std::nullopt);
}

TEST(AtomicProperty, MayBeUsedByWhatItLetsGo) {
  AtomicProperty<std::shared_ptr<void>> property;
  bool wasEmpty = false;
  property.set(std::shared_ptr<void>(
      nullptr, [&](void*) { wasEmpty = property.get() == nullptr; }));

  property.set(nullptr);

  EXPECT_TRUE(wasEmpty);
}

TEST(AtomicProperty, NeverShowsHalfAValue) {
  AtomicProperty<std::string> property(std::string(100, 'a'));

  onThreads([&](int thread) {
    for (int i = 0; i < kRounds; ++i) {
      property.set(std::string(100, static_cast<char>('a' + thread)));
      const std::string text = property.get();
      EXPECT_EQ(text, std::string(100, text[0]));
    }
  });
}

TEST(MadeOnce, IsThereOnceItIsMadeAndGoesAtTheEnd) {
  auto value = std::make_shared<int>(4);
  {
    MadeOnce<std::shared_ptr<int>> made;
    EXPECT_EQ(made.get(), nullptr);
    auto& set = made.set(std::make_unique<std::shared_ptr<int>>(value));
    EXPECT_EQ(made.get(), &set);
    EXPECT_EQ(value.use_count(), 2);
  }
  EXPECT_EQ(value.use_count(), 1);
}

TEST(Monitored, LetsOneInAtATime) {
  Monitored<std::vector<int>> list;

  onThreads([&](int thread) {
    for (int i = 0; i < kRounds; ++i) list.lock()->push_back(thread);
  });

  EXPECT_EQ(list.lock()->size(), static_cast<std::size_t>(kThreads * kRounds));
}

TEST(Monitored, PassesItsArgumentsOn) {
  const Monitored<std::string> text(3u, 'x');

  EXPECT_EQ(*text.lock(), "xxx");
}

TEST(MutableDictionary, MergesOverWhatIsThere) {
  MutableDictionary dictionary;
  const Dictionary empty = dictionary.snapshot();

  dictionary.merge({{"a", 1}, {"b", 1}});
  dictionary.merge({{"b", 2}});

  EXPECT_EQ(empty, Dictionary());
  EXPECT_EQ(dictionary.snapshot(), (Dictionary{{"a", 1}, {"b", 2}}));
}

TEST(MutableDictionary, LosesNoMergeOfAnyThread) {
  MutableDictionary dictionary;

  onThreads([&](int thread) {
    for (int i = 0; i < 50; ++i) {
      dictionary.merge({{std::to_string(thread * 50 + i), i}});
    }
  });

  EXPECT_EQ(dictionary.snapshot().size(), kThreads * 50u);
}

}  // namespace
}  // namespace ostrel
