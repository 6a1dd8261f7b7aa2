// Random sequences of requests, backend answers, time and scheduling on the core and on
// the reference, compared after every step.
//
//   OSTREL_MODEL_STEPS=10000000   as many steps from fresh sequences
//   OSTREL_MODEL_SEED=7           the fresh sequences of that seed
//   OSTREL_MODEL_REPLAY=FILE      the sequence that a failure printed
#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <fstream>
#include <iostream>
#include <random>
#include <sstream>
#include <string>

#include "tests/model/Comparison.h"

namespace ostrel {
namespace {

constexpr std::size_t kFixedSteps = 100'000;
constexpr std::size_t kFreshSteps = 10'000;

/// The sequences of consecutive seeds until there were so many steps.
Statistics runSequences(std::uint64_t firstSeed, std::size_t steps) {
  Statistics statistics;
  for (std::uint64_t seed = firstSeed; statistics.steps < steps; ++seed) {
    const Sequence sequence = randomSequence(seed);
    if (compare(sequence, &statistics)) {
      ADD_FAILURE() << "seed " << seed << ", " << report(sequence);
      break;
    }
  }
  return statistics;
}

const Statistics& fixedSequences() {
  static const Statistics kStatistics = runSequences(/*firstSeed=*/1, kFixedSteps);
  return kStatistics;
}

TEST(Model, AgreesWithTheCoreAfterEveryStepOfFixedSequences) {
  EXPECT_GE(fixedSequences().steps, kFixedSteps);
}

TEST(Model, ComesOftenToEveryPartOfTheService) {
  constexpr std::size_t kOften = 10;
  for (const char* const event :
       {// Clients.
        "trace 0x21042814", "trace 0x21042818", "trace 0x2104281c", "trace 0x21042820",
        "trace 0x21042824", "log default osrs InterruptionHandler: connection",
        "log default osrs clientStartDate is", "log default osrs clientProcessName is",
        "log default osrs re-reading ostrel", "log error osrs failed to",
        "log default osrs no active", "log default osrs DESTROYING SERVICE",
        // Sessions.
        "trace 0x2104282c", "trace 0x21042830", "trace 0x21042834", "trace 0x21042838",
        "log default osrr waiting for", "log default osrr continuing",
        "log error osrr failed to", "log error osrr No backends",
        "log error osrr No valid", "log error osrr error sending",
        "log info osrr transactions aren't", "log debug osrr session not",
        "log error osrr flush error", "log error osrr sendOneMessageWithSessionInfo not",
        "log default osrr sending summary", "log error osrr jsonOutput writeToURL:",
        "log error osrr can't create", "log debug osrr Orientation handler",
        // The surroundings.
        "backend.createSession", "backend.sendMessage", "backend.flush",
        "backend.release", "backend.sendOneMessage", "wattlog", "files.write",
        "orientation.registerDevice", "orientation.unregisterInterface",
        "log default osrs fetching driver", "log default osrs nothing interesting",
        "log error osrd ChanrepCreateSamplesDelta error"}) {
    const auto found = fixedSequences().events.find(event);
    EXPECT_TRUE(found != fixedSequences().events.end() && found->second >= kOften)
        << event;
  }
}

TEST(Model, AgreesWithTheCoreAfterEveryStepOfFreshSequences) {
  const char* const steps = std::getenv("OSTREL_MODEL_STEPS");
  const char* const chosen = std::getenv("OSTREL_MODEL_SEED");
  const std::uint64_t seed = chosen != nullptr
                                 ? std::stoull(chosen)
                                 : std::uint64_t{std::random_device()()} << 20;
  std::cout << "first seed " << seed << '\n';
  RecordProperty("seed", std::to_string(seed));
  const std::size_t wanted = steps != nullptr ? std::stoull(steps) : kFreshSteps;
  const Statistics statistics = runSequences(seed, wanted);
  std::cout << statistics.steps << " steps\n";
  if (steps == nullptr) return;
  for (const auto& [event, count] : statistics.events) {
    std::cout << count << '\t' << event << '\n';
  }
}

TEST(Model, ReplaysASequenceFromAFile) {
  const char* const path = std::getenv("OSTREL_MODEL_REPLAY");
  std::stringstream text;
  if (path != nullptr) {
    text << std::ifstream(path).rdbuf();
  } else {
    text << print(randomSequence(/*seed=*/1));
  }
  const auto difference = compare(parse(text.str()), /*statistics=*/nullptr);
  EXPECT_FALSE(difference) << "after step " << difference->step + 1 << '\n'
                           << difference->text;
}

TEST(Model, ReadsBackWhatItPrints) {
  for (std::uint64_t seed = 0; seed < 50; ++seed) {
    const std::string text = print(randomSequence(seed));
    ASSERT_EQ(print(parse(text)), text);
  }
}

TEST(Model, ShrinksASequenceToTheActionsThatMatter) {
  const auto startsBehindACreate = [](const Sequence& sequence) {
    bool isCreated = false;
    for (const Action& action : sequence.actions) {
      if (action.kind == ActionKind::kCreate) isCreated = true;
      if (action.kind == ActionKind::kStart && isCreated) return true;
    }
    return false;
  };
  const Sequence long_ = randomSequence(/*seed=*/3);
  ASSERT_TRUE(startsBehindACreate(long_));
  const Sequence shortest = shrink(long_, startsBehindACreate);
  ASSERT_EQ(shortest.actions.size(), 2u);
  EXPECT_EQ(shortest.actions[0].kind, ActionKind::kCreate);
  EXPECT_EQ(shortest.actions[1].kind, ActionKind::kStart);
}

}  // namespace
}  // namespace ostrel
