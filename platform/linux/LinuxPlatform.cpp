#include "platform/linux/LinuxPlatform.h"

#include <atomic>
#include <future>
#include <utility>
#include <vector>

#include "platform/Logging.h"
#include "platform/linux/DirectoryFileSystem.h"
#include "platform/linux/EtcDeviceInfo.h"
#include "platform/linux/FileEntryStorage.h"
#include "platform/linux/HeapKeeper.h"
#include "platform/linux/InotifyChangeNotification.h"
#include "platform/linux/JSONTextSerialization.h"
#include "platform/linux/JSONUserDefaults.h"
#include "platform/linux/JournalLog.h"
#include "platform/linux/LinuxOrientationService.h"
#include "platform/linux/MappedChannelReporting.h"
#include "platform/linux/MisuseLog.h"
#include "platform/linux/PeerRegistry.h"
#include "platform/linux/Places.h"
#include "platform/linux/ProcProcessInfo.h"
#include "platform/linux/SystemClock.h"
#include "platform/linux/SystemRandom.h"
#include "platform/linux/ThreadPoolWorkQueues.h"
#include "platform/linux/TimedConditionFactory.h"
#include "platform/linux/TimerThread.h"
#include "platform/linux/UnixSocketIPCListener.h"
#include "platform/linux/UsdtKernelTrace.h"
#include "platform/linux/store/Store.h"
#include "platform/linux/store/StoreAnalyticsSink.h"
#include "platform/linux/store/StoreTelemetryBackend.h"
#include "platform/linux/store/StoreWattlogSink.h"

namespace ostrel {
namespace {

constexpr std::chrono::milliseconds kLogFarewell{200};

// How soon the status shows what clients were cut short of.
constexpr std::chrono::seconds kStatusDelay{1};

// How long the last lines are waited for when a client ends the service.
constexpr std::chrono::milliseconds kLogFarewellOfKill{50};

// Once the store is known, no session waits for it any more.
void awaitStore(Store& store, std::chrono::steady_clock::time_point deadline) {
  const auto known = std::make_shared<std::promise<void>>();
  store.whenKnown([known](bool) { known->set_value(); });
  known->get_future().wait_until(deadline);
}

/// Says to the store that counts have changed, however many do, once in a while.
class StatusNotice : public std::enable_shared_from_this<StatusNotice> {
 public:
  explicit StatusNotice(std::shared_ptr<TimerThread> timers)
      : timers_(std::move(timers)) {}

  void setStore(const std::shared_ptr<Store>& store) { store_ = store; }

  /// Any thread, once there is a store.
  void give() {
    if (isGiven_.exchange(true)) return;
    timers_->scheduleAfter(kStatusDelay, [self = shared_from_this()] {
      self->isGiven_ = false;
      if (const auto store = self->store_.lock()) store->noteStatusChange();
    });
  }

 private:
  const std::shared_ptr<TimerThread> timers_;
  std::weak_ptr<Store> store_;
  std::atomic<bool> isGiven_{false};
};

}  // namespace

// In the order of making; what is below may use what is above. The socket comes
// first: a second service must not touch the store of the first.
struct LinuxPlatform::Bindings {
  std::shared_ptr<JournalLog> log;
  std::shared_ptr<PeerRegistry> peers;
  std::shared_ptr<TimerThread> timers;
  std::shared_ptr<StatusNotice> notice;
  std::shared_ptr<MisuseLog> misuse;
  std::shared_ptr<ThreadPoolWorkQueues> queues;
  std::unique_ptr<UnixSocketIPCListener> listener;
  std::shared_ptr<FileEntryStorage> entries =
      std::make_shared<FileEntryStorage>(stateDirectory(), &queues->backgroundQueue());
  std::shared_ptr<Store> store = Store::open(storePath(), storeOptions());

  StoreOptions storeOptions() const {
    StoreOptions options;
    options.otherCounts = [misuse = misuse, entries = entries] {
      std::vector<StatusCount> counts;
      const MisuseLog::Counts refused = misuse->counts();
      for (std::size_t i = 0; i < MisuseLog::kKinds; ++i) {
        counts.push_back({MisuseLog::keyOf(static_cast<MisuseLog::Kind>(i)), refused[i]});
      }
      counts.push_back({"entries_refused", entries->refusedEntries()});
      return counts;
    };
    return options;
  }
};

Outcome<std::unique_ptr<LinuxPlatform>> LinuxPlatform::open() {
  shareHeaps();
  const std::shared_ptr<JournalLog> log = JournalLog::open();
  setSystemLog(log);
  registerLogScope(processLogScope);
  const auto peers = std::make_shared<PeerRegistry>();
  const auto timers = std::make_shared<TimerThread>();
  const auto notice = std::make_shared<StatusNotice>(timers);
  const auto misuse = std::make_shared<MisuseLog>([notice] { notice->give(); });
  const auto queues = std::make_shared<ThreadPoolWorkQueues>(timers);
  auto listener = UnixSocketIPCListener::open(
      reportingSocketPath(), peers,
      {ListenerLimits(), misuse, &queues->backgroundQueue(),
       std::make_shared<HeapKeeper>(timers), /*identityOf=*/nullptr});
  if (!listener.value) return {std::nullopt, std::move(listener.error)};
  auto bindings = std::unique_ptr<Bindings>(new Bindings{
      log, peers, timers, notice, misuse, queues, *std::move(listener.value)});
  notice->setStore(bindings->store);
  return {std::unique_ptr<LinuxPlatform>(new LinuxPlatform(std::move(bindings))),
          std::nullopt};
}

LinuxPlatform::LinuxPlatform(std::unique_ptr<Bindings> bindings)
    : bindings_(std::move(bindings)) {
  platform_.workQueues = bindings_->queues;
  platform_.conditions = std::make_shared<TimedConditionFactory>(bindings_->timers);
  platform_.clock = std::make_shared<SystemClock>();
  platform_.random = std::make_shared<SystemRandom>();
  platform_.fileSystem = std::make_shared<DirectoryFileSystem>(diagnosticLogRoot());
  platform_.entryStorage = bindings_->entries;
  platform_.json = std::make_shared<JSONTextSerialization>();
  platform_.notifications = std::make_shared<InotifyChangeNotification>(
      InotifyChangeNotification::systemDirectory());
  platform_.userDefaults =
      std::make_shared<JSONUserDefaults>(JSONUserDefaults::systemDirectory());
  platform_.processInfo = std::make_shared<ProcProcessInfo>(
      bindings_->peers, "/proc",
      [log = bindings_->log] { log->flush(kLogFarewellOfKill); });
  platform_.deviceInfo = std::make_shared<EtcDeviceInfo>(EtcDeviceInfo::systemFiles());
  platform_.telemetryBackend = std::make_shared<StoreTelemetryBackend>(bindings_->store);
  platform_.analyticsSink = std::make_shared<StoreAnalyticsSink>(bindings_->store);
  platform_.wattlogSink = std::make_shared<StoreWattlogSink>(bindings_->store);
  platform_.channelReportingService = MappedChannelReporting::ofSystem();
  platform_.orientationService = std::make_shared<LinuxOrientationService>();
  platform_.kernelTrace = std::make_shared<UsdtKernelTrace>();
}

LinuxPlatform::~LinuxPlatform() = default;

IPCListener& LinuxPlatform::listener() { return *bindings_->listener; }

bool LinuxPlatform::finish(std::chrono::steady_clock::time_point deadline) {
  // A session that waits for the store keeps its messages on a suspended queue, which
  // is not drained. What is queued now may begin such a wait; the store answers in
  // order.
  bindings_->queues->drain(deadline);
  awaitStore(*bindings_->store, deadline);
  const bool isDrained = bindings_->queues->drain(deadline);
  if (!isDrained) {
    OSTREL_LOG_ERROR(processLogScope, "some work was still queued at the end");
  }
  const bool isDurable = bindings_->store->shutdown(deadline);
  bindings_->log->flush(kLogFarewell);
  return isDrained && isDurable;
}

}  // namespace ostrel
