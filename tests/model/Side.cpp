#include "tests/model/Side.h"

#include <cmath>
#include <utility>

#include "Statistics/OstrelReportingUtility.h"
#include "Statistics/Service/OstrelReportingServiceDelegate.h"
#include "tests/model/ReferenceService.h"

namespace ostrel {
namespace {

using Group = std::pair<std::optional<std::string>, std::optional<std::string>>;

struct Scope {
  const char* code;
  const char* verbosityKey;
};

constexpr Scope kScopes[] = {{"osrs", "reporting_server_verbose"},
                             {"osrr", "reporting_rtc_verbose"},
                             {"osrd", "reporting_driver_verbose"}};

// As drivers publish them; some are seen through two rows of the driver table.
const Group kGroups[] = {
    {"OrbiskVX3QDL", "QDL"}, {"Speaker", "Amp"}, {"Other", "QDL"}, {"Haptics", "Stats"}};
// As the service asks for them.
const Group kDrivers[] = {{"OrbiskVX3QDL", std::nullopt},
                          {"Speaker", std::nullopt},
                          {std::nullopt, "QDL"},
                          {"Haptics", "Stats"}};
const char* const kChannels[] = {"faults", "resets", "shared name"};

const ProcessID kProcesses[] = {100, 200, 300, 4242, 0, -1};

ErrorObject error(int code, const char* text) { return {"test", code, text}; }

Dictionary payloadAt(std::int64_t index) {
  switch (index) {
    case 0:
      return {};
    case 1:
      return {{"device name", "Speaker"}, {"a b c", 2}};
    case 2:
      return {{"a b", 1}, {"other", "x"}, {"a_b", 2}};
    case 3:
      return {{"EngineOnTime", 1.5}, {"ostrelreporting_timestamp", 1000}};
    case 4:
      return {{"EngineOnTime", 3}, {"HostApplicationDisplayID", "Mine"}};
    case 5:
      return DictionaryBuilder().set(Value(7), Value("seven")).set("7", 8).build();
    case 6:
      return {
          {"nested name",
           Dictionary{{"in side",
                       ArrayBuilder().append(Value(true)).append(Value("b")).build()}}}};
    case 7:
      return {{"number", std::nan("")}};
    default:
      return {{" ", ""}, {"", " "}};
  }
}

std::optional<Dictionary> configurationAt(std::int64_t index) {
  switch (index) {
    case 0:
      return std::nullopt;
    case 1:
      return Dictionary();
    case 2:
      return Dictionary{{"HostApplicationDisplayID", "ExampleApp"}};
    case 3:
      return Dictionary{{"HostApplicationDisplayID", 5}, {"more", "x y"}};
    case 4:
      return Dictionary{{"kTelvarUserInfoServiceName", "renamed"}};
    case 5:
      return Dictionary{{"kTelvarUserInfoClientName", "client"}, {"more", 2}};
    default:
      return Dictionary{{"HostApplicationDisplayID", "a/b"}};
  }
}

Dictionary defaultsAt(std::int64_t index) {
  switch (index) {
    case 0:
      return {{"disable_reporting", true}};
    case 1:
      return {{"disable_reporting", false}, {"device_name", "Phone"}};
    case 2:
      return {{"device_name", 12}, {"other", 1}};
    case 3:
      return {{"disable_reporting", "yes"}, {"device_name", "Phone 2"}};
    case 4:
      return {{"disable_reporting", "no"}};
    default:
      return {};
  }
}

FakeDiscovery discoveryAt(std::int64_t index) {
  switch (index) {
    case 0:
      return FakeDiscovery::found();
    case 1:
      return FakeDiscovery::foundTwice();
    case 2:
      return FakeDiscovery::emptyList();
    case 3:
      return FakeDiscovery::none();
    default:
      return FakeDiscovery::held();
  }
}

std::optional<Array> backendsAt(std::int64_t index) {
  if (index == 0) return std::nullopt;
  if (index == 1) return Array();
  return ArrayBuilder().append(Value("embedded")).append(Value("other")).build();
}

std::string shown(const std::optional<ErrorObject>& reply) {
  return reply ? reply->domain + ' ' + std::to_string(reply->code) : "no error";
}

}  // namespace

Side::Side(Surroundings surroundings, const Setup& setup)
    : around(std::move(surroundings)) {
  around.events->showArguments();
  around.deviceInfo->setAnswer("InternalBuild", setup.isInternalBuild);
  around.deviceInfo->setDeviceClass(static_cast<std::int32_t>(setup.deviceClass));
  around.processInfo->setCommandName(/*pid=*/100, "first");
  around.processInfo->setCommandName(/*pid=*/200, "second");
  for (std::size_t i = 0; i < std::size(kGroups); ++i) {
    if ((setup.drivers >> i & 1) == 0) continue;
    const auto& [group, subgroup] = kGroups[i];
    around.channels->setCounters(group, subgroup, {{kChannels[0], 5}, {kChannels[2], 1}});
  }
  if (setup.drivers == 15) {
    around.channels->setLookupFault(
        "Speaker", std::nullopt,
        FakeChannelReportingService::Fault{/*givesValue=*/true, error(8, "look-up")});
  } else if (setup.drivers == 14) {
    around.channels->setCounters("Speaker", "Amp", {});
  }
}

void Side::makeVerbose(const Setup& setup) {
  for (std::size_t i = 0; i < std::size(kScopes); ++i) {
    setVerbose(kScopes[i].code, (setup.verbose >> i & 1) != 0);
  }
}

std::vector<std::string> Side::takeEvents() {
  std::vector<std::string> events = around.events->take();
  std::erase_if(events,
                [](const std::string& event) { return event.starts_with("device."); });
  return events;
}

void Side::apply(const Action& action) {
  const auto slot = static_cast<std::size_t>(action.numbers[0]);
  switch (action.kind) {
    case ActionKind::kConnect:
      connect(slot, action.numbers[1]);
      return;
    case ActionKind::kInterrupt:
    case ActionKind::kOnlyInterrupt:
    case ActionKind::kInvalidate:
      endConnection(slot, action.kind);
      return;
    case ActionKind::kRun:
      runChosenStep(slot, static_cast<std::size_t>(action.numbers[1]));
      return;
    default:
      break;
  }
  if (action.kind > ActionKind::kKill) {
    steerBackend(action);
  } else if (connections_[slot]) {
    ++requests_;
    request(*connections_[slot]->exportedObject(), action);
  }
}

void Side::connect(std::size_t slot, std::int64_t process) {
  if (connections_[slot]) return;
  connections_[slot] = around.listener->accept(kProcesses[process]);
}

void Side::endConnection(std::size_t slot, ActionKind how) {
  if (!connections_[slot]) return;
  if (how == ActionKind::kOnlyInterrupt) {
    connections_[slot]->onlyInterrupt();
    return;
  }
  const auto connection = std::exchange(connections_[slot], nullptr);
  if (how == ActionKind::kInterrupt) {
    connection->interrupt();
  } else {
    connection->invalidate();
  }
}

void Side::closeConnections() {
  for (std::size_t slot = 0; slot < connections_.size(); ++slot) {
    endConnection(slot, ActionKind::kInvalidate);
  }
}

void Side::releaseHeld() {
  around.orientation->releaseCallbacks();
  around.telemetryBackend->releaseCallbacks();
}

void Side::request(OstrelReportingServiceProtocol& client, const Action& action) {
  const ReporterID id{action.numbers[1]};
  const auto reply = [events = around.events,
                      head = "reply " + std::to_string(requests_) +
                             ' '](const std::string& text) { events->add(head + text); };
  const BoolReply boolReply = [reply](bool value) { reply(value ? "true" : "false"); };
  switch (action.kind) {
    case ActionKind::kCreate:
      client.createReportingSession(id, boolReply);
      break;
    case ActionKind::kSetType:
      client.setServiceType(static_cast<ServiceType>(action.numbers[2]), id, boolReply);
      break;
    case ActionKind::kGetType:
      client.getServiceNameForReporterID(
          id, [reply](ServiceType type) { reply(format("%i", type)); });
      break;
    case ActionKind::kConfigure:
      client.setConfiguration(configurationAt(action.numbers[2]), id, boolReply);
      break;
    case ActionKind::kStart:
      client.startReportingSessionForID(id, boolReply);
      break;
    case ActionKind::kSend: {
      std::optional<ReporterIDs> ids;
      if (action.ids) {
        ids.emplace();
        for (const std::int64_t each : *action.ids) ids->push_back(ReporterID{each});
      }
      client.sendMessage(
          payloadAt(action.numbers[1]), static_cast<MessageCategory>(action.numbers[2]),
          static_cast<MessageType>(action.numbers[3]), ids,
          [reply](const std::optional<ErrorObject>& value) { reply(shown(value)); });
      break;
    }
    case ActionKind::kStop:
      client.stopReportingSessionForID(id, boolReply);
      break;
    case ActionKind::kDestroy:
      client.destroyReportingSession(id, boolReply);
      break;
    case ActionKind::kValidate:
      client.reporterIDValid(
          id, [events = around.events, number = requests_](const Dictionary& value) {
            events->add("reply " + std::to_string(number), {value.value()});
          });
      break;
    case ActionKind::kGetAll:
      client.getAllReporters(
          [reply](const ReporterIDs& ids) { reply(format("%@", ids)); });
      break;
    default:
      client.killService(boolReply);
  }
}

void Side::runChosenStep(std::size_t choice, std::size_t position) {
  const auto ready = readyQueues();
  if (ready.empty()) return;
  const std::size_t queue = ready[choice % ready.size()];
  runStep(queue, queue == 0 ? position % backgroundCount() : 0);
}

std::shared_ptr<FakeTelemetrySession> Side::telemetrySession(
    std::int64_t fromLast) const {
  const auto count = static_cast<std::int64_t>(around.telemetryBackend->sessionCount());
  if (count <= fromLast) return nullptr;
  return around.telemetryBackend->session(static_cast<std::size_t>(count - fromLast));
}

void Side::steerBackend(const Action& action) {
  const auto& [first, second, third, fourth] = action.numbers;
  switch (action.kind) {
    case ActionKind::kSetDiscovery:
      around.telemetryBackend->setDiscovery(discoveryAt(first));
      break;
    case ActionKind::kAnswerDiscovery: {
      const auto session = telemetrySession(first);
      if (!session || !session->isDiscovering()) return;
      if (third != 0) {
        session->answerDiscoveryDespiteRelease(backendsAt(second));
      } else {
        session->answerDiscovery(backendsAt(second));
      }
      break;
    }
    case ActionKind::kForgetDiscovery:
      if (const auto session = telemetrySession(first)) session->forgetDiscovery();
      break;
    case ActionKind::kSetFlush:
      around.telemetryBackend->setFlush(
          {/*isHeld=*/first == 1,
           first == 2 ? std::optional(error(3, "flush")) : std::nullopt});
      break;
    case ActionKind::kAnswerFlush: {
      const auto session = telemetrySession(first);
      if (!session || !session->hasHeldFlush()) return;
      session->answerFlush(second != 0 ? std::optional(error(4, "late flush"))
                                       : std::nullopt);
      break;
    }
    case ActionKind::kFailSend:
    case ActionKind::kFailSendOne: {
      const Success failure{
          false, first != 0 ? std::nullopt : std::optional(error(5, "not sent"))};
      if (action.kind == ActionKind::kFailSend) {
        around.telemetryBackend->scriptSend(failure);
      } else {
        around.telemetryBackend->scriptSendOne(failure);
      }
      break;
    }
    default:
      steerOthers(action);
  }
}

void Side::steerOthers(const Action& action) {
  const auto& [first, second, third, fourth] = action.numbers;
  switch (action.kind) {
    case ActionKind::kAdvance:
      around.clock->advance(std::chrono::milliseconds(250 * first));
      break;
    case ActionKind::kSetWallClock:
      around.clock->setWallClock(
          {around.clock->now().secondsSince1970 + static_cast<double>(first)});
      break;
    case ActionKind::kSetDefaults:
      around.userDefaults->setSuite("com.orbisk.ostrel", defaultsAt(first));
      break;
    case ActionKind::kPostDefaults:
      postDefaults(/*isOwnToken=*/first != 0);
      break;
    case ActionKind::kDraw:
      around.random->script({static_cast<std::uint32_t>(first)});
      break;
    case ActionKind::kWakeSpuriously:
      wakeSpuriously();
      break;
    case ActionKind::kTurnDevice:
      around.orientation->turnDevice(static_cast<std::int32_t>(first));
      break;
    case ActionKind::kTurnInterface:
      around.orientation->turnInterface(static_cast<std::int32_t>(first));
      break;
    case ActionKind::kSetVerbose:
      setVerbose(kScopes[first].code, second != 0);
      break;
    case ActionKind::kFailFiles: {
      const auto failure = [](bool withError) {
        return Success{false, withError ? std::optional(error(6, "disk")) : std::nullopt};
      };
      around.fileSystem->setDirectoryResult(
          first == 1 || first == 2 ? std::optional(failure(first == 1)) : std::nullopt);
      around.fileSystem->setWriteResult(
          first == 3 || first == 4 ? std::optional(failure(first == 3)) : std::nullopt);
      break;
    }
    default:
      steerDrivers(action);
  }
}

void Side::steerDrivers(const Action& action) {
  const auto& [first, second, third, fourth] = action.numbers;
  const auto fault = [](std::int64_t variant) {
    using Fault = FakeChannelReportingService::Fault;
    if (variant == 0) return std::optional<Fault>();
    return std::optional(Fault{/*givesValue=*/variant == 1, error(7, "drivers")});
  };
  if (action.kind == ActionKind::kSetCounter) {
    const auto& [group, subgroup] = kGroups[first];
    around.channels->setCounters(group, subgroup,
                                 {{kChannels[second], third}, {"steady", 2}});
  } else if (action.kind == ActionKind::kFailSamples) {
    const auto& [group, subgroup] = kDrivers[first];
    around.channels->setSamplesFault(group, subgroup, fault(second));
  } else {
    around.channels->setDeltaFault(fault(first));
  }
}

namespace {

class CoreSide final : public Side {
 public:
  CoreSide(std::unique_ptr<FakePlatform> fakes, const Setup& setup)
      : Side(Surroundings(*fakes), setup),
        fakes_(std::move(fakes)),
        platform_(fakes_->platform()) {
    forgetIsInternalBuildForTesting();
    fakes_->log->recordInto(fakes_->events);
    makeVerbose(setup);
    root_ = OstrelReportingServiceDelegate::init(platform_);
    fakes_->listener->setDelegate(root_.get());
  }
  ~CoreSide() override {
    closeConnections();
    releaseHeld();
    fakes_->clock->releaseCallbacks();
    // The removals let go of the clients.
    fakes_->runUntilIdle();
    root_.reset();
    fakes_.reset();
    forgetIsInternalBuildForTesting();
  }

  std::vector<std::size_t> readyQueues() const override {
    return fakes_->workQueues->readyQueues();
  }
  std::size_t backgroundCount() const override {
    return fakes_->workQueues->backgroundCount();
  }

 private:
  void runStep(std::size_t queue, std::size_t position) override {
    fakes_->workQueues->runOneOf(queue, position);
  }
  void postDefaults(bool isOwnToken) override {
    constexpr const char* kName = "com.orbisk.ostrel.reporting";
    if (isOwnToken) {
      fakes_->notifications->post(kName);
    } else {
      fakes_->notifications->postWithToken(kName, /*token=*/77);
    }
  }
  void wakeSpuriously() override { fakes_->conditions->wakeAllSpuriously(); }
  void setVerbose(const std::string& scope, bool isOn) override {
    for (const Scope& each : kScopes) {
      if (scope == each.code) {
        fakes_->log->setVerbosity(each.verbosityKey, isOn ? 5 : 4);
      }
    }
  }

  std::unique_ptr<FakePlatform> fakes_;
  const OstrelReportingPlatform platform_;
  std::shared_ptr<OstrelReportingServiceDelegate> root_;
};

class ReferenceSide final : public Side {
 public:
  explicit ReferenceSide(const Setup& setup) : Side(Surroundings(), setup) {
    service_ = std::make_unique<reference::Service>(around);
    makeVerbose(setup);
    around.listener->setDelegate(service_.get());
  }
  ~ReferenceSide() override {
    closeConnections();
    releaseHeld();
    around.clock->releaseCallbacks();
    service_.reset();
  }

  std::vector<std::size_t> readyQueues() const override {
    return service_->context.queues.ready();
  }
  std::size_t backgroundCount() const override {
    return service_->context.queues.backgroundCount();
  }

 private:
  void runStep(std::size_t queue, std::size_t position) override {
    service_->context.queues.run(queue, position);
  }
  void postDefaults(bool isOwnToken) override { service_->defaultsChanged(isOwnToken); }
  void wakeSpuriously() override { service_->wakeSpuriously(); }
  void setVerbose(const std::string& scope, bool isOn) override {
    if (isOn) {
      service_->context.verboseScopes.insert(scope);
    } else {
      service_->context.verboseScopes.erase(scope);
    }
  }

  std::unique_ptr<reference::Service> service_;
};

}  // namespace

std::unique_ptr<Side> makeCoreSide(const Setup& setup) {
  // The process's first session registers the scope of all; the reference has no such
  // beginning.
  static const bool kIsRegistered = [] {
    const FakePlatform fakes;
    const OstrelReportingPlatform platform = fakes.platform();
    OstrelReportingSession::initWithID(ReporterID{1}, /*processIdentifiers=*/{},
                                       platform);
    return true;
  }();
  static_cast<void>(kIsRegistered);
  return std::make_unique<CoreSide>(std::make_unique<FakePlatform>(), setup);
}

std::unique_ptr<Side> makeReferenceSide(const Setup& setup) {
  return std::make_unique<ReferenceSide>(setup);
}

}  // namespace ostrel
