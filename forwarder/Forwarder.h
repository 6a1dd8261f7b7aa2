#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

#include "forwarder/ForwardMark.h"
#include "forwarder/ForwarderSettings.h"
#include "forwarder/ReportSource.h"
#include "forwarder/RetryPauses.h"
#include "forwarder/Transport.h"
#include "forwarder/Verdict.h"
#include "platform/Clock.h"
#include "platform/Random.h"

namespace ostrel {

/// What the forwarder waits for. One thread.
class Waits {
 public:
  virtual ~Waits() = default;

  // Each is false when the process is to end.

  /// Until the store may hold more than it did.
  virtual bool forChange() = 0;
  virtual bool forTime(std::chrono::milliseconds pause) = 0;
};

/// All of them outlive the forwarder.
struct ForwarderParts {
  ReportSource& source;
  Transport& transport;
  MarkKeeper& marks;
  Waits& waits;
  const Clock& clock;
  Random& random;
};

/// Posts what a store holds to a collector, in order and in batches, each message at
/// least once. One thread.
///
/// | the collector               | the forwarder                                       |
/// |-----------------------------|-----------------------------------------------------|
/// | takes a batch               | moves its mark                                      |
/// | refuses a batch as such     | tries half of it; one message alone is parked       |
/// | fails on a batch            | waits, then tries half of it; one message alone is  |
/// |                             | parked when it is what the collector fails on       |
/// | refuses for now, or is away | waits, longer each time, and tries it again         |
class Forwarder {
 public:
  /// Of one request. One record is sent however large it is.
  static constexpr std::size_t kMostReports = 512;
  static constexpr std::size_t kMostRecordBytes = 2 * 1024 * 1024;
  /// Of the texts that are read for it.
  static constexpr std::size_t kMostTextBytes = 1024 * 1024;
  /// A collector that refuses so many messages in a row, one by one, may be one that
  /// refuses everything: from then on each costs a pause.
  static constexpr int kParkedAtOnce = 10;
  /// How often a collector has to fail on one message alone before it is suspected. With
  /// the pauses between them that takes minutes, or an hour where it was searched for.
  static constexpr int kFailuresOfSuspect = 8;

  Forwarder(const ForwarderParts& parts, NamesAndValues resource, ForwardMark mark);

  /// Forwards what there is and what comes, until the process is to end.
  void run();

  /// Forwards what there is. Without success when some of it was not taken, or at the
  /// first thing that takes patience; the error is a sentence for people.
  Success runOnce();

  const ForwardMark& mark() const { return mark_; }

 private:
  struct Next {
    enum class Kind { kGoOn, kWaitForChange, kPause, kEnd };
    Kind kind = Kind::kGoOn;
    std::chrono::milliseconds pause{};
  };

  Next step();
  std::string requestOf(ReportBatch& batch);
  Verdict post(const std::string& request);
  void beginStore(const std::string& store);
  Next act(const ReportBatch& batch, const std::string& request, const Verdict& verdict);
  Next take(const ReportBatch& batch, const Verdict& verdict);
  Next refuse(const ReportBatch& batch, std::size_t requestBytes, const Verdict& verdict);
  Next wait(const Verdict& verdict);
  Next bearFailure(const ReportBatch& batch, const std::string& request,
                   const Verdict& verdict);
  bool takesAnother(const ReportBatch& batch);
  Next park(const ReportBatch& batch, const Verdict& verdict);
  Next later(const std::string& sentence, std::optional<std::chrono::milliseconds> asked);
  void moveMark(const ReportBatch& batch);

  const ForwarderParts parts_;
  const NamesAndValues resource_;
  ForwardMark mark_;
  RetryPauses pauses_;
  std::size_t mostReports_ = kMostReports;
  std::size_t mostRecordBytes_ = kMostRecordBytes;
  int parkedInARow_ = 0;
  int failuresOfFirst_ = 0;  // While it was sent alone.
  std::string loggedFault_;
  std::string loggedMarkFault_;
};

}  // namespace ostrel
