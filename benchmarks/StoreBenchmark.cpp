// The embedded store: the JSON writer alone, and messages with their analytics
// events from the call until they are durable.
#include <benchmark/benchmark.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <future>
#include <string>
#include <thread>

#include "platform/ValueJSON.h"
#include "platform/linux/store/StoreAnalyticsSink.h"
#include "platform/linux/store/StoreTelemetryBackend.h"

namespace ostrel {
namespace {

// 10 entries, 185 bytes: 4 strings, 4 integers, 1 double, 1 array.
Dictionary usualPayload() {
  ArrayBuilder levels;
  for (int i = 0; i < 4; ++i) levels.append(Value(1000 + i));
  return {{"device_name", Value("Built-in Speaker")},
          {"route", Value("Speaker")},
          {"client", Value("com.example.player")},
          {"codec", Value("aac-lc, 2 channels")},
          {"sample_rate", Value(48000)},
          {"frames", Value(4096)},
          {"underruns", Value(3)},
          {"session", Value(123456789)},
          {"volume", Value(0.4375)},
          {"levels", Value(levels.build())}};
}

void appendJSONOfUsualPayload(benchmark::State& state) {
  const Dictionary payload = usualPayload();
  std::string text;
  for (auto _ : state) {
    text.clear();
    appendJSON(text, payload.value(), JSONLayout::kCompact, JSONStrictness::kLenient,
               /*indent=*/0);
    benchmark::DoNotOptimize(text.data());
  }
  state.counters["encoded_bytes"] = static_cast<double>(payload.value().bytes().size());
  state.counters["text_bytes"] = static_cast<double>(text.size());
}
BENCHMARK(appendJSONOfUsualPayload);

void findJSONErrorOfUsualPayload(benchmark::State& state) {
  const Dictionary payload = usualPayload();
  for (auto _ : state) benchmark::DoNotOptimize(findJSONError(payload.value()));
}
BENCHMARK(findJSONErrorOfUsualPayload);

// The range is 1 with an analytics event for each message. At most as much is
// under way as a connection may have.
void storeMessages(benchmark::State& state) {
  constexpr std::uint64_t kUnderWay = 8192;
  constexpr int kMessages = 200'000;
  const bool withAnalytics = state.range(0) != 0;
  const std::uint64_t rowsOfMessage = withAnalytics ? 2 : 1;
  const std::string directory = std::filesystem::temp_directory_path() /
                                ("ostrel-store-benchmark-" + std::to_string(::getpid()));
  {
    const auto store = Store::open(directory + "/reports.db");
    StoreTelemetryBackend backend(store);
    StoreAnalyticsSink analytics(store);
    const auto session = backend.createSession(Dictionary(), Dictionary(), {});
    const Dictionary payload = usualPayload();
    for (auto _ : state) {
      for (int i = 0; i < kMessages; ++i) {
        // A payload of its own for each, as decoded messages have.
        const Value copy(payload.value());
        const Dictionary message = *Dictionary::from(copy);
        if (withAnalytics) {
          analytics.sendEventLazy("com.orbisk.ostrel.Routing_RouteChange.Start",
                                  [message] { return message; });
        }
        session->sendMessage(2, 7, message);
        while (store->counters().accepted - store->counters().written >
               kUnderWay * rowsOfMessage) {
          std::this_thread::sleep_for(std::chrono::microseconds(200));
        }
      }
      std::promise<void> done;
      session->flush([&](std::optional<ErrorObject>) { done.set_value(); });
      done.get_future().wait();
    }
  }
  state.SetItemsProcessed(state.iterations() * kMessages);
  std::filesystem::remove_all(directory);
}
BENCHMARK(storeMessages)->Arg(0)->Arg(1)->UseRealTime()->Unit(benchmark::kMillisecond);

// The caller's part alone.
void acceptMessage(benchmark::State& state) {
  const std::string directory = std::filesystem::temp_directory_path() /
                                ("ostrel-store-benchmark-" + std::to_string(::getpid()));
  {
    StoreOptions options;
    options.commitWindow = std::chrono::hours(1);
    const auto store = Store::open(directory + "/reports.db", options);
    StoreTelemetryBackend backend(store);
    const auto session = backend.createSession(Dictionary(), Dictionary(), {});
    const Dictionary payload = usualPayload();
    for (auto _ : state) session->sendMessage(2, 7, payload);
  }
  std::filesystem::remove_all(directory);
}
BENCHMARK(acceptMessage)->Iterations(100'000);

}  // namespace
}  // namespace ostrel
