#pragma once

#include <memory>

#include "platform/TelemetryBackend.h"
#include "platform/linux/store/Store.h"

namespace ostrel {

/// The telemetry backend that keeps everything in the embedded store. Discovery
/// finds the backend "store" when the store can be used, and none otherwise.
class StoreTelemetryBackend final : public TelemetryBackend {
 public:
  explicit StoreTelemetryBackend(std::shared_ptr<Store> store);

  HierarchyToken makeHierarchyToken(const std::optional<HierarchyToken>& parent) override;
  std::shared_ptr<TelemetrySession> createSession(
      const Dictionary& sessionInfo, const Dictionary& userInfo,
      const std::vector<std::string>& frameworksToCheck) override;
  Success sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo,
                         std::uint16_t category, std::uint16_t type,
                         const Dictionary& payload) override;

 private:
  const std::shared_ptr<Store> store_;
};

}  // namespace ostrel
