// Clients whose messages can be told apart, and what the store must hold of them.
#pragma once

#include <sqlite3.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <map>
#include <mutex>
#include <random>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "ostrel/OstrelReportingClient.h"

namespace ostrel::crash {

using SteadyClock = std::chrono::steady_clock;

/// One message: whose it is, and its number.
struct MessageName {
  int client = 0;
  std::int64_t number = 0;

  auto operator<=>(const MessageName&) const = default;
};

/// What follows from a message's name, so that any change of it shows.
std::string textOf(const MessageName& name);
/// As the store writes it.
std::string payloadOf(const MessageName& name);

struct NumberedClientOptions {
  std::string socketPath;
  int name = 0;
  std::uint64_t seed = 0;
  /// Messages under way at once.
  int window = 32;
  /// Between two messages.
  std::chrono::microseconds pause{0};
  /// Another session follows after so many messages at most; 0: never.
  int sessionLength = 0;
};

/// A client of the service in a thread of its own, which numbers its messages from 1
/// and sends them into its session as fast as they are answered. It finds the service
/// again whenever that went away, and goes on with the numbers.
class NumberedClient {
 public:
  explicit NumberedClient(const NumberedClientOptions& options);
  ~NumberedClient();
  NumberedClient(const NumberedClient&) = delete;
  NumberedClient& operator=(const NumberedClient&) = delete;

  /// The messages that the service has answered, with the time of the answer; those
  /// of before the last call are left out.
  std::vector<std::pair<MessageName, SteadyClock::time_point>> takeAccepted();

  /// How many have been answered in all.
  std::int64_t acceptedCount() const { return acceptedCount_; }

 private:
  void send();
  void end(const MessageName& name, bool isAccepted);

  const NumberedClientOptions options_;
  std::atomic<bool> isEnding_{false};
  std::atomic<std::int64_t> acceptedCount_{0};
  std::mutex mutex_;
  std::condition_variable changed_;
  int underWay_ = 0;
  std::vector<std::pair<MessageName, SteadyClock::time_point>> accepted_;
  std::thread thread_;
};

/// Reads the store beside the service, as the tools do, and remembers what it saw
/// there: a row that was seen once is durable against the death of the process.
class StoreReader {
 public:
  explicit StoreReader(std::string path) : path_(std::move(path)) {}
  ~StoreReader() { close(); }
  StoreReader(const StoreReader&) = delete;
  StoreReader& operator=(const StoreReader&) = delete;

  /// Looks for new rows; they count as seen from now on. Does nothing as long as there
  /// is no store. Gives the messages that are new.
  std::vector<MessageName> look();

  /// Ends the connection; the next look makes a new one.
  void close();

  /// Fails the test unless as much is there as was seen, in a sound file: quick.
  void check();

  /// Fails the test unless all that was seen is there once and as it was sent, in the
  /// order of its numbers, without a gap in a session, and the file is sound.
  void audit();

  std::size_t seenCount() const { return seen_.size(); }
  bool hasSeen(const MessageName& name) const { return seen_.contains(name); }

 private:
  bool open();
  std::string one(const char* sql);

  const std::string path_;
  sqlite3* connection_ = nullptr;
  std::int64_t lastRow_ = 0;
  std::map<MessageName, std::int64_t> seen_;  // With their rows.
};

/// How often something is done: `usual`, or what the variable says.
std::int64_t timesFrom(const char* variable, std::int64_t usual);
/// The seed of a run: the variable OSTREL_SEED, else `usual`.
std::uint64_t seedFrom(std::uint64_t usual);

}  // namespace ostrel::crash
