// What the codec costs for a message of usual size, 10 entries in 185 bytes.
#include <benchmark/benchmark.h>

#include <string>

#include "benchmarks/wholepath/Payload.h"
#include "platform/linux/Limits.h"
#include "platform/linux/wire/Frame.h"

namespace ostrel {
namespace {

constexpr wire::PayloadLimits kLimits{limits::kNesting, limits::kNodes,
                                      limits::kKeyBytes};

std::span<const std::uint8_t> spanOf(std::string_view bytes) {
  return {reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size()};
}

std::string requestFrame() {
  const reporting::PreparedMessage message(bench::examplePayload(),
                                           bench::kExampleCategory, bench::kExampleType,
                                           {{reporting::ReporterID{4711}}});
  return std::string(message.frame());
}

// Checks the request and leaves its payload where it was read.
void decodeRequest(benchmark::State& state) {
  const std::string frame = requestFrame();
  const auto bytes = spanOf(std::string_view(frame).substr(wire::kFrameHeaderSize));
  const ValueBuffer read = ValueBuffer::copyOfInput(bytes, /*account=*/{});
  const std::span item(read.data(), bytes.size());
  for (auto _ : state) {
    wire::Request request;
    const auto error =
        wire::decodeRequest(item, kLimits, limits::kReporterIDs, read, request);
    if (error) state.SkipWithError("the request is refused");
    benchmark::DoNotOptimize(request);
  }
  state.SetBytesProcessed(state.iterations() * static_cast<std::int64_t>(item.size()));
}
BENCHMARK(decodeRequest);

// The check alone: the part that grows with the payload's entries.
void checkPayload(benchmark::State& state) {
  const reporting::Message payload = bench::examplePayload();
  const auto encoded = spanOf(payload.encoded());
  const ValueBuffer read = ValueBuffer::copyOfInput(encoded, /*account=*/{});
  const std::span bytes(read.data(), encoded.size());
  for (auto _ : state) {
    std::size_t size = 0;
    bool hasRepeatedKeys = false;
    benchmark::DoNotOptimize(wire::checkItem(bytes, kLimits, size, hasRepeatedKeys,
                                             read.data() + read.size()));
  }
  state.SetBytesProcessed(state.iterations() * static_cast<std::int64_t>(bytes.size()));
}
BENCHMARK(checkPayload);

void appendReply(benchmark::State& state) {
  std::string out;
  for (auto _ : state) {
    out.clear();
    wire::appendReply(out, /*number=*/70'000, wire::ReplyValue());
    benchmark::DoNotOptimize(out);
  }
}
BENCHMARK(appendReply);

// A batch as the socket gives it, from bytes to frames.
void findFrames(benchmark::State& state) {
  constexpr std::size_t kBatchBytes = 64 * 1024;
  const std::string frame = requestFrame();
  std::string batch;
  while (batch.size() + frame.size() <= kBatchBytes) batch += frame;
  wire::FrameReader reader(limits::kFrameBytes);
  std::int64_t frames = 0;
  for (auto _ : state) {
    const auto room = reader.room(batch.size());
    std::copy(batch.begin(), batch.end(), room.begin());
    reader.added(batch.size());
    std::span<const std::uint8_t> item;
    while (reader.next(item) == wire::FrameReader::Next::kFrame) ++frames;
  }
  state.SetItemsProcessed(frames);
}
BENCHMARK(findFrames);

}  // namespace
}  // namespace ostrel
