#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "Statistics/OstrelReportingDriverUtility.h"
#include "Statistics/OstrelReportingTypes.h"
#include "Statistics/Service/OstrelReportingServiceProtocol.h"
#include "Statistics/Service/OstrelReportingSession.h"
#include "Statistics/Service/OstrelReportingSessionIndex.h"
#include "Statistics/Support/AtomicProperty.h"
#include "platform/ChangeNotification.h"
#include "platform/IPCListener.h"
#include "platform/OstrelReportingPlatform.h"
#include "platform/SpreadHash.h"
#include "platform/ThreadAnnotations.h"
#include "platform/WorkQueue.h"

namespace ostrel {

/// Stands for being on `serverQueue`, whose one queue guards fields of several
/// classes.
class OSTREL_CAPABILITY("server queue") ServerQueueRole {};
extern ServerQueueRole serverQueueRole;

/// The process's one queue for client requests, registration and removal of
/// clients, and defaults. None before the first root object.
std::shared_ptr<WorkQueue> serverQueue();
void assertOnServerQueue() OSTREL_ASSERT_CAPABILITY(serverQueueRole);

class OstrelReportingServerInstance;

/// The root of the service, one per process: accepts every client, knows the
/// clients and their sessions, and keeps what all share.
class OstrelReportingServiceDelegate final
    : public IPCListenerDelegate,
      public std::enable_shared_from_this<OstrelReportingServiceDelegate> {
 public:
  using Clients = std::vector<std::shared_ptr<OstrelReportingServerInstance>>;

  /// Makes `serverQueue`, registers for changes of the defaults and subscribes to
  /// the drivers. The defaults are not read. `platform` outlives the object.
  static std::shared_ptr<OstrelReportingServiceDelegate> init(
      const OstrelReportingPlatform& platform);

  /// Makes the connection's server instance, registers it on `serverQueue` and
  /// resumes the connection. Always true. On the listener's thread.
  bool listenerShouldAcceptNewConnection(
      IPCListener& listener,
      const std::shared_ptr<IPCConnection>& newConnection) override;

  /// Registers for the change notification; its status is only logged.
  void listenForDefaultsNotification();

  /// The defaults as they stand in the store: "device_name" when it is there,
  /// and "disable_reporting", 0 when it is not.
  Dictionary OstrelReportingDefaults() const;

  /// The session of the client that registered first among those that have one
  /// under the ID; none, with an error logged, when there is none; none without
  /// a line for ID 0 and while reporting is switched off.
  std::shared_ptr<OstrelReportingSession> findReportingSessionForID(
      ReporterID reporterID) const OSTREL_ON_QUEUE(serverQueueRole);

  bool reportingEnabled() const {
    return reportingEnabled_.load(std::memory_order_acquire);
  }
  const Clients& clients() const OSTREL_ON_QUEUE(serverQueueRole) { return clients_; }
  const std::shared_ptr<OstrelReportingDriverUtility>& driverUtility() const {
    return driverUtility_;
  }
  /// None until the first change notification.
  std::optional<Dictionary> defaults() const { return defaults_.get(); }
  const OstrelReportingPlatform& platform() const { return platform_; }

  /// "<OstrelReportingServiceDelegate>".
  std::string description() const;

 private:
  struct Passkey {};
  friend class OstrelReportingServerInstance;

 public:
  OstrelReportingServiceDelegate(Passkey, const OstrelReportingPlatform& platform);

 private:
  void registerClientStep(const std::shared_ptr<OstrelReportingServerInstance>& client,
                          ProcessID pid) OSTREL_ON_QUEUE(serverQueueRole);
  void removeClientStep(OstrelReportingServerInstance& client)
      OSTREL_ON_QUEUE(serverQueueRole);
  std::optional<std::string> processName(ProcessID pid) const;
  void defaultsChangedStep(int token) OSTREL_ON_QUEUE(serverQueueRole);

  // The same without a reference: the session lives as long as its client's map.
  OstrelReportingSession* borrowReportingSessionForID(ReporterID reporterID) const
      OSTREL_ON_QUEUE(serverQueueRole);

  // The index of the sessions of registered clients, so that a look-up does not walk
  // all clients.
  void indexSession(OstrelReportingSession& session,
                    OstrelReportingServerInstance& client)
      OSTREL_ON_QUEUE(serverQueueRole);

  // Constant after construction.
  const OstrelReportingPlatform& platform_;
  std::shared_ptr<OstrelReportingDriverUtility> driverUtility_;

  // On the queue. The index holds sessions of members of `clients_`.
  Clients clients_ OSTREL_GUARDED_BY(serverQueueRole);
  OstrelReportingSessionIndex sessionIndex_ OSTREL_GUARDED_BY(serverQueueRole);
  std::uint64_t registrations_ OSTREL_GUARDED_BY(serverQueueRole) = 0;

  // Shared, each with its own lock.
  std::atomic<bool> reportingEnabled_{true};
  AtomicProperty<std::optional<Dictionary>> defaults_;
};

/// What one client sees: its connection's exported object.
///
/// Every operation but `killService` only logs and queues its work on
/// `serverQueue`; the work and the reply happen there.
class OstrelReportingServerInstance final
    : public OstrelReportingServiceProtocol,
      public std::enable_shared_from_this<OstrelReportingServerInstance> {
 public:
  using SessionMap =
      std::unordered_map<ReporterID, std::shared_ptr<OstrelReportingSession>, SpreadHash>;

  /// `outError` is never written.
  static std::shared_ptr<OstrelReportingServerInstance> initWithMasterAndID(
      std::shared_ptr<OstrelReportingServiceDelegate> master, ProcessID clientID,
      std::optional<ErrorObject>* outError);

  void createReportingSession(ReporterID reporterID, BoolReply reply) override;
  void setServiceType(ServiceType serviceType, ReporterID reportingSession,
                      BoolReply reply) override;
  void getServiceNameForReporterID(ReporterID reporterID,
                                   ServiceTypeReply reply) override;
  void setConfiguration(std::optional<Dictionary> configuration, ReporterID reporterID,
                        BoolReply reply) override;
  void startReportingSessionForID(ReporterID reporterID, BoolReply reply) override;
  void sendMessage(Dictionary message, MessageCategory category, MessageType type,
                   std::optional<ReporterIDs> reportingIDs, ErrorReply reply) override;
  void expectMessage(ReporterID reporterID) override;
  void stopReportingSessionForID(ReporterID reporterID, BoolReply reply) override;
  void destroyReportingSession(ReporterID reporterID, BoolReply reply) override;
  void reporterIDValid(ReporterID reporterID, DictionaryReply reply) override;
  void getAllReporters(ReporterIDsReply reply) override;
  void killService(BoolReply reply) override;

  /// Queues the removal of this client from the root object's list; nothing
  /// happens when it is not there. Its sessions go with its last reference.
  void handleConnectionError();

  ProcessID clientID() const { return clientID_; }
  const std::shared_ptr<OstrelReportingServiceDelegate>& master() const {
    return master_;
  }
  /// When the client was registered; none before.
  std::optional<Date> clientStartDate() const { return clientStartDate_.get(); }
  /// None when it could not be found.
  std::optional<std::string> clientProcessName() const {
    return clientProcessName_.get();
  }
  const SessionMap& clientReportingSessionMap() const OSTREL_ON_QUEUE(serverQueueRole) {
    return clientReportingSessionMap_;
  }
  /// The map's sessions by ascending ID: the order of every walk over it.
  std::vector<std::shared_ptr<OstrelReportingSession>> sessionsInOrder() const
      OSTREL_ON_QUEUE(serverQueueRole);

 private:
  struct Passkey {};
  friend class OstrelReportingServiceDelegate;

 public:
  OstrelReportingServerInstance(Passkey,
                                std::shared_ptr<OstrelReportingServiceDelegate> master,
                                ProcessID clientID);

 private:
  void createStep(ReporterID reporterID, const BoolReply& reply)
      OSTREL_ON_QUEUE(serverQueueRole);
  void setServiceTypeStep(ServiceType serviceType, ReporterID reporterID,
                          const BoolReply& reply) OSTREL_ON_QUEUE(serverQueueRole);
  void getServiceNameStep(ReporterID reporterID, const ServiceTypeReply& reply)
      OSTREL_ON_QUEUE(serverQueueRole);
  void setConfigurationStep(const std::optional<Dictionary>& configuration,
                            ReporterID reporterID, const BoolReply& reply)
      OSTREL_ON_QUEUE(serverQueueRole);
  void startStep(ReporterID reporterID, BoolReply reply) OSTREL_ON_QUEUE(serverQueueRole);
  void sendMessageStep(Dictionary message, MessageCategory category, MessageType type,
                       const std::optional<ReporterIDs>& reportingIDs,
                       const ErrorReply& reply) OSTREL_ON_QUEUE(serverQueueRole);
  void fetchAhead() OSTREL_ON_QUEUE(serverQueueRole);
  void sendToActiveSessions(const Dictionary& message, MessageCategory category,
                            MessageType type) OSTREL_ON_QUEUE(serverQueueRole);
  void stopStep(ReporterID reporterID, const BoolReply& reply)
      OSTREL_ON_QUEUE(serverQueueRole);
  void destroyStep(ReporterID reporterID, const BoolReply& reply)
      OSTREL_ON_QUEUE(serverQueueRole);
  void validateStep(ReporterID reporterID, const DictionaryReply& reply)
      OSTREL_ON_QUEUE(serverQueueRole);
  void getAllReportersStep(const ReporterIDsReply& reply)
      OSTREL_ON_QUEUE(serverQueueRole);
  std::shared_ptr<OstrelReportingSession> ownSession(ReporterID reporterID) const
      OSTREL_ON_QUEUE(serverQueueRole);

  /// One of the map.
  struct Entry {
    ReporterID reporterID;
    const std::shared_ptr<OstrelReportingSession>* session;
  };
  const std::vector<Entry>& entriesInOrder() const OSTREL_ON_QUEUE(serverQueueRole);

  // Constant after construction.
  const std::shared_ptr<OstrelReportingServiceDelegate> master_;
  const ProcessID clientID_;

  // On the queue. `registration_` numbers the registered clients in their
  // order; 0 while this one is not registered.
  SessionMap clientReportingSessionMap_ OSTREL_GUARDED_BY(serverQueueRole);
  // The map in its order since somebody asked for that, but for what was made after.
  mutable std::vector<Entry> entriesInOrder_ OSTREL_GUARDED_BY(serverQueueRole);
  mutable std::vector<Entry> latestEntries_ OSTREL_GUARDED_BY(serverQueueRole);
  mutable bool isOrderKnown_ OSTREL_GUARDED_BY(serverQueueRole) = false;
  std::uint64_t registration_ OSTREL_GUARDED_BY(serverQueueRole) = 0;

  // The thread's that sends messages: the sessions of the next ones, 0 for those of which
  // nothing is to be fetched any more.
  std::array<ReporterID, 3> expected_{};

  // Shared, each with its own lock.
  AtomicProperty<std::optional<Date>> clientStartDate_;
  AtomicProperty<std::optional<std::string>> clientProcessName_;
};

}  // namespace ostrel
