#include "tests/model/Action.h"

#include <cstdio>
#include <cstdlib>
#include <limits>
#include <sstream>

namespace ostrel {
namespace {

struct Row {
  ActionKind kind;
  const char* name;
  int weight;  // How often it is drawn.
};

constexpr Row kRows[] = {
    {ActionKind::kConnect, "connect", 25},
    {ActionKind::kInterrupt, "interrupt", 3},
    {ActionKind::kOnlyInterrupt, "only-interrupt", 2},
    {ActionKind::kInvalidate, "invalidate", 4},
    {ActionKind::kCreate, "create", 60},
    {ActionKind::kSetType, "set-type", 50},
    {ActionKind::kGetType, "get-type", 10},
    {ActionKind::kConfigure, "configure", 30},
    {ActionKind::kStart, "start", 80},
    {ActionKind::kSend, "send", 120},
    {ActionKind::kStop, "stop", 55},
    {ActionKind::kDestroy, "destroy", 25},
    {ActionKind::kValidate, "validate", 10},
    {ActionKind::kGetAll, "get-all", 10},
    {ActionKind::kKill, "kill", 2},
    {ActionKind::kRun, "run", 800},
    {ActionKind::kAdvance, "advance", 60},
    {ActionKind::kSetWallClock, "set-wall-clock", 4},
    {ActionKind::kSetDefaults, "set-defaults", 8},
    {ActionKind::kPostDefaults, "post-defaults", 12},
    {ActionKind::kSetDiscovery, "set-discovery", 35},
    {ActionKind::kAnswerDiscovery, "answer-discovery", 45},
    {ActionKind::kForgetDiscovery, "forget-discovery", 15},
    {ActionKind::kSetFlush, "set-flush", 6},
    {ActionKind::kAnswerFlush, "answer-flush", 8},
    {ActionKind::kFailSend, "fail-send", 12},
    {ActionKind::kFailSendOne, "fail-send-one", 8},
    {ActionKind::kSetCounter, "set-counter", 20},
    {ActionKind::kFailSamples, "fail-samples", 5},
    {ActionKind::kFailDelta, "fail-delta", 5},
    {ActionKind::kDraw, "draw", 6},
    {ActionKind::kWakeSpuriously, "wake-spuriously", 8},
    {ActionKind::kTurnDevice, "turn-device", 40},
    {ActionKind::kTurnInterface, "turn-interface", 20},
    {ActionKind::kSetVerbose, "set-verbose", 5},
    {ActionKind::kFailFiles, "fail-files", 4},
};

std::int64_t roll(Dice& dice, std::int64_t sides) {
  return static_cast<std::int64_t>(dice() % static_cast<std::uint64_t>(sides));
}

template <std::size_t kSize>
std::int64_t any(Dice& dice, const std::int64_t (&values)[kSize]) {
  return values[roll(dice, kSize)];
}

// Few, so that they meet; others now and then.
std::int64_t anyID(Dice& dice) {
  static const std::int64_t kOdd[] = {0, -1, std::numeric_limits<std::int64_t>::min(), 99,
                                      std::numeric_limits<std::int64_t>::max()};
  if (roll(dice, 10) == 0) return any(dice, kOdd);
  return 1 + roll(dice, 3);
}

std::int64_t anyServiceType(Dice& dice) {
  static const std::int64_t kTypes[] = {0, 2, 2, 2, 3, 4, 7, 7, 7, 11, 11, 12, 65535};
  return any(dice, kTypes);
}

std::int64_t anyCategory(Dice& dice) {
  static const std::int64_t kCategories[] = {
      0, 1, 9, 0x40000007, 65538, 0x00010003, 0x0800000C, 0xFFFFFFFF, 0x8000000B};
  return any(dice, kCategories);
}

std::int64_t anyMessageType(Dice& dice) {
  static const std::int64_t kTypes[] = {0, 1, 2, 6, 300, 65535};
  return any(dice, kTypes);
}

std::int64_t anyDuration(Dice& dice) {  // Round the 9 s of a wait above all.
  static const std::int64_t kQuarters[] = {0, 1, 4, 17, 35, 36, 36, 36, 37, 240};
  return any(dice, kQuarters);
}

std::int64_t anyWallClockStep(Dice& dice) {
  static const std::int64_t kSeconds[] = {-3600, -1, 3600, 86400 * 3650};
  return any(dice, kSeconds);
}

ActionKind anyKind(Dice& dice) {
  static const int kSum = [] {
    int sum = 0;
    for (const Row& row : kRows) sum += row.weight;
    return sum;
  }();
  std::int64_t left = roll(dice, kSum);
  for (const Row& row : kRows) {
    left -= row.weight;
    if (left < 0) return row.kind;
  }
  std::abort();
}

std::optional<std::vector<std::int64_t>> anyIDs(Dice& dice) {
  if (roll(dice, 4) == 0) return std::nullopt;
  std::vector<std::int64_t> ids;
  for (std::int64_t i = roll(dice, 4); i > 0; --i) ids.push_back(anyID(dice));
  return ids;
}

// What a client's action needs besides its slot.
void rollRequest(Action& action, Dice& dice) {
  auto& [slot, second, third, fourth] = action.numbers;
  switch (action.kind) {
    case ActionKind::kConnect:
      second = roll(dice, 6);
      break;
    case ActionKind::kSetType:
      second = anyID(dice);
      third = anyServiceType(dice);
      break;
    case ActionKind::kConfigure:
      second = anyID(dice);
      third = roll(dice, 7);
      break;
    case ActionKind::kCreate:
    case ActionKind::kGetType:
    case ActionKind::kStart:
    case ActionKind::kStop:
    case ActionKind::kDestroy:
    case ActionKind::kValidate:
      second = anyID(dice);
      break;
    case ActionKind::kSend:
      second = roll(dice, 9);
      third = anyCategory(dice);
      fourth = anyMessageType(dice);
      action.ids = anyIDs(dice);
      break;
    default:
      break;
  }
}

// `first` was rolled as a slot is, of four.
void rollSteering(Action& action, Dice& dice) {
  auto& [first, second, third, fourth] = action.numbers;
  switch (action.kind) {
    case ActionKind::kRun:
      first = roll(dice, 60);
      second = roll(dice, 60);
      break;
    case ActionKind::kAdvance:
      first = anyDuration(dice);
      break;
    case ActionKind::kSetWallClock:
      first = anyWallClockStep(dice);
      break;
    case ActionKind::kSetDefaults:
      first = roll(dice, 9);  // Some of them leave reporting on.
      break;
    case ActionKind::kPostDefaults:
      first = roll(dice, 5) == 0 ? 0 : 1;
      break;
    case ActionKind::kSetDiscovery:
      first = roll(dice, 7);
      break;
    case ActionKind::kAnswerDiscovery:
      second = roll(dice, 3);
      third = roll(dice, 4) == 0 ? 1 : 0;
      break;
    case ActionKind::kAnswerFlush:
      second = roll(dice, 2);
      break;
    case ActionKind::kFailSend:
    case ActionKind::kFailSendOne:
      first = roll(dice, 2);
      break;
    case ActionKind::kSetCounter:
      second = roll(dice, 3);
      third = roll(dice, 30) - 3;
      break;
    case ActionKind::kFailSamples:
      second = roll(dice, 3);
      break;
    case ActionKind::kFailDelta:
      first = roll(dice, 3);
      break;
    case ActionKind::kDraw:
      first = roll(dice, 60);
      break;
    case ActionKind::kTurnDevice:
      first = roll(dice, 6);
      break;
    case ActionKind::kTurnInterface:
      first = 10 + roll(dice, 6);
      break;
    case ActionKind::kSetVerbose:
      first = roll(dice, 3);
      second = roll(dice, 2);
      break;
    case ActionKind::kFailFiles:
      first = roll(dice, 5);
      break;
    default:
      break;
  }
}

Action randomAction(Dice& dice) {
  Action action{anyKind(dice), {roll(dice, 4)}, std::nullopt};
  if (action.kind <= ActionKind::kKill) {
    rollRequest(action, dice);
  } else {
    rollSteering(action, dice);
  }
  return action;
}

// Two clients with a session each that may both be meant by 1, and one more.
void beginWithSessions(Sequence& sequence, Dice& dice) {
  const auto add = [&sequence](ActionKind kind, std::int64_t slot, std::int64_t number) {
    sequence.actions.push_back({kind, {slot, number}, std::nullopt});
  };
  add(ActionKind::kConnect, /*slot=*/0, roll(dice, 6));
  add(ActionKind::kConnect, /*slot=*/1, roll(dice, 6));
  add(ActionKind::kCreate, /*slot=*/0, /*number=*/1);
  add(ActionKind::kCreate, /*slot=*/1, /*number=*/1);
  add(ActionKind::kCreate, /*slot=*/1, /*number=*/2);
  if (roll(dice, 2) == 0) return;
  for (const std::int64_t id : {1, 2}) {
    sequence.actions.push_back(
        {ActionKind::kSetType, {1, id, anyServiceType(dice)}, std::nullopt});
  }
}

[[noreturn]] void refuse(const std::string& line) {
  std::fprintf(stderr, "a sequence has no line like this: %s\n", line.c_str());
  std::abort();
}

Action parseAction(const std::string& line) {
  std::istringstream words(line);
  std::string name;
  words >> name;
  Action action{};
  bool isKnown = false;
  for (const Row& row : kRows) {
    if (name != row.name) continue;
    action.kind = row.kind;
    isKnown = true;
  }
  for (std::int64_t& number : action.numbers) words >> number;
  if (!isKnown || !words) refuse(line);
  std::string colon;
  if (words >> colon) {
    if (colon != ":") refuse(line);
    action.ids.emplace();
    for (std::int64_t id = 0; words >> id;) action.ids->push_back(id);
  }
  return action;
}

}  // namespace

Sequence randomSequence(std::uint64_t seed) {
  Dice dice(seed);
  Sequence sequence;
  sequence.setup = {.isInternalBuild = roll(dice, 2) == 0,
                    .deviceClass = roll(dice, 8) == 0 ? 6 : 1,
                    .drivers = roll(dice, 16),
                    .verbose = roll(dice, 3) == 0 ? 7 : roll(dice, 8)};
  if (roll(dice, 4) != 0) beginWithSessions(sequence, dice);
  const std::int64_t size = 50 + roll(dice, 400);
  for (std::int64_t i = 0; i < size; ++i) sequence.actions.push_back(randomAction(dice));
  return sequence;
}

std::string print(const Sequence& sequence) {
  const Setup& setup = sequence.setup;
  std::ostringstream text;
  text << "setup " << setup.isInternalBuild << ' ' << setup.deviceClass << ' '
       << setup.drivers << ' ' << setup.verbose << '\n';
  for (const Action& action : sequence.actions) {
    for (const Row& row : kRows) {
      if (row.kind == action.kind) text << row.name;
    }
    for (const std::int64_t number : action.numbers) text << ' ' << number;
    if (action.ids) {
      text << " :";
      for (const std::int64_t id : *action.ids) text << ' ' << id;
    }
    text << '\n';
  }
  return text.str();
}

Sequence parse(const std::string& text) {
  Sequence sequence;
  std::istringstream lines(text);
  std::string word;
  Setup& setup = sequence.setup;
  lines >> word >> setup.isInternalBuild >> setup.deviceClass >> setup.drivers >>
      setup.verbose;
  if (word != "setup" || !lines) refuse(text.substr(0, text.find('\n')));
  std::string line;
  std::getline(lines, line);
  while (std::getline(lines, line)) {
    if (!line.empty()) sequence.actions.push_back(parseAction(line));
  }
  return sequence;
}

}  // namespace ostrel
