#include "tests/model/ReferenceService.h"

#include <algorithm>
#include <array>
#include <cstdlib>
#include <utility>

namespace ostrel::reference {

Drivers::Drivers(Context& context) : context_(context) {
  using Name = std::optional<std::string>;
  log(LogLevel::kInfo, "creating chanreporting driver utility");
  const std::array<std::pair<Name, Name>, 4> kTable = {{{"OrbiskVX3QDL", std::nullopt},
                                                        {"Speaker", std::nullopt},
                                                        {std::nullopt, "QDL"},
                                                        {"Haptics", "Stats"}}};
  FakeChannelReportingService& channels = *context_.around.channels;
  for (const auto& [group, subGroup] : kTable) {
    const auto found = channels.copyChannelsInGroup(group, subGroup);
    if (found.error) {
      log(LogLevel::kError, "error %li getting channels for driver %@-%@",
          found.error->code, group, subGroup);
    }
    if (!found.value) continue;
    if ((*found.value)->channelCount() < 1) {
      log(LogLevel::kInfo, "couldn't find any channels for driver group %@-%@", group,
          subGroup);
    } else {
      subscriptions_.push_back(
          {format("%@-%@", group, subGroup), channels.createSubscription(**found.value)});
    }
    log(LogLevel::kDefault, "subscribed to group group %@-%@", group, subGroup);
  }
}

std::optional<Dictionary> Drivers::sample(const Subscription& subscription) const {
  const auto& [handle, channels] = subscription.subscribed;
  const auto samples = context_.around.channels->createSamples(*handle, channels);
  if (!samples.error) return samples.value;
  log(LogLevel::kError, "ChanrepCreateSamples error %li", samples.error->code);
  return std::nullopt;
}

DriverSnapshot Drivers::snapshot() const {
  DriverSnapshot snapshot;
  for (const Subscription& subscription : subscriptions_) {
    log(LogLevel::kInfo, "sampling driver");
    if (auto samples = sample(subscription)) {
      snapshot.insert_or_assign(subscription.driver, *samples);
    }
  }
  return snapshot;
}

std::optional<Dictionary> Drivers::statistics(
    const std::optional<DriverSnapshot>& since) const {
  FakeChannelReportingService& channels = *context_.around.channels;
  DictionaryBuilder result;
  for (const Subscription& subscription : subscriptions_) {
    log(LogLevel::kInfo, "getting latest samples");
    const auto& [handle, subscribed] = subscription.subscribed;
    const auto current = channels.createSamples(*handle, subscribed);
    log(LogLevel::kInfo, "done getting latest samples");
    if (current.error) {
      log(LogLevel::kError, "ChanrepCreateSamples error %li", current.error->code);
      continue;
    }
    if (!current.value) continue;
    std::optional<Dictionary> working = current.value;
    if (since) {
      const auto earlier = since->find(subscription.driver);
      const auto delta = channels.createSamplesDelta(
          earlier == since->end() ? std::nullopt : std::optional(earlier->second),
          *current.value);
      if (delta.error) {
        log(LogLevel::kError, "ChanrepCreateSamplesDelta error %li", delta.error->code);
      } else {
        working = delta.value;
      }
    }
    if (!working) continue;
    channels.iterate(*working, [&](const ChannelReportingService::Channel& channel) {
      if (channel.simpleIntegerValue() >= 1) {
        result.set(channel.channelName(), channel.simpleIntegerValue());
      }
      return 0;
    });
  }
  if (result.empty()) return std::nullopt;
  return result.build();
}

Service::Service(Surroundings& around)
    : context(around), serverQueue(context.queues.make()) {
  around.events->add("notify.registerDispatch com.orbisk.ostrel.reporting");
  log(LogLevel::kDefault, "notify setup result %i", 0);
  drivers.emplace(context);
}

Service::~Service() {
  clients.clear();
  context.queues.clear();
}

bool Service::listenerShouldAcceptNewConnection(
    IPCListener&, const std::shared_ptr<IPCConnection>& connection) {
  const ProcessID pid = connection->processIdentifier();
  log(LogLevel::kDefault, "newConnection: %@", connection);
  log(LogLevel::kDefault, "%@, %lu", "<OstrelReportingServiceDelegate>", pid);
  const auto client = std::make_shared<Client>(*this, pid);
  connection->setExportedObject(client);
  const std::weak_ptr<Client> weak = client;
  context.queues.add(serverQueue, [this, weak] {
    if (const auto alive = weak.lock()) registerClient(alive);
  });
  connection->setInterruptionHandler([this, weak] {
    log(LogLevel::kDefault, "InterruptionHandler: connection exited");
    if (const auto alive = weak.lock()) handleConnectionError(alive);
  });
  connection->setInvalidationHandler(
      [this, weak, pid] { invalidated(weak.lock(), pid); });
  connection->resume();
  return true;
}

void Service::registerClient(const std::shared_ptr<Client>& client) {
  clients.push_back(client);
  client->startDate = context.around.clock->now();
  const FakeProcessInfo& processes = *context.around.processInfo;
  if (client->pid == processes.processIdentifier()) {
    client->processName = processes.processName();
  } else if (client->pid >= 1) {
    client->processName = processes.commandName(client->pid);
  }
}

void Service::handleConnectionError(const std::shared_ptr<Client>& client) {
  context.queues.add(serverQueue, [this, client] {
    const auto at = std::find(clients.begin(), clients.end(), client);
    if (at == clients.end()) return;
    clients.erase(at);
    log(LogLevel::kDefault, "removing %i from the server client list", client->pid);
  });
}

void Service::invalidated(const std::shared_ptr<Client>& client, ProcessID pid) {
  if (client) handleConnectionError(client);
  const Date now = context.around.clock->now();
  const auto name = client ? client->processName : std::nullopt;
  Value seconds = -1;
  double truncated = -1;
  if (!client || !client->startDate) {
    log(LogLevel::kDefault, "clientStartDate is nil. clientpid=%d clientprocessname=%@",
        pid, name.value_or("unknown"));
  } else {
    const Date start = *client->startDate;
    truncated = std::abs(now.secondsSince1970 - start.secondsSince1970);
    seconds = truncated;
    if (start > now) {
      log(LogLevel::kDefault,
          "clientStartDate is in the past. clientpid=%d clientprocessname=%@", pid,
          name.value_or("unknown"));
    }
  }
  log(LogLevel::kDefault,
      "InvalidationHandler: connection exited process=%@ uptime_sec=%d", name,
      static_cast<int>(truncated));
  if (!name) {
    log(LogLevel::kDefault, "clientProcessName is nil. clientpid=%d", pid);
    return;
  }
  context.around.analyticsSink->sendEventLazy(
      "com.orbisk.ostrel.ostrelreportingclientuptime",
      [event = Dictionary{{"processName", *name}, {"seconds", seconds}}] {
        return event;
      });
}

Dictionary Service::readDefaults() const {
  const auto suite = context.around.userDefaults->openSuite("com.orbisk.ostrel");
  DictionaryBuilder read;
  if (suite->objectForKey("device_name")) {
    if (const auto name = suite->stringForKey("device_name")) {
      read.set("device_name", *name);
    }
  }
  if (suite->objectForKey("disable_reporting")) {
    read.set("disable_reporting", suite->boolForKey("disable_reporting"));
  } else {
    read.set("disable_reporting", 0);
  }
  return read.build();
}

void Service::defaultsChanged(bool isOwnToken) {
  context.queues.add(serverQueue, [this, isOwnToken] {
    if (!isOwnToken) return;
    log(LogLevel::kDefault, "re-reading ostrel defaults");
    defaults = readDefaults();
    log(LogLevel::kInfo, "defaults %@", *defaults);
    for (const auto& client : clients) {
      for (const auto& [id, session] : client->sessions) {
        session->updateDefaults(defaults);
      }
    }
    reportingEnabled = defaults->find("disable_reporting")->number() == 0.0;
  });
}

void Service::wakeSpuriously() {
  for (const auto& weak : context.waits) {
    if (const auto wait = weak.lock()) {
      wait->wake(*context.around.clock, /*isTimeout=*/false);
    }
  }
}

std::shared_ptr<Session> Service::findSession(ReporterID id) const {
  if (id == kNoReporter || !reportingEnabled) return nullptr;
  for (const auto& client : clients) {
    const auto found = client->sessions.find(id);
    if (found == client->sessions.end()) continue;
    log(LogLevel::kInfo, "found reporting session %lli for client %i", id, client->pid);
    return found->second;
  }
  log(LogLevel::kError, "failed to find reporting session %lli", id);
  return nullptr;
}

void Service::sendToAll(const Dictionary& message, MessageCategory category,
                        MessageType type) {
  std::vector<std::shared_ptr<Session>> active;
  for (const auto& client : clients) {
    std::vector<std::shared_ptr<Session>> all;
    for (const auto& [id, session] : client->sessions) {
      all.push_back(session);
      if (session->started) active.push_back(session);
    }
    log(LogLevel::kDefault, "sessions for client %i : %@", client->pid, all);
  }
  log(LogLevel::kDefault, "active reporting sessions %lu : %@", active.size(), active);
  for (const auto& session : active) session->sendMessage(message, category, type);
  if (!active.empty()) return;
  log(LogLevel::kDefault, "no active reporting sessions found, sending as standalone");
  Session::sendSingleMessage(context, message, category, type, ServiceType{5});
}

template <typename... Arguments>
void Client::log(LogLevel level, std::string_view text,
                 const Arguments&... arguments) const {
  service_.context.log(level, "osrs", text, arguments...);
}

void Client::later(Step step) {
  service_.context.queues.add(service_.serverQueue, [self = shared_from_this(),
                                                     step = std::move(step)] { step(); });
}

void Client::later(TraceCode code, Step step) {
  later([this, code, step = std::move(step)] {
    service_.context.around.kernelTrace->trace(code);
    step();
  });
}

std::shared_ptr<Session> Client::ownSession(ReporterID id) const {
  const auto found = sessions.find(id);
  return found == sessions.end() ? nullptr : found->second;
}

void Client::createReportingSession(ReporterID id, BoolReply reply) {
  log(LogLevel::kDebug, "creating session for reporter %lli", id);
  later(TraceCode::kCreate, [this, id, reply] {
    sessions.insert_or_assign(id, std::make_shared<Session>(service_.context, id));
    log(LogLevel::kDefault, "session created for reporter %lli", id);
    reply(true);
  });
}

void Client::setServiceType(ServiceType type, ReporterID id, BoolReply reply) {
  log(LogLevel::kDebug, "setting service type %i for reporter %lli", type, id);
  later([this, type, id, reply] {
    if (id == kNoReporter) return;
    if (const auto session = ownSession(id)) {
      session->setServiceType(type);
      log(LogLevel::kDefault, "service type %i set for reporter  %lli", type, id);
    }
    reply(true);
  });
}

void Client::getServiceNameForReporterID(ReporterID id, ServiceTypeReply reply) {
  log(LogLevel::kDebug, "fetching seviceType");
  later([this, id, reply] {
    if (id == kNoReporter) reply(kServiceTypeUnknown);
    const auto session = service_.findSession(id);
    const ServiceType type = session ? session->serviceType : kServiceTypeUnknown;
    reply(type);
    log(LogLevel::kDefault, "returnning service type %i for reporter  %lli", type, id);
  });
}

void Client::setConfiguration(std::optional<Dictionary> configuration, ReporterID id,
                              BoolReply reply) {
  log(LogLevel::kDebug, "setting configuration");
  later([this, configuration, id, reply] {
    if (const auto session = service_.findSession(id)) {
      session->setConfiguration(configuration);
    }
    reply(true);
  });
}

void Client::startReportingSessionForID(ReporterID id, BoolReply reply) {
  log(LogLevel::kDebug, "starting session for reporter %lli", id);
  later(TraceCode::kStart, [this, id, reply] {
    if (id == kNoReporter) return;
    const auto session = service_.findSession(id);
    if (!session) {
      reply(false);
    } else if (!session->started) {
      session->start();
      session->driverSnapshot = service_.drivers->snapshot();
      session->transactionComplete = reply;
    }
  });
}

void Client::sendMessage(Dictionary message, MessageCategory category, MessageType type,
                         std::optional<ReporterIDs> ids, ErrorReply reply) {
  log(LogLevel::kDebug, "sending message for reporter %@", ids);
  later(TraceCode::kSend, [this, message, category, type, ids, reply] {
    if (!service_.reportingEnabled) {
      reply(ErrorObject{"com.orbisk.audio.reporting", /*code=*/1, ""});
      return;
    }
    if (ids) {
      for (const ReporterID id : *ids) {
        if (id == kNoReporter) continue;
        const auto session = service_.findSession(id);
        if (session) session->sendMessage(message, category, type);
      }
    } else {
      service_.sendToAll(message, category, type);
    }
    reply(std::nullopt);
  });
}

void Client::stopReportingSessionForID(ReporterID id, BoolReply reply) {
  log(LogLevel::kDebug, "stopping session for reporter %lli", id);
  later(TraceCode::kStop, [this, id, reply] {
    if (id == kNoReporter) return;
    const auto session = service_.findSession(id);
    const auto statistics =
        service_.drivers->statistics(session ? session->driverSnapshot : std::nullopt);
    if (statistics) {
      if (session) {
        session->sendMessage(*statistics, MessageCategory{9}, MessageType{0});
      }
      log(LogLevel::kDefault, "fetching driver logs %@", *statistics);
    } else {
      log(LogLevel::kDefault, "nothing interesting to fetch from the drivers");
    }
    if (session) {
      session->driverSnapshot.reset();
      session->stop();
    }
    log(LogLevel::kDefault, "stopping %lli", id);
    reply(true);
  });
}

void Client::destroyReportingSession(ReporterID id, BoolReply reply) {
  log(LogLevel::kDebug, "destroying session for reporter %lli", id);
  later(TraceCode::kDestroy, [this, id, reply] {
    if (id == kNoReporter) return;
    if (const auto found = sessions.find(id); found != sessions.end()) {
      if (found->second->started) found->second->stop();
      sessions.erase(found);
    }
    log(LogLevel::kDefault, "destroying %lli", id);
    reply(true);
  });
}

void Client::reporterIDValid(ReporterID id, DictionaryReply reply) {
  log(LogLevel::kDebug, "validating reporter %lli", id);
  later([this, id, reply] {
    const auto session = service_.findSession(id);
    const ServiceType type = session ? session->serviceType : kServiceTypeUnknown;
    log(LogLevel::kDefault, "validating reporter %lli", id);
    reply(Dictionary{{"reporterID", std::int64_t(session ? id : kNoReporter)},
                     {"serviceType", std::uint16_t(type)}});
  });
}

void Client::getAllReporters(ReporterIDsReply reply) {
  later([this, reply] {
    ReporterIDs ids;
    for (const auto& client : service_.clients) {
      for (const auto& [id, session] : client->sessions) ids.push_back(id);
    }
    reply(ids);
  });
}

void Client::killService(BoolReply) {
  log(LogLevel::kDefault, "DESTROYING SERVICE");
  service_.context.around.processInfo->endProcess(/*status=*/2);
}

}  // namespace ostrel::reference
