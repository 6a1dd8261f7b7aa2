// What it costs to make, search and change the values that cross the service.
#include <benchmark/benchmark.h>

#include "platform/Value.h"
#include "platform/ValueJSON.h"

namespace ostrel {
namespace {

Dictionary examplePayload() {
  return Dictionary{
      {"route", "Speaker"},
      {"codec", "aac-eld"},
      {"application", "com.orbisk.music"},
      {"reason", "category change by user"},
      {"sample_rate", 48000},
      {"channels", 2},
      {"underruns", 317},
      {"buffer_frames", 1024},
      {"latency", 0.0213},
      {"formats", ArrayBuilder().append("pcm").append("aac").append("opus").build()}};
}

void buildDictionaryOfTen(benchmark::State& state) {
  for (auto _ : state) benchmark::DoNotOptimize(examplePayload());
}
BENCHMARK(buildDictionaryOfTen);

void copyDictionary(benchmark::State& state) {
  const Dictionary payload = examplePayload();
  for (auto _ : state) {
    Dictionary copy = payload;
    benchmark::DoNotOptimize(copy);
  }
}
BENCHMARK(copyDictionary);

// The power-log bridge asks every message for a key that is seldom there.
void findMissingKey(benchmark::State& state) {
  const Dictionary payload = examplePayload();
  for (auto _ : state) benchmark::DoNotOptimize(payload.find("EngineOnTime"));
}
BENCHMARK(findMissingKey);

void setOneEntryOfTen(benchmark::State& state) {
  const Dictionary payload = examplePayload();
  const Value application("com.orbisk.music");
  for (auto _ : state) {
    benchmark::DoNotOptimize(
        DictionaryBuilder(payload).set("HostApplicationDisplayID", application).build());
  }
}
BENCHMARK(setOneEntryOfTen);

void writeAsJSON(benchmark::State& state) {
  const Dictionary payload = examplePayload();
  std::string out;
  for (auto _ : state) {
    out.clear();
    appendJSON(out, payload.value(), JSONLayout::kCompact, JSONStrictness::kLenient,
               /*indent=*/0);
    benchmark::DoNotOptimize(out);
  }
  state.SetBytesProcessed(state.iterations() * static_cast<std::int64_t>(out.size()));
}
BENCHMARK(writeAsJSON);

}  // namespace
}  // namespace ostrel
