#include "benchmarks/wholepath/DBusPeer.h"

#include <systemd/sd-bus.h>
#include <unistd.h>

#include <array>
#include <cstring>
#include <fstream>
#include <thread>

namespace ostrel::bench {
namespace {

constexpr const char* kName = "com.orbisk.bench";
constexpr const char* kPath = "/bench";
constexpr std::chrono::seconds kStartPatience{10};
// Below the queue's limit in the library, and many messages to a write.
constexpr std::uint64_t kMessagesAFlush = 256;

constexpr const char* kConfiguration =
    "<busconfig><type>session</type><auth>EXTERNAL</auth>"
    "<policy context=\"default\"><allow send_destination=\"*\" eavesdrop=\"true\"/>"
    "<allow eavesdrop=\"true\"/><allow own=\"*\"/></policy>"
    "<limit name=\"max_incoming_bytes\">1000000000</limit>"
    "<limit name=\"max_outgoing_bytes\">1000000000</limit>";

void check(int result, const char* what) {
  if (result >= 0) return;
  fail(std::string(what) + ": " + std::strerror(-result));
}

sd_bus* openBus(const std::string& address) {
  sd_bus* bus = nullptr;
  check(sd_bus_new(&bus), "sd_bus_new");
  check(sd_bus_set_address(bus, address.c_str()), "sd_bus_set_address");
  check(sd_bus_set_bus_client(bus, /*b=*/1), "sd_bus_set_bus_client");
  check(sd_bus_start(bus), "sd_bus_start");
  return bus;
}

ChildProcess startDaemon(const PrivateDirectory& directory) {
  const std::string path = directory.path() + "/bus.conf";
  std::ofstream(path) << kConfiguration << "<listen>unix:path=" << directory.path()
                      << "/bus</listen></busconfig>\n";
  ChildProcess::Settings settings;
  settings.outputPath = directory.path() + "/bus.log";
  auto daemon = ChildProcess::execute(
      {"/usr/bin/dbus-daemon", "--nofork", "--nopidfile", "--config-file=" + path},
      settings);
  const auto deadline = Clock::now() + kStartPatience;
  while (::access((directory.path() + "/bus").c_str(), F_OK) != 0) {
    if (!daemon.isRunning() || Clock::now() > deadline) {
      fail("dbus-daemon did not start");
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return daemon;
}

struct Receiver {
  std::uint64_t left;
};

int countMessage(sd_bus_message* message, void* context, sd_bus_error* /*error*/) {
  if (sd_bus_message_is_method_call(message, kName, "Send") <= 0) return 0;
  check(sd_bus_message_skip(message, "uqa{sv}"), "sd_bus_message_skip");
  --static_cast<Receiver*>(context)->left;
  return 1;
}

// Counts and says on `done` that it is ready, then that all have come.
void receive(const std::string& address, std::uint64_t messages, int done) {
  sd_bus* bus = openBus(address);
  Receiver receiver{messages};
  check(sd_bus_add_filter(bus, /*slot=*/nullptr, countMessage, &receiver),
        "sd_bus_add_filter");
  check(sd_bus_request_name(bus, kName, /*flags=*/0), "sd_bus_request_name");
  const char byte = 1;
  if (::write(done, &byte, 1) != 1) failWithErrno("write");
  while (receiver.left > 0) {
    const int processed = sd_bus_process(bus, /*r=*/nullptr);
    check(processed, "sd_bus_process");
    if (processed == 0) check(sd_bus_wait(bus, /*timeout_usec=*/UINT64_MAX), "wait");
  }
  if (::write(done, &byte, 1) != 1) failWithErrno("write");
  ::pause();
}

void appendText(sd_bus_message* message, const char* key, const char* value) {
  check(sd_bus_message_append(message, "{sv}", key, "s", value), "append");
}

void appendNumber(sd_bus_message* message, const char* key, std::int64_t value) {
  check(sd_bus_message_append(message, "{sv}", key, "x", value), "append");
}

void sendOne(sd_bus* bus) {
  sd_bus_message* message = nullptr;
  check(sd_bus_message_new_method_call(bus, &message, kName, kPath, kName, "Send"),
        "sd_bus_message_new_method_call");
  check(sd_bus_message_set_expect_reply(message, /*b=*/0), "set_expect_reply");
  check(sd_bus_message_append(message, "uq", 0x40000007u, 1u), "append");
  check(sd_bus_message_open_container(message, 'a', "{sv}"), "open");
  appendText(message, "route", "Speaker");
  appendText(message, "codec", "aac-eld");
  appendText(message, "application", "com.orbisk.music");
  appendText(message, "reason", "category change by user");
  appendNumber(message, "sample_rate", 48000);
  appendNumber(message, "channels", 2);
  appendNumber(message, "underruns", 317);
  appendNumber(message, "buffer_frames", 1024);
  check(sd_bus_message_append(message, "{sv}", "latency", "d", 0.0213), "append");
  check(sd_bus_message_append(message, "{sv}", "formats", "as", 4, "pcm", "aac", "opus",
                              "24"),
        "append");
  check(sd_bus_message_close_container(message), "close");
  check(sd_bus_send(bus, message, /*cookie=*/nullptr), "sd_bus_send");
  sd_bus_message_unref(message);
}

void waitForByte(int pipe) {
  char byte = 0;
  if (::read(pipe, &byte, 1) != 1) fail("the receiver behind the bus ended");
}

}  // namespace

PeerResult runDBusOneWay(std::uint64_t messages) {
  const PrivateDirectory directory;
  const auto daemon = startDaemon(directory);
  const std::string address = "unix:path=" + directory.path() + "/bus";
  std::array<int, 2> pipe{};
  if (::pipe(pipe.data()) != 0) failWithErrno("pipe");
  const auto receiver = ChildProcess::fork([&] { receive(address, messages, pipe[1]); });
  ::close(pipe[1]);
  waitForByte(pipe[0]);
  sd_bus* bus = openBus(address);

  const auto began = Clock::now();
  const auto processorTime = [&] {
    return ownProcessorTime() + daemon.processorTime() + receiver.processorTime();
  };
  const Seconds processorBefore = processorTime();
  for (std::uint64_t i = 1; i <= messages; ++i) {
    sendOne(bus);
    if (i % kMessagesAFlush == 0) check(sd_bus_flush(bus), "sd_bus_flush");
  }
  check(sd_bus_flush(bus), "sd_bus_flush");
  waitForByte(pipe[0]);
  const Seconds took = Clock::now() - began;
  const Seconds processor = processorTime() - processorBefore;

  ::close(pipe[0]);
  sd_bus_flush_close_unref(bus);
  const double count = static_cast<double>(messages);
  return {count / took.count(), processor.count() * 1e9 / count};
}

}  // namespace ostrel::bench
