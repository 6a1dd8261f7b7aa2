#pragma once

#include <cstddef>
#include <initializer_list>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Value.h"

namespace ostrel {

/// What the fakes of one test saw, in order. Each fake's header lists the texts
/// that it adds. Any thread.
class EventLog {
 public:
  void add(std::string event);
  /// As `add`; the event shows the values that came with it when `showArguments`
  /// was called: " " and JSON for each.
  void add(std::string event, std::initializer_list<ValueView> arguments);

  /// From now on; called before anything is added.
  void showArguments() { showsArguments_ = true; }
  bool showsArguments() const { return showsArguments_; }

  std::vector<std::string> all() const;
  /// As `all`, and forgets them.
  std::vector<std::string> take();
  /// The events that begin with `prefix`, in order.
  std::vector<std::string> startingWith(std::string_view prefix) const;
  std::size_t count(std::string_view event) const;
  /// Where `event` stands the first time; none when it does not.
  std::optional<std::size_t> indexOf(std::string_view event) const;
  /// Whether both are there and the first `earlier` stands before the first
  /// `later`.
  bool inOrder(std::string_view earlier, std::string_view later) const;
  void clear();

 private:
  bool showsArguments_ = false;

  mutable std::mutex mutex_;
  std::vector<std::string> events_;
};

using SharedEventLog = std::shared_ptr<EventLog>;

}  // namespace ostrel
