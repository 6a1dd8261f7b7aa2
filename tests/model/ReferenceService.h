// The service, told again as a plain program on one thread: what the eleven client
// operations, the states of a session and its deliveries do, one line after the other,
// with no locks, no threads and no care for speed. The tests hold the real core to it;
// to a reader it is the shortest description of the service.
//
// It knows the role interfaces, values and codes, and shares no line with the core.
#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "Statistics/OstrelReportingTypes.h"
#include "Statistics/Service/OstrelReportingServiceProtocol.h"
#include "platform/IPCListener.h"
#include "tests/model/ReferenceContext.h"
#include "tests/model/ReferenceSession.h"

namespace ostrel::reference {

/// The drivers' counters.
class Drivers {
 public:
  explicit Drivers(Context& context);
  DriverSnapshot snapshot() const;
  /// What moved up since the snapshot; none when nothing did.
  std::optional<Dictionary> statistics(const std::optional<DriverSnapshot>& since) const;

 private:
  struct Subscription {
    std::string driver;
    ChannelReportingService::Subscribed subscribed;
  };

  template <typename... Arguments>
  void log(LogLevel level, std::string_view text, const Arguments&... arguments) const {
    context_.log(level, "osrd", text, arguments...);
  }
  /// None also when samples came with an error.
  std::optional<Dictionary> sample(const Subscription& subscription) const;

  Context& context_;
  std::vector<Subscription> subscriptions_;
};

class Service;

/// What one client sees.
class Client : public OstrelReportingServiceProtocol,
               public std::enable_shared_from_this<Client> {
 public:
  Client(Service& service, ProcessID process) : pid(process), service_(service) {}

  void createReportingSession(ReporterID id, BoolReply reply) override;
  void setServiceType(ServiceType type, ReporterID id, BoolReply reply) override;
  void getServiceNameForReporterID(ReporterID id, ServiceTypeReply reply) override;
  void setConfiguration(std::optional<Dictionary> configuration, ReporterID id,
                        BoolReply reply) override;
  void startReportingSessionForID(ReporterID id, BoolReply reply) override;
  void sendMessage(Dictionary message, MessageCategory category, MessageType type,
                   std::optional<ReporterIDs> ids, ErrorReply reply) override;
  void stopReportingSessionForID(ReporterID id, BoolReply reply) override;
  void destroyReportingSession(ReporterID id, BoolReply reply) override;
  void reporterIDValid(ReporterID id, DictionaryReply reply) override;
  void getAllReporters(ReporterIDsReply reply) override;
  void killService(BoolReply reply) override;

  const ProcessID pid;
  std::optional<Date> startDate;  // None before the registration.
  std::optional<std::string> processName;
  std::map<ReporterID, std::shared_ptr<Session>> sessions;

 private:
  template <typename... Arguments>
  void log(LogLevel level, std::string_view text, const Arguments&... arguments) const;
  void later(Step step);
  void later(TraceCode code, Step step);
  std::shared_ptr<Session> ownSession(ReporterID id) const;

  Service& service_;
};

/// The root object. The server queue is the first serial one.
class Service : public IPCListenerDelegate {
 public:
  explicit Service(Surroundings& around);
  ~Service();

  bool listenerShouldAcceptNewConnection(
      IPCListener& listener, const std::shared_ptr<IPCConnection>& connection) override;
  /// The change notification came; with a foreign token it changes nothing.
  void defaultsChanged(bool isOwnToken);
  /// Wakes every wait for backends, though nobody signalled.
  void wakeSpuriously();

  std::shared_ptr<Session> findSession(ReporterID id) const;
  /// Sends to every started session or, when there is none, by itself.
  void sendToAll(const Dictionary& message, MessageCategory category, MessageType type);

  Context context;
  const std::size_t serverQueue;
  std::vector<std::shared_ptr<Client>> clients;  // In the order of registration.
  bool reportingEnabled = true;
  std::optional<Dictionary> defaults;
  std::optional<Drivers> drivers;

 private:
  template <typename... Arguments>
  void log(LogLevel level, std::string_view text, const Arguments&... arguments) const {
    context.log(level, "osrs", text, arguments...);
  }
  void registerClient(const std::shared_ptr<Client>& client);
  void handleConnectionError(const std::shared_ptr<Client>& client);
  void invalidated(const std::shared_ptr<Client>& client, ProcessID pid);
  Dictionary readDefaults() const;
};

}  // namespace ostrel::reference
