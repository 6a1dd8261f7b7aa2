#include "tests/model/ReferenceSession.h"

#include <algorithm>
#include <chrono>
#include <utility>

namespace ostrel::reference {
namespace {

constexpr ServiceType kTest{11};
constexpr ServiceType kAlarms{4};

/// Text keys with "_" for every blank; of keys that become equal the later wins.
Dictionary sanitised(const Dictionary& message) {
  DictionaryBuilder copy;
  for (const auto& [key, value] : message) {
    if (const auto text = key.string()) {
      std::string name(*text);
      std::replace(name.begin(), name.end(), ' ', '_');
      copy.set(name, Value(value));
    } else {
      copy.set(key, value);
    }
  }
  return copy.build();
}

Dictionary merged(const Dictionary& into, const Dictionary& from) {
  DictionaryBuilder all(into);
  all.merge(from);
  return all.build();
}

std::uint16_t low16(MessageCategory category) {
  return static_cast<std::uint16_t>(static_cast<std::uint32_t>(category) & 0xFFFF);
}

}  // namespace

Session::Session(Context& context, ReporterID reporterID)
    : id(reporterID), context_(context), queue_(context.queues.make()) {
  log(LogLevel::kInfo, "created reporting session for ID: %lli", id);
  context_.around.kernelTrace->trace(TraceCode::kSessionCreated);
}

Session::~Session() {
  context_.around.kernelTrace->trace(TraceCode::kSessionTeardown);
  log(LogLevel::kInfo, "deallocing this session %lli", id);
}

void Session::later(Step step) {
  context_.queues.add(queue_,
                      [self = shared_from_this(), step = std::move(step)] { step(); });
}

void Session::setServiceType(ServiceType type) {
  later([this, type, before = serviceType] { changeServiceType(type, before); });
}

void Session::changeServiceType(ServiceType type, ServiceType before) {
  const bool restarts = started;
  if (restarts && before == type) return;
  if (restarts) {
    announceStop();
    stopStep();
  }
  serviceType = type;
  log(LogLevel::kInfo, "setting service type %@", serviceTypeName(type));
  if (restarts) {
    announceStart();
    startStep();
  }
}

void Session::setConfiguration(const std::optional<Dictionary>& configuration) {
  if (configuration) userInfo_ = merged(userInfo_, *configuration);
}

void Session::updateDefaults(const std::optional<Dictionary>& defaults) {
  later([this, defaults] {
    if (defaults) userInfo_ = merged(userInfo_, *defaults);
  });
}

void Session::announceStart() const {
  log(LogLevel::kDebug, "starting session owned by %lli", id);
}

void Session::start() {
  announceStart();
  later([this] { startStep(); });
}

void Session::startStep() {
  if (started) {
    log(LogLevel::kInfo, "%lli is already started", id);
    return;
  }
  orientationCallbackID_ = format("OstrelReportingService %lli", id);
  startDate_ = context_.around.clock->now();
  aggregated_.emplace();
  context_.around.kernelTrace->trace(TraceCode::kSessionStart);
  if (serviceType == kTest) {
    started = true;
    return;
  }
  telemetrySession_ = makeTelemetrySession();
  const auto wait = std::make_shared<BackendWait>();
  context_.waits.push_back(wait);
  telemetrySession_->startConfiguration(
      [self = shared_from_this(), wait](const std::optional<Array>& backends) {
        self->backendCallback(backends, *wait);
      });
  waitForBackends(wait);
}

std::shared_ptr<TelemetrySession> Session::makeTelemetrySession() const {
  FakeTelemetryBackend& backend = *context_.around.telemetryBackend;
  const HierarchyToken token = backend.makeHierarchyToken(/*parent=*/std::nullopt);
  const Dictionary sessionInfo{{kTelvarSessionInfoClientType, 19},
                               {kTelvarSessionInfoClientVersion, 1.0},
                               {kTelvarSessionInfoSessionID, std::int64_t(id)},
                               {kTelvarSessionInfoBatchEvent, true},
                               {kTelvarSessionInfoHierarchyToken, token}};
  const Dictionary userInfo{
      {kTelvarUserInfoClientName, "com.orbisk.ostrel"},
      {kTelvarUserInfoServiceName, serviceTypeName(serviceType) + "_session"}};
  return backend.createSession(sessionInfo, merged(userInfo, userInfo_),
                               /*frameworksToCheck=*/{});
}

// May come at any time while the backend keeps it, and more than once.
void Session::backendCallback(const std::optional<Array>& backends, BackendWait& wait) {
  if (!backends) {
    log(LogLevel::kError, "No backends found, this session won't get sent to the server");
    return;
  }
  log(LogLevel::kDefault, "List of backends %@", *backends);
  started = true;
  wait.wake(*context_.around.clock, /*isTimeout=*/false);
}

// The start goes on in `endOfStart`; until then nothing of this session's queue runs.
void Session::waitForBackends(const std::shared_ptr<BackendWait>& wait) {
  if (started) {
    endOfStart();
    return;
  }
  log(LogLevel::kDefault, "%@", "waiting for telvard to find backends");
  context_.queues.hold(queue_);
  wait->begin(*context_.around.clock, [self = shared_from_this(), wait](bool isTimeout) {
    self->context_.queues.release(
        self->queue_, [self, wait, isTimeout] { self->endOfWait(wait, isTimeout); });
  });
}

void Session::endOfWait(const std::shared_ptr<BackendWait>& wait, bool isTimeout) {
  if (!isTimeout) {
    log(LogLevel::kDefault, "continuing");
    waitForBackends(wait);
    return;
  }
  log(LogLevel::kError, "%@", "failed to find backend");
  telemetrySession_ = nullptr;
  started = true;
  endOfStart();
}

void Session::endOfStart() {
  if (!shouldReportOrientation()) return;
  FakeOrientationService& orientation = *context_.around.orientation;
  orientation.registerDeviceOrientationObserver(
      *orientationCallbackID_, [self = shared_from_this()](std::int32_t code) {
        self->orientationChanged("device", code);
      });
  orientation.registerInterfaceOrientationObserver(
      *orientationCallbackID_, [self = shared_from_this()](std::int32_t code) {
        self->orientationChanged("ui", code);
      });
}

void Session::announceStop() const { log(LogLevel::kDebug, "ending session %lli", id); }

void Session::stop() {
  announceStop();
  later([this] { stopStep(); });
}

void Session::stopStep() {
  if (shouldReportOrientation()) {
    FakeOrientationService& orientation = *context_.around.orientation;
    orientation.unregisterDeviceOrientationObserver(*orientationCallbackID_);
    orientation.unregisterInterfaceOrientationObserver(*orientationCallbackID_);
  }
  if (!started) return;
  log(LogLevel::kDebug, "ending session %lli", id);
  context_.around.kernelTrace->trace(TraceCode::kSessionStop);
  if (const auto summary = createSummaryEvent()) {
    log(LogLevel::kDefault, "sending summary event for reporter %lli", id);
    announceMessage();
    deliver(*summary, MessageCategory{0xFFFFFFFF}, MessageType{0xFFFF});
  }
  if (serviceType != kTest) {
    if (telemetrySession_) {
      telemetrySession_->flush(
          [&context = context_](const std::optional<ErrorObject>& error) {
            if (error) context.log(LogLevel::kError, "osrr", "flush error %@", *error);
          });
    }
    telemetrySession_ = nullptr;
  }
  aggregated_.reset();
  started = false;
  if (transactionComplete) transactionComplete(true);
}

void Session::announceMessage() const {
  log(LogLevel::kDebug, "sending message for session owned by %lli", id);
}

void Session::sendMessage(const Dictionary& message, MessageCategory category,
                          MessageType type) {
  announceMessage();
  later([this, message, category, type] { deliver(message, category, type); });
}

void Session::deliver(const Dictionary& message, MessageCategory category,
                      MessageType type) {
  mirror(message, category, type);
  const Dictionary payload = sanitised(message);
  const std::string identifier = messageIdentifier(category, type);
  if (aggregated_) aggregated_->push_back(Dictionary{{identifier, payload}});
  context_.around.kernelTrace->trace(TraceCode::kMessageDelivery);
  if (!started) {
    log(LogLevel::kDebug, "session not started, will send as a single message");
    sendSingleMessage(context_, payload, category, type, serviceType);
  } else if (serviceType == kTest) {
    log(LogLevel::kInfo, "transactions aren't allowed on this platform");
  } else if (!telemetrySession_) {
    log(LogLevel::kError, "%@", "No valid TelvarSession");
  } else {
    const Success sent = telemetrySession_->sendMessage(
        low16(category), static_cast<std::uint16_t>(type), payload);
    if (sent.succeeded) {
      log(LogLevel::kDebug, "TelvarAgent %@ : message %@ : category %i : type %i",
          telemetrySession_, message, category, type);
    } else if (sent.error) {
      log(LogLevel::kError, "error sending message %@", *sent.error);
    }
  }
}

// To the analytics service and, when an engine ran, to the power log.
void Session::mirror(const Dictionary& message, MessageCategory category,
                     MessageType type) {
  const Value host = hostApplicationID(userInfo_);
  DictionaryBuilder event(message);
  event.set("HostApplicationDisplayID", host);
  context_.around.analyticsSink->sendEventLazy(
      "com.orbisk.ostrel." + categoryName(category) + '.' + messageTypeName(type),
      [payload = event.build()] { return payload; });

  const auto engineOnTime = message.get("EngineOnTime");
  if (!engineOnTime) return;
  DictionaryBuilder power;
  power.set("EngineOnDuration", *engineOnTime).set("ApplicationName", host);
  if (const auto timestamp = message.get("ostrelreporting_timestamp")) {
    power.set("TimestampEnd", *timestamp);
  } else {
    context_.log(LogLevel::kError, "osrp",
                 "failed to get OstrelReporting timestamp for wattlog");
  }
  context_.around.wattlogSink->logRegisteredEvent(/*clientID=*/28, "Mediora_Haptics",
                                                  power.build(),
                                                  /*attachment=*/std::nullopt);
}

std::string Session::messageIdentifier(MessageCategory category, MessageType type) {
  const std::string base = categoryName(category) + '_' + messageTypeName(type);
  return base + '_' + std::to_string(++messageTypeCounts_[base]);
}

void Session::sendSingleMessage(Context& context, const Dictionary& message,
                                MessageCategory category, MessageType type,
                                ServiceType serviceType) {
  const std::uint32_t delay =
      serviceType == kAlarms ? context.around.random->uniform(/*bound=*/60) : 0;
  context.log(LogLevel::kDebug, "osrr",
              "sending single message after delta %lli for service %i", delay,
              serviceType);
  const auto send = [&context, message, category, type, serviceType] {
    context.around.kernelTrace->trace(TraceCode::kMessageDelivery);
    context.log(LogLevel::kDebug, "osrr", "sending single message");
    const Success sent = context.around.telemetryBackend->sendOneMessage(
        Dictionary{{kTelvarSessionInfoClientType, 19},
                   {kTelvarSessionInfoClientVersion, 1.0},
                   {kTelvarSessionInfoSessionID, -1}},
        Dictionary{{kTelvarUserInfoClientName, "com.orbisk.ostrel"},
                   {kTelvarUserInfoServiceName, serviceTypeName(serviceType)}},
        low16(category), static_cast<std::uint16_t>(type), sanitised(message));
    if (sent.succeeded) {
      context.log(LogLevel::kDebug, "osrr", "message %@ : category %i : type %i", message,
                  category, type);
    } else if (sent.error) {
      context.log(LogLevel::kError, "osrr", "sendOneMessageWithSessionInfo %@",
                  *sent.error);
    }
  };
  ManualClock& clock = *context.around.clock;
  if (delay == 0) {
    context.queues.add(/*queue=*/0, send);
  } else {
    clock.scheduleAt(clock.monotonicNow() + std::chrono::seconds(delay),
                     [&context, send] { context.queues.add(/*queue=*/0, send); });
  }
}

std::optional<Dictionary> Session::createSummaryEvent() {
  if (!aggregated_ || aggregated_->empty()) return std::nullopt;
  std::vector<std::string> keys = {"Ostrel_Session_Summary_Event"};  // In order.
  std::map<std::string, std::string> texts = {
      {keys[0], std::to_string(static_cast<std::uint16_t>(serviceType))}};
  for (const Dictionary& entry : *aggregated_) {
    for (const auto& [key, value] : entry) {
      const std::string name(*key.string());
      const auto [at, isNew] = texts.emplace(name, "");
      if (isNew) {
        keys.push_back(name);
      } else {
        at->second += ',';
      }
      at->second += ostrel::description(value);
    }
  }
  DictionaryBuilder summary;
  for (const std::string& key : keys) summary.set(key, texts[key]);
  aggregated_->insert(aggregated_->begin(), userInfo_);
  if (context_.isInternalBuild()) writeSessionLog();
  return summary.build();
}

// One slot takes the errors of all three calls and keeps the last.
void Session::writeSessionLog() {
  std::optional<ErrorObject> slot;
  const auto text = context_.around.json->prettyPrintedArray(
      [&entries = *aggregated_](const std::function<void(ValueView)>& each) {
        for (const Dictionary& entry : entries) each(entry.value());
      });
  if (text.error) {
    slot = text.error;
    log(LogLevel::kError, "dataWithJSONObject: %@", *slot);
  }
  FakeFileSystem& files = *context_.around.fileSystem;
  const std::string directory = files.diagnosticLogDirectory() + "/Audio/Reporting";
  const Success made = files.createDirectory(directory, /*permissions=*/0777);
  if (!made.succeeded) {
    if (made.error) slot = made.error;
    log(LogLevel::kError, "can't create logging directory at %@: %@", directory, slot);
  }
  const auto host = userInfo_.get("HostApplicationDisplayID");
  const ManualClock& clock = *context_.around.clock;
  const std::string name = clock.fileNameDate(clock.now()) + "-ostrel-" +
                           (host ? ostrel::description(*host) : "(null)") + '-' +
                           serviceTypeName(serviceType) + ".json";
  const Success written = files.writeFileAtomically(directory, name, text.value);
  if (!written.succeeded && written.error) slot = written.error;
  if (slot) log(LogLevel::kError, "jsonOutput writeToURL: %@", *slot);
}

bool Session::shouldReportOrientation() const {
  return orientationCallbackID_ && context_.isInternalBuild() &&
         (serviceType == ServiceType{7} || serviceType == ServiceType{2}) &&
         context_.around.deviceInfo->deviceClass() != 6;
}

void Session::orientationChanged(const std::string& mode, std::int32_t code) {
  const std::string name = context_.around.orientation->orientationName(code);
  const double time =
      context_.around.clock->now().secondsSince1970 - startDate_.secondsSince1970;
  log(LogLevel::kDebug,
      "Orientation handler callback mode=%@ orientation=\"%@\" app=\"%@\", time=%f, "
      "id=\"%@\"",
      mode, name, userInfo_.get("HostApplicationDisplayID"), time,
      orientationCallbackID_);
  if (!aggregated_) return;
  aggregated_->push_back(
      Dictionary{{mode + "_orientation", name}, {mode + "_orientation_time", time}});
}

}  // namespace ostrel::reference
