// The service host. Client requests arrive on the listener's thread, are logged
// there and queued on `serverQueue`; all that this file keeps of clients and
// their sessions is touched on that queue only, so requests of all clients are
// handled one at a time in the order of their arrival. Sessions have queues of
// their own; from here they are only handed work.
//
// Some requests are answered twice and some never. Those places say so.
#include "Statistics/Service/OstrelReportingServiceDelegate.h"

#include <algorithm>
#include <cmath>
#include <utility>

#include "Statistics/OstrelReportingUtility.h"
#include "platform/AnalyticsSink.h"
#include "platform/Clock.h"
#include "platform/KernelTrace.h"
#include "platform/Logging.h"
#include "platform/ProcessInfo.h"
#include "platform/UserDefaults.h"

namespace ostrel {

ServerQueueRole serverQueueRole;

namespace {

LogScope logScope("osrs", "reporting_server_verbose");

constexpr std::string_view kDefaultsSuite = "com.orbisk.ostrel";
constexpr std::string_view kDefaultsNotification = "com.orbisk.ostrel.reporting";
constexpr std::string_view kDeviceNameKey = "device_name";
constexpr std::string_view kDisableReportingKey = "disable_reporting";
constexpr MessageCategory kDriverStatisticsCategory{9};
constexpr MessageType kDriverStatisticsType{0};
constexpr int kKilledExitStatus = 2;

AtomicProperty<std::shared_ptr<WorkQueue>>& serverQueueProperty() {
  static auto& property = *new AtomicProperty<std::shared_ptr<WorkQueue>>;
  return property;
}

// The queue of the property, for what each message does with it: without its lock and
// without a reference. A process replaces it only with its root object.
std::atomic<WorkQueue*> servingQueue{nullptr};

std::atomic<int> defaultsNotifyToken{-1};

template <typename Reply, typename... Values>
void call(const Reply& reply, const Values&... values) {
  if (reply) reply(values...);
}

std::int64_t truncated(double seconds) {
  constexpr double kLimit = 9007199254740992.0;  // Exact in a double.
  if (std::isnan(seconds)) return 0;
  return static_cast<std::int64_t>(std::clamp(seconds, -kLimit, kLimit));
}

// None for one session, as most messages have.
std::shared_ptr<OstrelReportingSharedPayload> payloadFor(std::size_t sessions) {
  return sessions > 1 ? std::make_shared<OstrelReportingSharedPayload>() : nullptr;
}

/// How long the client was there, for its uptime event.
struct Uptime {
  Value seconds{-1};  // An integer when it is not known, else a double.
  std::int64_t wholeSeconds = -1;
};

Uptime uptimeOf(const OstrelReportingServerInstance* client, ProcessID pid, Date now) {
  const auto name = client != nullptr ? client->clientProcessName() : std::nullopt;
  const auto start = client != nullptr ? client->clientStartDate() : std::nullopt;
  if (!start) {
    OSTREL_LOG_DEFAULT(logScope,
                       "clientStartDate is nil. clientpid=%d clientprocessname=%@", pid,
                       name.value_or("unknown"));
    return {};
  }
  const double sinceStart = now.secondsSince1970 - start->secondsSince1970;
  // Kept: the text says past where the start lies in the future.
  // [KeepsInThePastTextForAFutureStartDate]
  if (sinceStart < 0) {
    OSTREL_LOG_DEFAULT(logScope,
                       "clientStartDate is in the past. clientpid=%d "
                       "clientprocessname=%@",
                       pid, name.value_or("unknown"));
  }
  return {Value(std::abs(sinceStart)), truncated(std::abs(sinceStart))};
}

void connectionInvalidated(const OstrelReportingPlatform& platform,
                           const std::weak_ptr<OstrelReportingServerInstance>& weak,
                           ProcessID pid) {
  const auto client = weak.lock();
  if (client) client->handleConnectionError();
  const Uptime uptime = uptimeOf(client.get(), pid, platform.clock->now());
  const auto name = client ? client->clientProcessName() : std::nullopt;
  OSTREL_LOG_DEFAULT(logScope,
                     "InvalidationHandler: connection exited process=%@ uptime_sec=%d",
                     name, uptime.wholeSeconds);
  if (!name) {
    OSTREL_LOG_DEFAULT(logScope, "clientProcessName is nil. clientpid=%d", pid);
    return;
  }
  platform.analyticsSink->sendEventLazy(
      "com.orbisk.ostrel.ostrelreportingclientuptime",
      [event = Dictionary{{"processName", *name}, {"seconds", uptime.seconds}}] {
        return event;
      });
}

void connectionInterrupted(const std::weak_ptr<OstrelReportingServerInstance>& weak) {
  OSTREL_LOG_DEFAULT(logScope, "InterruptionHandler: connection exited");
  if (const auto client = weak.lock()) client->handleConnectionError();
}

}  // namespace

std::shared_ptr<WorkQueue> serverQueue() { return serverQueueProperty().get(); }

void assertOnServerQueue() {
  if (const auto* queue = servingQueue.load(std::memory_order_acquire)) {
    queue->assertCurrent();
  }
}

std::shared_ptr<OstrelReportingServiceDelegate> OstrelReportingServiceDelegate::init(
    const OstrelReportingPlatform& platform) {
  registerLogScope(logScope);
  auto root = std::make_shared<OstrelReportingServiceDelegate>(Passkey{}, platform);
  serverQueueProperty().set(platform.workQueues->makeSerialQueue(
      "com.orbisk.ostrel.reporting.server", QualityOfService::kUserInteractive,
      /*relativePriority=*/0));
  servingQueue.store(serverQueue().get(), std::memory_order_release);
  root->listenForDefaultsNotification();
  root->driverUtility_ = OstrelReportingDriverUtility::init(platform);
  return root;
}

OstrelReportingServiceDelegate::OstrelReportingServiceDelegate(
    Passkey, const OstrelReportingPlatform& platform)
    : platform_(platform) {}

std::string OstrelReportingServiceDelegate::description() const {
  return "<OstrelReportingServiceDelegate>";
}

bool OstrelReportingServiceDelegate::listenerShouldAcceptNewConnection(
    IPCListener& /*listener*/, const std::shared_ptr<IPCConnection>& newConnection) {
  const ProcessID pid = newConnection->processIdentifier();
  OSTREL_LOG_DEFAULT(logScope, "newConnection: %@", *newConnection);
  newConnection->setExportedObject(OstrelReportingServerInstance::initWithMasterAndID(
      shared_from_this(), pid, /*outError=*/nullptr));
  const std::weak_ptr<OstrelReportingServerInstance> weak =
      std::static_pointer_cast<OstrelReportingServerInstance>(
          newConnection->exportedObject());
  serverQueue()->async([self = shared_from_this(), weak, pid] {
    assertOnServerQueue();
    self->registerClientStep(weak.lock(), pid);
  });
  newConnection->setInterruptionHandler([weak] { connectionInterrupted(weak); });
  newConnection->setInvalidationHandler(
      [&platform = platform_, weak, pid] { connectionInvalidated(platform, weak, pid); });
  newConnection->resume();
  return true;
}

void OstrelReportingServiceDelegate::registerClientStep(
    const std::shared_ptr<OstrelReportingServerInstance>& client, ProcessID pid) {
  if (!client) return;  // Its connection ended before this step ran.
  clients_.push_back(client);
  client->registration_ = ++registrations_;
  for (const auto& [reporterID, session] : client->clientReportingSessionMap_) {
    indexSession(*session, *client);
  }
  client->clientStartDate_.set(platform_.clock->now());
  client->clientProcessName_.set(processName(pid));
}

std::optional<std::string> OstrelReportingServiceDelegate::processName(
    ProcessID pid) const {
  if (pid == platform_.processInfo->processIdentifier()) {
    return platform_.processInfo->processName();
  }
  if (pid >= 1) return platform_.processInfo->commandName(pid);
  return std::nullopt;
}

void OstrelReportingServiceDelegate::removeClientStep(
    OstrelReportingServerInstance& client) {
  const auto found =
      std::find_if(clients_.begin(), clients_.end(),
                   [&](const auto& registered) { return registered.get() == &client; });
  if (found == clients_.end()) return;
  for (const auto& [reporterID, session] : client.clientReportingSessionMap_) {
    sessionIndex_.remove(reporterID, client);
  }
  client.registration_ = 0;
  clients_.erase(found);
  OSTREL_LOG_DEFAULT(logScope, "removing %i from the server client list",
                     client.clientID());
}

void OstrelReportingServiceDelegate::indexSession(OstrelReportingSession& session,
                                                  OstrelReportingServerInstance& client) {
  if (client.registration_ == 0) return;
  sessionIndex_.enter(session.reporterID(), {client.registration_, &client, &session});
}

std::shared_ptr<OstrelReportingSession>
OstrelReportingServiceDelegate::findReportingSessionForID(ReporterID reporterID) const {
  OstrelReportingSession* const session = borrowReportingSessionForID(reporterID);
  return session != nullptr ? session->shared_from_this() : nullptr;
}

OstrelReportingSession* OstrelReportingServiceDelegate::borrowReportingSessionForID(
    ReporterID reporterID) const {
  if (reporterID == kNoReporter || !reportingEnabled()) return nullptr;
  OstrelReportingSession* const session = sessionIndex_.find(reporterID);
  if (session == nullptr) {
    OSTREL_LOG_ERROR(logScope, "failed to find reporting session %lli", reporterID);
    return nullptr;
  }
  OSTREL_LOG_INFO(logScope, "found reporting session %lli for client %i", reporterID,
                  sessionIndex_.clientOf(reporterID)->clientID());
  return session;
}

void OstrelReportingServiceDelegate::listenForDefaultsNotification() {
  const std::weak_ptr<OstrelReportingServiceDelegate> weak = weak_from_this();
  const ChangeNotification::Registration registration =
      platform_.notifications->registerDispatch(kDefaultsNotification, serverQueue(),
                                                [weak](int token) {
                                                  assertOnServerQueue();
                                                  if (const auto self = weak.lock())
                                                    self->defaultsChangedStep(token);
                                                });
  defaultsNotifyToken = registration.token;
  OSTREL_LOG_DEFAULT(logScope, "notify setup result %i", registration.status);
}

Dictionary OstrelReportingServiceDelegate::OstrelReportingDefaults() const {
  const auto suite = platform_.userDefaults->openSuite(kDefaultsSuite);
  DictionaryBuilder defaults;
  if (suite->objectForKey(kDeviceNameKey)) {
    if (const auto name = suite->stringForKey(kDeviceNameKey)) {
      defaults.set(kDeviceNameKey, *name);
    }
  }
  if (suite->objectForKey(kDisableReportingKey)) {
    defaults.set(kDisableReportingKey, suite->boolForKey(kDisableReportingKey));
  } else {
    defaults.set(kDisableReportingKey, 0);
  }
  return defaults.build();
}

void OstrelReportingServiceDelegate::defaultsChangedStep(int token) {
  if (token != defaultsNotifyToken) return;
  OSTREL_LOG_DEFAULT(logScope, "re-reading ostrel defaults");
  const Dictionary defaults = OstrelReportingDefaults();
  defaults_.set(defaults);
  OSTREL_LOG_INFO(logScope, "defaults %@", defaults);
  for (const auto& client : clients_) {
    for (const auto& session : client->sessionsInOrder()) {
      session->updateDefaults(defaults);
    }
  }
  if (const auto disabled = defaults.find(kDisableReportingKey)) {
    reportingEnabled_.store(disabled->number().value_or(0) == 0,
                            std::memory_order_release);
  }
}

std::shared_ptr<OstrelReportingServerInstance>
OstrelReportingServerInstance::initWithMasterAndID(
    std::shared_ptr<OstrelReportingServiceDelegate> master, ProcessID clientID,
    std::optional<ErrorObject>* /*outError*/) {
  OSTREL_LOG_DEFAULT(logScope, "%@, %lu", *master, clientID);
  return std::make_shared<OstrelReportingServerInstance>(Passkey{}, std::move(master),
                                                         clientID);
}

OstrelReportingServerInstance::OstrelReportingServerInstance(
    Passkey, std::shared_ptr<OstrelReportingServiceDelegate> master, ProcessID clientID)
    : master_(std::move(master)), clientID_(clientID) {}

void OstrelReportingServerInstance::handleConnectionError() {
  serverQueue()->async([self = shared_from_this()] {
    assertOnServerQueue();
    self->master_->removeClientStep(*self);
  });
}

std::shared_ptr<OstrelReportingSession> OstrelReportingServerInstance::ownSession(
    ReporterID reporterID) const {
  const auto found = clientReportingSessionMap_.find(reporterID);
  return found != clientReportingSessionMap_.end() ? found->second : nullptr;
}

// To find and sort 40,000 sessions takes 10 ms, which every other client waits for.
const std::vector<OstrelReportingServerInstance::Entry>&
OstrelReportingServerInstance::entriesInOrder() const {
  const auto isBefore = [](const Entry& a, const Entry& b) {
    return a.reporterID < b.reporterID;
  };
  if (!std::exchange(isOrderKnown_, true)) {
    latestEntries_.clear();
    for (const auto& [reporterID, session] : clientReportingSessionMap_) {
      latestEntries_.push_back({reporterID, &session});
    }
    entriesInOrder_.clear();
  }
  if (latestEntries_.empty()) return entriesInOrder_;
  std::sort(latestEntries_.begin(), latestEntries_.end(), isBefore);
  const auto middle = static_cast<std::ptrdiff_t>(entriesInOrder_.size());
  entriesInOrder_.insert(entriesInOrder_.end(), latestEntries_.begin(),
                         latestEntries_.end());
  std::inplace_merge(entriesInOrder_.begin(), entriesInOrder_.begin() + middle,
                     entriesInOrder_.end(), isBefore);
  latestEntries_ = {};
  return entriesInOrder_;
}

std::vector<std::shared_ptr<OstrelReportingSession>>
OstrelReportingServerInstance::sessionsInOrder() const {
  std::vector<std::shared_ptr<OstrelReportingSession>> sessions;
  const std::vector<Entry>& entries = entriesInOrder();
  sessions.reserve(entries.size());
  for (const Entry& entry : entries) sessions.push_back(*entry.session);
  return sessions;
}

void OstrelReportingServerInstance::createReportingSession(ReporterID reporterID,
                                                           BoolReply reply) {
  OSTREL_LOG_DEBUG(logScope, "creating session for reporter %lli", reporterID);
  serverQueue()->async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    assertOnServerQueue();
    self->createStep(reporterID, reply);
  });
}

void OstrelReportingServerInstance::createStep(ReporterID reporterID,
                                               const BoolReply& reply) {
  master_->platform_.kernelTrace->trace(TraceCode::kCreate);
  const auto [place, isNew] = clientReportingSessionMap_.try_emplace(reporterID);
  auto& session = place->second;
  if (isNew && isOrderKnown_) latestEntries_.push_back({reporterID, &session});
  session = OstrelReportingSession::initWithID(
      reporterID, /*processIdentifiers=*/{clientID_}, master_->platform_);
  master_->indexSession(*session, *this);
  OSTREL_LOG_DEFAULT(logScope, "session created for reporter %lli", reporterID);
  call(reply, true);
}

void OstrelReportingServerInstance::setServiceType(ServiceType serviceType,
                                                   ReporterID reportingSession,
                                                   BoolReply reply) {
  OSTREL_LOG_DEBUG(logScope, "setting service type %i for reporter %lli", serviceType,
                   reportingSession);
  serverQueue()->async([self = shared_from_this(), serviceType, reportingSession,
                        reply = std::move(reply)] {
    assertOnServerQueue();
    self->setServiceTypeStep(serviceType, reportingSession, reply);
  });
}

// Kept: ID 0 gets no reply here, nor from start, stop and destroy.
// [KeepsSilenceForReporterZeroOnStartStopDestroySetType]
void OstrelReportingServerInstance::setServiceTypeStep(ServiceType serviceType,
                                                       ReporterID reporterID,
                                                       const BoolReply& reply) {
  if (reporterID == kNoReporter) return;
  if (const auto session = ownSession(reporterID)) {
    session->setServiceType(serviceType);
    OSTREL_LOG_DEFAULT(logScope, "service type %i set for reporter  %lli", serviceType,
                       reporterID);
  }
  call(reply, true);
}

// Kept: some texts are misspelt, here and elsewhere. [KeepsMisspeltLogTexts]
void OstrelReportingServerInstance::getServiceNameForReporterID(ReporterID reporterID,
                                                                ServiceTypeReply reply) {
  OSTREL_LOG_DEBUG(logScope, "fetching seviceType");
  serverQueue()->async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    assertOnServerQueue();
    self->getServiceNameStep(reporterID, reply);
  });
}

void OstrelReportingServerInstance::getServiceNameStep(ReporterID reporterID,
                                                       const ServiceTypeReply& reply) {
  // Kept: ID 0 is answered here and again below. [KeepsDoubleReplyForReporterZero]
  if (reporterID == kNoReporter) call(reply, kServiceTypeUnknown);
  const auto session = master_->findReportingSessionForID(reporterID);
  const ServiceType serviceType = session ? session->serviceType() : kServiceTypeUnknown;
  call(reply, serviceType);
  OSTREL_LOG_DEFAULT(logScope, "returnning service type %i for reporter  %lli",
                     serviceType, reporterID);
}

void OstrelReportingServerInstance::setConfiguration(
    std::optional<Dictionary> configuration, ReporterID reporterID, BoolReply reply) {
  OSTREL_LOG_DEBUG(logScope, "setting configuration");
  serverQueue()->async([self = shared_from_this(),
                        configuration = std::move(configuration), reporterID,
                        reply = std::move(reply)] {
    assertOnServerQueue();
    self->setConfigurationStep(configuration, reporterID, reply);
  });
}

void OstrelReportingServerInstance::setConfigurationStep(
    const std::optional<Dictionary>& configuration, ReporterID reporterID,
    const BoolReply& reply) {
  if (const auto session = master_->findReportingSessionForID(reporterID)) {
    session->setConfiguration(configuration);
  }
  call(reply, true);
}

void OstrelReportingServerInstance::startReportingSessionForID(ReporterID reporterID,
                                                               BoolReply reply) {
  OSTREL_LOG_DEBUG(logScope, "starting session for reporter %lli", reporterID);
  serverQueue()->async(
      [self = shared_from_this(), reporterID, reply = std::move(reply)]() mutable {
        assertOnServerQueue();
        self->startStep(reporterID, std::move(reply));
      });
}

void OstrelReportingServerInstance::startStep(ReporterID reporterID, BoolReply reply) {
  const OstrelReportingPlatform& platform = master_->platform_;
  platform.kernelTrace->trace(TraceCode::kStart);
  if (reporterID == kNoReporter) return;
  const auto session = master_->findReportingSessionForID(reporterID);
  if (!session) {
    call(reply, false);
    return;
  }
  // Kept: starting what is started is not answered.
  // [KeepsSilenceOnStartOfAStartedSession]
  if (session->started()) return;
  session->start();
  session->setDriverSnapShot(master_->driverUtility_->getSnapShot());
  session->setTransactionCompleteBlock(std::move(reply));
}

void OstrelReportingServerInstance::sendMessage(Dictionary message,
                                                MessageCategory category,
                                                MessageType type,
                                                std::optional<ReporterIDs> reportingIDs,
                                                ErrorReply reply) {
  OSTREL_LOG_DEBUG(logScope, "sending message for reporter %@", reportingIDs);
  WorkQueue& queue = *servingQueue.load(std::memory_order_acquire);
  // The thread that read the message mostly runs the queue too: a step in it, only to be
  // taken out again at once, takes 50 ns a message.
  if (queue.tryEnter()) {
    assertOnServerQueue();
    fetchAhead();
    sendMessageStep(std::move(message), category, type, reportingIDs, reply);
    queue.leave();
    return;
  }
  queue.async([self = shared_from_this(), message = std::move(message), category, type,
               reportingIDs = std::move(reportingIDs),
               reply = std::move(reply)]() mutable {
    assertOnServerQueue();
    self->sendMessageStep(std::move(message), category, type, reportingIDs, reply);
  });
}

void OstrelReportingServerInstance::expectMessage(ReporterID reporterID) {
  expected_ = {expected_[1], expected_[2], reporterID};
}

// Of many sessions each is far away in memory: its place in the index, the session and
// its queue one after the other, each of them found through the one before. Each message
// asks for one of these for three others (150 ns a message with 100,000 sessions).
void OstrelReportingServerInstance::fetchAhead() {
  const auto [next, second, third] = expected_;
  const OstrelReportingSessionIndex& index = master_->sessionIndex_;
  if (next != kNoReporter) {
    if (const auto* const session = index.find(next)) session->fetchQueueAhead();
  }
  if (second != kNoReporter) {
    if (const auto* const session = index.find(second)) session->fetchSelfAhead();
  }
  if (third != kNoReporter) index.fetchAhead(third);
}

void OstrelReportingServerInstance::sendMessageStep(
    Dictionary message, MessageCategory category, MessageType type,
    const std::optional<ReporterIDs>& reportingIDs, const ErrorReply& reply) {
  master_->platform_.kernelTrace->trace(TraceCode::kSend);
  if (!master_->reportingEnabled()) {
    call(reply, ErrorObject{std::string(kOstrelErrorDomain), /*code=*/1,
                            "reporting is switched off"});
    return;
  }
  if (!reportingIDs) {
    sendToActiveSessions(message, category, type);
  } else {
    const auto shared = payloadFor(reportingIDs->size());
    for (const ReporterID reporterID : *reportingIDs) {
      if (reporterID == kNoReporter) continue;
      if (auto* const session = master_->borrowReportingSessionForID(reporterID)) {
        // Others that hold the message would share its count with the session's thread.
        const bool isLast = &reporterID + 1 == reportingIDs->end();
        session->sendMessage(isLast ? std::move(message) : message, category, type,
                             /*sync=*/false, /*reply=*/nullptr, shared);
      }
    }
  }
  call(reply, std::optional<ErrorObject>());
}

void OstrelReportingServerInstance::sendToActiveSessions(const Dictionary& message,
                                                         MessageCategory category,
                                                         MessageType type) {
  std::vector<std::shared_ptr<OstrelReportingSession>> active;
  for (const auto& client : master_->clients()) {
    const auto sessions = client->sessionsInOrder();
    OSTREL_LOG_DEFAULT(logScope, "sessions for client %i : %@", client->clientID(),
                       sessions);
    std::copy_if(sessions.begin(), sessions.end(), std::back_inserter(active),
                 [](const auto& session) { return session->started(); });
  }
  OSTREL_LOG_DEFAULT(logScope, "active reporting sessions %lu : %@", active.size(),
                     active);
  const auto shared = payloadFor(active.size());
  for (const auto& session : active) {
    session->sendMessage(message, category, type, /*sync=*/false, /*reply=*/nullptr,
                         shared);
  }
  if (!active.empty()) return;
  OSTREL_LOG_DEFAULT(logScope,
                     "no active reporting sessions found, sending as standalone");
  OstrelReportingSession::sendSingleMessage(master_->platform_, message, category, type,
                                            kServiceTypeStandalone, master_->defaults(),
                                            /*reply=*/nullptr);
}

void OstrelReportingServerInstance::stopReportingSessionForID(ReporterID reporterID,
                                                              BoolReply reply) {
  OSTREL_LOG_DEBUG(logScope, "stopping session for reporter %lli", reporterID);
  serverQueue()->async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    assertOnServerQueue();
    self->stopStep(reporterID, reply);
  });
}

// The statistics are handed to the session before it is stopped, so that they
// travel in the same session.
void OstrelReportingServerInstance::stopStep(ReporterID reporterID,
                                             const BoolReply& reply) {
  master_->platform_.kernelTrace->trace(TraceCode::kStop);
  if (reporterID == kNoReporter) return;
  const auto session = master_->findReportingSessionForID(reporterID);
  const auto statistics = master_->driverUtility_->getDriverStatisticsRelativeToSnapShot(
      session ? session->driverSnapShot() : nullptr);
  if (statistics) {
    if (session) {
      session->sendMessage(*statistics, kDriverStatisticsCategory, kDriverStatisticsType,
                           /*reply=*/nullptr);
    }
    OSTREL_LOG_DEFAULT(logScope, "fetching driver logs %@", *statistics);
  } else {
    OSTREL_LOG_DEFAULT(logScope, "nothing interesting to fetch from the drivers");
  }
  if (session) {
    session->setDriverSnapShot(nullptr);
    session->stop();
  }
  OSTREL_LOG_DEFAULT(logScope, "stopping %lli", reporterID);
  call(reply, true);
}

void OstrelReportingServerInstance::destroyReportingSession(ReporterID reporterID,
                                                            BoolReply reply) {
  OSTREL_LOG_DEBUG(logScope, "destroying session for reporter %lli", reporterID);
  serverQueue()->async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    assertOnServerQueue();
    self->destroyStep(reporterID, reply);
  });
}

void OstrelReportingServerInstance::destroyStep(ReporterID reporterID,
                                                const BoolReply& reply) {
  master_->platform_.kernelTrace->trace(TraceCode::kDestroy);
  if (reporterID == kNoReporter) return;
  if (const auto session = ownSession(reporterID)) {
    if (session->started()) session->stop();
    master_->sessionIndex_.remove(reporterID, *this);
    isOrderKnown_ = false;
    entriesInOrder_ = {};
    latestEntries_ = {};
    clientReportingSessionMap_.erase(reporterID);
  }
  OSTREL_LOG_DEFAULT(logScope, "destroying %lli", reporterID);
  call(reply, true);
}

void OstrelReportingServerInstance::reporterIDValid(ReporterID reporterID,
                                                    DictionaryReply reply) {
  OSTREL_LOG_DEBUG(logScope, "validating reporter %lli", reporterID);
  serverQueue()->async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    assertOnServerQueue();
    self->validateStep(reporterID, reply);
  });
}

void OstrelReportingServerInstance::validateStep(ReporterID reporterID,
                                                 const DictionaryReply& reply) {
  DictionaryBuilder answer;
  answer.set("reporterID", static_cast<std::int64_t>(kNoReporter));
  answer.set("serviceType", static_cast<std::uint16_t>(kServiceTypeUnknown));
  if (const auto session = master_->findReportingSessionForID(reporterID)) {
    answer.set("reporterID", static_cast<std::int64_t>(reporterID));
    answer.set("serviceType", static_cast<std::uint16_t>(session->serviceType()));
  }
  OSTREL_LOG_DEFAULT(logScope, "validating reporter %lli", reporterID);
  call(reply, answer.build());
}

void OstrelReportingServerInstance::getAllReporters(ReporterIDsReply reply) {
  serverQueue()->async([self = shared_from_this(), reply = std::move(reply)] {
    assertOnServerQueue();
    self->getAllReportersStep(reply);
  });
}

void OstrelReportingServerInstance::getAllReportersStep(const ReporterIDsReply& reply) {
  ReporterIDs reporters;
  for (const auto& client : master_->clients()) {
    for (const auto& entry : client->entriesInOrder()) {
      reporters.push_back(entry.reporterID);
    }
  }
  call(reply, reporters);
}

void OstrelReportingServerInstance::killService(BoolReply /*reply*/) {
  OSTREL_LOG_DEFAULT(logScope, "DESTROYING SERVICE");
  master_->platform_.processInfo->endProcess(kKilledExitStatus);
}

}  // namespace ostrel
