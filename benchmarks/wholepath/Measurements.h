// What is measured: each is one round of one thing, on services of its own.
#pragma once

#include <cstdint>
#include <string_view>
#include <vector>

#include "benchmarks/wholepath/Figures.h"

namespace ostrel::bench {

/// How much a round does. `quick` is for seeing that everything runs.
struct Scale {
  std::uint64_t messages = 1'000'000;
  std::uint64_t storedMessages = 300'000;
  std::uint64_t busMessages = 50'000;
  std::uint64_t roundTrips = 20'000;
  std::uint64_t audioSends = 200'000;
  std::int64_t sessions = 100'000;
  std::int64_t clients = 1'000;
  int idleSeconds = 5;

  static Scale full() { return {}; }
  static Scale quick();
};

struct Measurement {
  void (*run)(const Scale& scale, Figures& figures);
  std::vector<std::string_view> figures;
};

/// In the order in which a round runs them: peers first.
std::vector<Measurement> allMeasurements();

// Of the peers.
void measureRawSocket(const Scale& scale, Figures& figures);
void measureRawRoundTrip(const Scale& scale, Figures& figures);
void measureDBus(const Scale& scale, Figures& figures);

// How fast.
void measureOneWay(const Scale& scale, Figures& figures);
void measureStored(const Scale& scale, Figures& figures);
void measurePipelinedReplies(const Scale& scale, Figures& figures);
void measureRoundTrip(const Scale& scale, Figures& figures);
void measureAudioSend(const Scale& scale, Figures& figures);
void measureManySessions(const Scale& scale, Figures& figures);
void measureManyClients(const Scale& scale, Figures& figures);

// How much.
void measureRetainedMessage(const Scale& scale, Figures& figures);
void measureSessionMemory(const Scale& scale, Figures& figures);
void measureConnectionMemory(const Scale& scale, Figures& figures);
void measureIdle(const Scale& scale, Figures& figures);
void measureStart(const Scale& scale, Figures& figures);
void measureStopOfAMillion(const Scale& scale, Figures& figures);

}  // namespace ostrel::bench
