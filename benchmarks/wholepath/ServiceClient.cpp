#include "benchmarks/wholepath/ServiceClient.h"

#include <semaphore>

#include "benchmarks/wholepath/Payload.h"

namespace ostrel::bench {
namespace {

constexpr std::chrono::minutes kReplyPatience{4};

reporting::Options optionsFor(const std::string& socketPath) {
  reporting::Options options;
  options.socketPath = socketPath;
  options.replyTimeout = kReplyPatience;
  return options;
}

}  // namespace

ServiceClient::ServiceClient(const std::string& socketPath)
    : payload_(examplePayload()), client_(optionsFor(socketPath)) {}

void ServiceClient::startSessions(std::int64_t first, std::int64_t count) {
  for (std::int64_t id = first; id < first + count; ++id) {
    const reporting::ReporterID session{id};
    submit([&] { return client_.createReportingSession(session); });
    submit([&] { return client_.setServiceType(reporting::ServiceType{1}, session); });
    submit([&] { return client_.startReportingSessionForID(session); });
  }
}

void ServiceClient::send(std::uint64_t count, std::int64_t first, std::int64_t sessions) {
  std::optional<reporting::ReporterIDs> addressee = {{reporting::ReporterID{first}}};
  for (std::uint64_t i = 0; i < count; ++i) {
    const auto turn = static_cast<std::int64_t>(i) % sessions;
    addressee->front() = reporting::ReporterID{first + turn};
    submit([&] {
      return client_.sendMessage(payload_, kExampleCategory, kExampleType, addressee);
    });
  }
}

void ServiceClient::waitUntilServed() {
  std::binary_semaphore isServed{0};
  bool wasReplied = false;
  submit([&] {
    return client_.sendMessage(payload_, kExampleCategory, kExampleType,
                               reporting::ReporterIDs{},
                               [&](const reporting::Reply<void>& reply) {
                                 wasReplied = static_cast<bool>(reply);
                                 isServed.release();
                               });
  });
  isServed.acquire();
  if (!wasReplied) fail("the service did not reply");
}

DeliveryResult deliver(ServiceProcess& service, std::uint64_t messages,
                       const std::function<void()>& send) {
  const std::uint64_t wanted = service.counts().messages + messages;
  const auto began = Clock::now();
  const auto processorTime = [&] {
    return ownProcessorTime() + service.process().processorTime();
  };
  const Seconds processorBefore = processorTime();
  send();
  service.waitUntil("all messages were delivered",
                    [&] { return service.counts().messages >= wanted; });
  const Seconds took = Clock::now() - began;
  const Seconds processor = processorTime() - processorBefore;
  const double count = static_cast<double>(messages);
  return {count / took.count(), processor.count() * 1e9 / count};
}

}  // namespace ostrel::bench
