#include "forwarder/Forwarder.h"

#include <algorithm>
#include <utility>
#include <vector>

#include "forwarder/LogRecord.h"
#include "platform/Logging.h"

namespace ostrel {

using std::chrono::milliseconds;

Forwarder::Forwarder(const ForwarderParts& parts, NamesAndValues resource,
                     ForwardMark mark)
    : parts_(parts),
      resource_(std::move(resource)),
      mark_(std::move(mark)),
      pauses_(parts.random) {}

void Forwarder::run() {
  for (;;) {
    const Next next = step();
    switch (next.kind) {
      case Next::Kind::kGoOn:
        break;
      case Next::Kind::kWaitForChange:
        if (!parts_.waits.forChange()) return;
        break;
      case Next::Kind::kPause:
        if (!parts_.waits.forTime(next.pause)) return;
        break;
      case Next::Kind::kEnd:
        return;
    }
  }
}

Success Forwarder::runOnce() {
  const auto failure = [](std::string sentence) {
    return Success{/*succeeded=*/false,
                   ErrorObject{std::string(kOstrelErrorDomain), 1, std::move(sentence)}};
  };
  const std::int64_t lostBefore = mark_.parked + mark_.rejected + mark_.dropped;
  Next next;
  while (next.kind == Next::Kind::kGoOn) next = step();
  if (next.kind == Next::Kind::kEnd) return failure("it was ended before all was sent");
  if (next.kind == Next::Kind::kPause) return failure(loggedFault_);
  const std::int64_t lost = mark_.parked + mark_.rejected + mark_.dropped - lostBefore;
  if (lost != 0) {
    return failure(std::to_string(lost) +
                   " messages were refused by the collector or "
                   "gone from the store before they could be sent");
  }
  return {/*succeeded=*/true, {}};
}

Forwarder::Next Forwarder::step() {
  auto read = parts_.source.reportsAfter(mark_.through, {mostReports_, kMostTextBytes});
  if (!read.value) return later(read.error->description, std::nullopt);
  ReportBatch& batch = *read.value;
  if (batch.store.empty()) return {Next::Kind::kWaitForChange, {}};
  if (batch.store != mark_.store || batch.newestID < mark_.through) {
    beginStore(batch.store);
    return {};
  }
  if (batch.reports.empty()) return {Next::Kind::kWaitForChange, {}};
  const std::string request = requestOf(batch);
  return act(batch, request, post(request));
}

/// Takes out of the batch what there is no room for.
std::string Forwarder::requestOf(ReportBatch& batch) {
  std::vector<std::string> records;
  std::size_t bytes = 0;
  for (const Report& report : batch.reports) {
    std::string record = logRecordJSON(report, batch.store);
    bytes += record.size();
    if (!records.empty() && bytes > mostRecordBytes_) break;
    records.push_back(std::move(record));
  }
  if (records.size() < batch.reports.size()) {
    batch.reports.resize(records.size());
    mostReports_ = records.size();  // The next may be twice as many.
  }
  return logsRequestJSON(resource_, OSTREL_VERSION, records);
}

Verdict Forwarder::post(const std::string& request) {
  const Reply reply = parts_.transport.post(request);
  return verdictOn(reply, parts_.clock.now());
}

// Another store than before, or the same with its end cut off.
void Forwarder::beginStore(const std::string& store) {
  if (!mark_.store.empty()) {
    OSTREL_LOG_DEFAULT(processLogScope,
                       "the store was made anew: it is forwarded from its beginning");
  }
  mark_.store = store;
  mark_.through = 0;
}

Forwarder::Next Forwarder::act(const ReportBatch& batch, const std::string& request,
                               const Verdict& verdict) {
  switch (verdict.kind) {
    case Verdict::Kind::kTaken:
      return take(batch, verdict);
    case Verdict::Kind::kRefused:
    case Verdict::Kind::kTooLarge:
      return refuse(batch, request.size(), verdict);
    case Verdict::Kind::kBroken:
      return bearFailure(batch, request, verdict);
    case Verdict::Kind::kLater:
      return wait(verdict);
    case Verdict::Kind::kInterrupted:
      break;
  }
  return {Next::Kind::kEnd, {}};
}

Forwarder::Next Forwarder::take(const ReportBatch& batch, const Verdict& verdict) {
  if (!loggedFault_.empty()) {
    OSTREL_LOG_DEFAULT(processLogScope, "messages are forwarded again");
    loggedFault_.clear();
  }
  const auto count = static_cast<std::int64_t>(batch.reports.size());
  const std::int64_t rejected = std::min(verdict.rejected, count);
  if (rejected != 0) {
    OSTREL_LOG_ERROR(processLogScope,
                     "the collector took out %lli of the messages %lli to %lli", rejected,
                     batch.reports.front().id, batch.reports.back().id);
  }
  mark_.rejected += rejected;
  mark_.forwarded += count - rejected;
  moveMark(batch);
  parkedInARow_ = 0;
  mostReports_ = std::min(2 * mostReports_, kMostReports);
  pauses_.reset();
  return {};
}

// Halves the batch. It is doubled again whenever one is taken, so that a message that is
// refused costs some twenty requests, and not one for each of its neighbours.
Forwarder::Next Forwarder::refuse(const ReportBatch& batch, std::size_t requestBytes,
                                  const Verdict& verdict) {
  const std::size_t count = batch.reports.size();
  if (count == 1) return park(batch, verdict);
  mostReports_ = count / 2;
  if (verdict.kind == Verdict::Kind::kTooLarge) {
    mostRecordBytes_ = std::min(mostRecordBytes_, requestBytes / 2);
  }
  return {};
}

Forwarder::Next Forwarder::wait(const Verdict& verdict) {
  return later("the collector does not take anything now: " + verdict.reason,
               verdict.pauseAsked);
}

// A failure may be the collector's own, which will pass, or come of a message, which will
// not. It is the message's when it comes every time, though another is taken before and
// it comes once more after that.
Forwarder::Next Forwarder::bearFailure(const ReportBatch& batch,
                                       const std::string& request,
                                       const Verdict& verdict) {
  if (batch.reports.size() > 1) {
    mostReports_ = batch.reports.size() / 2;
    return wait(verdict);
  }
  if (++failuresOfFirst_ < kFailuresOfSuspect || !takesAnother(batch)) {
    return wait(verdict);
  }
  const Verdict again = post(request);
  return again.kind == Verdict::Kind::kBroken ? park(batch, again)
                                              : act(batch, request, again);
}

/// Sends one of the messages that follow. It comes again in its turn.
bool Forwarder::takesAnother(const ReportBatch& batch) {
  constexpr BatchSize kFew{16, kMostTextBytes};
  auto following = parts_.source.reportsAfter(batch.reports.back().id, kFew);
  if (!following.value || following.value->store != batch.store) return false;
  std::vector<Report>& reports = following.value->reports;
  if (reports.empty()) return false;
  const auto drawn = parts_.random.uniform(static_cast<std::uint32_t>(reports.size()));
  const std::string record = logRecordJSON(reports[drawn], batch.store);
  return post(logsRequestJSON(resource_, OSTREL_VERSION, {record})).kind ==
         Verdict::Kind::kTaken;
}

Forwarder::Next Forwarder::park(const ReportBatch& batch, const Verdict& verdict) {
  OSTREL_LOG_ERROR(processLogScope, "the collector refuses the message %lli: %@",
                   batch.reports.front().id, verdict.reason);
  ++mark_.parked;
  moveMark(batch);
  if (++parkedInARow_ <= kParkedAtOnce) return {};
  return later("the collector refuses one message after the other: " + verdict.reason,
               std::nullopt);
}

Forwarder::Next Forwarder::later(const std::string& sentence,
                                 std::optional<milliseconds> asked) {
  if (loggedFault_ != sentence) {
    OSTREL_LOG_ERROR(processLogScope, "%@", sentence);
    loggedFault_ = sentence;
  }
  return {Next::Kind::kPause, pauses_.next(asked)};
}

void Forwarder::moveMark(const ReportBatch& batch) {
  // The store gives its IDs without gaps.
  const std::int64_t dropped = batch.reports.back().id - mark_.through -
                               static_cast<std::int64_t>(batch.reports.size());
  if (dropped > 0) {
    OSTREL_LOG_ERROR(processLogScope,
                     "%lli messages were gone from the store before they could be sent",
                     dropped);
    mark_.dropped += dropped;
  }
  mark_.through = batch.reports.back().id;
  failuresOfFirst_ = 0;
  const Success saved = parts_.marks.save(mark_);
  if (saved.succeeded) {
    loggedMarkFault_.clear();
  } else if (loggedMarkFault_ != saved.error->description) {
    OSTREL_LOG_ERROR(processLogScope, "what follows is sent again after a restart: %@",
                     *saved.error);
    loggedMarkFault_ = saved.error->description;
  }
}

}  // namespace ostrel
