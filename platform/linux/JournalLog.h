#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <thread>

#include "platform/ScopedLog.h"
#include "platform/linux/FileDescriptor.h"
#include "platform/linux/Limits.h"

namespace ostrel {

/// Where log lines go. One call at a time.
class LogSink {
 public:
  enum class Result { kWritten, kWouldBlock, kFailed };

  virtual ~LogSink() = default;

  /// Writes the line's record, of which `written` bytes are out already, as far
  /// as that goes without blocking, and adds to `written`. `kWouldBlock`: the
  /// rest is for later. `kFailed`: nobody will ever take it.
  virtual Result tryWrite(const LogLine& line, std::size_t& written) = 0;

  /// To be polled for `POLLOUT` after `kWouldBlock`. The caller's at least until
  /// the next `tryWrite`.
  virtual int descriptor() const = 0;
};

/// The system log by the journal, or by lines on standard error.
///
/// A line is written at once, on the calling thread, as long as the reader keeps
/// up. While another thread writes one, lines wait for that thread, which writes
/// them too: nobody waits for another's call to the system. When the reader does not
/// keep up, they wait for a thread that is started then. They wait in order, in
/// `kMostWaitingBytes` of memory. What does not fit is dropped where it is the reader
/// who is slow, and a line says how many were lost at the place where they were lost.
/// No caller ever waits for the reader.
class JournalLog final : public ScopedLog {
 public:
  static constexpr std::size_t kMostWaitingBytes = limits::kLogWaitingBytes;
  /// The rest of a longer line is cut off.
  static constexpr std::size_t kMostLineBytes = limits::kLogLineBytes;
  /// How long the destructor waits for a slow reader.
  static constexpr std::chrono::milliseconds kFarewell{500};

  /// Writes to the journal's socket if somebody listens there now, else
  /// "<PRIORITY>text" lines to standard error. Ignores SIGPIPE from here on: a
  /// reader that goes away must not end the process.
  static std::shared_ptr<JournalLog> open();

  explicit JournalLog(std::unique_ptr<LogSink> sink);
  ~JournalLog() override;

  /// The number under the key in the environment; 0 without one.
  int verbosity(std::string_view verbosityKey) const override;

  /// `$OSTREL_LOG_LEVEL`: "error", "default", "info"; anything else is `kDefault`.
  LogLevel lowestLevel() const override;

  void write(const LogLine& line) override;

  /// Waits until every line is out, at most `timeout`. False when some are not.
  bool flush(std::chrono::nanoseconds timeout);

 private:
  struct WaitingLine {
    LogLevel level;
    std::string_view scopeCode;
    std::string text;
    std::size_t written;
  };

  bool isDrained() const { return waiting_.empty() && lostLines_ == 0 && !isWriting_; }
  bool fits(std::string_view text) const {
    return waitingBytes_ + text.size() <= kMostWaitingBytes;
  }
  LogSink::Result writeUnlocked(std::unique_lock<std::mutex>& lock, const LogLine& line,
                                std::size_t& written);
  void keep(WaitingLine line);
  void keepLoss();
  void drainSome(std::unique_lock<std::mutex>& lock);
  void startWriter();
  void runWriter();

  const std::unique_ptr<LogSink> sink_;  // Whoever set `isWriting_` uses it.
  FileDescriptor stopEvent_;

  std::mutex mutex_;                 // Guards all below.
  std::condition_variable hasWork_;  // For the writer's thread.
  std::condition_variable hasWritten_;
  int waiters_ = 0;  // For `hasWritten_`.
  std::deque<WaitingLine> waiting_;
  std::size_t waitingBytes_ = 0;
  std::uint64_t lostLines_ = 0;
  bool isWriting_ = false;
  bool isBlocked_ = false;  // The reader is to be waited for.
  bool isStopping_ = false;
  std::thread writer_;
};

/// Sends lines to the journal's socket at `path` by its native protocol. None
/// when nobody listens there. When the listener goes away for good, lines go to
/// standard error.
std::unique_ptr<LogSink> connectJournalSink(const std::string& path);

/// Writes lines to `descriptor`, which stays the caller's and keeps its flags.
std::unique_ptr<LogSink> makeLineSink(int descriptor);

}  // namespace ostrel
