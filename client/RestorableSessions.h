#pragma once

#include <map>
#include <optional>
#include <string>

#include "ostrel/Reply.h"

namespace ostrel::reporting {

/// What this client asked for its own sessions, so that it can be asked again of
/// another service. Not safe for threads.
class RestorableSessions {
 public:
  // Each does nothing for a session that was not created here.
  void create(ReporterID reporterID) { sessions_[reporterID] = {}; }
  void setServiceType(ServiceType serviceType, ReporterID reporterID);
  void setConfiguration(const Message& configuration, ReporterID reporterID);
  void setStarted(bool isStarted, ReporterID reporterID);
  void destroy(ReporterID reporterID) { sessions_.erase(reporterID); }

  /// Appends the requests that bring all sessions to where they are; they ask
  /// for no replies.
  void appendRequests(std::string& out) const;

 private:
  struct Session {
    std::optional<ServiceType> serviceType;
    Message configuration;
    bool isStarted = false;
  };

  std::map<ReporterID, Session> sessions_;
};

}  // namespace ostrel::reporting
