// Life of an operation: it is added to `pending_` and written into the open
// transaction (one begins with the first operation). A commit empties `pending_`.
// Any fault rolls back; `pending_` stays, and `recover` starts again from its
// front, in a new file if the old one was damaged. So an operation is either kept
// here or durable, and written once.
#include "platform/linux/store/StoreWriter.h"

#include <sqlite3.h>

#include <algorithm>
#include <iterator>
#include <new>
#include <type_traits>

#include "platform/Logging.h"
#include "platform/ValueJSON.h"

namespace ostrel {
namespace {

// Rows gathered for one statement.
constexpr std::size_t kRowsAtOnce = 512;
constexpr std::size_t kTextAtOnce = 512 * 1024;
constexpr std::size_t kKnownNames = 4096;

template <typename... Cases>
struct Overloaded : Cases... {
  using Cases::operator()...;
};
template <typename... Cases>
Overloaded(Cases...) -> Overloaded<Cases...>;

// Whether a row of its own came of it.
bool isRow(const StoreOperation& operation) {
  if (const auto* event = std::get_if<AnalyticsEvent>(&operation.what)) {
    return event->payload.has_value();
  }
  return std::holds_alternative<SessionMessage>(operation.what) ||
         std::holds_alternative<LoneMessage>(operation.what) ||
         std::holds_alternative<PowerEvent>(operation.what);
}

// Whose client brought the payload, or caused what brought it.
std::int64_t userOf(const StoreOperation& operation, const Dictionary& payload) {
  const auto& account = payload.owner().account();
  const std::int64_t user = account ? account->user() : PayloadAccount::kNobody;
  return user != PayloadAccount::kNobody ? user : operation.user;
}

std::size_t payloadBytesOf(const StoreBatch& batch) {
  std::size_t bytes = 0;
  for (const StoreOperation& operation : batch) bytes += operation.payloadBytes();
  return bytes;
}

void appendLenientJSON(std::string& out, const Dictionary& value) {
  appendJSON(out, value.value(), JSONLayout::kCompact, JSONStrictness::kLenient,
             /*indent=*/0);
}

}  // namespace

// The texts of one row, added to others. They are taken away again if together they are
// longer than a row's may be.
class StoreWriter::RowTexts {
 public:
  RowTexts(std::string& text, std::size_t most)
      : text_(text), begin_(text.size()), most_(most) {}

  RowText plain(std::string_view piece) {
    return add([&](std::size_t room) {
      if (piece.size() > room) return false;
      text_ += piece;
      return true;
    });
  }
  RowText json(const Dictionary& value) {
    return add([&](std::size_t room) {
      return !appendJSON(text_, value.value(), JSONLayout::kCompact,
                         JSONStrictness::kLenient, /*indent=*/0, room);
    });
  }

  std::string_view of(RowText piece) const {
    return std::string_view(text_).substr(piece.begin, piece.size);
  }
  bool areTooLong() const { return areTooLong_; }

 private:
  template <typename Append>
  RowText add(const Append& append) {
    const std::size_t begin = text_.size();
    if (!areTooLong_) areTooLong_ = !append(most_ - (begin - begin_));
    if (areTooLong_) text_.resize(begin_);
    return {begin, text_.size() - begin, !areTooLong_};
  }

  std::string& text_;
  const std::size_t begin_;
  const std::size_t most_;
  bool areTooLong_ = false;
};

StoreWriter::StoreWriter(std::string path, const char* vfs,
                         const StoreRetention& retention, StoreCounters& counters,
                         StatusCounts otherCounts)
    : database_(std::move(path), vfs),
      retention_(retention),
      counters_(counters),
      otherCounts_(std::move(otherCounts)) {
  fault_ = {StoreFault::Kind::kTransient, SQLITE_CANTOPEN, "the store is not open yet"};
}

void StoreWriter::recover() {
  rollback();
  Result failed = openOrReplace();
  if (!failed) failed = resolveDoubt();
  if (!failed) {
    fault_.reset();
    failed = writePending();
  }
  if (failed) {
    fail(*failed);
  } else if (!loggedFault_.empty()) {
    OSTREL_LOG_DEFAULT(processLogScope, "the store can be used again");
    loggedFault_.clear();
  }
}

StoreWriter::Result StoreWriter::openOrReplace() {
  if (database_.isOpen() && database_.isInPlace()) return std::nullopt;
  Result failed = database_.open();
  if (failed && failed->kind == StoreFault::Kind::kDamaged) {
    if (Result stuck = setAside(*failed)) return stuck;
    failed = database_.open();
  }
  if (!failed && database_.isAnother()) {
    ++file_;
    doubt_.reset();
  }
  return failed;
}

StoreWriter::Result StoreWriter::setAside(const StoreFault& fault) {
  const Result failed = database_.setAside(fault.description);
  if (!failed) counters_.setAside.fetch_add(1, std::memory_order_relaxed);
  return failed;
}

// The commit's frames may have reached the log before the error: then what it held
// must not be written again.
StoreWriter::Result StoreWriter::resolveDoubt() {
  if (!doubt_) return std::nullopt;
  std::int64_t fingerprint = 0;
  if (Result failed = database_.readFingerprint(fingerprint)) return failed;
  if (fingerprint == doubt_->fingerprint) {
    for (const auto& [session, row] : doubt_->rows) {
      session->row = row;
      session->file = file_;
    }
    takeDone(doubt_->batches);
  }
  doubt_.reset();
  return std::nullopt;
}

void StoreWriter::add(std::vector<StoreBatch> batches) {
  for (StoreBatch& batch : batches) {
    uncommittedBytes_ += payloadBytesOf(batch);
    pending_.push_back(std::move(batch));
  }
  if (fault_) return;
  if (const Result failed = writePending()) fail(*failed);
}

StoreWriter::Result StoreWriter::writePending() {
  if (pending_.empty()) return std::nullopt;
  if (!isInTransaction_) {
    if (Result failed = database_.begin()) return failed;
    isInTransaction_ = true;
    if (Result failed = database_.readFingerprint(fingerprintBefore_)) return failed;
    if (Result failed = readInterest()) return failed;
  }
  try {
    for (; written_.batch < pending_.size(); ++written_.batch, written_.operation = 0) {
      StoreBatch& batch = pending_[written_.batch];
      for (; written_.operation < batch.size(); ++written_.operation) {
        if (Result failed = write(batch[written_.operation])) return failed;
        if (Result failed = writeRows(/*evenIfFew=*/false)) return failed;
      }
    }
    return writeRows(/*evenIfFew=*/true);
  } catch (const std::bad_alloc&) {
    return StoreFault{StoreFault::Kind::kTransient, SQLITE_NOMEM, "out of memory"};
  }
}

StoreWriter::Result StoreWriter::write(StoreOperation& operation) {
  const std::int64_t time = operation.time;
  return std::visit(
      Overloaded{[&](SessionMessage& message) { return write(operation, message); },
                 [&](AnalyticsEvent& event) { return write(operation, event); },
                 [&](LoneMessage& message) { return write(operation, message); },
                 [&](PowerEvent& event) { return write(operation, event); },
                 [&](StatusChange&) -> Result { return std::nullopt; },
                 [&](SessionBegin& begin) { return insertSession(*begin.session); },
                 [&](SessionFlush& flush) -> Result {
                   if (Result failed = insertSession(*flush.session)) return failed;
                   return database_.setFlushedAt(flush.session->row, time);
                 },
                 [&](SessionEnd& end) -> Result {
                   if (Result failed = insertSession(*end.session)) return failed;
                   return database_.setEndedAt(end.session->row, time);
                 }},
      operation.what);
}

StoreWriter::Result StoreWriter::write(StoreOperation& operation,
                                       SessionMessage& message) {
  if (Result failed = insertSession(*message.session)) return failed;
  if (operation.user == PayloadAccount::kNobody) operation.user = message.session->user;
  RowTexts texts(rows_.text, retention_.rowBytes);
  MessageRow row;
  row.session = message.session->row;
  addRow(operation, message, texts, row);
  return std::nullopt;
}

StoreWriter::Result StoreWriter::write(StoreOperation& operation,
                                       const LoneMessage& message) {
  RowTexts texts(rows_.text, retention_.rowBytes);
  MessageRow row;
  row.sessionInfo = texts.json(message.sessionInfo);
  row.userInfo = texts.json(message.userInfo);
  addRow(operation, message, texts, row);
  return std::nullopt;
}

template <typename Message>
void StoreWriter::addRow(StoreOperation& operation, const Message& message,
                         RowTexts& texts, MessageRow& row) {
  row.category = message.category;
  row.type = message.type;
  row.payload = texts.json(message.payload);
  row.createdAt = operation.time;
  row.user = userOf(operation, message.payload);
  if (texts.areTooLong()) {
    lose(operation, counters_.lost);
  } else {
    rows_.messages.push_back(row);
  }
}

StoreWriter::Result StoreWriter::write(StoreOperation& operation, AnalyticsEvent& event) {
  if (event.provider) {
    AnalyticsSink::PayloadProvider provider = std::move(event.provider);
    if (!wants(event.name)) return std::nullopt;
    try {
      event.payload = provider();
    } catch (...) {
      counters_.droppedAnalytics.fetch_add(1, std::memory_order_relaxed);
      OSTREL_LOG_ERROR(processLogScope, "no payload for the analytics event %@",
                       event.name);
    }
    if (event.payload) uncommittedBytes_ += event.payload->value().bytes().size();
  }
  if (!event.payload) return std::nullopt;
  RowTexts texts(rows_.text, retention_.rowBytes);
  AnalyticsRow row;
  row.name = texts.plain(event.name);
  row.payload = texts.json(*event.payload);
  row.createdAt = operation.time;
  row.user = userOf(operation, *event.payload);
  if (texts.areTooLong()) {
    lose(operation, counters_.droppedAnalytics);
  } else {
    rows_.analytics.push_back(row);
  }
  return std::nullopt;
}

StoreWriter::Result StoreWriter::write(StoreOperation& operation,
                                       const PowerEvent& event) {
  text_.clear();
  RowTexts texts(text_, retention_.rowBytes);
  const RowText name = texts.plain(event.name);
  const RowText content = texts.json(event.event);
  RowText attachment;
  if (event.attachment) attachment = texts.json(*event.attachment);
  if (texts.areTooLong()) {
    lose(operation, counters_.droppedPower);
    return std::nullopt;
  }
  StoreDatabase::PowerRow row;
  row.clientID = event.clientID;
  row.name = texts.of(name);
  row.event = texts.of(content);
  if (event.attachment) row.attachment = texts.of(attachment);
  row.createdAt = operation.time;
  row.user = userOf(operation, event.event);
  Result failed = database_.insertPowerEvent(row);
  emptyText(text_);
  return failed;
}

// Not tried again: nothing is left of it.
void StoreWriter::lose(StoreOperation& operation, std::atomic<std::uint64_t>& counter) {
  OSTREL_LOG_ERROR(processLogScope,
                   "a row is lost: its texts are longer than the %llu bytes that the "
                   "store takes of one",
                   retention_.rowBytes);
  counter.fetch_add(1, std::memory_order_relaxed);
  uncommittedBytes_ -= std::min(uncommittedBytes_, operation.payloadBytes());
  operation.what = StatusChange();
  emptyText(text_);
  if (rows_.empty()) rows_.clear();
}

StoreWriter::Result StoreWriter::insertSession(StoreSession& session) {
  if (session.row != 0 && session.file == file_) return std::nullopt;
  text_.clear();
  appendLenientJSON(text_, session.sessionInfo);
  const std::size_t end = text_.size();
  appendLenientJSON(text_, session.userInfo);
  const std::string_view text(text_);
  StoreDatabase::SessionRow row;
  if (const auto id = session.sessionInfo.find(kTelvarSessionInfoSessionID)) {
    row.reporterID = id->signedInteger();
  }
  if (const auto token = session.sessionInfo.find(kTelvarSessionInfoHierarchyToken)) {
    row.hierarchyToken = token->string();
  }
  row.sessionInfo = text.substr(0, end);
  row.userInfo = text.substr(end);
  row.startedAt = session.startedAt;
  row.user = session.user;
  if (Result failed = database_.insertSession(row, session.row)) {
    session.row = 0;
    return failed;
  }
  session.file = file_;
  uncommittedSessions_.push_back(&session);
  return std::nullopt;
}

StoreWriter::Result StoreWriter::writeRows(bool evenIfFew) {
  const std::size_t count = rows_.messages.size() + rows_.analytics.size();
  if (count == 0) return std::nullopt;
  if (!evenIfFew && count < kRowsAtOnce && rows_.text.size() < kTextAtOnce) {
    return std::nullopt;
  }
  const Result failed = database_.insertRows(rows_);
  rows_.clear();
  return failed;
}

std::vector<StoreBatch> StoreWriter::commit() {
  if (fault_ || pending_.empty()) return {};
  DoubtfulCommit made{0, pending_.size(), {}};
  Result failed = database_.noteOwners();
  if (!failed) failed = removeOld();
  if (!failed) failed = writeStatus();
  if (!failed) failed = database_.readFingerprint(made.fingerprint);
  if (failed) {
    fail(*failed);
    return {};
  }
  failed = database_.commit();
  if (!failed && !database_.isInPlace()) {
    failed = StoreFault{StoreFault::Kind::kTransient, SQLITE_IOERR,
                        "the store's file was moved or removed"};
  }
  if (failed) {
    for (StoreSession* session : uncommittedSessions_) {
      made.rows.emplace_back(session, session->row);
    }
    // What inserts nothing is written again, whether it was there or not.
    if (made.fingerprint != fingerprintBefore_) doubt_ = std::move(made);
    fail(*failed);
    return {};
  }
  isInTransaction_ = false;
  uncommittedSessions_.clear();
  return takeDone(pending_.size());
}

// Completes the flushes of the first batches and takes these out, emptied.
std::vector<StoreBatch> StoreWriter::takeDone(std::size_t batches) {
  std::vector<StoreBatch> done;
  done.swap(pending_);
  pending_.assign(
      std::make_move_iterator(done.begin() + static_cast<std::ptrdiff_t>(batches)),
      std::make_move_iterator(done.end()));
  done.resize(batches);
  written_ = {};
  std::uint64_t rows = 0;
  for (const StoreBatch& batch : done) {
    for (const StoreOperation& operation : batch) {
      uncommittedBytes_ -= std::min(uncommittedBytes_, operation.payloadBytes());
      if (isRow(operation)) ++rows;
    }
  }
  counters_.written.fetch_add(rows, std::memory_order_relaxed);
  completeFlushes(done, std::nullopt);
  for (StoreBatch& batch : done) batch.clear();
  return done;
}

StoreWriter::Result StoreWriter::writeStatus() {
  std::vector<StatusCount> rare = {
      {"refused", counters_.refused.load(std::memory_order_relaxed)},
      {"lost", counters_.lost.load(std::memory_order_relaxed)},
      {"dropped_analytics", counters_.droppedAnalytics.load(std::memory_order_relaxed)},
      {"dropped_power", counters_.droppedPower.load(std::memory_order_relaxed)},
      {"failures", counters_.failures.load(std::memory_order_relaxed)},
      {"set_aside", counters_.setAside.load(std::memory_order_relaxed)},
  };
  if (otherCounts_) {
    const std::vector<StatusCount> others = otherCounts_();
    rare.insert(rare.end(), others.begin(), others.end());
  }
  std::uint64_t sum = 1;
  for (const auto& [key, value] : rare) sum += value;
  if (sum == writtenStatus_) return std::nullopt;
  if (Result failed = database_.nameStore()) return failed;
  for (const auto& [key, value] : rare) {
    if (Result failed = database_.setStatus(key, static_cast<std::int64_t>(value))) {
      return failed;
    }
  }
  writtenStatus_ = sum;
  return std::nullopt;
}

// Removes at least twice as much as comes, so that the bound holds under any load,
// and not so much at once that others wait for it.
StoreWriter::Result StoreWriter::removeOld() {
  constexpr std::int64_t kLeast = 1000;
  constexpr std::int64_t kHour = 3'600'000'000;
  std::int64_t coming = 0;
  for (const StoreBatch& batch : pending_) {
    coming += static_cast<std::int64_t>(batch.size());
    newestTime_ = std::max(newestTime_, batch.back().time);
  }
  const std::int64_t rows = std::max(kLeast, 2 * coming);
  std::int64_t removed = 0;
  if (Result failed = makeRoom(rows, removed)) return failed;
  if (newestTime_ >= nextAgeCheck_) {
    std::int64_t old = 0;
    const std::int64_t before = newestTime_ - retention_.age.count();
    if (Result failed = database_.removeOldest(rows, before, old)) return failed;
    if (Result failed = database_.forgetOwnersOfRemoved()) return failed;
    if (old == 0) nextAgeCheck_ = newestTime_ + kHour;
    removed += old;
  }
  return removed == 0 ? std::nullopt : database_.addToStatus("removed", removed);
}

StoreWriter::Result StoreWriter::makeRoom(std::int64_t rows, std::int64_t& removed) {
  StoreDatabase::Room room;
  if (Result failed = database_.readRoom(room)) return failed;
  // Beyond what comes, since a part of what is free is in pages of other tables.
  const auto coming = static_cast<std::int64_t>(2 * uncommittedBytes_ + kTextAtOnce);
  const bool mustNotGrow = room.used > retention_.bytesInNeed && room.free < coming &&
                           StoreDatabase::isScarce(room.diskAvailable, room.diskBytes,
                                                   retention_.percentKeptFree);
  if (room.used <= retention_.bytes && !mustNotGrow) return std::nullopt;
  if (Result failed = database_.removeOfLargestOwner(rows, removed)) return failed;
  if (removed != 0) return std::nullopt;
  // Nobody owns what there is.
  if (Result failed = database_.removeOldest(rows, std::nullopt, removed)) return failed;
  return database_.forgetOwnersOfRemoved();
}

StoreWriter::Result StoreWriter::readInterest() {
  std::optional<std::vector<std::string>> patterns;
  if (Result failed = database_.readInterestIfChanged(patterns)) return failed;
  if (!patterns) return std::nullopt;
  wantedPatterns_ = std::move(*patterns);
  wantedNames_.clear();
  wantsAll_ = false;
  for (const std::string& pattern : wantedPatterns_) wantsAll_ |= pattern == "*";
  return std::nullopt;
}

bool StoreWriter::wants(const std::string& name) {
  if (wantsAll_) return true;
  if (const auto known = wantedNames_.find(name); known != wantedNames_.end()) {
    return known->second;
  }
  bool isWanted = false;
  for (const std::string& pattern : wantedPatterns_) {
    isWanted |= StoreDatabase::matches(pattern, name);
  }
  if (wantedNames_.size() < kKnownNames) wantedNames_.emplace(name, isWanted);
  return isWanted;
}

void StoreWriter::fail(const StoreFault& fault) {
  counters_.failures.fetch_add(1, std::memory_order_relaxed);
  rollback();
  fault_ = fault;
  if (loggedFault_ != fault.description) {
    OSTREL_LOG_ERROR(processLogScope, "the store cannot be used: %@", fault.description);
    loggedFault_ = fault.description;
  }
  if (fault.kind == StoreFault::Kind::kDamaged) {
    setAside(fault);
    return;
  }
  switch (fault.code & 0xFF) {
    case SQLITE_FULL:
    case SQLITE_BUSY:
    case SQLITE_LOCKED:
    case SQLITE_NOMEM:
      break;  // The connection is sound.
    default:
      database_.close();
      break;
  }
}

void StoreWriter::rollback() {
  database_.rollback();
  isInTransaction_ = false;
  written_ = {};
  rows_.clear();
  writtenStatus_ = 0;
  for (StoreSession* session : uncommittedSessions_) session->row = 0;
  uncommittedSessions_.clear();
}

void StoreWriter::failFlushes() {
  if (fault_) completeFlushes(pending_, errorOf(*fault_));
}

void StoreWriter::completeFlushes(std::vector<StoreBatch>& batches,
                                  const std::optional<ErrorObject>& error) {
  for (StoreBatch& batch : batches) {
    for (StoreOperation& operation : batch) {
      auto* flush = std::get_if<SessionFlush>(&operation.what);
      if (flush != nullptr && flush->completion) {
        std::exchange(flush->completion, nullptr)(error);
      }
    }
  }
}

void StoreWriter::keepAtMost(std::size_t count) {
  std::size_t kept = 0;
  for (const StoreBatch& batch : pending_) kept += batch.size();
  std::size_t batches = 0;
  for (; kept > count && batches < pending_.size(); ++batches) {
    kept -= pending_[batches].size();
    counters_.lost.fetch_add(pending_[batches].size(), std::memory_order_relaxed);
  }
  if (batches == 0) return;
  if (doubt_) leaveOutOfDoubt(batches);
  pending_.erase(pending_.begin(),
                 pending_.begin() + static_cast<std::ptrdiff_t>(batches));
  uncommittedBytes_ = 0;
  for (const StoreBatch& batch : pending_) uncommittedBytes_ += payloadBytesOf(batch);
}

// The first batches, which are given up. The others are not written again if the commit
// was made.
void StoreWriter::leaveOutOfDoubt(std::size_t batches) {
  doubt_->batches -= std::min(doubt_->batches, batches);
  for (std::size_t i = 0; i < batches; ++i) {
    for (const StoreOperation& operation : pending_[i]) {
      const auto* const end = std::get_if<SessionEnd>(&operation.what);
      if (end == nullptr) continue;
      std::erase_if(doubt_->rows,
                    [&](const auto& row) { return row.first == end->session.get(); });
    }
  }
}

ErrorObject StoreWriter::errorOf(const StoreFault& fault) {
  return {std::string(kOstrelErrorDomain), fault.code, fault.description};
}

}  // namespace ostrel
