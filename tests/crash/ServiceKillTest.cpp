// The real service is killed at any point, again and again, while four clients send:
// what was durable is found once, intact and in order. OSTREL_KILLS says how often it
// is killed, OSTREL_SEED makes a run again.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>

#include "client/ServiceConnection.h"
#include "tests/crash/NumberedClient.h"
#include "tests/integration/ServiceUnderTest.h"

namespace ostrel::crash {
namespace {

using namespace std::chrono_literals;
using std::chrono::microseconds;

constexpr int kClients = 4;
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

microseconds since(SteadyClock::time_point begin) {
  return std::chrono::duration_cast<microseconds>(SteadyClock::now() - begin);
}

// One store and its clients through some kills.
class KilledService {
 public:
  KilledService(std::uint64_t seed, Figures& figures)
      : random_(seed), figures_(figures), reader_(service_ / "state/reports.db") {
    for (int i = 0; i < kClients; ++i) {
      NumberedClientOptions options;
      options.socketPath = service_.socketPath();
      options.name = i;
      options.seed = random_();
      options.pause = 300us;
      options.window = i % 2 == 0 ? 16 : 64;
      options.sessionLength = i < 2 ? 60 : 0;
      clients_.push_back(std::make_unique<NumberedClient>(options));
    }
  }

  // In the middle of its start, while it opens the store or recovers it.
  void killAtStart() {
    service_.start();
    std::this_thread::sleep_for(microseconds(random_() % 12'000));
    service_.kill();
    ++figures_.kills;
    ++figures_.killsAtStart;
  }

  void killUnderLoad() {
    startAndWaitForAnswers();
    reader_.check();
    // Some live for long enough that whole commit windows pass.
    const auto length = microseconds(random_() % (random_() % 8 == 0 ? 300'000 : 40'000));
    for (const auto begin = SteadyClock::now(); since(begin) < length;) {
      look();
      std::this_thread::sleep_for(1ms);
    }
    // A tool that reads meanwhile keeps the log's index alive; without one it is made
    // anew.
    if (random_() % 2 == 0) reader_.close();
    service_.kill();
    ++figures_.kills;
  }

  // What was answered before SIGTERM is there, too.
  void end() {
    startAndWaitForAnswers();
    look();
    const std::vector<MessageName> accepted = acceptedSinceTheStart();
    ASSERT_EQ(service_.terminate(), 0);
    look();
    reader_.audit();
    for (const MessageName& name : accepted) {
      ASSERT_TRUE(reader_.hasSeen(name)) << name.client << ' ' << name.number;
    }
    figures_.durable += static_cast<std::int64_t>(reader_.seenCount());
  }

 private:
  std::int64_t acceptedCount() const {
    std::int64_t count = 0;
    for (const auto& client : clients_) count += client->acceptedCount();
    return count;
  }

  std::vector<MessageName> acceptedSinceTheStart() {
    std::vector<MessageName> names;
    for (const auto& client : clients_) {
      for (const auto& [name, time] : client->takeAccepted()) names.push_back(name);
    }
    return names;
  }

  void startAndWaitForAnswers() {
    acceptedSinceTheStart();
    times_.clear();
    const std::int64_t before = acceptedCount();
    const auto begin = SteadyClock::now();
    service_.start();
    ASSERT_TRUE(eventually([&] {
      return ServiceConnection::connect(service_.socketPath()).value.has_value();
    }));
    figures_.slowestStart = std::max(figures_.slowestStart, since(begin));
    ASSERT_TRUE(eventually([&] { return acceptedCount() > before; }))
        << service_.read("log.txt");
    figures_.slowestAnswer = std::max(figures_.slowestAnswer, since(begin));
  }

  void look() {
    for (const auto& client : clients_) {
      for (const auto& [name, time] : client->takeAccepted()) times_[name] = time;
    }
    for (const MessageName& name : reader_.look()) {
      const auto accepted = times_.find(name);
      if (accepted == times_.end()) continue;
      figures_.untilDurable.push_back(since(accepted->second));
      times_.erase(accepted);
    }
  }

  ServiceUnderTest service_;
  std::mt19937_64 random_;
  Figures& figures_;
  StoreReader reader_;
  std::map<MessageName, SteadyClock::time_point> times_;  // Answered, not yet seen.
  std::vector<std::unique_ptr<NumberedClient>> clients_;
};

void print(Figures& figures) {
  auto& delays = figures.untilDurable;
  std::sort(delays.begin(), delays.end());
  const auto part = [&](std::size_t hundredths) {
    return delays.empty() ? 0.0
                          : static_cast<double>(
                                delays[(delays.size() - 1) * hundredths / 100].count()) /
                                1000;
  };
  std::printf(
      "%lld kills, %lld of them at the start; %lld messages durable; slowest start %.1f "
      "ms, first answer %.1f ms; answered until durable: median %.1f ms, 99 in 100 %.1f "
      "ms, longest %.1f ms\n",
      static_cast<long long>(figures.kills), static_cast<long long>(figures.killsAtStart),
      static_cast<long long>(figures.durable),
      static_cast<double>(figures.slowestStart.count()) / 1000,
      static_cast<double>(figures.slowestAnswer.count()) / 1000, part(50), part(99),
      part(100));
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
