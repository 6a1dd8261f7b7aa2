#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "Statistics/OstrelReportingTypes.h"
#include "tests/model/ReferenceContext.h"

namespace ostrel::reference {

/// One sample of each driver, by the driver's description.
using DriverSnapshot = std::map<std::string, Dictionary>;

/// A session: created, started (live, detached or test), stopped.
class Session : public std::enable_shared_from_this<Session> {
 public:
  Session(Context& context, ReporterID reporterID);
  ~Session();

  // Each queues its work on the session's queue, but for the configuration.
  void setServiceType(ServiceType type);
  void setConfiguration(const std::optional<Dictionary>& configuration);
  void updateDefaults(const std::optional<Dictionary>& defaults);
  void start();
  void stop();
  void sendMessage(const Dictionary& message, MessageCategory category, MessageType type);

  /// One message by itself, through the background queue.
  static void sendSingleMessage(Context& context, const Dictionary& message,
                                MessageCategory category, MessageType type,
                                ServiceType serviceType);

  std::string description() const { return format("<OstrelReportingSession: %lli>", id); }

  const ReporterID id;
  bool started = false;
  ServiceType serviceType = kServiceTypeUnknown;
  std::optional<DriverSnapshot> driverSnapshot;
  BoolReply transactionComplete;

 private:
  template <typename... Arguments>
  void log(LogLevel level, std::string_view text, const Arguments&... arguments) const {
    context_.log(level, "osrr", text, arguments...);
  }
  void later(Step step);
  void announceStart() const;
  void announceStop() const;
  void announceMessage() const;
  void changeServiceType(ServiceType type, ServiceType before);
  void startStep();
  std::shared_ptr<TelemetrySession> makeTelemetrySession() const;
  void backendCallback(const std::optional<Array>& backends, BackendWait& wait);
  void waitForBackends(const std::shared_ptr<BackendWait>& wait);
  void endOfWait(const std::shared_ptr<BackendWait>& wait, bool isTimeout);
  void endOfStart();
  void stopStep();
  void deliver(const Dictionary& message, MessageCategory category, MessageType type);
  void mirror(const Dictionary& message, MessageCategory category, MessageType type);
  std::string messageIdentifier(MessageCategory category, MessageType type);
  std::optional<Dictionary> createSummaryEvent();
  void writeSessionLog();
  bool shouldReportOrientation() const;
  void orientationChanged(const std::string& mode, std::int32_t code);

  Context& context_;
  const std::size_t queue_;
  Dictionary userInfo_;
  std::map<std::string, std::int64_t> messageTypeCounts_;
  std::optional<std::vector<Dictionary>> aggregated_ = std::vector<Dictionary>();
  std::optional<std::string> orientationCallbackID_;
  Date startDate_;
  std::shared_ptr<TelemetrySession> telemetrySession_;
};

}  // namespace ostrel::reference
