// The service with four clients that never stop sending, and a reader of its store.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <memory>
#include <random>
#include <vector>

#include "client/ServiceConnection.h"
#include "tests/crash/NumberedClient.h"
#include "tests/integration/ServiceUnderTest.h"

namespace ostrel::crash {

/// How much slower things are in this build.
#ifdef OSTREL_SANITIZED
inline constexpr int kSlowness = 10;
#else
inline constexpr int kSlowness = 1;
#endif

inline std::chrono::microseconds since(SteadyClock::time_point begin) {
  return std::chrono::duration_cast<std::chrono::microseconds>(SteadyClock::now() -
                                                               begin);
}

inline double millisecondsOf(std::chrono::microseconds time) {
  return static_cast<double>(time.count()) / 1000;
}

class LoadedService {
 public:
  static constexpr int kClients = 4;

  struct StartTimes {
    std::chrono::microseconds untilConnected{0};
    std::chrono::microseconds untilAnswered{0};  // The first message.
  };

  /// Two of the clients have short sessions. All rest for `pause` between messages.
  LoadedService(std::uint64_t seed, std::chrono::microseconds pause)
      : reader_(service_ / "state/reports.db") {
    std::mt19937_64 random(seed);
    for (int i = 0; i < kClients; ++i) {
      NumberedClientOptions options;
      options.socketPath = service_.socketPath();
      options.name = i;
      options.seed = random();
      options.window = i % 2 == 0 ? 16 : 64;
      options.pause = pause;
      options.sessionLength = i < 2 ? 60 : 0;
      clients_.push_back(std::make_unique<NumberedClient>(options));
    }
  }

  ServiceUnderTest& operator*() { return service_; }
  ServiceUnderTest* operator->() { return &service_; }
  StoreReader& reader() { return reader_; }

  /// Starts the service and waits until it has answered a message. What is accepted
  /// counts anew.
  StartTimes start() {
    StartTimes times;
    takeAccepted();
    const std::int64_t before = acceptedCount();
    const auto begin = SteadyClock::now();
    service_.start();
    EXPECT_TRUE(eventually([&] { return isThere(); })) << service_.read("log.txt");
    times.untilConnected = since(begin);
    EXPECT_TRUE(eventually([&] { return acceptedCount() > before; }))
        << service_.read("log.txt");
    times.untilAnswered = since(begin);
    return times;
  }

  bool isThere() const {
    return ServiceConnection::connect(service_.socketPath()).value.has_value();
  }

  std::int64_t acceptedCount() const {
    std::int64_t count = 0;
    for (const auto& client : clients_) count += client->acceptedCount();
    return count;
  }

  /// What has been answered since the last call.
  std::vector<std::pair<MessageName, SteadyClock::time_point>> takeAccepted() {
    std::vector<std::pair<MessageName, SteadyClock::time_point>> all;
    for (const auto& client : clients_) {
      auto some = client->takeAccepted();
      all.insert(all.end(), some.begin(), some.end());
    }
    return all;
  }

  /// Fails the test unless the store holds all of these.
  void expectDurable(
      const std::vector<std::pair<MessageName, SteadyClock::time_point>>& accepted) {
    reader_.look();
    for (const auto& [name, time] : accepted) {
      ASSERT_TRUE(reader_.hasSeen(name))
          << "lost: message " << name.number << " of client " << name.client;
    }
  }

 private:
  ServiceUnderTest service_;
  StoreReader reader_;
  std::vector<std::unique_ptr<NumberedClient>> clients_;
};

}  // namespace ostrel::crash
