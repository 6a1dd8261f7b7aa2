#include "platform/linux/JournalLog.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>

#include <array>
#include <atomic>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <semaphore>
#include <sstream>
#include <thread>
#include <vector>

#include "platform/Logging.h"
#include "platform/linux/TestSockets.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

LogLine line(std::string_view text, LogLevel level = LogLevel::kDefault) {
  return {level, "osrs", text};
}

/// The two ends of a pipe or of a stream socket.
struct Channel {
  FileDescriptor reader;
  FileDescriptor writer;

  static Channel pipe() {
    std::array<int, 2> ends{};
    if (::pipe2(ends.data(), O_CLOEXEC) != 0) std::abort();
    return {FileDescriptor(ends[0]), FileDescriptor(ends[1])};
  }
  static Channel socket() {
    std::array<int, 2> ends{};
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()) != 0) {
      std::abort();
    }
    return {FileDescriptor(ends[0]), FileDescriptor(ends[1])};
  }

  /// What is there now.
  std::string readNow() const {
    std::string text;
    std::array<char, 65536> buffer;
    pollfd ready = {reader.get(), POLLIN, 0};
    while (::poll(&ready, 1, /*timeout=*/0) == 1) {
      const ssize_t size = ::read(reader.get(), buffer.data(), buffer.size());
      if (size <= 0) break;
      text.append(buffer.data(), static_cast<std::size_t>(size));
    }
    return text;
  }

  /// All until the writing end closes.
  std::string readAll() const {
    std::string text;
    std::array<char, 4096> buffer;
    for (;;) {
      const ssize_t size = ::read(reader.get(), buffer.data(), buffer.size());
      if (size <= 0) return text;
      text.append(buffer.data(), static_cast<std::size_t>(size));
    }
  }

  void fill() const {
    const int flags = ::fcntl(writer.get(), F_GETFL);
    ::fcntl(writer.get(), F_SETFL, flags | O_NONBLOCK);
    const std::string junk(4096, '\n');
    while (::write(writer.get(), junk.data(), junk.size()) > 0) {
    }
    while (::write(writer.get(), "\n", 1) > 0) {
    }
    ::fcntl(writer.get(), F_SETFL, flags);
  }
};

std::vector<std::string> linesOf(const std::string& text) {
  std::vector<std::string> lines;
  std::istringstream stream(text);
  for (std::string one; std::getline(stream, one);) {
    if (!one.empty()) lines.push_back(one);
  }
  return lines;
}

/// The number in a "N log lines were lost" line; 0 for any other line.
std::size_t lostIn(const std::string& text) {
  const auto place = text.find(" log lines were lost");
  if (place == std::string::npos) return 0;
  return std::stoul(text.substr(text.rfind(' ', place - 1) + 1));
}

class JournalLogLines : public testing::Test {
 protected:
  JournalLogLines() { std::signal(SIGPIPE, SIG_IGN); }

  std::unique_ptr<JournalLog> open(const Channel& channel) {
    return std::make_unique<JournalLog>(makeLineSink(channel.writer.get()));
  }
};

TEST_F(JournalLogLines, CarryThePriorityBeforeTheText) {
  const Channel channel = Channel::pipe();
  const auto log = open(channel);
  log->write(line("one", LogLevel::kError));
  log->write(line("two", LogLevel::kDefault));
  log->write(line("three", LogLevel::kInfo));
  log->write(line("four", LogLevel::kDebug));
  EXPECT_EQ(channel.readNow(), "<3>one\n<5>two\n<6>three\n<7>four\n");
}

TEST_F(JournalLogLines, GoToASocketToo) {
  const Channel channel = Channel::socket();
  open(channel)->write(line("one"));
  EXPECT_EQ(channel.readNow(), "<5>one\n");
}

TEST_F(JournalLogLines, GoToAFileAfterWhatOthersWroteThere) {
  char path[] = "/tmp/ostrel-log-XXXXXX";
  const FileDescriptor file(::mkstemp(path));
  ASSERT_EQ(::write(file.get(), "before\n", 7), 7);
  open(Channel{FileDescriptor(), FileDescriptor(::dup(file.get()))})->write(line("one"));
  ASSERT_EQ(::write(file.get(), "after\n", 6), 6);
  std::array<char, 64> text{};
  ASSERT_GT(::pread(file.get(), text.data(), text.size(), 0), 0);
  std::filesystem::remove(path);
  EXPECT_STREQ(text.data(), "before\n<5>one\nafter\n");
}

TEST_F(JournalLogLines, CannotForgeFurtherLines) {
  const Channel channel = Channel::pipe();
  open(channel)->write(line("one\n<3>forged"));
  EXPECT_EQ(channel.readNow(), "<5>one <3>forged\n");
}

TEST_F(JournalLogLines, LeaveTheFlagsOfASharedDescriptorAlone) {
  for (const Channel& channel : {Channel::pipe(), Channel::socket()}) {
    const int flags = ::fcntl(channel.writer.get(), F_GETFL);
    channel.fill();
    const auto log = open(channel);
    log->write(line("waits"));
    EXPECT_EQ(::fcntl(channel.writer.get(), F_GETFL), flags);
    channel.readNow();
  }
}

TEST_F(JournalLogLines, AreCutAtTheLongestLine) {
  for (const std::size_t size :
       {JournalLog::kMostLineBytes - 1, JournalLog::kMostLineBytes,
        JournalLog::kMostLineBytes + 1}) {
    Channel channel = Channel::pipe();
    std::string text;
    std::thread reader([&] { text = channel.readAll(); });
    open(channel)->write(line(std::string(size, 'x')));
    channel.writer.reset();
    reader.join();
    EXPECT_EQ(text.size(), std::min(size, JournalLog::kMostLineBytes) + 4);
  }
}

TEST_F(JournalLogLines, WaitInOrderForASlowReader) {
  for (auto* make : {&Channel::pipe, &Channel::socket}) {
    Channel channel = make();
    channel.fill();
    auto log = open(channel);
    for (int i = 0; i < 1000; ++i) log->write(line(std::to_string(i)));
    std::string text;
    std::thread reader([&] { text = channel.readAll(); });
    EXPECT_TRUE(log->flush(std::chrono::minutes(1)));
    log.reset();
    channel.writer.reset();
    reader.join();
    const auto lines = linesOf(text);
    ASSERT_EQ(lines.size(), 1000u);
    for (std::size_t i = 0; i < lines.size(); ++i) {
      EXPECT_EQ(lines[i], "<5>" + std::to_string(i));
    }
  }
}

TEST_F(JournalLogLines, AreCountedWhereTheyAreLost) {
  Channel channel = Channel::pipe();
  channel.fill();
  auto log = open(channel);
  const std::string filler(1000, '.');
  constexpr std::size_t kLines = 1000;  // Four times what may wait.
  for (std::size_t i = 0; i < kLines; ++i) {
    log->write(line(std::to_string(i) + filler));
  }
  std::string text;
  std::thread reader([&] { text = channel.readAll(); });
  EXPECT_TRUE(log->flush(std::chrono::minutes(1)));
  log->write(line("afterwards"));
  log.reset();
  channel.writer.reset();
  reader.join();

  const auto lines = linesOf(text);
  ASSERT_GE(lines.size(), 3u);
  const std::size_t written = lines.size() - 2;
  EXPECT_GE(written * 1000, JournalLog::kMostWaitingBytes - 2000);
  for (std::size_t i = 0; i < written; ++i) {
    EXPECT_EQ(lines[i].substr(3, filler.size()),
              (std::to_string(i) + filler).substr(0, filler.size()));
  }
  EXPECT_EQ(lostIn(lines[written]), kLines - written) << lines[written];
  EXPECT_EQ(lines[written].rfind("<3>JournalLog.cpp:", 0), 0u) << lines[written];
  EXPECT_EQ(lines.back(), "<5>afterwards");
}

TEST_F(JournalLogLines, DoNotHoldAFlushLongerThanItsTime) {
  const Channel channel = Channel::pipe();
  channel.fill();
  const auto log = open(channel);
  log->write(line("waits"));
  EXPECT_FALSE(log->flush(std::chrono::milliseconds(1)));
  channel.readNow();
}

TEST_F(JournalLogLines, AreDroppedWhenTheReaderIsGone) {
  Channel channel = Channel::pipe();
  channel.fill();
  const auto log = open(channel);
  log->write(line("waits"));
  channel.reader.reset();
  EXPECT_TRUE(log->flush(std::chrono::minutes(1)));
}

TEST_F(JournalLogLines, OfManyThreadsStayWholeAndInEachThreadsOrder) {
  constexpr std::size_t kThreads = 16;
  constexpr std::size_t kLinesOfThread = 2000;
  Channel channel = Channel::pipe();
  auto log = open(channel);
  std::string text;
  std::thread reader([&] { text = channel.readAll(); });
  std::vector<std::thread> threads;
  for (std::size_t t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (std::size_t i = 0; i < kLinesOfThread; ++i) {
        log->write(line(std::to_string(t) + " " + std::to_string(i) + " " +
                        std::string(i % 100, 'x') + "."));
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_TRUE(log->flush(std::chrono::minutes(1)));
  log.reset();
  channel.writer.reset();
  reader.join();

  std::array<std::size_t, kThreads> next{};
  std::size_t seen = 0;
  for (const std::string& one : linesOf(text)) {
    if (const std::size_t lost = lostIn(one); lost != 0) {
      seen += lost;
      continue;
    }
    std::istringstream fields(one.substr(3));
    std::size_t thread = 0;
    std::size_t number = 0;
    std::string rest;
    fields >> thread >> number >> rest;
    ASSERT_LT(thread, kThreads) << one;
    EXPECT_GE(number, next[thread]) << one;
    EXPECT_EQ(rest, std::string(number % 100, 'x') + ".") << one;
    next[thread] = number + 1;
    ++seen;
  }
  EXPECT_EQ(seen, kThreads * kLinesOfThread);
}

/// Holds the first line's call until it is let go, and keeps what it is given.
class HeldSink final : public LogSink {
 public:
  struct State {
    std::binary_semaphore isHeld{0};
    std::binary_semaphore mayGoOn{0};
    std::vector<std::string> lines;  // The caller's at a time.
  };
  explicit HeldSink(State& state) : state_(state) {}
  Result tryWrite(const LogLine& line, std::size_t& /*written*/) override {
    if (state_.lines.empty()) {
      state_.isHeld.release();
      state_.mayGoOn.acquire();
    }
    state_.lines.emplace_back(line.text);
    return Result::kWritten;
  }
  int descriptor() const override { return -1; }

 private:
  State& state_;
};

/// A thread is in a call that writes the line "held".
class JournalLogHeld : public testing::Test {
 protected:
  JournalLogHeld() { state_.isHeld.acquire(); }
  ~JournalLogHeld() override {
    if (holder_.joinable()) letGo();
  }
  void letGo() {
    state_.mayGoOn.release();
    holder_.join();
  }

  HeldSink::State state_;
  JournalLog log_{std::make_unique<HeldSink>(state_)};
  std::thread holder_{[this] { log_.write(line("held")); }};
};

TEST_F(JournalLogHeld, LetsOthersGoOnAndWritesTheirLinesInOrder) {
  for (int i = 0; i < 100; ++i) log_.write(line(std::to_string(i)));
  EXPECT_FALSE(log_.flush(std::chrono::nanoseconds(1)));
  letGo();
  EXPECT_TRUE(log_.flush(std::chrono::minutes(1)));
  ASSERT_EQ(state_.lines.size(), 101u);
  for (std::size_t i = 1; i < state_.lines.size(); ++i) {
    EXPECT_EQ(state_.lines[i], std::to_string(i - 1));
  }
}

TEST_F(JournalLogHeld, LosesNothingThoughMoreComesThanMayWait) {
  const std::string text(1000, 'x');
  const std::size_t lines = 2 * JournalLog::kMostWaitingBytes / text.size();
  std::atomic<std::size_t> given{0};
  std::thread writer([&] {
    for (; given < lines; ++given) log_.write(line(text));
  });
  while (given < JournalLog::kMostWaitingBytes / text.size()) std::this_thread::yield();
  letGo();
  writer.join();
  EXPECT_TRUE(log_.flush(std::chrono::minutes(1)));
  EXPECT_EQ(state_.lines.size(), lines + 1);
}

class JournalLogJournal : public testing::Test {
 protected:
  void SetUp() override { listen(); }

  std::string socketPath() const { return directory_ / "socket"; }

  void listen() {
    std::filesystem::remove(socketPath());
    journal_ = testing_support::boundSocket(SOCK_DGRAM, socketPath());
    ASSERT_TRUE(journal_);
  }

  /// The next record; waits for it.
  std::string receive() const {
    std::string record(512 * 1024, '\0');
    const ssize_t size = ::recv(journal_.get(), record.data(), record.size(), 0);
    record.resize(size > 0 ? static_cast<std::size_t>(size) : 0);
    return record;
  }

  const testing_support::TemporaryDirectory directory_;
  FileDescriptor journal_;
};

TEST_F(JournalLogJournal, GetsPriorityScopeAndText) {
  JournalLog log(connectJournalSink(socketPath()));
  log.write(line("File.cpp:1:f: text", LogLevel::kError));
  EXPECT_EQ(receive(),
            "PRIORITY=3\nSYSLOG_IDENTIFIER=ostrelreportingd\nOSTREL_SCOPE=osrs\n"
            "MESSAGE=File.cpp:1:f: text\n");
}

TEST_F(JournalLogJournal, GetsATextWithAnEndOfLineByItsLength) {
  JournalLog log(connectJournalSink(socketPath()));
  log.write(line("a\nPRIORITY=0"));
  using namespace std::string_literals;
  EXPECT_EQ(receive(),
            "PRIORITY=5\nSYSLOG_IDENTIFIER=ostrelreportingd\nOSTREL_SCOPE=osrs\n"
            "MESSAGE\n\x0c\0\0\0\0\0\0\0"s
            "a\nPRIORITY=0\n");
}

TEST_F(JournalLogJournal, IsNoneWhereNobodyListens) {
  journal_.reset();
  EXPECT_EQ(connectJournalSink(socketPath()), nullptr);
  EXPECT_EQ(connectJournalSink(directory_ / "missing"), nullptr);
  EXPECT_EQ(connectJournalSink(std::string(200, 'x')), nullptr);
}

TEST_F(JournalLogJournal, GetsAllLinesInOrderAfterItHung) {
  JournalLog log(connectJournalSink(socketPath()));
  for (int i = 0; i < 3000; ++i) log.write(line(std::to_string(i)));
  for (int i = 0; i < 3000; ++i) {
    const std::string record = receive();
    EXPECT_EQ(record.substr(record.find("MESSAGE=")),
              "MESSAGE=" + std::to_string(i) + "\n");
  }
  EXPECT_TRUE(log.flush(std::chrono::minutes(1)));
}

TEST_F(JournalLogJournal, IsFoundAgainAfterItsRestart) {
  JournalLog log(connectJournalSink(socketPath()));
  log.write(line("before"));
  listen();
  log.write(line("after"));
  EXPECT_NE(receive().find("MESSAGE=after\n"), std::string::npos);
}

TEST_F(JournalLogJournal, IsReplacedByStandardErrorWhenItIsGone) {
  JournalLog log(connectJournalSink(socketPath()));
  journal_.reset();
  const Channel channel = Channel::pipe();
  const FileDescriptor standardError(::dup(STDERR_FILENO));
  ::dup2(channel.writer.get(), STDERR_FILENO);
  log.write(line("after"));
  ::dup2(standardError.get(), STDERR_FILENO);
  EXPECT_EQ(channel.readNow(), "<5>after\n");
}

class JournalLogEnvironment : public testing::Test {
 protected:
  void TearDown() override {
    ::unsetenv("OSTREL_LOG_LEVEL");
    ::unsetenv("reporting_test_verbose");
  }
  const Channel channel_ = Channel::pipe();
  JournalLog log_{makeLineSink(channel_.writer.get())};
};

TEST_F(JournalLogEnvironment, NamesTheLowestLevel) {
  EXPECT_EQ(log_.lowestLevel(), LogLevel::kDefault);
  ::setenv("OSTREL_LOG_LEVEL", "error", /*replace=*/1);
  EXPECT_EQ(log_.lowestLevel(), LogLevel::kError);
  ::setenv("OSTREL_LOG_LEVEL", "info", /*replace=*/1);
  EXPECT_EQ(log_.lowestLevel(), LogLevel::kInfo);
  ::setenv("OSTREL_LOG_LEVEL", "nonsense", /*replace=*/1);
  EXPECT_EQ(log_.lowestLevel(), LogLevel::kDefault);
}

TEST_F(JournalLogEnvironment, GivesVerbositiesByKey) {
  EXPECT_EQ(log_.verbosity("reporting_test_verbose"), 0);
  ::setenv("reporting_test_verbose", "5", /*replace=*/1);
  EXPECT_EQ(log_.verbosity("reporting_test_verbose"), 5);
  ::setenv("reporting_test_verbose", "loud", /*replace=*/1);
  EXPECT_EQ(log_.verbosity("reporting_test_verbose"), 0);
}

TEST_F(JournalLogEnvironment, TurnsDebugLinesOfAScopeOn) {
  static LogScope scope("ostt", "reporting_test_verbose");
  ::setenv("reporting_test_verbose", "5", /*replace=*/1);
  ::setenv("OSTREL_LOG_LEVEL", "error", /*replace=*/1);
  registerLogScope(scope);
  setSystemLog(std::make_shared<JournalLog>(makeLineSink(channel_.writer.get())));
  OSTREL_LOG_DEBUG(scope, "debug");
  OSTREL_LOG_DEFAULT(scope, "default");
  setSystemLog(nullptr);
  const std::string text = channel_.readNow();
  EXPECT_EQ(text.rfind("<7>JournalLogTest.cpp:", 0), 0u);
  EXPECT_EQ(text.find("default"), std::string::npos);
}

}  // namespace
}  // namespace ostrel
