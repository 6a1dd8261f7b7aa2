// What a step through a serial queue costs, for bursts and for single hops.
#include <benchmark/benchmark.h>

#include <semaphore>

#include "platform/linux/ThreadPoolWorkQueues.h"

namespace ostrel {
namespace {

// As large as a step of the message path: a message, its codes and a reply.
struct Cargo {
  std::shared_ptr<int> owner;
  std::uint64_t words[10] = {};
};

class Queues {
 public:
  std::shared_ptr<WorkQueue> make(QualityOfService qualityOfService) {
    return queues_.makeSerialQueue("benchmark", qualityOfService,
                                   /*relativePriority=*/0);
  }

 private:
  ThreadPoolWorkQueues queues_{std::make_shared<TimerThread>()};
};

// Queues a burst and waits until it has run.
void oneQueueBurst(benchmark::State& state) {
  Queues queues;
  const auto queue = queues.make(QualityOfService::kUserInteractive);
  std::binary_semaphore isDone{0};
  std::uint64_t sum = 0;
  const auto owner = std::make_shared<int>(0);
  for (auto _ : state) {
    for (std::int64_t i = 0; i < state.range(0); ++i) {
      queue->async([&sum, cargo = Cargo{owner}] { sum += cargo.words[3] + 1; });
    }
    queue->async([&] { isDone.release(); });
    isDone.acquire();
  }
  benchmark::DoNotOptimize(sum);
  state.SetItemsProcessed(state.iterations() * state.range(0));
}
BENCHMARK(oneQueueBurst)->Arg(1)->Arg(16)->Arg(256)->Arg(4096)->Arg(65536)->UseRealTime();

// Each step of the first queue hands one on to the second, as a request of a
// client does.
void twoQueuesBurst(benchmark::State& state) {
  Queues queues;
  const auto server = queues.make(QualityOfService::kUserInteractive);
  const auto session = queues.make(QualityOfService::kUtility);
  std::binary_semaphore isDone{0};
  std::uint64_t sum = 0;
  const auto owner = std::make_shared<int>(0);
  for (auto _ : state) {
    for (std::int64_t i = 0; i < state.range(0); ++i) {
      server->async([&session, &sum, cargo = Cargo{owner}]() mutable {
        session->async([&sum, cargo = std::move(cargo)] { sum += cargo.words[3] + 1; });
      });
    }
    server->async([&] { session->async([&] { isDone.release(); }); });
    isDone.acquire();
  }
  benchmark::DoNotOptimize(sum);
  state.SetItemsProcessed(state.iterations() * state.range(0));
}
BENCHMARK(twoQueuesBurst)
    ->Arg(1)
    ->Arg(16)
    ->Arg(256)
    ->Arg(4096)
    ->Arg(65536)
    ->UseRealTime();

// Many queues with one step each: every step goes through the pool's line.
void manyQueues(benchmark::State& state) {
  Queues queues;
  std::vector<std::shared_ptr<WorkQueue>> all;
  for (std::int64_t i = 0; i < state.range(0); ++i) {
    all.push_back(queues.make(QualityOfService::kUtility));
  }
  std::atomic<std::int64_t> left{0};
  std::binary_semaphore isDone{0};
  for (auto _ : state) {
    left = state.range(0);
    for (const auto& queue : all) {
      queue->async([&] {
        if (--left == 0) isDone.release();
      });
    }
    isDone.acquire();
  }
  state.SetItemsProcessed(state.iterations() * state.range(0));
}
BENCHMARK(manyQueues)->Arg(100)->Arg(10000)->UseRealTime();

}  // namespace
}  // namespace ostrel
