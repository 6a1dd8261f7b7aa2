// One thread a client. A call appends its frame to the queue under a lock that
// is only ever held for memory work and at most one non-blocking write; the
// thread swaps the queue with the buffer that it writes from, so that a burst
// of calls costs few writes.
//
// While the thread sleeps, a call that comes alone writes its frame itself and
// wakes nobody; a call close behind another one wakes the thread, and from then
// on calls only append until the thread has written everything and sleeps
// again. Audio threads never take part in this: the thread looks into their
// rings by the clock.
//
// A loss of the service drops what was not written, ends all open requests and
// starts over. What is queued afterwards waits for the next connection.
#include "client/ClientCore.h"

#include <pthread.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <random>
#include <span>
#include <system_error>
#include <utility>

#include "client/ServiceConnection.h"
#include "platform/linux/Limits.h"

namespace ostrel::reporting {
namespace {

using std::chrono::milliseconds;

constexpr milliseconds kFirstBackOff{10};
constexpr milliseconds kLongestBackOff{5'000};

// A connection that lived so long, or gave a reply, was a good one.
constexpr std::chrono::seconds kGoodConnection{5};

// Calls closer together than this go through the thread.
constexpr std::chrono::microseconds kCalm{10};

// How long the thread that is woken for a request waits for more of them, so that a burst
// goes with one call. Else the two took ten turns with each burst of 250 messages of one
// of a thousand clients (500 ns a message).
constexpr std::chrono::microseconds kBurst{20};

// A ring that gave nothing so often in a row is looked into less often.
constexpr unsigned kQuietDrains = 64;
constexpr unsigned kMostRingPeriods = 8;

constexpr std::size_t kReadSize = 64 * 1024;
constexpr int kReadsInATurn = 16;
// Then the thread looks for replies.
constexpr int kWritesInARow = 4;

// Buffers beyond it are given back when there is nothing to do.
constexpr std::size_t kKeptBufferBytes = 256 * 1024;

// How much later than its deadline `close` still waits for a handler that runs.
constexpr milliseconds kHandlerGrace{100};

constexpr wire::PayloadLimits kReplyLimits{limits::kNesting, limits::kNodes,
                                           limits::kKeyBytes};

// Up to 45 % shorter than told, so that a thousand clients do not come back at
// once.
ClientCore::Clock::duration withJitter(ClientCore::Clock::duration time) {
  thread_local std::minstd_rand random(static_cast<std::minstd_rand::result_type>(
      ClientCore::Clock::now().time_since_epoch().count() ^ ::getpid()));
  return time * (55 + static_cast<int>(random() % 46)) / 100;
}

std::size_t countFrames(std::string_view frames, std::size_t written) {
  std::size_t count = 0;
  std::size_t at = 0;
  while (at + wire::kFrameHeaderSize <= frames.size()) {
    at += wire::kFrameHeaderSize +
          wire::frameLength(reinterpret_cast<const std::uint8_t*>(frames.data()) + at);
    if (at > written) ++count;
  }
  return count;
}

}  // namespace

ClientCore::ClientCore(Options options)
    : options_(std::move(options)),
      socketPath_(options_.socketPath.empty() ? serviceSocketPath()
                                              : options_.socketPath),
      generation_(ForkGuard::generation()),
      reader_(limits::kFrameBytes),
      backOff_(kFirstBackOff) {
  ForkGuard::add(this);
}

ClientCore::~ClientCore() { ForkGuard::remove(this); }

void ClientCore::start() {
  const std::lock_guard lock(mutex_);
  auto sleep = ClientSleep::make();
  sigset_t all;
  sigset_t before;
  sigfillset(&all);
  // The host's signal handlers have no business on this thread.
  pthread_sigmask(SIG_SETMASK, &all, &before);
  try {
    if (sleep.value) {
      sleep_ = std::move(sleep.value);
      thread_ = std::thread([self = shared_from_this()] { self->run(); });
    }
  } catch (const std::system_error&) {
  }
  pthread_sigmask(SIG_SETMASK, &before, nullptr);
  if (thread_.joinable()) {
    threadID_ = thread_.get_id();
    pthread_setname_np(thread_.native_handle(), "ostrel-client");
  } else {
    phase_ = Phase::kEnded;
    isFinished_ = true;
  }
}

Submission ClientCore::refuseInvalid() {
  if (!isOfThisProcess()) return Submission::kClosed;
  const std::lock_guard lock(mutex_);
  return refuse(phase_ == Phase::kOpen ? Submission::kInvalid : Submission::kClosed);
}

Submission ClientCore::refuse(Submission reason) {
  ++counts_.droppedRequests;
  return reason;
}

PendingRequests::TimePoint ClientCore::deadlineAfter(
    const std::optional<milliseconds>& timeout) const {
  const milliseconds time = timeout.value_or(options_.replyTimeout);
  constexpr milliseconds kForEver = std::chrono::hours(24 * 365);
  if (time <= milliseconds::zero() || time > kForEver) return Clock::time_point::max();
  return Clock::now() + time;
}

void ClientCore::afterQueueing(bool wasEmpty, PendingRequests::TimePoint deadline) {
  if (!isAsleep_ || isOwnThread()) return;
  if (isConnected_ && !isBlocked_) {
    const auto now = Clock::now();
    if (wasEmpty && now - lastDirectSend_ >= kCalm) {
      lastDirectSend_ = now;
      sendDirectly();
    }
    if (!queue_.empty()) {
      awaitsBurst_ = true;
      wake();
    }
  }
  if (deadline < sleepsUntil_) wake();
}

void ClientCore::sendDirectly() {
  const auto sent = socket_.send(queue_);
  if (!sent) return;  // The thread finds the connection broken.
  bytesWritten_ += *sent;
  queueSent_ = *sent;
  if (queueSent_ == queue_.size()) {
    queue_.clear();
    queueSent_ = 0;
  }
}

void ClientCore::wake() {
  if (!isAsleep_) return;
  isAsleep_ = false;
  sleep_->wake();
}

void ClientCore::addRing(std::shared_ptr<AudioSender::Ring> ring) {
  if (!isOfThisProcess()) return;
  const std::lock_guard lock(mutex_);
  if (phase_ == Phase::kEnded) return;
  newRings_.push_back(std::move(ring));
  wake();
}

void ClientCore::wakeForRings() {
  if (!isOfThisProcess()) return;
  const std::lock_guard lock(mutex_);
  if (phase_ == Phase::kEnded) return;
  ringsWanted_ = true;
  wake();
}

bool ClientCore::flush(milliseconds timeout) {
  if (!isOfThisProcess()) return false;
  const auto deadline =
      Clock::now() + std::min<milliseconds>(timeout, std::chrono::hours(24));
  std::unique_lock lock(mutex_);
  if (phase_ == Phase::kEnded || isOwnThread()) return false;
  const std::uint64_t look = ++looksWanted_;
  const std::uint64_t losses = losses_;
  wake();
  const auto isOver = [&] { return phase_ == Phase::kEnded || losses_ != losses; };
  if (!changed_.wait_until(lock, deadline,
                           [&] { return isOver() || looksDone_ >= look; })) {
    return false;
  }
  const std::uint64_t bytes = bytesQueued_;
  return changed_.wait_until(lock, deadline, [&] {
    return isOver() || bytesWritten_ >= bytes;
  }) && !isOver();
}

void ClientCore::close() {
  if (!isOfThisProcess()) return;
  std::unique_lock lock(mutex_);
  if (phase_ == Phase::kOpen) {
    phase_ = Phase::kClosing;
    closeDeadline_ = Clock::now() + std::max(options_.closeTimeout, milliseconds::zero());
    wake();
  }
  if (!isOwnThread()) {
    changed_.wait_until(lock, closeDeadline_ + kHandlerGrace,
                        [&] { return isFinished_; });
  }
  // What the thread has not told is told here: it may be this one, or be held up by a
  // handler or by a machine that is busy, and no handler is called later.
  isSilent_ = true;
  endAll(Status::kClosed);
  std::thread thread = std::move(thread_);
  const bool isFinished = isFinished_;
  lock.unlock();
  tellEndings();
  if (!thread.joinable()) return;
  isFinished ? thread.join() : thread.detach();
}

// With the lock.
void ClientCore::endAll(Status status) {
  for (Handler& handler : pending_.takeAll()) {
    endings_.push_back({std::move(handler), status});
  }
}

// The endings are taken one by one, so that `close` may tell those that are left.
void ClientCore::tellEndings() {
  while (true) {
    Ending ending;
    {
      const std::lock_guard lock(mutex_);
      if (endings_.empty()) return;
      ending = std::move(endings_.front());
      endings_.pop_front();
    }
    callHandler(ending.handler, ending.status);
  }
}

bool ClientCore::isConnected() const {
  if (!isOfThisProcess()) return false;
  const std::lock_guard lock(mutex_);
  return isConnected_;
}

Counts ClientCore::counts() const {
  if (!isOfThisProcess()) return {};
  const std::lock_guard lock(mutex_);
  return counts_;
}

void ClientCore::closeInChild() noexcept {
  socket_.close();
  if (sleep_) sleep_->close();
}

void ClientCore::run() {
  {
    // The thread that made this one has set `threadID_` when it lets go.
    const std::lock_guard lock(mutex_);
  }
  while (takeTurn()) {
  }
  if (isOfThisProcess()) finish();
}

// False when the client is over.
bool ClientCore::takeTurn() {
  if (std::exchange(hasExpired_, false)) endExpired();
  if (!socket_) connectIfDue();
  const Written written = socket_ ? writeOut() : Written::kAll;
  if (written == Written::kBroken) {
    readReplies();  // What the service still said.
    if (socket_) connectionLost("the service went away");
    return isOfThisProcess();
  }
  if (!isOfThisProcess()) return false;  // A handler forked, and this is the child.

  Clock::time_point until;
  {
    const std::lock_guard lock(mutex_);
    countWritten();
    if (isClosingDone()) return false;
    until = nextTurn(written);
    const bool hasMore = until == Clock::time_point::min();
    if (hasMore && ++writesInARow_ < kWritesInARow) return true;
    isAsleep_ = true;
    isBlocked_ = written == Written::kBlocked;
    sleepsUntil_ = sleep_->endOfWait(until);
  }
  writesInARow_ = 0;
  sleep_->wait(until, socket_ ? socket_.descriptor() : -1,
               /*wantsToWrite=*/written == Written::kBlocked);
  bool awaitsBurst;
  {
    const std::lock_guard lock(mutex_);
    isAsleep_ = false;
    awaitsBurst = std::exchange(awaitsBurst_, false);
    const auto deadline = pending_.nextDeadline();
    hasExpired_ = deadline != Clock::time_point::max() && deadline <= Clock::now();
  }
  if (awaitsBurst) std::this_thread::sleep_for(kBurst);
  if (socket_) readReplies();
  return isOfThisProcess();
}

void ClientCore::connectIfDue() {
  {
    const std::lock_guard lock(mutex_);
    const bool isLastChance = phase_ == Phase::kClosing && hasAnythingToSend();
    if (!isLastChance && Clock::now() < nextAttempt_) return;
    if (phase_ == Phase::kClosing) hasTriedToClose_ = true;
  }
  std::string reason;
  {
    const auto noFork = ForkGuard::lock();
    auto socket = ClientSocket::connect(socketPath_);
    if (socket.value && sleep_->watch(socket.value->descriptor())) {
      connected(std::move(*socket.value));
    } else {
      reason =
          socket.error ? socket.error->description : "a connection cannot be watched";
    }
  }
  if (socket_) {
    tellConnection(/*isConnected=*/true, /*reason=*/{});
    return;
  }
  if (reason != lastConnectError_) {
    lastConnectError_ = reason;
    tellConnection(/*isConnected=*/false, reason);
  }
  nextAttempt_ = Clock::now() + withJitter(backOff_);
  backOff_ = std::min<Clock::duration>(backOff_ * 2, kLongestBackOff);
}

void ClientCore::connected(ClientSocket socket) {
  connectedAt_ = Clock::now();
  hasReplied_ = false;
  lastConnectError_.clear();
  reader_ = wire::FrameReader(limits::kFrameBytes);
  std::string restoration;
  const std::lock_guard lock(mutex_);
  sessionsToRestore_.appendRequests(restoration);
  queue_.insert(0, restoration);
  bytesQueued_ += restoration.size();
  socket_ = std::move(socket);
  isConnected_ = true;
  ++counts_.connections;
}

// `unanswered` is told with all requests that are open; it may be empty.
void ClientCore::connectionLost(const std::string& reason, Handler unanswered) {
  bool isExpected;
  {
    const auto noFork = ForkGuard::lock();
    const std::lock_guard lock(mutex_);
    isExpected = phase_ != Phase::kOpen;
    sleep_->forget(socket_.descriptor());
    socket_.close();
    isConnected_ = false;
    ++losses_;
    counts_.droppedRequests +=
        countFrames(writing_, writingBegin_) + countFrames(queue_, queueSent_);
    bytesWritten_ = bytesQueued_;
    queue_.clear();
    queueSent_ = 0;
    sessionsToRestore_ = sessions_;
    const Status status = isExpected ? Status::kClosed : Status::kConnectionLost;
    endings_.push_back({std::move(unanswered), status});
    endAll(status);
    changed_.notify_all();
  }
  writing_.clear();
  writingBegin_ = 0;
  writingBytes_ = 0;
  uncountedBytes_ = 0;
  const auto now = Clock::now();
  if (hasReplied_ || now - connectedAt_ >= kGoodConnection) backOff_ = kFirstBackOff;
  nextAttempt_ = now + withJitter(backOff_);
  backOff_ = std::min<Clock::duration>(backOff_ * 2, kLongestBackOff);
  tellEndings();
  if (!isExpected) tellConnection(/*isConnected=*/false, reason);
}

ClientCore::Written ClientCore::writeOut() {
  if (writingBegin_ == writing_.size()) refill();
  while (writingBegin_ < writing_.size()) {
    const auto sent = socket_.send(std::string_view(writing_).substr(writingBegin_));
    if (!sent) return Written::kBroken;
    if (*sent == 0) return Written::kBlocked;
    writingBegin_ += *sent;
    writingBytes_ = writing_.size() - writingBegin_;
    uncountedBytes_ += *sent;
  }
  return Written::kAll;
}

// With the lock. What was written since the last count; whoever waits for a flush hears
// of it, also when the rest has to wait.
void ClientCore::countWritten() {
  if (uncountedBytes_ == 0) return;
  bytesWritten_ += std::exchange(uncountedBytes_, 0);
  changed_.notify_all();
}

// Takes what is queued.
void ClientCore::refill() {
  writing_.clear();
  writingBegin_ = 0;
  std::uint64_t looksWanted;
  bool isLastLook;
  bool isQueueAll;  // That there is to take.
  {
    const std::lock_guard lock(mutex_);
    queue_.swap(writing_);
    writingBegin_ = std::exchange(queueSent_, 0);
    rings_.insert(rings_.end(), newRings_.begin(), newRings_.end());
    looksWanted = looksWanted_;
    isLastLook = phase_ != Phase::kOpen;
    if (isLastLook || ringsWanted_ || !newRings_.empty() || looksWanted != looksDone_) {
      nextRingLook_ = Clock::time_point::min();
    }
    newRings_.clear();
    ringsWanted_ = false;
    isQueueAll = rings_.empty() && !isLastLook;
    if (isQueueAll) {
      nextRingLook_ = Clock::time_point::max();
      looksDone_ = looksWanted;
      writingBytes_ = writing_.size() - writingBegin_;
    }
  }
  const std::size_t queued = writing_.size();
  if (queued == 0 && writing_.capacity() > kKeptBufferBytes) std::string().swap(writing_);
  if (isQueueAll) {
    changed_.notify_all();
    return;
  }
  if (Clock::now() >= nextRingLook_) drainRings();
  if (isLastLook && !std::exchange(hasSaidFarewell_, true)) {
    rings_.clear();
    wire::appendFarewell(writing_);
  }
  writingBytes_ = writing_.size() - writingBegin_;
  {
    const std::lock_guard lock(mutex_);
    bytesQueued_ += writing_.size() - queued;
    looksDone_ = looksWanted;
  }
  changed_.notify_all();
}

void ClientCore::drainRings() {
  auto wait = Clock::duration::max();
  for (auto& ring : rings_) {
    const bool isAbandoned = ring->isAbandoned.load(std::memory_order_acquire);
    const std::size_t size = ring->drainInto(writing_);
    ring->quietDrains = size != 0 ? 0 : ring->quietDrains + 1;
    if (isAbandoned) {
      ring.reset();
      continue;
    }
    if (!ring->isArmed.load(std::memory_order_relaxed)) continue;
    const unsigned slower =
        std::min(1 + ring->quietDrains / kQuietDrains, kMostRingPeriods);
    wait = std::min<Clock::duration>(wait, ring->period * slower);
    // A ring that fills fast is looked into again at once.
    if (size >= ring->capacity() / 16) wait = Clock::duration::zero();
  }
  rings_.erase(std::remove(rings_.begin(), rings_.end(), nullptr), rings_.end());
  nextRingLook_ = wait == Clock::duration::max()    ? Clock::time_point::max()
                  : wait == Clock::duration::zero() ? Clock::time_point::min()
                                                    : Clock::now() + wait;
}

void ClientCore::readReplies() {
  for (int reads = 0; socket_ && reads < kReadsInATurn; ++reads) {
    std::size_t size = 0;
    switch (socket_.receive(reader_.room(kReadSize), size)) {
      case ClientSocket::Received::kNothingYet:
        return;
      case ClientSocket::Received::kEnd:
        return connectionLost("the service went away");
      case ClientSocket::Received::kBytes:
        break;
    }
    reader_.added(size);
    if (!readFrames()) return;
    if (size < kReadSize) return;
  }
}

// False when the connection is over.
bool ClientCore::readFrames() {
  std::span<const std::uint8_t> item;
  while (true) {
    switch (reader_.next(item)) {
      case wire::FrameReader::Next::kMoreNeeded:
        return true;
      case wire::FrameReader::Next::kTooLarge:
      case wire::FrameReader::Next::kEmpty:
        connectionLost("the service sent a frame of an impossible length");
        return false;
      case wire::FrameReader::Next::kFrame:
        break;
    }
    if (!takeReply(item)) return false;
    if (!isOfThisProcess()) return false;
  }
}

bool ClientCore::takeReply(std::span<const std::uint8_t> item) {
  using wire::Operation;
  PendingRequests::Answered answered;
  wire::Reply reply;
  const auto error = wire::decodeReply(
      item, kReplyLimits,
      [&](wire::RequestNumber number) -> std::optional<Operation> {
        const std::lock_guard lock(mutex_);
        pending_.takeForReply(number, answered);
        if (isSilent_) answered.handler = {};
        return answered.operation;
      },
      reply);
  // Nobody waits for it any more.
  if (answered.operation == Operation::kFarewell) return true;
  if (error) {
    if (!answered.isFirst) answered.handler = {};
    connectionLost("the service sent a malformed reply: " + std::string(*error),
                   std::move(answered.handler));
    return false;
  }
  if (reply.number == 0) {
    connectionLost(reply.closingReason.empty() ? "the service closed the connection"
                                               : reply.closingReason);
    return false;
  }
  hasReplied_ = true;
  if (callHandler(answered.handler, reply.value)) return true;
  callHandler(answered.handler, Status::kConnectionLost);
  connectionLost("the service sent a reply of the wrong kind");
  return false;
}

void ClientCore::endExpired() {
  {
    const std::lock_guard lock(mutex_);
    for (Handler& handler : pending_.takeExpired(Clock::now())) {
      endings_.push_back({std::move(handler), Status::kTimedOut});
      ++counts_.timedOutRequests;
    }
  }
  tellEndings();
}

void ClientCore::tellConnection(bool isConnected, const std::string& reason) {
  {
    const std::lock_guard lock(mutex_);
    if (isSilent_) return;
  }
  try {
    if (options_.onConnection) options_.onConnection(isConnected, reason);
  } catch (...) {
    // As with replies: the host's failure stays the host's.
  }
}

// With the lock. Once the farewell is written, the service ends the connection.
bool ClientCore::isClosingDone() const {
  if (phase_ == Phase::kOpen) return false;
  if (phase_ == Phase::kEnded || Clock::now() >= closeDeadline_) return true;
  return !isConnected_ && (hasTriedToClose_ || !hasAnythingToSend());
}

// With the lock.
bool ClientCore::hasAnythingToSend() const {
  return !queue_.empty() || !rings_.empty() || !newRings_.empty();
}

// With the lock.
ClientCore::Clock::time_point ClientCore::nextTurn(Written written) const {
  if (isConnected_ && written != Written::kBlocked &&
      (!queue_.empty() || !newRings_.empty() || ringsWanted_ ||
       looksWanted_ != looksDone_)) {
    return Clock::time_point::min();
  }
  auto next = std::min(pending_.nextDeadline(), closeDeadline_);
  if (!isConnected_) next = std::min(next, nextAttempt_);
  if (isConnected_ && written != Written::kBlocked) next = std::min(next, nextRingLook_);
  return next;
}

void ClientCore::finish() {
  {
    const auto noFork = ForkGuard::lock();
    const std::lock_guard lock(mutex_);
    phase_ = Phase::kEnded;
    counts_.droppedRequests +=
        countFrames(writing_, writingBegin_) + countFrames(queue_, queueSent_);
    socket_.close();
    isConnected_ = false;
    queue_.clear();
    endAll(Status::kClosed);
  }
  rings_.clear();
  tellEndings();
  const std::lock_guard lock(mutex_);
  newRings_.clear();
  isFinished_ = true;
  changed_.notify_all();
}

}  // namespace ostrel::reporting
