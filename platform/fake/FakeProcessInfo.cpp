#include "platform/fake/FakeProcessInfo.h"

#include <utility>

namespace ostrel {

FakeProcessInfo::FakeProcessInfo(SharedEventLog events) : events_(std::move(events)) {}

std::optional<std::string> FakeProcessInfo::commandName(ProcessID pid) const {
  events_->add("process.commandName " + std::to_string(pid));
  const std::lock_guard lock(mutex_);
  const auto found = names_.find(pid);
  if (found == names_.end()) return std::nullopt;
  return found->second;
}

void FakeProcessInfo::endProcess(int status) {
  events_->add("process.end " + std::to_string(status));
  const std::lock_guard lock(mutex_);
  if (!endStatus_) endStatus_ = status;
}

void FakeProcessInfo::setCommandName(ProcessID pid, std::optional<std::string> name) {
  const std::lock_guard lock(mutex_);
  if (name) {
    names_.insert_or_assign(pid, std::move(*name));
  } else {
    names_.erase(pid);
  }
}

std::optional<int> FakeProcessInfo::endStatus() const {
  const std::lock_guard lock(mutex_);
  return endStatus_;
}

}  // namespace ostrel
