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
  changed_.notify_all();
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
  const std::lock_guard lock(mutex_);
  if (isDrained() && sink_->tryWrite(cut, written) != LogSink::Result::kWouldBlock) {
    return;
  }
  if (lostLines_ != 0) keepLoss();
  if (lostLines_ != 0 || waitingBytes_ + cut.text.size() > kMostWaitingBytes) {
    ++lostLines_;
  } else {
    keep({cut.level, cut.scopeCode, std::string(cut.text), written});
  }
  startWriter();
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

// Writes what waits, oldest first, until the sink would block or the others have
// waited long enough for the lock.
void JournalLog::drainSome() {
  constexpr int kMostLines = 32;
  for (int i = 0; i < kMostLines && !isDrained(); ++i) {
    if (waiting_.empty()) keepLoss();
    WaitingLine& first = waiting_.front();
    const auto result =
        sink_->tryWrite({first.level, first.scopeCode, first.text}, first.written);
    if (result == LogSink::Result::kWouldBlock) return;
    waitingBytes_ -= first.text.size();
    waiting_.pop_front();
  }
  if (isDrained()) changed_.notify_all();
}

void JournalLog::startWriter() {
  if (!writer_.joinable() && !isStopping_) {
    try {
      writer_ = startThread("log", /*niceness=*/0, [this] { runWriter(); });
    } catch (const std::system_error&) {
      drainSome();  // The next line tries again to start the thread.
    }
  }
  changed_.notify_all();
}

void JournalLog::runWriter() {
  std::unique_lock lock(mutex_);
  while (!isStopping_) {
    drainSome();
    if (isDrained()) {
      changed_.wait(lock, [this] { return isStopping_ || !isDrained(); });
      continue;
    }
    pollfd descriptors[] = {{sink_->descriptor(), POLLOUT, 0},
                            {stopEvent_.get(), POLLIN, 0}};
    lock.unlock();
    ::poll(descriptors, std::size(descriptors), /*timeout=*/-1);
    lock.lock();
  }
}

bool JournalLog::flush(std::chrono::nanoseconds timeout) {
  std::unique_lock lock(mutex_);
  if (!isDrained()) startWriter();
  return changed_.wait_for(lock, timeout, [this] { return isDrained(); });
}

}  // namespace ostrel
