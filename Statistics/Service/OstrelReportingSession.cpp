// A session is its queue: start, stop, changes of type, merges of defaults and
// deliveries are steps on it and follow one another in the order of the calls.
// What a message meets is decided by the state when its step runs, not when its
// client called.
//
// Starting waits for the telemetry backend. The wait suspends the queue and
// holds no thread, so that thousands of sessions may wait at once; the rest of
// the start then runs before everything that was queued meanwhile. The backend
// answers on its own thread and sets `started` under the condition's lock.
//
// A stopped session has no aggregation list. Orientation callbacks that come
// late append to the list they still find, or to none.
#include "Statistics/Service/OstrelReportingSession.h"

#include <chrono>
#include <mutex>
#include <utility>

#include "Statistics/OstrelReportingTallyraBridge.h"
#include "Statistics/OstrelReportingUtility.h"
#include "Statistics/OstrelReportingWattlogUtility.h"
#include "Statistics/Service/OstrelReportingPayloadSurvey.h"
#include "Statistics/Service/OstrelReportingSessionSummary.h"
#include "platform/AnalyticsSink.h"
#include "platform/Clock.h"
#include "platform/DeviceInfo.h"
#include "platform/FileSystem.h"
#include "platform/JSONSerialization.h"
#include "platform/KernelTrace.h"
#include "platform/Logging.h"
#include "platform/Random.h"

namespace ostrel {
namespace {

LogScope logScope("osrr", "reporting_rtc_verbose");

constexpr MessageCategory kSummaryCategory{0xFFFFFFFF};
constexpr MessageType kSummaryType{0xFFFF};
constexpr int kClientType = 19;
constexpr double kClientVersion = 1.0;
constexpr std::string_view kClientName = "com.orbisk.ostrel";
constexpr std::int64_t kNoSessionID = -1;
constexpr std::uint32_t kAlarmSpreadSeconds = 60;
constexpr std::int32_t kDeviceClassWithoutOrientation = 6;
constexpr std::string_view kHostApplicationKey = "HostApplicationDisplayID";
constexpr std::uint32_t kLogDirectoryPermissions = 0777;

// Kept: the backend gets the low half of the category, log lines get all of it.
// [KeepsFullCategoryInLogAndLow16BitsOnTheWire]
std::uint16_t categoryOnTheWire(MessageCategory category) {
  return static_cast<std::uint16_t>(static_cast<std::uint32_t>(category) & 0xFFFF);
}

void call(const ErrorReply& reply, const std::optional<ErrorObject>& error) {
  if (reply) reply(error);
}

void sendSingleMessageStep(const OstrelReportingPlatform& platform,
                           const Dictionary& message, MessageCategory category,
                           MessageType type, ServiceType serviceType,
                           const ErrorReply& reply) {
  platform.kernelTrace->trace(TraceCode::kMessageDelivery);
  OSTREL_LOG_DEBUG(logScope, "sending single message");
  const Dictionary sessionInfo{{kTelvarSessionInfoClientType, kClientType},
                               {kTelvarSessionInfoClientVersion, kClientVersion},
                               {kTelvarSessionInfoSessionID, kNoSessionID}};
  const Dictionary userInfo{{kTelvarUserInfoClientName, kClientName},
                            {kTelvarUserInfoServiceName, ServiceTypeName(serviceType)}};
  const Success sent = platform.telemetryBackend->sendOneMessage(
      sessionInfo, userInfo, categoryOnTheWire(category),
      static_cast<std::uint16_t>(type), SanitisedPayload(message));
  if (sent.succeeded) {
    OSTREL_LOG_DEBUG(logScope, "message %@ : category %i : type %i", message, category,
                     type);
  } else if (sent.error) {
    OSTREL_LOG_ERROR(logScope, "sendOneMessageWithSessionInfo %@",
                     sent.error->description);
  }
  call(reply, sent.error);
}

}  // namespace

std::shared_ptr<OstrelReportingSession> OstrelReportingSession::initWithID(
    ReporterID reporterID, std::vector<ProcessID> processIdentifiers,
    const OstrelReportingPlatform& platform) {
  static std::once_flag registered;
  std::call_once(registered, [] { registerLogScope(logScope); });
  auto session = std::make_shared<OstrelReportingSession>(
      Passkey{}, reporterID, std::move(processIdentifiers), platform);
  OSTREL_LOG_INFO(logScope, "created reporting session for ID: %lli", reporterID);
  platform.kernelTrace->trace(TraceCode::kSessionCreated);
  return session;
}

OstrelReportingSession::OstrelReportingSession(Passkey, ReporterID reporterID,
                                               std::vector<ProcessID> processIdentifiers,
                                               const OstrelReportingPlatform& platform)
    : platform_(platform),
      reporterID_(reporterID),
      sessionReportingQueue_(platform.workQueues->makeSerialQueue(
          "com.orbisk.ostrel.reporting.session", QualityOfService::kUtility,
          /*relativePriority=*/0)),
      processIdentifiers_(std::move(processIdentifiers)) {
  sessionReportingQueue_->setSubject(*this);
}

OstrelReportingSession::~OstrelReportingSession() {
  platform_.kernelTrace->trace(TraceCode::kSessionTeardown);
  OSTREL_LOG_INFO(logScope, "deallocing this session %lli", reporterID_);
}

// Kept: the step compares with the type at the time of the call, not with the
// one that it finds. [KeepsComparisonWithTheTypeAtTheCall]
void OstrelReportingSession::setServiceType(ServiceType serviceType) {
  sessionReportingQueue_->async(
      [self = shared_from_this(), serviceType, before = this->serviceType()] {
        self->sessionReportingQueue_->assertCurrent();
        self->setServiceTypeStep(serviceType, before);
      });
}

void OstrelReportingSession::setServiceTypeStep(ServiceType serviceType,
                                                ServiceType before) {
  if (!started()) {
    applyServiceType(serviceType);
  } else if (before != serviceType) {
    stopSync(/*sync=*/true);
    applyServiceType(serviceType);
    startSync(/*sync=*/true);
  }
}

void OstrelReportingSession::applyServiceType(ServiceType serviceType) {
  serviceType_.store(serviceType, std::memory_order_release);
  OSTREL_LOG_INFO(logScope, "setting service type %@", ServiceTypeName(serviceType));
}

void OstrelReportingSession::setConfiguration(
    const std::optional<Dictionary>& configuration) {
  if (configuration) mutableUserInfo()->merge(*configuration);
}

void OstrelReportingSession::updateDefaults(std::optional<Dictionary> defaults) {
  sessionReportingQueue_->async(
      [self = shared_from_this(), defaults = std::move(defaults)] {
        self->sessionReportingQueue_->assertCurrent();
        self->updateDefaultsStep(defaults);
      });
}

// Kept: a default that is gone from the store stays in the user info.
// [KeepsDefaultsMergeNeverRemoving]
void OstrelReportingSession::updateDefaultsStep(
    const std::optional<Dictionary>& defaults) {
  if (defaults) mutableUserInfo()->merge(*defaults);
}

void OstrelReportingSession::startSync(bool sync) {
  OSTREL_LOG_DEBUG(logScope, "starting session owned by %lli", reporterID_);
  if (sync) {
    sessionReportingQueue_->assertCurrent();
    startStep();
    return;
  }
  sessionReportingQueue_->async([self = shared_from_this()] {
    self->sessionReportingQueue_->assertCurrent();
    self->startStep();
  });
}

void OstrelReportingSession::startStep() {
  if (started()) {
    OSTREL_LOG_INFO(logScope, "%lli is already started", reporterID_);
    return;
  }
  setOrientationCallbackID(format("OstrelReportingService %lli", reporterID_));
  setStartDate(platform_.clock->now());
  setAggregatedPayloadData(makeList());
  platform_.kernelTrace->trace(TraceCode::kSessionStart);
  if (serviceType() == kServiceTypeTest) {
    setStarted(/*started=*/true);
    return;
  }
  const HierarchyToken token =
      platform_.telemetryBackend->makeHierarchyToken(/*parent=*/std::nullopt);
  set(&Details::reportingAgentToken, std::optional<HierarchyToken>(token));
  set(&Details::reportingSession, makeReportingSession(token));
  findBackends();
}

std::shared_ptr<TelemetrySession> OstrelReportingSession::makeReportingSession(
    const HierarchyToken& token) const {
  const Dictionary sessionInfo{
      {kTelvarSessionInfoClientType, kClientType},
      {kTelvarSessionInfoClientVersion, kClientVersion},
      {kTelvarSessionInfoSessionID, static_cast<std::int64_t>(reporterID_)},
      {kTelvarSessionInfoBatchEvent, true},
      {kTelvarSessionInfoHierarchyToken, token}};
  DictionaryBuilder userInfo;
  userInfo.set(kTelvarUserInfoClientName, kClientName);
  userInfo.set(kTelvarUserInfoServiceName, serviceName() + "_session");
  userInfo.merge(this->userInfo());
  return platform_.telemetryBackend->createSession(sessionInfo, userInfo.build(),
                                                   /*frameworksToCheck=*/{});
}

void OstrelReportingSession::findBackends() {
  const std::shared_ptr<OstrelReportingSession> self = shared_from_this();
  const std::shared_ptr<Condition> condition = platform_.conditions->makeCondition();
  reportingSession()->startConfiguration(
      [self, condition](std::optional<Array> backends) {
        self->backendCallback(backends, *condition);
      });
  OstrelReportingUtilityWait(std::make_shared<const BackendWait>(BackendWait{
      logScope, *sessionReportingQueue_, condition, [self] { return self->started(); },
      [self](bool foundBackends) {
        self->sessionReportingQueue_->assertCurrent();
        self->finishStartStep(foundBackends);
      }}));
}

void OstrelReportingSession::backendCallback(const std::optional<Array>& backends,
                                             Condition& condition) {
  if (!backends) {
    OSTREL_LOG_ERROR(logScope,
                     "No backends found, this session won't get sent to the server");
    return;
  }
  OSTREL_LOG_DEFAULT(logScope, "List of backends %@", *backends);
  condition.lock();
  setStarted(/*started=*/true);
  condition.signal();
  condition.unlock();
}

void OstrelReportingSession::finishStartStep(bool foundBackends) {
  if (!foundBackends) {
    set(&Details::reportingSession, std::shared_ptr<TelemetrySession>());
    setStarted(/*started=*/true);
  }
  if (shouldReportOrientation()) registerOrientationObservers();
}

void OstrelReportingSession::stopSync(bool sync) {
  OSTREL_LOG_DEBUG(logScope, "ending session %lli", reporterID_);
  if (sync) {
    sessionReportingQueue_->assertCurrent();
    stopStep();
    return;
  }
  sessionReportingQueue_->async([self = shared_from_this()] {
    self->sessionReportingQueue_->assertCurrent();
    self->stopStep();
  });
}

void OstrelReportingSession::stopStep() {
  if (shouldReportOrientation()) {
    const std::string id = orientationCallbackID().value_or("");
    platform_.orientationService->unregisterDeviceOrientationObserver(id);
    platform_.orientationService->unregisterInterfaceOrientationObserver(id);
  }
  if (!started()) return;
  // Kept: a stop says so twice, when it is asked for and when it begins.
  // [KeepsDoubledLineOfAStop]
  OSTREL_LOG_DEBUG(logScope, "ending session %lli", reporterID_);
  platform_.kernelTrace->trace(TraceCode::kSessionStop);
  if (auto summary = createSummaryEventForSession()) {
    OSTREL_LOG_DEFAULT(logScope, "sending summary event for reporter %lli", reporterID_);
    sendMessage(*std::move(summary), kSummaryCategory, kSummaryType, /*sync=*/true,
                /*reply=*/nullptr);
  }
  if (serviceType() != kServiceTypeTest) flushStep();
  if (const auto list = aggregatedPayloadData()) {
    const auto locked = list->lock();
    setAggregatedPayloadData(nullptr);
  }
  setStarted(/*started=*/false);
  // Kept: a start is answered here, at each stop, and nowhere else.
  // [KeepsStartReplyAtEveryStop]
  if (const BoolReply complete = transactionCompleteBlock()) complete(true);
}

// The flush is issued before the handle is released.
void OstrelReportingSession::flushStep() {
  if (const auto session = reportingSession()) {
    session->flush([](const std::optional<ErrorObject>& error) {
      if (error) OSTREL_LOG_ERROR(logScope, "flush error %@", error->description);
    });
  }
  set(&Details::reportingSession, std::shared_ptr<TelemetrySession>());
}

void OstrelReportingSession::sendMessage(
    Dictionary message, MessageCategory category, MessageType type, bool sync,
    ErrorReply reply, std::shared_ptr<OstrelReportingSharedPayload> shared) {
  OSTREL_LOG_DEBUG(logScope, "sending message for session owned by %lli", reporterID_);
  if (sync) {
    sessionReportingQueue_->assertCurrent();
    deliverStep(message, category, type, reply, shared.get());
    return;
  }
  if (shared != nullptr) {
    sessionReportingQueue_->async([self = shared_from_this(),
                                   message = std::move(message), category, type,
                                   reply = std::move(reply), shared = std::move(shared)] {
      self->sessionReportingQueue_->assertCurrent();
      self->deliverStep(message, category, type, reply, shared.get());
    });
    return;
  }
  // Most messages go to one session: theirs is the smaller step.
  sessionReportingQueue_->async([self = shared_from_this(), message = std::move(message),
                                 category, type, reply = std::move(reply)] {
    self->sessionReportingQueue_->assertCurrent();
    self->deliverStep(message, category, type, reply, /*shared=*/nullptr);
  });
}

// One walk over the payload for all that the delivery's parts ask of that.
void OstrelReportingSession::deliverStep(const Dictionary& message,
                                         MessageCategory category, MessageType type,
                                         const ErrorReply& reply,
                                         OstrelReportingSharedPayload* shared) {
  const auto [details, list, configuredUserInfo] = propertiesOnQueue();
  const Dictionary userInfo =
      configuredUserInfo != nullptr ? configuredUserInfo->snapshot() : Dictionary();
  const PayloadSurvey survey(message);
  OstrelReportingTallyraBridge::handleEvent(platform_, &message, category, type,
                                            userInfo);
  if (survey.hasEngineOnTime()) {
    OstrelReportingWattlogUtility::handleEvent(platform_, &message, category, type,
                                               userInfo);
  }
  std::optional<Dictionary> sanitised;
  if (survey.hasBlankInKey()) {
    sanitised = shared != nullptr ? shared->of(message) : SanitisedPayload(message);
  }
  const Dictionary& payload = sanitised ? *sanitised : message;
  const MessageIdentifier identifier =
      details.messageTypeCounts.next(messageNames(category, type));
  // Kept: each entry is a dictionary of its own with the one identifier.
  // [KeepsOneElementEntriesOfMessages]
  if (list != nullptr) {
    list->lock()->append(identifier.text(), payload,
                         sanitised ? payload.value().bytes() : survey.bytes());
  }
  platform_.kernelTrace->trace(TraceCode::kMessageDelivery);
  if (started()) {
    sendToBackend(message, payload, category, type, reply, details);
    return;
  }
  OSTREL_LOG_DEBUG(logScope, "session not started, will send as a single message");
  sendSingleMessage(platform_, payload, category, type, serviceType(), userInfo, reply);
}

// What a delivery looks at.
void OstrelReportingSession::fetchAhead(int stage) const noexcept {
  if (stage == 0) {
    fetchToRead(this, sizeof *this);
    return;
  }
  const Details* const made = details_.get();
  if (made == nullptr) return;
  if (stage == 1) {
    fetchToWrite(made, Details::kBytesOfDelivery);
  } else {
    fetchToRead(made->reportingSession.get(), sizeof(TelemetrySession));
    fetchToWrite(made->aggregatedPayloadData.get(), sizeof(AggregatedPayloadData));
  }
}

OstrelReportingSession::PropertiesOnQueue OstrelReportingSession::propertiesOnQueue()
    const {
  Details* made = details_.get();
  if (made == nullptr) {
    const std::lock_guard lock(mutex_);
    made = &details();
  }
  const auto* const info = userInfo_.get();
  return {*made, made->aggregatedPayloadData.get(),
          info != nullptr ? info->get() : nullptr};
}

// Kept: the count belongs to the name; codes with equal names share it.
// [KeepsSharedCounterForEqualNames]
std::string OstrelReportingSession::messageIdForCategory(MessageCategory category,
                                                         MessageType type) {
  Details& details = propertiesOnQueue().details;
  return std::string(details.messageTypeCounts.next(messageNames(category, type)).text());
}

std::map<std::string, std::int64_t> OstrelReportingSession::messageTypeCounts() const {
  return propertiesOnQueue().details.messageTypeCounts.byName();
}

void OstrelReportingSession::sendToBackend(const Dictionary& message,
                                           const Dictionary& payload,
                                           MessageCategory category, MessageType type,
                                           const ErrorReply& reply,
                                           const Details& details) {
  if (serviceType() == kServiceTypeTest) {
    OSTREL_LOG_INFO(logScope, "transactions aren't allowed on this platform");
    call(reply, /*error=*/std::nullopt);
    return;
  }
  TelemetrySession* const session = details.reportingSession.get();
  if (session == nullptr) {
    const ErrorObject error{std::string(kGeneralErrorDomain), /*code=*/-1,
                            "No valid TelvarSession"};
    OSTREL_LOG_ERROR(logScope, "%@", error.description);
    call(reply, error);
    return;
  }
  const Success sent = session->sendMessage(categoryOnTheWire(category),
                                            static_cast<std::uint16_t>(type), payload);
  if (sent.succeeded) {
    OSTREL_LOG_DEBUG(logScope, "TelvarAgent %@ : message %@ : category %i : type %i",
                     *session, message, category, type);
  } else if (sent.error) {
    OSTREL_LOG_ERROR(logScope, "error sending message %@", sent.error->description);
  }
  call(reply, sent.error);
}

// Kept: what the caller gives as user info reaches nobody.
// [KeepsIgnoringUserInfoOfSingleMessages]
void OstrelReportingSession::sendSingleMessage(
    const OstrelReportingPlatform& platform, Dictionary message, MessageCategory category,
    MessageType type, ServiceType serviceType,
    const std::optional<Dictionary>& /*userInfo*/, ErrorReply reply) {
  const std::int64_t delay = serviceType == kServiceTypeAlarms
                                 ? platform.random->uniform(kAlarmSpreadSeconds)
                                 : 0;
  OSTREL_LOG_DEBUG(logScope, "sending single message after delta %lli for service %i",
                   delay, serviceType);
  // What waits for up to a minute keeps no more in memory than itself.
  if (delay != 0) message = message.compact();
  platform.workQueues->backgroundQueue().asyncAfter(
      std::chrono::seconds(delay), [&platform, message = std::move(message), category,
                                    type, serviceType, reply = std::move(reply)] {
        sendSingleMessageStep(platform, message, category, type, serviceType, reply);
      });
}

std::optional<Dictionary> OstrelReportingSession::createSummaryEventForSession() {
  const auto list = aggregatedPayloadData();
  if (!list || list->lock()->empty()) return std::nullopt;
  const auto delivered = list->lock()->snapshot();
  Dictionary summary = summaryEvent(serviceType(), delivered);
  // Kept: the user info goes in at the front on every build, at every call, and
  // after the summary is made. [KeepsUserInfoInsertedAtEverySummary]
  list->lock()->insertFront(mutableUserInfo());
  if (IsInternalBuild(platform_)) writeSessionLog(*list);
  return summary;
}

// Kept: one error slot serves all three calls, so that an earlier error is
// logged again as one of the write. [KeepsSecondLogOfAnEarlierErrorAsWriteError]
void OstrelReportingSession::writeSessionLog(const AggregatedPayloadData& list) {
  std::optional<ErrorObject> error;
  const auto entries = list.lock()->snapshot();
  Outcome<TextSource> json = platform_.json->prettyPrintedArray(
      [entries](const std::function<void(ValueView)>& element) {
        entries.forEach(element);
      });
  if (json.error) error = json.error;
  if (error) OSTREL_LOG_ERROR(logScope, "dataWithJSONObject: %@", error->description);

  const std::string directory =
      platform_.fileSystem->diagnosticLogDirectory() + "/Audio/Reporting";
  const Success created =
      platform_.fileSystem->createDirectory(directory, kLogDirectoryPermissions);
  if (!created.succeeded) {
    if (created.error) error = created.error;
    OSTREL_LOG_ERROR(logScope, "can't create logging directory at %@: %@", directory,
                     error);
  }

  const std::string name =
      sessionLogFileName(*platform_.clock, platform_.clock->now(),
                         userInfo().get(kHostApplicationKey), serviceType());
  const Success written =
      platform_.fileSystem->writeFileAtomically(directory, name, json.value);
  if (!written.succeeded && written.error) error = written.error;
  if (error) OSTREL_LOG_ERROR(logScope, "jsonOutput writeToURL: %@", error->description);
}

bool OstrelReportingSession::shouldReportOrientation() const {
  if (!orientationCallbackID()) return false;
  if (!IsInternalBuild(platform_)) return false;
  const ServiceType type = serviceType();
  if (type != kServiceTypeLongFormAudio && type != kServiceTypeTelephony) return false;
  return platform_.deviceInfo->deviceClass() != kDeviceClassWithoutOrientation;
}

// The callbacks hold the session until they are unregistered.
void OstrelReportingSession::registerOrientationObservers() {
  const std::shared_ptr<OstrelReportingSession> self = shared_from_this();
  const std::string id = orientationCallbackID().value_or("");
  platform_.orientationService->registerDeviceOrientationObserver(
      id, [self](OrientationService::OrientationCode code) {
        self->orientationChanged("device", code);
      });
  platform_.orientationService->registerInterfaceOrientationObserver(
      id, [self](OrientationService::OrientationCode code) {
        self->orientationChanged("ui", code);
      });
}

void OstrelReportingSession::orientationChanged(
    std::string_view mode, OrientationService::OrientationCode code) {
  const std::string name = platform_.orientationService->orientationName(code);
  const Date start = startDate().value_or(Date{});
  const double time = platform_.clock->now().secondsSince1970 - start.secondsSince1970;
  OSTREL_LOG_DEBUG(logScope,
                   "Orientation handler callback mode=%@ orientation=\"%@\" app=\"%@\", "
                   "time=%f, id=\"%@\"",
                   mode, name, userInfo().get(kHostApplicationKey), time,
                   orientationCallbackID());
  // Kept: name and time stand in one entry. [KeepsTwoElementEntriesOfOrientation]
  const std::string key = std::string(mode) + "_orientation";
  if (const auto list = aggregatedPayloadData()) {
    list->lock()->append(Dictionary{{key, name}, {key + "_time", time}});
  }
}

std::shared_ptr<AggregatedPayloadData> OstrelReportingSession::makeList() const {
  return std::make_shared<AggregatedPayloadData>(*platform_.entryStorage, reporterID_);
}

// A session that was never started has a list too.
OstrelReportingSession::Details& OstrelReportingSession::details() const {
  if (Details* const made = details_.get()) return *made;
  auto made = std::make_unique<Details>();
  made->aggregatedPayloadData = makeList();
  return details_.set(std::move(made));
}

std::shared_ptr<AggregatedPayloadData> OstrelReportingSession::aggregatedPayloadData()
    const {
  const std::lock_guard lock(mutex_);
  return details().aggregatedPayloadData;
}

std::shared_ptr<MutableDictionary> OstrelReportingSession::mutableUserInfo() {
  const std::lock_guard lock(mutex_);
  if (const auto* const made = userInfo_.get()) return *made;
  return userInfo_.set(std::make_unique<std::shared_ptr<MutableDictionary>>(
      std::make_shared<MutableDictionary>()));
}

Dictionary OstrelReportingSession::userInfo() const {
  const auto* const made = userInfo_.get();
  return made != nullptr ? (*made)->snapshot() : Dictionary();
}

std::string OstrelReportingSession::serviceName() const {
  return std::string(ServiceTypeName(serviceType()));
}

std::string OstrelReportingSession::description() const {
  return format("<OstrelReportingSession: %lli>", reporterID_);
}

}  // namespace ostrel
