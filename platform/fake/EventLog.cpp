#include "platform/fake/EventLog.h"

#include <algorithm>
#include <utility>

#include "platform/ValueJSON.h"

namespace ostrel {

void EventLog::add(std::string event) {
  const std::lock_guard lock(mutex_);
  events_.push_back(std::move(event));
}

void EventLog::add(std::string event, std::initializer_list<ValueView> arguments) {
  if (showsArguments_) {
    for (const ValueView argument : arguments) {
      event += ' ';
      appendJSON(event, argument, JSONLayout::kCompact, JSONStrictness::kLenient,
                 /*indent=*/0);
    }
  }
  add(std::move(event));
}

std::vector<std::string> EventLog::all() const {
  const std::lock_guard lock(mutex_);
  return events_;
}

std::vector<std::string> EventLog::take() {
  const std::lock_guard lock(mutex_);
  return std::exchange(events_, {});
}

std::vector<std::string> EventLog::startingWith(std::string_view prefix) const {
  const std::lock_guard lock(mutex_);
  std::vector<std::string> found;
  for (const std::string& event : events_) {
    if (event.starts_with(prefix)) found.push_back(event);
  }
  return found;
}

std::size_t EventLog::count(std::string_view event) const {
  const std::lock_guard lock(mutex_);
  return static_cast<std::size_t>(std::count(events_.begin(), events_.end(), event));
}

std::optional<std::size_t> EventLog::indexOf(std::string_view event) const {
  const std::lock_guard lock(mutex_);
  const auto found = std::find(events_.begin(), events_.end(), event);
  if (found == events_.end()) return std::nullopt;
  return static_cast<std::size_t>(found - events_.begin());
}

bool EventLog::inOrder(std::string_view earlier, std::string_view later) const {
  const auto first = indexOf(earlier);
  const auto second = indexOf(later);
  return first && second && *first < *second;
}

void EventLog::clear() {
  const std::lock_guard lock(mutex_);
  events_.clear();
}

}  // namespace ostrel
