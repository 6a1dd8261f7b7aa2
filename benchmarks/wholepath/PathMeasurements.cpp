// Rates and latencies, of the peers and of the service.
#include <sys/resource.h>

#include <cstdio>
#include <memory>
#include <semaphore>
#include <thread>

#include "benchmarks/wholepath/DBusPeer.h"
#include "benchmarks/wholepath/Measurements.h"
#include "benchmarks/wholepath/Payload.h"
#include "benchmarks/wholepath/RawSocketPeer.h"
#include "benchmarks/wholepath/ServiceClient.h"

namespace ostrel::bench {
namespace {

using reporting::Reply;
using reporting::ReporterID;
using reporting::ReporterIDs;

constexpr std::int64_t kSession = 4711;
// Replies under way in the pipeline; 1,000 of them fit into 1 MiB of queued requests.
constexpr int kPipelineDepth = 1000;
// What a client of many sends at its turn.
constexpr std::uint64_t kBurst = 250;

// Memory and code are touched and threads exist.
void warmUp(ServiceProcess& service, ServiceClient& client, std::uint64_t messages) {
  deliver(service, messages / 20, [&] { client.send(messages / 20, kSession); });
}

// Sends a message with a reply, and the next from its reply, `count` times.
class Relay {
 public:
  Relay(ServiceClient& client, ReporterIDs addressees)
      : client_(client), addressees_(std::move(addressees)) {}

  void run(std::uint64_t count) {
    left_ = count;
    sendNext();
    isDone_.acquire();
  }

 private:
  void sendNext() {
    client_.client().sendMessage(payload_, kExampleCategory, kExampleType, addressees_,
                                 [this](const Reply<void>& reply) {
                                   if (!reply) fail("a round trip got no reply");
                                   if (--left_ == 0) {
                                     isDone_.release();
                                   } else {
                                     sendNext();
                                   }
                                 });
  }

  ServiceClient& client_;
  const std::optional<ReporterIDs> addressees_;
  const reporting::Message payload_ = examplePayload();
  std::uint64_t left_ = 0;
  std::binary_semaphore isDone_{0};
};

// Microseconds a round trip.
double relayOnOneCore(std::uint64_t roundTrips, bool isDelivered) {
  ServiceProcess service({.kind = ServiceKind::kCounting, .onlyCPU = 0});
  useOnlyCPU(0);
  double microseconds = 0;
  {
    ServiceClient client(service.socketPath());
    client.startSessions(kSession, 1);
    client.waitUntilServed();
    Relay relay(client, isDelivered ? ReporterIDs{ReporterID{kSession}} : ReporterIDs{});
    relay.run(roundTrips / 20);
    const auto began = Clock::now();
    relay.run(roundTrips);
    const Seconds took = Clock::now() - began;
    microseconds = took.count() * 1e6 / static_cast<double>(roundTrips);
  }
  useOnlyCPU(-1);
  return microseconds;
}

}  // namespace

void measureRawSocket(const Scale& scale, Figures& figures) {
  runRawBatched(scale.messages);
  const PeerResult batched = runRawBatched(4 * scale.messages);
  figures.add("raw_batched", batched.messagesPerSecond);
  figures.add("raw_cpu_per_message_ns", batched.processorNanoseconds);
  figures.add("raw_single", runRawSingle(scale.messages / 2).messagesPerSecond);
}

void measureRawRoundTrip(const Scale& scale, Figures& figures) {
  figures.add("raw_round_trip_one_core_us", runRawRoundTripOnOneCore(scale.roundTrips));
}

void measureDBus(const Scale& scale, Figures& figures) {
  const PeerResult result = runDBusOneWay(scale.busMessages);
  figures.add("dbus_one_way", result.messagesPerSecond);
  figures.add("dbus_cpu_per_message_ns", result.processorNanoseconds);
}

void measureOneWay(const Scale& scale, Figures& figures) {
  ServiceProcess service({.kind = ServiceKind::kCounting});
  ServiceClient client(service.socketPath());
  client.startSessions(kSession, 1);
  warmUp(service, client, scale.messages);
  const DeliveryResult result =
      deliver(service, scale.messages, [&] { client.send(scale.messages, kSession); });
  if (service.counts().analyticsEvents < scale.messages) {
    fail("not every message was mirrored to the analytics sink");
  }
  figures.add("one_way", result.messagesPerSecond);
  figures.add("cpu_per_message_ns", result.processorNanoseconds);
}

void measureStored(const Scale& scale, Figures& figures) {
  ServiceProcess service({.kind = ServiceKind::kProduct});
  ServiceClient client(service.socketPath());
  client.startSessions(kSession, 1);
  const auto storeAll = [&](std::uint64_t count) {
    const std::uint64_t messages = service.storedMessages() + count;
    const std::uint64_t events = service.storedAnalyticsEvents() + count;
    client.send(count, kSession);
    service.waitUntil("all messages were stored",
                      [&] { return service.storedMessages() >= messages; });
    service.waitUntil("all events were stored",
                      [&] { return service.storedAnalyticsEvents() >= events; });
  };
  storeAll(scale.storedMessages / 20);
  const auto began = Clock::now();
  storeAll(scale.storedMessages);
  const Seconds took = Clock::now() - began;
  figures.add("one_way_stored", static_cast<double>(scale.storedMessages) / took.count());
}

void measurePipelinedReplies(const Scale& scale, Figures& figures) {
  ServiceProcess service({.kind = ServiceKind::kCounting});
  ServiceClient client(service.socketPath());
  client.startSessions(kSession, 1);
  warmUp(service, client, scale.messages);
  const reporting::Message payload = examplePayload();
  const std::optional<ReporterIDs> addressee = {{ReporterID{kSession}}};
  std::counting_semaphore<> room{kPipelineDepth};
  const auto sendAndAwaitReplies = [&] {
    for (std::uint64_t i = 0; i < scale.messages; ++i) {
      room.acquire();
      client.submit([&] {
        return client.client().sendMessage(payload, kExampleCategory, kExampleType,
                                           addressee, [&room](const Reply<void>& reply) {
                                             if (!reply) fail("a message got no reply");
                                             room.release();
                                           });
      });
    }
    for (int i = 0; i < kPipelineDepth; ++i) room.acquire();
  };
  figures.add("pipelined_replies",
              deliver(service, scale.messages, sendAndAwaitReplies).messagesPerSecond);
}

void measureRoundTrip(const Scale& scale, Figures& figures) {
  const double microseconds = relayOnOneCore(scale.roundTrips, /*isDelivered=*/false);
  figures.add("round_trip_one_core_us", microseconds);
  const double raw = figures.last("raw_round_trip_one_core_us").value();
  figures.add("round_trip_one_core", microseconds / raw);
  figures.add("delivered_round_trip_one_core_us",
              relayOnOneCore(scale.roundTrips, /*isDelivered=*/true));
}

// The probe is a process of its own, since nothing may end it but its filter.
void measureAudioSend(const Scale& scale, Figures& figures) {
  ServiceProcess service({.kind = ServiceKind::kCounting});
  const std::string command = programDirectory() + "/ostrel_bench_audio_send " +
                              service.socketPath() + " " +
                              std::to_string(scale.audioSends);
  FILE* const output = ::popen(command.c_str(), "re");
  if (output == nullptr) failWithErrno(command);
  double typical = 0;
  double rare = 0;
  const int fields = std::fscanf(output, "median_ns %lf p999_ns %lf", &typical, &rare);
  if (::pclose(output) != 0 || fields != 2) {
    fail("the probe of the audio thread was ended: a system call or an allocation");
  }
  service.waitUntil("all messages were delivered",
                    [&] { return service.counts().messages >= scale.audioSends; });
  figures.add("client_send_ns", typical);
  figures.add("client_send_p999_ns", rare);
}

void measureManySessions(const Scale& scale, Figures& figures) {
  ServiceProcess service({.kind = ServiceKind::kCounting});
  ServiceClient client(service.socketPath());
  client.startSessions(kSession, 1);
  warmUp(service, client, scale.messages);
  const double single = deliver(service, scale.messages, [&] {
                          client.send(scale.messages, kSession);
                        }).messagesPerSecond;

  const std::int64_t first = kSession + 1;
  client.startSessions(first, scale.sessions);
  // Each session has met one message, so that all are started and touched.
  deliver(service, static_cast<std::uint64_t>(scale.sessions), [&] {
    client.send(static_cast<std::uint64_t>(scale.sessions), first, scale.sessions);
  });
  const double many = deliver(service, scale.messages, [&] {
                        client.send(scale.messages, first, scale.sessions);
                      }).messagesPerSecond;
  figures.add("many_sessions", many / single);
}

void measureManyClients(const Scale& scale, Figures& figures) {
  ServiceProcess service({.kind = ServiceKind::kCounting});
  std::vector<std::unique_ptr<ServiceClient>> clients;
  for (std::int64_t i = 0; i < scale.clients; ++i) {
    clients.push_back(std::make_unique<ServiceClient>(service.socketPath()));
    clients.back()->startSessions(kSession + i, 1);
  }
  for (auto& client : clients) client->waitUntilServed();
  warmUp(service, *clients.front(), scale.messages);
  const double single = deliver(service, scale.messages, [&] {
                          clients.front()->send(scale.messages, kSession);
                        }).messagesPerSecond;
  const std::uint64_t bursts = scale.messages / kBurst;
  const auto sendInTurn = [&] {
    for (std::uint64_t burst = 0; burst < bursts; ++burst) {
      const std::uint64_t turn = burst % clients.size();
      clients[turn]->send(kBurst, kSession + static_cast<std::int64_t>(turn));
    }
  };
  sendInTurn();
  const double many = deliver(service, bursts * kBurst, sendInTurn).messagesPerSecond;
  figures.add("many_clients", many / single);
}

}  // namespace ostrel::bench
