// What a session does with a message: both bridges, the sanitised payload, the
// identifier, the list and the backend, the last with ends that only count.
#include <benchmark/benchmark.h>

#include <map>
#include <memory>
#include <string>

#include "Statistics/OstrelReportingUtility.h"
#include "Statistics/Service/OstrelReportingMessageCounts.h"
#include "Statistics/Service/OstrelReportingPayloadSurvey.h"
#include "Statistics/Service/OstrelReportingSession.h"
#include "Statistics/Service/OstrelReportingSessionSummary.h"
#include "benchmarks/wholepath/CountingRoles.h"
#include "benchmarks/wholepath/Payload.h"
#include "platform/KernelTrace.h"
#include "platform/Logging.h"
#include "platform/fake/FakePlatform.h"

namespace ostrel {
namespace {

constexpr MessageCategory kCategory{0x40000007};
constexpr MessageType kType{1};
constexpr int kBatch = 1000;
constexpr int kBatchesASession = 100;

class NoTrace final : public KernelTrace {
 public:
  void trace(TraceCode /*code*/) override {}
};

class NoLog final : public ScopedLog {
 public:
  int verbosity(std::string_view /*key*/) const override { return 0; }
  LogLevel lowestLevel() const override { return LogLevel::kError; }
  void write(const LogLine& /*line*/) override {}
};

class StartedSession {
 public:
  StartedSession() : platform_(fakes_.platform()) {
    setSystemLog(std::make_shared<NoLog>());
    platform_.kernelTrace = std::make_shared<NoTrace>();
    platform_.telemetryBackend = std::make_shared<bench::CountingBackend>(counts_);
    platform_.analyticsSink = std::make_shared<bench::CountingAnalyticsSink>(counts_);
    platform_.wattlogSink = std::make_shared<bench::CountingWattlogSink>(counts_);
    session_ = OstrelReportingSession::initWithID(ReporterID{4711},
                                                  /*processIdentifiers=*/{1}, platform_);
    start();
  }

  // One batch as steps of the session's queue.
  void deliver(const Dictionary& message) {
    for (int i = 0; i < kBatch; ++i) {
      session_->sendMessage(message, kCategory, kType, /*reply=*/nullptr);
    }
    fakes_.runUntilIdle();
  }

  // Begins a new list.
  void restart() {
    session_->stop();
    start();
  }

  std::uint64_t delivered() const { return counts_.messages; }

 private:
  void start() {
    session_->start();
    fakes_.runUntilIdle();
  }

  FakePlatform fakes_;
  bench::ServiceCounts counts_{};
  OstrelReportingPlatform platform_;
  std::shared_ptr<OstrelReportingSession> session_;
};

void deliverMessage(benchmark::State& state) {
  StartedSession session;
  const Dictionary message = Dictionary::copyOf(bench::examplePayload().encoded());
  std::int64_t batches = 0;
  for (auto _ : state) {
    session.deliver(message);
    if (++batches % kBatchesASession != 0) continue;
    state.PauseTiming();
    session.restart();
    state.ResumeTiming();
  }
  if (session.delivered() < static_cast<std::uint64_t>(batches * kBatch)) {
    state.SkipWithError("not every message reached the backend");
  }
  state.SetItemsProcessed(batches * kBatch);
}
BENCHMARK(deliverMessage);

void sanitisePayload(benchmark::State& state) {
  const Dictionary message = Dictionary::copyOf(bench::examplePayload().encoded());
  for (auto _ : state) benchmark::DoNotOptimize(SanitisedPayload(message));
}
BENCHMARK(sanitisePayload);

void surveyPayload(benchmark::State& state) {
  const Dictionary message = Dictionary::copyOf(bench::examplePayload().encoded());
  for (auto _ : state) benchmark::DoNotOptimize(PayloadSurvey(message));
}
BENCHMARK(surveyPayload);

// What the survey spares.
void walkPayloadForEachPart(benchmark::State& state) {
  const Dictionary message = Dictionary::copyOf(bench::examplePayload().encoded());
  for (auto _ : state) {
    benchmark::DoNotOptimize(SanitisedPayload(message));
    benchmark::DoNotOptimize(message.get("EngineOnTime"));
    benchmark::DoNotOptimize(message.value().bytes());
  }
}
BENCHMARK(walkPayloadForEachPart);

void nameMessage(benchmark::State& state) {
  MessageCounts counts;
  for (auto _ : state) {
    benchmark::DoNotOptimize(counts.next(messageNames(kCategory, kType)));
  }
}
BENCHMARK(nameMessage);

// Its name as it was made for each message.
void composeMessageName(benchmark::State& state) {
  std::map<std::string, std::int64_t> counts;
  for (auto _ : state) {
    std::string identifier;
    identifier.reserve(64);
    appendCategoryName(identifier, kCategory);
    identifier += '_';
    identifier += MessageTypeName(kType);
    const std::int64_t count = ++counts[identifier];
    identifier += '_';
    identifier += std::to_string(count);
    benchmark::DoNotOptimize(identifier);
  }
}
BENCHMARK(composeMessageName);

}  // namespace
}  // namespace ostrel
