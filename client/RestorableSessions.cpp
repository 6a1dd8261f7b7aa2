#include "client/RestorableSessions.h"

#include "client/RequestFrame.h"

namespace ostrel::reporting {

void RestorableSessions::setServiceType(ServiceType serviceType, ReporterID reporterID) {
  const auto found = sessions_.find(reporterID);
  if (found != sessions_.end()) found->second.serviceType = serviceType;
}

void RestorableSessions::setConfiguration(const Message& configuration,
                                          ReporterID reporterID) {
  const auto found = sessions_.find(reporterID);
  if (found != sessions_.end()) found->second.configuration.merge(configuration);
}

void RestorableSessions::setStarted(bool isStarted, ReporterID reporterID) {
  const auto found = sessions_.find(reporterID);
  if (found != sessions_.end()) found->second.isStarted = isStarted;
}

void RestorableSessions::appendRequests(std::string& out) const {
  using wire::Operation;
  for (const auto& [reporterID, session] : sessions_) {
    appendRequest(out, Operation::kCreateReportingSession, /*number=*/0, reporterID);
    if (session.serviceType) {
      appendSetServiceType(out, /*number=*/0, *session.serviceType, reporterID);
    }
    if (session.configuration.size() != 0) {
      appendSetConfiguration(out, /*number=*/0, session.configuration, reporterID);
    }
    if (session.isStarted) {
      appendRequest(out, Operation::kStartReportingSessionForID, /*number=*/0,
                    reporterID);
    }
  }
}

}  // namespace ostrel::reporting
