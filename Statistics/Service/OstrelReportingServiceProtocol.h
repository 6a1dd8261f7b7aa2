#pragma once

#include <optional>

#include "Statistics/OstrelReportingTypes.h"

namespace ostrel {

/// Everything that a client can ask of the service. The server's object for a
/// client implements it, and so does the client's proxy of the service.
///
/// Every operation returns at once; the work and the reply happen later, in the
/// order of the calls. A request may be answered once, twice or never, as each
/// operation says; a caller that waits does so with a deadline. Replies to one
/// client come on one thread at a time. An empty reply is allowed everywhere.
class OstrelReportingServiceProtocol {
 public:
  virtual ~OstrelReportingServiceProtocol() = default;

  /// Makes a session of this client's under `reporterID`, in place of an
  /// earlier one of this client's. Always replies true.
  virtual void createReportingSession(ReporterID reporterID, BoolReply reply) = 0;

  /// Sets the type of this client's session; a started session restarts when
  /// its type changes. Replies true, also when there is no such session; no
  /// reply at all for ID 0.
  virtual void setServiceType(ServiceType serviceType, ReporterID reportingSession,
                              BoolReply reply) = 0;

  /// Replies the type of any client's session, or `kServiceTypeUnknown` when
  /// there is none; twice so for ID 0.
  virtual void getServiceNameForReporterID(ReporterID reporterID,
                                           ServiceTypeReply reply) = 0;

  /// Merges the entries into the user info of any client's session. Always
  /// replies true. No configuration changes nothing.
  virtual void setConfiguration(std::optional<Dictionary> configuration,
                                ReporterID reporterID, BoolReply reply) = 0;

  /// Starts any client's session. Replies false at once when there is no such
  /// session; otherwise true when the session stops, at each of its stops. No
  /// reply for ID 0, nor for a session that is started already.
  virtual void startReportingSessionForID(ReporterID reporterID, BoolReply reply) = 0;

  /// Sends a message to the sessions named, whoever made them; IDs that name
  /// none are passed over. No list (none, not an empty one) sends it to every
  /// started session or, when there is none, out by itself. Replies no error
  /// once the message is accepted, or an error while reporting is switched off.
  virtual void sendMessage(Dictionary message, MessageCategory category, MessageType type,
                           std::optional<ReporterIDs> reportingIDs, ErrorReply reply) = 0;

  /// Says that a message to the session is read already and comes after the next two:
  /// what it needs may be fetched from memory meanwhile. 0: it is something else. Only a
  /// hint. On the thread that sends the messages.
  virtual void expectMessage(ReporterID /*reporterID*/) {}

  /// Stops any client's session. Replies true, also when there is none; no
  /// reply for ID 0.
  virtual void stopReportingSessionForID(ReporterID reporterID, BoolReply reply) = 0;

  /// Stops this client's session if it is started, and drops it. Replies true,
  /// also when there is none; no reply for ID 0.
  virtual void destroyReportingSession(ReporterID reporterID, BoolReply reply) = 0;

  /// Replies {"reporterID", "serviceType"} of any client's session, 0 and
  /// 65535 when there is none.
  virtual void reporterIDValid(ReporterID reporterID, DictionaryReply reply) = 0;

  /// Replies the IDs of every session of every client.
  virtual void getAllReporters(ReporterIDsReply reply) = 0;

  /// Ends the service at once with exit status 2. Never replies.
  virtual void killService(BoolReply reply) = 0;
};

}  // namespace ostrel
