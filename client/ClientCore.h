#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "client/AudioRing.h"
#include "client/ClientSleep.h"
#include "client/ClientSocket.h"
#include "client/ForkGuard.h"
#include "client/PendingRequests.h"
#include "client/RestorableSessions.h"
#include "ostrel/OstrelReportingClient.h"
#include "platform/linux/Limits.h"
#include "platform/linux/wire/Frame.h"

namespace ostrel::reporting {

/// What is behind a `Client`: the queue of its requests, and the thread that
/// reaches the service, writes, reads replies and calls handlers.
class ClientCore final : public ForkAware,
                         public std::enable_shared_from_this<ClientCore> {
 public:
  using Clock = std::chrono::steady_clock;
  using Replies = PendingRequests::Replies;

  explicit ClientCore(Options options);
  ~ClientCore() override;

  /// Starts the thread. Without a thread or a descriptor to be had, the client
  /// is closed from the start.
  void start();

  /// Queues one request. `append` writes its frame, given the string to write to
  /// and the request's number; `note` records it for a restoration. Both run at
  /// once, with the lock.
  template <typename Append, typename Note>
  Submission submit(wire::Operation operation, Handler&& handler, Replies replies,
                    const std::optional<std::chrono::milliseconds>& timeout,
                    const Append& append, const Note& note);

  /// Counts a request that could never be sent.
  Submission refuseInvalid();

  void addRing(std::shared_ptr<AudioSender::Ring> ring);
  /// Has the rings looked into now.
  void wakeForRings();

  bool flush(std::chrono::milliseconds timeout);
  void close();

  bool isConnected() const;
  Counts counts() const;

  /// Whether this process made it, rather than a parent.
  bool isOfThisProcess() const { return generation_ == ForkGuard::generation(); }

 private:
  enum class Phase { kOpen, kClosing, kEnded };

  void closeInChild() noexcept override;

  // A request that is over, whose handler is still to be told.
  struct Ending {
    Handler handler;
    Status status;
  };

  // On any thread, with the lock.
  Submission refuse(Submission reason);
  void endAll(Status status);
  PendingRequests::TimePoint deadlineAfter(
      const std::optional<std::chrono::milliseconds>& timeout) const;
  bool isOwnThread() const { return std::this_thread::get_id() == threadID_; }
  void afterQueueing(bool wasEmpty, PendingRequests::TimePoint deadline);
  void sendDirectly();
  void wake();

  // On the client's thread.
  void run();
  bool takeTurn();
  void connectIfDue();
  void connected(ClientSocket socket);
  void connectionLost(const std::string& reason, Handler unanswered = {});
  enum class Written { kAll, kBlocked, kBroken };
  Written writeOut();
  void countWritten();
  void refill();
  void drainRings();
  void readReplies();
  bool readFrames();
  bool takeReply(std::span<const std::uint8_t> item);
  void endExpired();
  void tellEndings();
  void tellConnection(bool isConnected, const std::string& reason);
  bool isClosingDone() const;
  bool hasAnythingToSend() const;
  Clock::time_point nextTurn(Written written) const;
  void finish();

  // Constant after construction.
  const Options options_;
  const std::string socketPath_;
  const std::uint64_t generation_;

  // On the client's thread.
  wire::FrameReader reader_;
  std::string writing_;  // Taken from the queue and the rings, from frame to frame.
  std::size_t writingBegin_ = 0;
  std::size_t uncountedBytes_ = 0;  // Written, and not in `bytesWritten_` yet.
  int writesInARow_ = 0;            // Without a look for replies.
  bool hasExpired_ = false;         // Some request's deadline, at the last look.
  std::vector<std::shared_ptr<AudioSender::Ring>> rings_;
  Clock::time_point nextRingLook_ = Clock::time_point::max();
  Clock::time_point nextAttempt_{};
  Clock::duration backOff_{};
  Clock::time_point connectedAt_{};
  bool hasReplied_ = false;       // The service has, on this connection.
  bool hasTriedToClose_ = false;  // An attempt was made since closing began.
  bool hasSaidFarewell_ = false;
  std::string lastConnectError_;

  // Shared, with the lock. The socket and what it sleeps in are changed by the
  // client's thread alone, with the fork guard's lock too.
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  ClientSocket socket_;
  std::optional<ClientSleep> sleep_;
  Phase phase_ = Phase::kOpen;
  bool isConnected_ = false;
  bool isSilent_ = false;  // `close` is over: the thread calls no handler any more.
  bool isFinished_ = false;
  std::thread thread_;
  std::thread::id threadID_;
  bool isAsleep_ = false;     // The thread waits; `writing_` is empty.
  bool awaitsBurst_ = false;  // It is woken for a request, and others may follow.
  bool isBlocked_ = false;    // The thread waits for room in the socket.
  Clock::time_point sleepsUntil_{};
  Clock::time_point lastDirectSend_{};
  Clock::time_point closeDeadline_ = Clock::time_point::max();
  std::string queue_;          // Whole frames.
  std::size_t queueSent_ = 0;  // Of the first ones, written already.
  PendingRequests pending_;
  std::deque<Ending> endings_;
  RestorableSessions sessions_;
  RestorableSessions sessionsToRestore_;
  std::vector<std::shared_ptr<AudioSender::Ring>> newRings_;
  bool ringsWanted_ = false;
  std::uint64_t looksWanted_ = 0;  // Looks into all rings, for `flush`.
  std::uint64_t looksDone_ = 0;
  std::uint64_t bytesQueued_ = 0;
  std::uint64_t bytesWritten_ = 0;  // Or lost.
  std::uint64_t losses_ = 0;
  Counts counts_;
  std::atomic<std::size_t> writingBytes_{0};  // What `writing_` still holds.
};

template <typename Append, typename Note>
Submission ClientCore::submit(wire::Operation operation, Handler&& handler,
                              Replies replies,
                              const std::optional<std::chrono::milliseconds>& timeout,
                              const Append& append, const Note& note) {
  if (!isOfThisProcess()) return Submission::kClosed;
  const bool wantsReply = handler.index() != 0;
  const std::lock_guard lock(mutex_);
  if (phase_ != Phase::kOpen) return refuse(Submission::kClosed);
  const std::size_t begin = queue_.size();
  append(queue_, wantsReply ? pending_.nextNumber() : 0);
  const std::size_t size = queue_.size() - begin;
  const bool isTooLarge = size > limits::kFrameBytes + wire::kFrameHeaderSize;
  const std::size_t waiting =
      begin + writingBytes_.load(std::memory_order_relaxed) - queueSent_;
  if (isTooLarge || waiting + size > options_.queueBytes) {
    queue_.resize(begin);
    return refuse(isTooLarge ? Submission::kInvalid : Submission::kQueueFull);
  }
  auto deadline = Clock::time_point::max();
  if (wantsReply) {
    deadline = deadlineAfter(timeout);
    pending_.add(operation, std::move(handler), replies, deadline);
  }
  if (options_.restoreSessions) note(sessions_);
  bytesQueued_ += size;
  afterQueueing(/*wasEmpty=*/begin == 0, deadline);
  return Submission::kQueued;
}

}  // namespace ostrel::reporting
