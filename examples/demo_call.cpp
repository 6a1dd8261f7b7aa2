// A phone call and its ring tone, as an audio process would report them: two
// sessions through the client library, with messages, driver counters, and the
// replies that come back. Ends with status 1 when one of them does not.
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <string>
#include <thread>

#include "ostrel/OstrelReportingClient.h"
#include "ostrel/channels.h"

namespace {

using namespace ostrel::reporting;
using namespace std::chrono_literals;

constexpr ReporterID kCall{4711};
constexpr ReporterID kRingTone{4712};
constexpr ServiceType kTelephony{2};
constexpr ServiceType kHaptics{3};

constexpr Category kRouteChange{0x40000007};
constexpr Category kRecord{0x08000002};
constexpr Category kPerformance{0x1000000A};
constexpr Category kVolume{0x0800000B};
constexpr MessageType kGeneric{0};
constexpr MessageType kStart{1};
constexpr MessageType kStop{2};

/// Counts the replies that are still to come, and those that were no answer.
class Replies {
 public:
  /// A handler that prints how the request ended.
  template <typename T>
  OnReply<T> expect(std::string request) {
    {
      const std::lock_guard lock(mutex_);
      ++outstanding_;
    }
    return [this, request = std::move(request)](const Reply<T>& reply) {
      const std::lock_guard lock(mutex_);
      std::printf("  %-28s %s\n", request.c_str(), reply ? "answered" : "NOT ANSWERED");
      if (!reply) ++failures_;
      --outstanding_;
      changed_.notify_all();
    };
  }

  /// Waits for all of them; false when one did not come.
  bool wait() {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, 15s, [this] { return outstanding_ == 0; }) &&
           failures_ == 0;
  }

 private:
  std::mutex mutex_;  // Protects all that follows.
  std::condition_variable changed_;
  int outstanding_ = 0;
  int failures_ = 0;
};

/// The counter of an audio driver, such as this process would have.
class Underruns {
 public:
  Underruns() {
    if (ostrel_channels_open("Speaker", "Demo", 0, &channels_) == 0) {
      ostrel_channels_counter(channels_, "underruns", &counter_);
    }
  }
  ~Underruns() { ostrel_channels_close(channels_); }
  Underruns(const Underruns&) = delete;
  Underruns& operator=(const Underruns&) = delete;

  void add(int count) {
    if (counter_ != nullptr) ostrel_channels_add(counter_, count);
  }

 private:
  ostrel_channels* channels_ = nullptr;
  ostrel_counter* counter_ = nullptr;
};

void ring(Client& client, Replies& replies) {
  client.createReportingSession(kRingTone);
  client.setServiceType(kHaptics, kRingTone);
  client.startReportingSessionForID(kRingTone,
                                    replies.expect<bool>("ring tone's session"));
  client.sendMessage({{"pattern", "pulse"}, {"intensity", 0.8}}, Category{3}, kStart,
                     {{kRingTone}});
  std::this_thread::sleep_for(200ms);
  client.sendMessage({{"haptics duration", 0.2}}, Category{3}, kStop, {{kRingTone}});
  client.stopReportingSessionForID(kRingTone, replies.expect<bool>("ring tone stops"));
}

void call(Client& client, Replies& replies) {
  Underruns underruns;
  client.createReportingSession(kCall);
  client.setServiceType(kTelephony, kCall);
  client.setConfiguration({{"HostApplicationDisplayID", "com.example.dialer"}}, kCall);
  client.startReportingSessionForID(kCall, replies.expect<bool>("call's session"));
  client.sendMessage({{"codec", "EVS"}, {"sample rate", 32000}}, kRecord, kStart,
                     {{kCall}});
  for (const char* route : {"Receiver", "Speaker", "Headset"}) {
    client.sendMessage({{"route", route}, {"at", std::chrono::system_clock::now()}},
                       kRouteChange, kGeneric, {{kCall}});
    std::this_thread::sleep_for(150ms);
    underruns.add(2);
  }
  client.sendMessage({{"volume", 0.625}, {"muted", false}}, kVolume, kGeneric, {{kCall}});
  client.sendMessage(
      {{"load", List{0.31, 0.42, 0.29}}, {"cycles", 18'446'744'073'709'551'615U}},
      kPerformance, kGeneric, {{kCall}});
  client.sendMessage({{"codec", "EVS"}}, kRecord, kStop, {{kCall}},
                     replies.expect<void>("last message"));
  client.stopReportingSessionForID(kCall, replies.expect<bool>("call stops"));
}

}  // namespace

int main() {
  Client client;
  Replies replies;
  std::puts("A call comes in:");
  ring(client, replies);
  call(client, replies);
  const bool answered = replies.wait();
  client.destroyReportingSession(kRingTone);
  client.destroyReportingSession(kCall);
  const bool handedOver = client.flush(5s);
  client.close();
  if (answered && handedOver) return EXIT_SUCCESS;
  std::fputs("demo_call: the service did not answer\n", stderr);
  return EXIT_FAILURE;
}
