#include "tests/model/Comparison.h"

#include <algorithm>
#include <memory>
#include <sstream>

#include "tests/model/Side.h"

namespace ostrel {
namespace {

constexpr const char* kCreated = "trace 0x21042828";
constexpr const char* kTornDown = "trace 0x21042834";

std::string joined(const std::vector<std::string>& lines) {
  std::string text;
  for (const std::string& line : lines) text += "    " + line + '\n';
  return text;
}

std::string shown(const std::vector<std::size_t>& queues) {
  std::string text = "queues";
  for (const std::size_t queue : queues) text += ' ' + std::to_string(queue);
  return text;
}

// "log info osrr created reporting", "trace 0x21042814", "backend.flush": enough to tell
// kinds apart.
std::string kindOf(const std::string& event) {
  int words = 1;
  if (event.starts_with("log")) words = 5;
  if (event.starts_with("trace")) words = 2;
  std::size_t end = 0;
  while (words-- > 0 && end != std::string::npos) {
    end = event.find(' ', end == 0 ? 0 : end + 1);
  }
  return event.substr(0, end);
}

// The sessions that go with a client go in no particular order: those torn down one
// behind the other are sorted, each with the lines that belong to it.
void sortTeardowns(std::vector<std::string>& events) {
  using Lines = std::vector<std::string>;
  for (auto begin = events.begin(); begin != events.end();) {
    std::vector<Lines> teardowns;
    auto end = begin;
    while (end != events.end() && *end == kTornDown) {
      const auto next = std::find_if(end + 1, events.end(), [](const auto& event) {
        return !event.starts_with("log info osrr deallocing") &&
               !event.starts_with("backend.release");
      });
      teardowns.emplace_back(end, next);
      end = next;
    }
    std::sort(teardowns.begin(), teardowns.end());
    auto out = begin;
    for (const Lines& each : teardowns) out = std::copy(each.begin(), each.end(), out);
    begin = end == begin ? begin + 1 : end;
  }
}

class Pair {
 public:
  Pair(const Setup& setup, Statistics* statistics)
      : core_(makeCoreSide(setup)),
        reference_(makeReferenceSide(setup)),
        statistics_(statistics) {}

  /// What differs now; empty when nothing does.
  std::string difference() {
    auto core = core_->takeEvents();
    auto reference = reference_->takeEvents();
    note(core);
    sortTeardowns(core);
    sortTeardowns(reference);
    if (core != reference) {
      return "  the core:\n" + joined(core) + "  the reference:\n" + joined(reference);
    }
    if (core_->readyQueues() != reference_->readyQueues()) {
      return "  of the core can run: " + shown(core_->readyQueues()) +
             "\n  of the reference: " + shown(reference_->readyQueues()) + '\n';
    }
    if (core_->timerCount() != reference_->timerCount()) {
      return "  timers of the core: " + std::to_string(core_->timerCount()) +
             "\n  of the reference: " + std::to_string(reference_->timerCount()) + '\n';
    }
    return "";
  }

  template <typename Step>
  std::string both(Step step) {
    step(*core_);
    step(*reference_);
    return difference();
  }
  std::string apply(const Action& action) {
    return both([&action](Side& side) { side.apply(action); });
  }

  std::string runOut() {
    const Action run{ActionKind::kRun, {}, std::nullopt};
    while (!core_->readyQueues().empty()) {
      if (auto text = apply(run); !text.empty()) return text;
    }
    return "";
  }

  std::string end() {
    const Action minute{ActionKind::kAdvance, {240}, std::nullopt};
    std::string text = both([](Side& side) { side.closeConnections(); });
    if (text.empty()) text = runOut();
    // A wait that ends may let another start begin to wait.
    while (text.empty() && core_->timerCount() != 0) {
      text = apply(minute);
      if (text.empty()) text = runOut();
    }
    if (text.empty()) text = both([](Side& side) { side.releaseHeld(); });
    if (text.empty()) text = runOut();
    if (text.empty() && core_->files() != reference_->files()) {
      text = "  the files of the core and of the reference differ\n";
    }
    if (text.empty() && created_ != tornDown_) {
      text = "  sessions made: " + std::to_string(created_) +
             "\n  torn down: " + std::to_string(tornDown_) + '\n';
    }
    return text;
  }

 private:
  void note(const std::vector<std::string>& events) {
    for (const std::string& event : events) {
      if (event == kCreated) ++created_;
      if (event == kTornDown) ++tornDown_;
      if (statistics_ != nullptr) ++statistics_->events[kindOf(event)];
    }
  }

  const std::unique_ptr<Side> core_;
  const std::unique_ptr<Side> reference_;
  Statistics* const statistics_;
  std::size_t created_ = 0;
  std::size_t tornDown_ = 0;
};

}  // namespace

std::optional<Difference> compare(const Sequence& sequence, Statistics* statistics) {
  Pair pair(sequence.setup, statistics);
  if (auto text = pair.difference(); !text.empty()) return Difference{0, text};
  for (std::size_t i = 0; i < sequence.actions.size(); ++i) {
    if (auto text = pair.apply(sequence.actions[i]); !text.empty()) {
      return Difference{i, text};
    }
    if (statistics != nullptr) ++statistics->steps;
  }
  if (auto text = pair.end(); !text.empty()) {
    return Difference{sequence.actions.size(), text};
  }
  return std::nullopt;
}

Sequence shrink(Sequence sequence, const std::function<bool(const Sequence&)>& fails) {
  for (std::size_t size = sequence.actions.size(); size >= 1;) {
    bool wasCut = false;
    for (std::size_t begin = 0; begin < sequence.actions.size();) {
      Sequence shorter = sequence;
      const auto first = shorter.actions.begin() + static_cast<std::ptrdiff_t>(begin);
      const auto left = static_cast<std::size_t>(shorter.actions.end() - first);
      shorter.actions.erase(first,
                            first + static_cast<std::ptrdiff_t>(std::min(size, left)));
      if (fails(shorter)) {
        sequence = std::move(shorter);
        wasCut = true;
      } else {
        begin += size;
      }
    }
    if (size > 1) {
      size /= 2;
    } else if (!wasCut) {
      break;
    }
  }
  return sequence;
}

std::string report(const Sequence& sequence) {
  const Sequence shortest = shrink(sequence, [](const Sequence& candidate) {
    return compare(candidate, /*statistics=*/nullptr).has_value();
  });
  const auto difference = compare(shortest, /*statistics=*/nullptr);
  std::ostringstream text;
  if (!difference) return "the sequence shows no difference when it is run again\n";
  text << "after step " << difference->step + 1 << " of " << shortest.actions.size()
       << ":\n"
       << difference->text << "the sequence:\n"
       << print(shortest);
  return text.str();
}

}  // namespace ostrel
