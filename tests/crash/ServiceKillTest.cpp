// The real service is killed at any point, again and again, while four clients send:
// what was durable is found once, intact and in order. OSTREL_KILLS says how often it
// is killed, OSTREL_SEED makes a run again.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>

#include "tests/crash/LoadedService.h"

namespace ostrel::crash {
namespace {

using namespace std::chrono_literals;
using std::chrono::microseconds;

constexpr std::int64_t kKillsOfOneStore = 40;

// What a run found out.
struct Figures {
  std::int64_t kills = 0;
  std::int64_t killsAtStart = 0;
  std::int64_t durable = 0;
  microseconds slowestStart{0};
  microseconds slowestAnswer{0};
  std::vector<microseconds> untilDurable;
};

// One store and its clients through some kills.
class KilledService {
 public:
  KilledService(std::uint64_t seed, Figures& figures)
      : random_(seed), figures_(figures), service_(random_(), /*pause=*/300us) {}

  // In the middle of its start, while it opens the store or recovers it.
  void killAtStart() {
    service_->start();
    std::this_thread::sleep_for(microseconds(random_() % 12'000));
    service_->kill();
    ++figures_.kills;
    ++figures_.killsAtStart;
  }

  void killUnderLoad() {
    start();
    service_.reader().check();
    // Some live for long enough that whole commit windows pass.
    const auto length = microseconds(random_() % (random_() % 8 == 0 ? 300'000 : 40'000));
    for (const auto begin = SteadyClock::now(); since(begin) < length;) {
      look();
      std::this_thread::sleep_for(1ms);
    }
    // A tool that reads meanwhile keeps the log's index alive; without one it is made
    // anew.
    if (random_() % 2 == 0) service_.reader().close();
    service_->kill();
    ++figures_.kills;
  }

  // What was answered before SIGTERM is there, too.
  void end() {
    start();
    const auto accepted = service_.takeAccepted();
    ASSERT_EQ(service_->terminate(), 0);
    service_.expectDurable(accepted);
    service_.reader().audit();
    figures_.durable += static_cast<std::int64_t>(service_.reader().seenCount());
  }

 private:
  void start() {
    times_.clear();
    const LoadedService::StartTimes times = service_.start();
    figures_.slowestStart = std::max(figures_.slowestStart, times.untilConnected);
    figures_.slowestAnswer = std::max(figures_.slowestAnswer, times.untilAnswered);
  }

  void look() {
    for (const auto& [name, time] : service_.takeAccepted()) times_[name] = time;
    for (const MessageName& name : service_.reader().look()) {
      const auto accepted = times_.find(name);
      if (accepted == times_.end()) continue;
      figures_.untilDurable.push_back(since(accepted->second));
      times_.erase(accepted);
    }
  }

  std::mt19937_64 random_;
  Figures& figures_;
  LoadedService service_;
  std::map<MessageName, SteadyClock::time_point> times_;  // Answered, not yet seen.
};

void print(Figures& figures) {
  auto& delays = figures.untilDurable;
  std::sort(delays.begin(), delays.end());
  const auto part = [&](std::size_t hundredths) {
    return delays.empty()
               ? 0.0
               : millisecondsOf(delays[(delays.size() - 1) * hundredths / 100]);
  };
  std::printf(
      "%lld kills, %lld of them at the start; %lld messages durable; slowest start %.1f "
      "ms, first answer %.1f ms; answered until durable: median %.1f ms, 99 in 100 %.1f "
      "ms, longest %.1f ms\n",
      static_cast<long long>(figures.kills), static_cast<long long>(figures.killsAtStart),
      static_cast<long long>(figures.durable), millisecondsOf(figures.slowestStart),
      millisecondsOf(figures.slowestAnswer), part(50), part(99), part(100));
}

TEST(KilledService, KeepsWhatWasDurable) {
  const std::int64_t kills = timesFrom("OSTREL_KILLS", /*usual=*/200);
  const std::uint64_t seed = seedFrom(/*usual=*/20260131);
  Figures figures;
  for (std::uint64_t store = 0; figures.kills < kills; ++store) {
    SCOPED_TRACE("OSTREL_SEED=" + std::to_string(seed + store));
    std::mt19937_64 random(seed + store);
    KilledService service(random(), figures);
    const std::int64_t end = std::min(kills, figures.kills + kKillsOfOneStore);
    while (figures.kills < end) {
      if (random() % 2 == 0) {
        service.killAtStart();
      } else {
        service.killUnderLoad();
      }
      ASSERT_FALSE(HasFailure()) << "after " << figures.kills << " kills";
    }
    service.end();
    ASSERT_FALSE(HasFailure()) << "after " << figures.kills << " kills";
    if (store % 25 == 24) print(figures);
  }
  print(figures);
  EXPECT_GT(figures.durable, figures.kills);
}

}  // namespace
}  // namespace ostrel::crash
