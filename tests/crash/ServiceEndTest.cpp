// The service is ended while four clients send: by SIGTERM, which keeps what was
// answered, and by a client.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>

#include "tests/crash/LoadedService.h"

namespace ostrel::crash {
namespace {

using namespace std::chrono_literals;
using std::chrono::microseconds;

constexpr std::int64_t kEndsOfOneStore = 25;

TEST(EndedService, KeepsWhatItAnsweredBeforeSIGTERM) {
  const std::int64_t ends = timesFrom("OSTREL_TERMINATIONS", /*usual=*/50);
  const std::uint64_t seed = seedFrom(/*usual=*/20260201);
  microseconds slowest{0};
  std::int64_t answered = 0;
  std::mt19937_64 random(seed);
  for (std::int64_t end = 0; end < ends;) {
    SCOPED_TRACE("OSTREL_SEED=" + std::to_string(seed) + ", end " + std::to_string(end));
    LoadedService service(random(), /*pause=*/100us);
    for (std::int64_t last = std::min(ends, end + kEndsOfOneStore); end < last; ++end) {
      service.start();
      std::this_thread::sleep_for(microseconds(random() % 30'000));
      const auto accepted = service.takeAccepted();
      const auto signalled = SteadyClock::now();
      ASSERT_EQ(service->terminate(), 0) << service->read("log.txt");
      slowest = std::max(slowest, since(signalled));
      answered += static_cast<std::int64_t>(accepted.size());
      service.expectDurable(accepted);
      ASSERT_FALSE(HasFailure());
    }
    service.reader().audit();
  }
  std::printf(
      "%lld ends by SIGTERM, %lld messages answered before, slowest end %.1f ms\n",
      static_cast<long long>(ends), static_cast<long long>(answered),
      millisecondsOf(slowest));
  EXPECT_LT(slowest, 2s * kSlowness);
}

TEST(EndedService, IsThereAgainAtOnceAfterAClientKilledIt) {
  const std::int64_t ends = timesFrom("OSTREL_KILLS_BY_CLIENT", /*usual=*/25);
  const std::uint64_t seed = seedFrom(/*usual=*/20260202);
  std::vector<microseconds> times;
  std::mt19937_64 random(seed);
  for (std::int64_t end = 0; end < ends;) {
    SCOPED_TRACE("OSTREL_SEED=" + std::to_string(seed) + ", end " + std::to_string(end));
    LoadedService service(random(), /*pause=*/100us);
    for (std::int64_t last = std::min(ends, end + kEndsOfOneStore); end < last; ++end) {
      const auto begin = SteadyClock::now();
      service->start();
      {
        RecordingClient client(service->socketPath());
        client->getAllReporters([](const ReporterIDs&) {});
        client.takeReplies();
        times.push_back(since(begin));
        service.reader().check();
        const auto served = SteadyClock::now();
        for (const auto life = kSlowness * (20ms + microseconds(random() % 40'000));
             since(served) < life;) {
          service.reader().look();
          std::this_thread::sleep_for(1ms);
        }
        client->killService([](bool) {});
        ASSERT_EQ(service->process().wait(), 2) << service->read("log.txt");
      }
      ASSERT_FALSE(HasFailure());
    }
    service->start();
    ASSERT_TRUE(eventually([&] { return service.isThere(); }));
    service.reader().audit();
    EXPECT_GT(service.reader().seenCount(), 0u);
  }
  std::sort(times.begin(), times.end());
  std::printf(
      "%lld ends by a client, answered after one: median %.1f ms, slowest %.1f ms\n",
      static_cast<long long>(ends), millisecondsOf(times[times.size() / 2]),
      millisecondsOf(times.back()));
  // The slowest says more of a machine that is busy than of the service.
  EXPECT_LT(times[times.size() / 2], 500ms * kSlowness);
}

}  // namespace
}  // namespace ostrel::crash
