// What a random sequence is made of.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <random>
#include <string>
#include <vector>

namespace ostrel {

using Dice = std::mt19937_64;

enum class ActionKind : std::uint8_t {
  // Numbers: slot of the connection, and what follows in the name.
  kConnect,  // process
  kInterrupt,
  kOnlyInterrupt,
  kInvalidate,
  kCreate,     // ID
  kSetType,    // ID, type
  kGetType,    // ID
  kConfigure,  // ID, configuration
  kStart,      // ID
  kSend,       // payload, category, type; IDs
  kStop,       // ID
  kDestroy,    // ID
  kValidate,   // ID
  kGetAll,
  kKill,
  // Of the surroundings.
  kRun,           // one step: which of the ready queues, position in the background queue
  kAdvance,       // quarters of a second
  kSetWallClock,  // seconds added to it
  kSetDefaults,   // variant
  kPostDefaults,  // 1: own token
  kSetDiscovery,  // variant
  kAnswerDiscovery,  // telemetry session, counted from the last; variant; 1: despite
                     // release
  kForgetDiscovery,  // telemetry session, counted from the last
  kSetFlush,         // variant
  kAnswerFlush,      // telemetry session, counted from the last; 1: an error
  kFailSend,         // 1: without an error object
  kFailSendOne,      // 1: without an error object
  kSetCounter,       // group, channel, value
  kFailSamples,      // driver; variant
  kFailDelta,        // variant
  kDraw,             // the next delay of an alarm
  kWakeSpuriously,
  kTurnDevice,     // code
  kTurnInterface,  // code
  kSetVerbose,     // scope; 1: on
  kFailFiles,      // variant
};

struct Action {
  ActionKind kind;
  std::array<std::int64_t, 4> numbers{};
  /// Of `kSend`; none is an absent list.
  std::optional<std::vector<std::int64_t>> ids;
};

/// What holds from the beginning of a sequence.
struct Setup {
  bool isInternalBuild = false;
  std::int64_t deviceClass = 0;
  std::int64_t drivers = 0;  // Which of the drivers are there, a bit each.
  std::int64_t verbose = 0;  // Which scopes are verbose, a bit each.
};

struct Sequence {
  Setup setup;
  std::vector<Action> actions;
};

Sequence randomSequence(std::uint64_t seed);

/// One line an action; `parse` reads it back. Ends the program on what it cannot read.
std::string print(const Sequence& sequence);
Sequence parse(const std::string& text);

}  // namespace ostrel
