// Runs whole paths, the real client library against the real service in a process of
// its own, beside what a bare socket and a message bus make of the same payload.
//
//   ostrel_bench [--json FILE] [--only NAME,...] [--rounds N] [--quick]
//                [--growth FILE]
//
// A round runs everything once, so that all figures see the same machine.
#include <sys/resource.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <set>
#include <string>

#include "benchmarks/wholepath/ChildProcess.h"
#include "benchmarks/wholepath/GrowthCurves.h"
#include "benchmarks/wholepath/Measurements.h"

namespace ostrel::bench {

Scale Scale::quick() {
  Scale scale;
  scale.messages = 100'000;
  scale.storedMessages = 30'000;
  scale.busMessages = 5'000;
  scale.roundTrips = 2'000;
  scale.audioSends = 20'000;
  scale.sessions = 5'000;
  scale.clients = 100;
  scale.idleSeconds = 1;
  return scale;
}

std::vector<Measurement> allMeasurements() {
  return {
      {measureRawSocket, {"raw_batched", "raw_single", "raw_cpu_per_message_ns"}},
      {measureRawRoundTrip, {"raw_round_trip_one_core_us"}},
      {measureDBus, {"dbus_one_way", "dbus_cpu_per_message_ns"}},
      {measureOneWay, {"one_way", "cpu_per_message_ns"}},
      {measureStored, {"one_way_stored"}},
      {measurePipelinedReplies, {"pipelined_replies"}},
      {measureRoundTrip,
       {"round_trip_one_core", "round_trip_one_core_us",
        "delivered_round_trip_one_core_us"}},
      {measureAudioSend, {"client_send_ns", "client_send_p999_ns"}},
      {measureManySessions, {"many_sessions"}},
      {measureManyClients, {"many_clients"}},
      {measureRetainedMessage, {"bytes_per_retained_message"}},
      {measureSessionMemory, {"bytes_per_session", "bytes_per_started_session"}},
      {measureConnectionMemory, {"bytes_per_connection"}},
      {measureIdle, {"idle_wakeups", "idle_threads", "idle_rss"}},
      {measureStart, {"start_ms"}},
      {measureStopOfAMillion, {"stop_million_s", "stop_million_memory"}},
  };
}

namespace {

constexpr int kUsageStatus = 2;
constexpr const char* kUsage =
    "usage: ostrel_bench [--json FILE] [--only NAME,...] [--rounds N] [--quick]\n"
    "                    [--growth FILE]\n";

struct Options {
  std::string jsonPath;
  std::string growthPath;
  std::set<std::string, std::less<>> only;
  int rounds = 5;
  bool isQuick = false;
};

[[noreturn]] void refuse(const std::string& sentence) {
  std::fprintf(stderr, "ostrel_bench: %s\n%s", sentence.c_str(), kUsage);
  std::exit(kUsageStatus);
}

void addNames(const std::string& list, Options& options) {
  std::size_t begin = 0;
  while (begin <= list.size()) {
    const std::size_t end = std::min(list.find(',', begin), list.size());
    const std::string name = list.substr(begin, end - begin);
    const auto& kinds = figureKinds();
    if (std::none_of(kinds.begin(), kinds.end(),
                     [&](const FigureKind& kind) { return kind.name == name; })) {
      refuse("no figure is called '" + name + "'");
    }
    options.only.insert(name);
    begin = end + 1;
  }
}

Options parse(int argc, char** argv) {
  Options options;
  for (int i = 1; i < argc; ++i) {
    const std::string word = argv[i];
    const auto value = [&]() -> std::string {
      if (i + 1 == argc) refuse(word + " needs a value");
      return argv[++i];
    };
    if (word == "--json") {
      options.jsonPath = value();
    } else if (word == "--growth") {
      options.growthPath = value();
    } else if (word == "--only") {
      addNames(value(), options);
    } else if (word == "--rounds") {
      options.rounds = std::atoi(value().c_str());
      if (options.rounds < 1) refuse("--rounds takes a number from 1 on");
    } else if (word == "--quick") {
      options.isQuick = true;
    } else {
      refuse("'" + word + "' is not an option");
    }
  }
  return options;
}

// Peers are wanted where a ratio to them is.
void addPeers(Options& options) {
  if (options.only.count("round_trip_one_core") != 0) {
    options.only.insert("raw_round_trip_one_core_us");
  }
  for (const FigureKind& kind : figureKinds()) {
    if (options.only.count(kind.name) != 0 && !kind.ratioTo.empty()) {
      options.only.insert(std::string(kind.ratioTo));
    }
  }
}

bool isWanted(const Measurement& measurement, const Options& options) {
  return options.only.empty() ||
         std::any_of(
             measurement.figures.begin(), measurement.figures.end(),
             [&](std::string_view name) { return options.only.count(name) != 0; });
}

// A thousand clients hold more descriptors than a shell allows by default.
void allowManyDescriptors() {
  rlimit limit{};
  ::getrlimit(RLIMIT_NOFILE, &limit);
  limit.rlim_cur = limit.rlim_max;
  ::setrlimit(RLIMIT_NOFILE, &limit);
}

int run(Options options) {
  allowManyDescriptors();
  const Scale scale = options.isQuick ? Scale::quick() : Scale::full();
  if (!options.growthPath.empty()) {
    return writeGrowthCurves(scale, options.growthPath) ? EXIT_SUCCESS : EXIT_FAILURE;
  }
  addPeers(options);
  Figures figures;
  for (int round = 1; round <= options.rounds; ++round) {
    for (const Measurement& measurement : allMeasurements()) {
      if (!isWanted(measurement, options)) continue;
      std::fprintf(stderr, "round %d of %d: %s\n", round, options.rounds,
                   std::string(measurement.figures.front()).c_str());
      measurement.run(scale, figures);
    }
  }
  figures.printTable();
  if (options.jsonPath.empty() || figures.writeJSON(options.jsonPath)) {
    return EXIT_SUCCESS;
  }
  std::fprintf(stderr, "ostrel_bench: %s cannot be written\n", options.jsonPath.c_str());
  return EXIT_FAILURE;
}

}  // namespace
}  // namespace ostrel::bench

int main(int argc, char** argv) {
  return ostrel::bench::run(ostrel::bench::parse(argc, argv));
}
