// The ends of the service, bound to nothing but counters.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "benchmarks/wholepath/ServiceCounts.h"
#include "platform/AnalyticsSink.h"
#include "platform/TelemetryBackend.h"
#include "platform/WattlogSink.h"

namespace ostrel::bench {

class CountingSession final : public TelemetrySession {
 public:
  explicit CountingSession(ServiceCounts& counts) : counts_(counts) {
    counts_.sessions.add();
  }

  void startConfiguration(BackendsCallback completion) override { completion(Array()); }

  Success sendMessage(std::uint16_t /*category*/, std::uint16_t /*type*/,
                      const Dictionary& /*payload*/) override {
    counts_.messages.add();
    return {/*succeeded=*/true, /*error=*/{}};
  }

  void flush(FlushCallback completion) override { completion(/*error=*/{}); }

  std::string description() const override { return "counting session"; }

 private:
  ServiceCounts& counts_;
};

class CountingBackend final : public TelemetryBackend {
 public:
  explicit CountingBackend(ServiceCounts& counts) : counts_(counts) {}

  HierarchyToken makeHierarchyToken(
      const std::optional<HierarchyToken>& /*parent*/) override {
    return "00-00000000000000000000000000000001-0000000000000001-01";
  }

  std::shared_ptr<TelemetrySession> createSession(
      const Dictionary& /*sessionInfo*/, const Dictionary& /*userInfo*/,
      const std::vector<std::string>& /*frameworksToCheck*/) override {
    return std::make_shared<CountingSession>(counts_);
  }

  Success sendOneMessage(const Dictionary& /*sessionInfo*/,
                         const Dictionary& /*userInfo*/, std::uint16_t /*category*/,
                         std::uint16_t /*type*/, const Dictionary& /*payload*/) override {
    counts_.loneMessages.add();
    return {/*succeeded=*/true, /*error=*/{}};
  }

 private:
  ServiceCounts& counts_;
};

class CountingAnalyticsSink final : public AnalyticsSink {
 public:
  explicit CountingAnalyticsSink(ServiceCounts& counts) : counts_(counts) {}

  void sendEventLazy(std::string_view /*name*/, PayloadProvider /*provider*/) override {
    counts_.analyticsEvents.add();
  }

 private:
  ServiceCounts& counts_;
};

class CountingWattlogSink final : public WattlogSink {
 public:
  explicit CountingWattlogSink(ServiceCounts& counts) : counts_(counts) {}

  void logRegisteredEvent(std::int32_t /*clientID*/, std::string_view /*name*/,
                          const Dictionary& /*event*/,
                          const std::optional<Dictionary>& /*attachment*/) override {
    counts_.powerEvents.add();
  }

 private:
  ServiceCounts& counts_;
};

}  // namespace ostrel::bench
