// The client library at a service that says anything, in any pieces, and goes away at any
// time: each request ends once, at the latest when the client does.
#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <span>
#include <string>

#include "fuzz/Fuzzing.h"
#include "ostrel/OstrelReportingClient.h"
#include "platform/linux/FileDescriptor.h"
#include "platform/linux/TestSockets.h"
#include "platform/linux/TestSupport.h"

namespace {

using namespace ostrel::reporting;
using ostrel::FileDescriptor;
using ostrel::fuzzing::expect;

constexpr ReporterID kSession{7};

struct Ended {
  std::atomic<int> once{0};
  std::atomic<int> starts{0};
};

// One of each kind. Their numbers are 1 to 7.
void ask(Client& client, Ended& ended) {
  const auto one = [&](const auto&) { ++ended.once; };
  client.createReportingSession(kSession, one);
  client.getServiceNameForReporterID(kSession, one);
  client.startReportingSessionForID(kSession,
                                    [&](const Reply<bool>&) { ++ended.starts; });
  client.sendMessage({{"a", 1}}, Category{1}, MessageType{2}, {{kSession}}, one);
  client.reporterIDValid(kSession, one);
  client.getAllReporters(one);
  client.stopReportingSessionForID(kSession, one);
}

}  // namespace

// Each piece that the service says has its size before it; 0 ends the connection.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const ostrel::testing_support::TemporaryDirectory directory;
  static const std::string path = directory / "socket";
  static const FileDescriptor listener = ostrel::testing_support::listeningSocket(path);
  expect(static_cast<bool>(listener));

  Ended ended;
  Options options;
  options.socketPath = path;
  options.closeTimeout = std::chrono::milliseconds(0);
  Client client(std::move(options));
  ask(client, ended);
  FileDescriptor service(::accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
  std::span<const std::uint8_t> rest(data, size);
  while (!rest.empty() && rest[0] != 0) {
    const std::size_t count = std::min<std::size_t>(rest[0], rest.size() - 1);
    if (::send(service.get(), rest.data() + 1, count, MSG_NOSIGNAL) < 0) break;
    rest = rest.subspan(1 + count);
  }
  if (!rest.empty()) service.reset();
  client.close();
  expect(ended.once == 6);
  expect(ended.starts >= 1);
  // Its attempts to reach the service again are not the next client's.
  pollfd waiting{listener.get(), POLLIN, /*revents=*/0};
  for (int ready = 1; ready != 0;) {
    ready = ::poll(&waiting, 1, /*timeout=*/0);
    if (ready > 0) {
      FileDescriptor(::accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
    }
  }
  return 0;
}
