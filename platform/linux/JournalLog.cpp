#include "platform/linux/JournalLog.h"

#include <poll.h>
#include <sys/eventfd.h>

#include <algorithm>
#include <charconv>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <system_error>

#include "platform/Logging.h"
#include "platform/linux/Threads.h"

namespace ostrel {
namespace {

constexpr char kJournalSocket[] = "/run/systemd/journal/socket";

}  // namespace

std::shared_ptr<JournalLog> JournalLog::open() {
  std::signal(SIGPIPE, SIG_IGN);
  auto sink = connectJournalSink(kJournalSocket);
  if (!sink) sink = makeLineSink(STDERR_FILENO);
  return std::make_shared<JournalLog>(std::move(sink));
}

JournalLog::JournalLog(std::unique_ptr<LogSink> sink)
    : sink_(std::move(sink)), stopEvent_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {}

JournalLog::~JournalLog() {
  flush(kFarewell);
  {
    const std::lock_guard lock(mutex_);
    isStopping_ = true;
  }
  hasWork_.notify_all();
  const std::uint64_t one = 1;
  if (::write(stopEvent_.get(), &one, sizeof one) < 0) std::abort();
  if (writer_.joinable()) writer_.join();
}

int JournalLog::verbosity(std::string_view verbosityKey) const {
  const char* value = std::getenv(std::string(verbosityKey).c_str());
  int number = 0;
  if (value != nullptr) std::from_chars(value, value + std::strlen(value), number);
  return number;
}

LogLevel JournalLog::lowestLevel() const {
  const char* value = std::getenv("OSTREL_LOG_LEVEL");
  const std::string_view name = value != nullptr ? value : "";
  if (name == "error") return LogLevel::kError;
  if (name == "info") return LogLevel::kInfo;
  return LogLevel::kDefault;
}

void JournalLog::write(const LogLine& line) {
  LogLine cut = line;
  cut.text = cut.text.substr(0, kMostLineBytes);
  std::size_t written = 0;
  std::unique_lock lock(mutex_);
  if (isDrained()) {
    if (writeUnlocked(lock, cut, written) == LogSink::Result::kWouldBlock) {
      waiting_.push_front({cut.level, cut.scopeCode, std::string(cut.text), written});
      waitingBytes_ += cut.text.size();
      startWriter();
    } else if (!isDrained()) {
      drainSome(lock);
    }
    return;
  }
  // The writer is another thread, not the reader: it makes room.
  ++waiters_;
  hasWritten_.wait(lock, [&] { return !isWriting_ || fits(cut.text); });
  --waiters_;
  if (lostLines_ != 0) keepLoss();
  if (lostLines_ != 0 || !fits(cut.text)) {
    ++lostLines_;
  } else {
    keep({cut.level, cut.scopeCode, std::string(cut.text), written});
  }
  if (isBlocked_) {
    startWriter();
  } else if (!isWriting_) {
    drainSome(lock);
  }
}

// The line is nobody else's meanwhile.
LogSink::Result JournalLog::writeUnlocked(std::unique_lock<std::mutex>& lock,
                                          const LogLine& line, std::size_t& written) {
  isWriting_ = true;
  lock.unlock();
  const LogSink::Result result = sink_->tryWrite(line, written);
  lock.lock();
  isWriting_ = false;
  isBlocked_ = result == LogSink::Result::kWouldBlock;
  if (waiters_ != 0) hasWritten_.notify_all();
  return result;
}

void JournalLog::keep(WaitingLine line) {
  waitingBytes_ += line.text.size();
  waiting_.push_back(std::move(line));
}

// Only where a further line fits as well, so that a full ring is not all losses.
void JournalLog::keepLoss() {
  if (waitingBytes_ + kMostLineBytes > kMostWaitingBytes) return;
  keep({LogLevel::kError, processLogScope.code(),
        std::string(__FILE_NAME__) + ":" + std::to_string(__LINE__) +
            ":ostrel::JournalLog::keepLoss: " + std::to_string(lostLines_) +
            " log lines were lost: their reader is too slow",
        /*written=*/0});
  lostLines_ = 0;
}

// Writes what waits, oldest first, until the sink would block or it is the writer
// thread's turn to go on.
void JournalLog::drainSome(std::unique_lock<std::mutex>& lock) {
  constexpr int kMostLines = 32;
  for (int i = 0; i < kMostLines && !isDrained(); ++i) {
    if (waiting_.empty()) keepLoss();
    WaitingLine first = std::move(waiting_.front());
    waiting_.pop_front();
    const auto result =
        writeUnlocked(lock, {first.level, first.scopeCode, first.text}, first.written);
    if (result == LogSink::Result::kWouldBlock) {
      waiting_.push_front(std::move(first));
      break;
    }
    waitingBytes_ -= first.text.size();
  }
  if (!isDrained()) {
    startWriter();
  } else if (waiters_ != 0) {
    hasWritten_.notify_all();
  }
}

void JournalLog::startWriter() {
  if (!writer_.joinable() && !isStopping_) {
    try {
      writer_ = startThread("log", /*niceness=*/0, [this] { runWriter(); });
    } catch (const std::system_error&) {
      // The next line tries again to start the thread, and to write.
      isBlocked_ = false;
    }
  }
  hasWork_.notify_one();
}

void JournalLog::runWriter() {
  std::unique_lock lock(mutex_);
  for (;;) {
    hasWork_.wait(lock, [this] { return isStopping_ || (!isDrained() && !isWriting_); });
    if (isStopping_) return;
    if (!isBlocked_) drainSome(lock);
    if (!isBlocked_) continue;
    pollfd descriptors[] = {{sink_->descriptor(), POLLOUT, 0},
                            {stopEvent_.get(), POLLIN, 0}};
    lock.unlock();
    ::poll(descriptors, std::size(descriptors), /*timeout=*/-1);
    lock.lock();
    isBlocked_ = false;
  }
}

bool JournalLog::flush(std::chrono::nanoseconds timeout) {
  std::unique_lock lock(mutex_);
  if (!isDrained() && !isWriting_) startWriter();
  ++waiters_;
  const bool isOut = hasWritten_.wait_for(lock, timeout, [this] { return isDrained(); });
  --waiters_;
  return isOut;
}

}  // namespace ostrel
