#pragma once

#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "Statistics/OstrelReportingDriverUtility.h"
#include "Statistics/OstrelReportingTypes.h"
#include "Statistics/Service/OstrelReportingAggregatedPayloads.h"
#include "Statistics/Service/OstrelReportingMessageCounts.h"
#include "platform/IPCListener.h"
#include "platform/TelemetryBackend.h"

namespace ostrel {

/// What a session has from its first start or message on, made then: most of what
/// it ever has, and of sessions that wait for theirs there are the most.
struct OstrelReportingSessionDetails {
  // What a delivery needs, side by side.
  MessageCounts messageTypeCounts;  // Only touched on the session's queue.
  // Only replaced on the session's queue, so that it is read there without a lock.
  std::shared_ptr<TelemetrySession> reportingSession;
  // Carries its own monitor: orientation callbacks append from their own thread.
  std::shared_ptr<AggregatedPayloadData> aggregatedPayloadData;
  static constexpr std::size_t kBytesOfDelivery =
      sizeof messageTypeCounts + sizeof reportingSession + sizeof aggregatedPayloadData;

  std::shared_ptr<const DriverSnapShot> driverSnapShot;
  BoolReply transactionCompleteBlock;
  std::optional<std::string> orientationCallbackID;
  std::optional<Date> startDate;
  std::optional<HierarchyToken> reportingAgentToken;
};

/// The pids of a session's owners: nearly always one.
class OstrelReportingProcessIdentifiers {
 public:
  explicit OstrelReportingProcessIdentifiers(std::vector<ProcessID> all)
      : only_(all.size() == 1 ? all.front() : ProcessID{}),
        notOne_(all.size() == 1
                    ? nullptr
                    : std::make_unique<const std::vector<ProcessID>>(std::move(all))) {}

  std::vector<ProcessID> all() const {
    return notOne_ != nullptr ? *notOne_ : std::vector<ProcessID>{only_};
  }

 private:
  const ProcessID only_;
  const std::unique_ptr<const std::vector<ProcessID>> notOne_;
};

}  // namespace ostrel
