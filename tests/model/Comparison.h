// Runs a sequence on both sides and compares them after every step.
#pragma once

#include <cstddef>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "tests/model/Action.h"

namespace ostrel {

struct Difference {
  std::size_t step = 0;  // Of the sequence; its size for the end that follows.
  std::string text;
};

/// What was seen over many sequences, on the core's side.
struct Statistics {
  std::size_t steps = 0;
  std::map<std::string, std::size_t> events;  // By their first words.
};

/// Runs the sequence and then its end: connections close, everything runs out, the
/// surroundings let go, the session logs must be the same and every session torn down.
/// `statistics` may be none.
std::optional<Difference> compare(const Sequence& sequence, Statistics* statistics);

/// Drops actions as long as `fails` holds, until none can go.
Sequence shrink(Sequence sequence, const std::function<bool(const Sequence&)>& fails);

/// The difference, and the shortest sequence that shows one, as text that
/// `OSTREL_MODEL_REPLAY` takes.
std::string report(const Sequence& sequence);

}  // namespace ostrel
