// Memory, and what the service costs while nothing happens, at its start and at a
// long session's end.
#include <sys/socket.h>
#include <unistd.h>

#include <semaphore>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "benchmarks/wholepath/Measurements.h"
#include "benchmarks/wholepath/Payload.h"
#include "benchmarks/wholepath/ServiceClient.h"

namespace ostrel::bench {
namespace {

using reporting::Reply;
using reporting::ReporterID;

constexpr std::int64_t kSession = 4711;
constexpr std::int64_t kIdleClients = 100;
constexpr std::uint64_t kMillion = 1'000'000;
constexpr double kMebibyte = 1024.0 * 1024.0;

// Work that was queued has ended, and threads have gone back to sleep.
void settle() { std::this_thread::sleep_for(std::chrono::milliseconds(300)); }

double anonymousBytes(const ServiceProcess& service) {
  return static_cast<double>(service.process().memory().anonymous);
}

// A connection of its own, without the client library's thread: requests the type of
// no session, which no log line tells at its usual level.
class BareConnection {
 public:
  explicit BareConnection(const std::string& path) : socket_(connectTo(path)) {
    if (socket_ < 0) fail("a connection was refused");
    // [10, 1]: all reporters.
    const unsigned char request[] = {3, 0, 0, 0, 0x82, 0x0A, 0x01};
    if (::send(socket_, request, sizeof request, MSG_NOSIGNAL) != sizeof request) {
      failWithErrno("send");
    }
    unsigned char length = 0;
    if (::recv(socket_, &length, 1, /*flags=*/0) != 1) {
      fail("a bare connection got no reply");
    }
  }
  BareConnection(BareConnection&& other) noexcept
      : socket_(std::exchange(other.socket_, -1)) {}
  ~BareConnection() {
    if (socket_ >= 0) ::close(socket_);
  }

 private:
  int socket_;
};

// Seconds from the request until the last step of the stop.
double stopSession(ServiceClient& client, std::binary_semaphore& isStopped) {
  const auto began = Clock::now();
  client.submit(
      [&] { return client.client().stopReportingSessionForID(ReporterID{kSession}); });
  isStopped.acquire();
  return Seconds(Clock::now() - began).count();
}

}  // namespace

void measureRetainedMessage(const Scale& scale, Figures& figures) {
  ServiceProcess service({.kind = ServiceKind::kCounting});
  ServiceClient client(service.socketPath());
  client.startSessions(kSession, 1);
  deliver(service, scale.messages / 10,
          [&] { client.send(scale.messages / 10, kSession); });
  settle();
  const double before = anonymousBytes(service);
  deliver(service, scale.messages, [&] { client.send(scale.messages, kSession); });
  settle();
  const double bytes =
      (anonymousBytes(service) - before) / static_cast<double>(scale.messages);
  figures.add("bytes_per_retained_message",
              bytes / static_cast<double>(bytesOnTheWire()));
}

void measureSessionMemory(const Scale& scale, Figures& figures) {
  ServiceProcess service({.kind = ServiceKind::kProduct});
  ServiceClient client(service.socketPath());
  client.startSessions(kSession, 1);
  client.waitUntilServed();
  settle();
  const double before = anonymousBytes(service);
  const std::int64_t first = kSession + 1;
  for (std::int64_t i = 0; i < scale.sessions; ++i) {
    client.submit(
        [&] { return client.client().createReportingSession(ReporterID{first + i}); });
  }
  client.waitUntilServed();
  settle();
  const double created = anonymousBytes(service);
  for (std::int64_t i = 0; i < scale.sessions; ++i) {
    client.submit([&] {
      return client.client().startReportingSessionForID(ReporterID{first + i});
    });
  }
  client.waitUntilServed();
  settle();
  settle();
  const double started = anonymousBytes(service);
  const double count = static_cast<double>(scale.sessions);
  figures.add("bytes_per_session", (created - before) / count);
  figures.add("bytes_per_started_session", (started - before) / count);
}

void measureConnectionMemory(const Scale& scale, Figures& figures) {
  ServiceProcess service({.kind = ServiceKind::kProduct});
  std::vector<BareConnection> connections;
  connections.emplace_back(service.socketPath());
  settle();
  const double before = anonymousBytes(service);
  for (std::int64_t i = 0; i < scale.clients; ++i) {
    connections.emplace_back(service.socketPath());
  }
  settle();
  figures.add("bytes_per_connection",
              (anonymousBytes(service) - before) / static_cast<double>(scale.clients));
}

// Idle is: clients are connected, sessions are started, and nothing comes.
void measureIdle(const Scale& scale, Figures& figures) {
  ServiceProcess service({.kind = ServiceKind::kProduct});
  settle();
  figures.add("idle_rss",
              static_cast<double>(service.process().memory().resident) / kMebibyte);
  ServiceClient client(service.socketPath());
  std::vector<BareConnection> connections;
  for (std::int64_t i = 0; i < kIdleClients; ++i) {
    connections.emplace_back(service.socketPath());
  }
  client.startSessions(kSession, kIdleClients);
  client.send(kIdleClients, kSession, kIdleClients);
  client.waitUntilServed();
  // The last commit and the timers of the start are over.
  std::this_thread::sleep_for(std::chrono::seconds(1));
  const std::uint64_t before = service.process().wakeups();
  std::this_thread::sleep_for(std::chrono::seconds(scale.idleSeconds));
  figures.add("idle_wakeups", static_cast<double>(service.process().wakeups() - before) /
                                  static_cast<double>(scale.idleSeconds));
  figures.add("idle_threads", static_cast<double>(service.process().memory().threads));
}

void measureStart(const Scale& /*scale*/, Figures& figures) {
  const ServiceProcess service({.kind = ServiceKind::kProduct});
  figures.add("start_ms", service.startTime().count() * 1e3);
}

// What a session of that many messages has in its list: each message's encoding below
// its identifier.
std::uint64_t listBytes(std::uint64_t messages) {
  constexpr std::uint64_t kHeads = 1 + 2;  // Of a dictionary of one, and of its key.
  std::uint64_t bytes = 0;
  for (std::uint64_t i = 1; i <= messages; ++i) {
    bytes += kHeads + kExampleName.size() + std::to_string(i).size() + kPayloadBytes;
  }
  return bytes;
}

// The memory is all that the service has taken since the session was started, wherever
// it has its list.
void measureStopOfAMillion(const Scale& /*scale*/, Figures& figures) {
  ServiceProcess service({.kind = ServiceKind::kProduct, .isInternalBuild = true});
  ServiceClient client(service.socketPath());
  std::binary_semaphore isStopped{0};
  const ReporterID session{kSession};
  client.submit([&] { return client.client().createReportingSession(session); });
  client.submit([&] {
    return client.client().startReportingSessionForID(
        session,
        {[&](const Reply<bool>&) { isStopped.release(); }, std::chrono::milliseconds(0)});
  });
  client.waitUntilServed();
  settle();
  const double before = static_cast<double>(service.process().memory().resident);
  // The store takes them as fast as its disk does, the session much faster.
  constexpr std::uint64_t kSlice = kMillion / 20;
  for (std::uint64_t sent = kSlice; sent <= kMillion; sent += kSlice) {
    client.send(kSlice, kSession);
    service.waitUntil("all messages were stored",
                      [&] { return service.storedMessages() >= sent; });
    service.waitUntil("all events were stored",
                      [&] { return service.storedAnalyticsEvents() >= sent; });
  }
  settle();
  const double list = static_cast<double>(listBytes(kMillion));
  service.process().forgetPeakMemory();
  figures.add("stop_million_s", stopSession(client, isStopped));
  const double peak = static_cast<double>(service.process().memory().peakResident);
  figures.add("stop_million_memory", (peak - before) / list);
  if (service.sessionLogBytes() < kMillion * kPayloadBytes) {
    fail("the session log does not hold the messages");
  }
}

}  // namespace ostrel::bench
