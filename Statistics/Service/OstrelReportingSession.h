#pragma once

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Statistics/OstrelReportingTypes.h"
#include "Statistics/Service/OstrelReportingSessionDetails.h"
#include "Statistics/Service/OstrelReportingSharedPayload.h"
#include "Statistics/Support/MadeOnce.h"
#include "Statistics/Support/MutableDictionary.h"
#include "platform/Condition.h"
#include "platform/FetchAhead.h"
#include "platform/OrientationService.h"
#include "platform/OstrelReportingPlatform.h"
#include "platform/SmallMutex.h"
#include "platform/TelemetryBackend.h"
#include "platform/WorkQueue.h"

namespace ostrel {

/// One reporting session of one client, named by a `reporterID`.
///
/// Operations may be called from any thread and only queue their work on the
/// session's own queue, except that `sync` true runs it before the call
/// returns; the caller must then already be on `sessionReportingQueue`.
///
/// | state             | started | reportingSession | entered by                 |
/// |-------------------|---------|------------------|----------------------------|
/// | created           | no      | none             | `initWithID`               |
/// | started, live     | yes     | present          | start with backends        |
/// | started, detached | yes     | none             | start without, after 9.0 s |
/// | started, test     | yes     | none             | start with service type 11 |
/// | stopped           | no      | none             | stop; no aggregation list  |
///
/// Releasing a started session does not stop it: its summary and its flush are
/// then lost.
class OstrelReportingSession final
    : public Subject,
      public std::enable_shared_from_this<OstrelReportingSession> {
  using Details = OstrelReportingSessionDetails;

 public:
  /// Makes a session that is not started. `processIdentifiers` are the pids of
  /// the client processes that own it. `platform` outlives the session.
  static std::shared_ptr<OstrelReportingSession> initWithID(
      ReporterID reporterID, std::vector<ProcessID> processIdentifiers,
      const OstrelReportingPlatform& platform);

  ~OstrelReportingSession();

  /// Sets type and name. A started session whose type was another when this was
  /// called is stopped and started again around the change.
  void setServiceType(ServiceType serviceType);

  /// Merges the entries into the user info at once, on the calling thread. A
  /// live telemetry session does not learn of it. None changes nothing.
  void setConfiguration(const std::optional<Dictionary>& configuration);

  /// Merges the service's defaults into the user info, on the session's queue.
  void updateDefaults(std::optional<Dictionary> defaults);

  /// Starts the session; when it is already started, only logs. Holds the
  /// session's queue back for up to `BackendWaitTimeout` without holding a
  /// thread. Finding no backend is not a failure: the session is then detached.
  void startSync(bool sync);
  void start() { startSync(/*sync=*/false); }

  /// Ends the session: summary, flush, release of the telemetry session, then
  /// `transactionCompleteBlock`. Nothing of these when it is not started.
  void stopSync(bool sync);
  void stop() { stopSync(/*sync=*/false); }

  /// Delivers one message. The backend gets the low 16 bits of `category`;
  /// bridges and log lines get all 32. `reply` may be empty; otherwise it is
  /// called once, on this session's queue or on the background queue, with the
  /// backend's error or none. `shared` is what all sessions have together that the
  /// message goes to; none where it goes to this one alone.
  void sendMessage(Dictionary message, MessageCategory category, MessageType type,
                   bool sync, ErrorReply reply,
                   std::shared_ptr<OstrelReportingSharedPayload> shared = nullptr);
  void sendMessage(Dictionary message, MessageCategory category, MessageType type,
                   ErrorReply reply) {
    sendMessage(std::move(message), category, type, /*sync=*/false, std::move(reply));
  }

  /// Sends a message outside any session, on the background queue; those of the
  /// alarms service after 0 to 59 seconds. `userInfo` is not used. `reply` may
  /// be empty; otherwise it is called once with the backend's error or none.
  static void sendSingleMessage(const OstrelReportingPlatform& platform,
                                Dictionary message, MessageCategory category,
                                MessageType type, ServiceType serviceType,
                                const std::optional<Dictionary>& userInfo,
                                ErrorReply reply);

  /// The numbered identifier of the next message with these codes, such as
  /// "Routing_RouteChange_Start_1". Counts from 1 for the session's life.
  std::string messageIdForCategory(MessageCategory category, MessageType type)
      OSTREL_ON_QUEUE(*sessionReportingQueue_);

  /// The summary of what was delivered, or none when nothing was. Puts the user
  /// info at the front of the list; on internal builds writes the session log,
  /// whose failures are only logged.
  std::optional<Dictionary> createSummaryEventForSession();

  /// Whether orientation changes belong into this session's record.
  bool shouldReportOrientation() const;

  /// Asks for the memory that queueing a message will look at: first of the session,
  /// then, once that is there, of its queue.
  void fetchSelfAhead() const { fetchToWrite(countsOf(this), kBytesOfQueueing); }
  void fetchQueueAhead() const {
    fetchToWrite(countsOf(sessionReportingQueue_.get()), kBytesOfQueue);
  }

  bool started() const { return started_.load(std::memory_order_acquire); }
  void setStarted(bool started) { started_.store(started, std::memory_order_release); }
  ServiceType serviceType() const { return serviceType_.load(std::memory_order_acquire); }
  std::string serviceName() const;
  ReporterID reporterID() const { return reporterID_; }
  std::vector<ProcessID> processIdentifiers() const { return processIdentifiers_.all(); }
  Dictionary userInfo() const;
  const std::shared_ptr<WorkQueue>& sessionReportingQueue() const {
    return sessionReportingQueue_;
  }
  std::shared_ptr<const DriverSnapShot> driverSnapShot() const {
    return get(&Details::driverSnapShot);
  }
  void setDriverSnapShot(std::shared_ptr<const DriverSnapShot> snapShot) {
    set(&Details::driverSnapShot, std::move(snapShot));
  }
  BoolReply transactionCompleteBlock() const {
    return get(&Details::transactionCompleteBlock);
  }
  /// Called with true as the last step of every stop of the started session;
  /// may be empty.
  void setTransactionCompleteBlock(BoolReply block) {
    set(&Details::transactionCompleteBlock, std::move(block));
  }
  /// None from a stop until the next start.
  std::shared_ptr<AggregatedPayloadData> aggregatedPayloadData() const;
  void setAggregatedPayloadData(std::shared_ptr<AggregatedPayloadData> list) {
    set(&Details::aggregatedPayloadData, std::move(list));
  }
  std::optional<std::string> orientationCallbackID() const {
    return get(&Details::orientationCallbackID);
  }
  void setOrientationCallbackID(std::optional<std::string> id) {
    set(&Details::orientationCallbackID, std::move(id));
  }
  std::optional<Date> startDate() const { return get(&Details::startDate); }
  void setStartDate(std::optional<Date> date) { set(&Details::startDate, date); }
  std::shared_ptr<TelemetrySession> reportingSession() const {
    return get(&Details::reportingSession);
  }
  std::optional<HierarchyToken> reportingAgentToken() const {
    return get(&Details::reportingAgentToken);
  }

  /// How many messages had each name, without their numbers.
  std::map<std::string, std::int64_t> messageTypeCounts() const
      OSTREL_ON_QUEUE(*sessionReportingQueue_);

  /// "<OstrelReportingSession: 42>".
  std::string description() const;

 private:
  struct Passkey {};

  // `std::make_shared` puts the counts of references before the object.
  static constexpr std::size_t kCountsBytes = 16;
  static const void* countsOf(const void* object) {
    return static_cast<const char*>(object) - kCountsBytes;
  }
  // The counts, and what stands first or is about as large on all platforms.
  static constexpr std::size_t kBytesOfQueueing = 64;
  static constexpr std::size_t kBytesOfQueue = 128;

 public:
  OstrelReportingSession(Passkey, ReporterID reporterID,
                         std::vector<ProcessID> processIdentifiers,
                         const OstrelReportingPlatform& platform);

 private:
  // Properties of `Details`. Their lock is held for a copy or a swap; what is
  // replaced is torn down after it, as the argument.
  template <typename T>
  T get(T Details::*property) const {
    const std::lock_guard lock(mutex_);
    const Details* const made = details_.get();
    return made != nullptr ? made->*property : T();
  }
  template <typename T>
  void set(T Details::*property, T value) {
    const std::lock_guard lock(mutex_);
    std::swap(details().*property, value);
  }
  Details& details() const;  // With the lock held.
  std::shared_ptr<AggregatedPayloadData> makeList() const;

  /// The properties on the session's queue. They are only replaced there, so that there
  /// is neither a lock nor a reference to take (30 ns a message).
  struct PropertiesOnQueue {
    Details& details;
    AggregatedPayloadData* list;        // May be none.
    const MutableDictionary* userInfo;  // May be none.
  };
  PropertiesOnQueue propertiesOnQueue() const OSTREL_ON_QUEUE(*sessionReportingQueue_);
  std::shared_ptr<MutableDictionary> mutableUserInfo();

  void fetchAhead(int stage) const noexcept override;

  void setServiceTypeStep(ServiceType serviceType, ServiceType before)
      OSTREL_ON_QUEUE(*sessionReportingQueue_);
  void applyServiceType(ServiceType serviceType) OSTREL_ON_QUEUE(*sessionReportingQueue_);
  void updateDefaultsStep(const std::optional<Dictionary>& defaults)
      OSTREL_ON_QUEUE(*sessionReportingQueue_);
  void startStep() OSTREL_ON_QUEUE(*sessionReportingQueue_);
  std::shared_ptr<TelemetrySession> makeReportingSession(
      const HierarchyToken& token) const;
  void findBackends() OSTREL_ON_QUEUE(*sessionReportingQueue_);
  void backendCallback(const std::optional<Array>& backends, Condition& condition);
  void finishStartStep(bool foundBackends) OSTREL_ON_QUEUE(*sessionReportingQueue_);
  void stopStep() OSTREL_ON_QUEUE(*sessionReportingQueue_);
  void flushStep() OSTREL_ON_QUEUE(*sessionReportingQueue_);
  void deliverStep(const Dictionary& message, MessageCategory category, MessageType type,
                   const ErrorReply& reply, OstrelReportingSharedPayload* shared)
      OSTREL_ON_QUEUE(*sessionReportingQueue_);
  void sendToBackend(const Dictionary& message, const Dictionary& payload,
                     MessageCategory category, MessageType type, const ErrorReply& reply,
                     const Details& details) OSTREL_ON_QUEUE(*sessionReportingQueue_);
  void writeSessionLog(const AggregatedPayloadData& list);
  void registerOrientationObservers();
  void orientationChanged(std::string_view mode,
                          OrientationService::OrientationCode code);

  // Constant after construction, and what those read who queue messages. What the
  // session's thread writes with each of them stands last: beside it, every message
  // would have to wait for the line of the cache.
  const OstrelReportingPlatform& platform_;
  const ReporterID reporterID_;
  const std::shared_ptr<WorkQueue> sessionReportingQueue_;
  const OstrelReportingProcessIdentifiers processIdentifiers_;

  // Shared. One lock for all properties that are not scalars. What is made once is made
  // under it too.
  mutable MadeOnce<Details> details_;
  MadeOnce<std::shared_ptr<MutableDictionary>> userInfo_;  // By the first entry.
  std::atomic<ServiceType> serviceType_{kServiceTypeUnknown};
  std::atomic<bool> started_{false};  // The backend's thread sets it too.
  mutable SmallMutex mutex_;
};

}  // namespace ostrel
