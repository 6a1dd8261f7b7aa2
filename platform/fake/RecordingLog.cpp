#include "platform/fake/RecordingLog.h"

#include <algorithm>
#include <utility>

#include "platform/Logging.h"
#include "platform/fake/FakeUse.h"

namespace ostrel {
namespace {

const char* levelName(LogLevel level) {
  switch (level) {
    case LogLevel::kError:
      return "error";
    case LogLevel::kDefault:
      return "default";
    case LogLevel::kInfo:
      return "info";
    case LogLevel::kDebug:
      return "debug";
  }
  return "?";
}

}  // namespace

std::shared_ptr<RecordingLog> RecordingLog::install() {
  const std::shared_ptr<RecordingLog> log(new RecordingLog);
  log->isInstalled_ = true;
  setSystemLog(log);
  return log;
}

void RecordingLog::uninstall() {
  {
    const std::lock_guard lock(mutex_);
    if (!std::exchange(isInstalled_, false)) return;
  }
  setSystemLog(nullptr);
}

int RecordingLog::verbosity(std::string_view verbosityKey) const {
  const std::lock_guard lock(mutex_);
  const auto found = verbosities_.find(verbosityKey);
  return found == verbosities_.end() ? 0 : found->second;
}

LogLevel RecordingLog::lowestLevel() const {
  const std::lock_guard lock(mutex_);
  return lowestLevel_;
}

void RecordingLog::write(const LogLine& line) {
  Line kept{line.level, std::string(line.scopeCode), withoutPrefix(line.text)};
  const std::lock_guard lock(mutex_);
  if (events_) {
    events_->add(std::string("log ") + levelName(kept.level) + ' ' + kept.scopeCode +
                 ' ' + kept.text);
  }
  lines_.push_back(std::move(kept));
  fullTexts_.emplace_back(line.text);
}

void RecordingLog::setVerbosity(std::string_view verbosityKey, int verbosity) {
  {
    const std::lock_guard lock(mutex_);
    verbosities_.insert_or_assign(std::string(verbosityKey), verbosity);
  }
  refreshScopes();
}

void RecordingLog::setLowestLevel(LogLevel level) {
  {
    const std::lock_guard lock(mutex_);
    lowestLevel_ = level;
  }
  refreshScopes();
}

void RecordingLog::refreshScopes() {
  checkFakeUse(isInstalled_, "the log is the process's log");
  setSystemLog(shared_from_this());
}

void RecordingLog::recordInto(SharedEventLog events) {
  const std::lock_guard lock(mutex_);
  events_ = std::move(events);
}

std::vector<RecordingLog::Line> RecordingLog::lines() const {
  const std::lock_guard lock(mutex_);
  return lines_;
}

std::vector<std::string> RecordingLog::fullTexts() const {
  const std::lock_guard lock(mutex_);
  return fullTexts_;
}

std::vector<std::string> RecordingLog::texts() const {
  const std::lock_guard lock(mutex_);
  std::vector<std::string> texts;
  for (const Line& line : lines_) texts.push_back(line.text);
  return texts;
}

std::vector<std::string> RecordingLog::texts(LogLevel level) const {
  const std::lock_guard lock(mutex_);
  std::vector<std::string> texts;
  for (const Line& line : lines_) {
    if (line.level == level) texts.push_back(line.text);
  }
  return texts;
}

bool RecordingLog::contains(LogLevel level, std::string_view scopeCode,
                            std::string_view text) const {
  const Line wanted{level, std::string(scopeCode), std::string(text)};
  const std::lock_guard lock(mutex_);
  return std::find(lines_.begin(), lines_.end(), wanted) != lines_.end();
}

std::size_t RecordingLog::count(std::string_view text) const {
  const std::lock_guard lock(mutex_);
  return static_cast<std::size_t>(std::count_if(
      lines_.begin(), lines_.end(), [&](const Line& line) { return line.text == text; }));
}

void RecordingLog::clear() {
  const std::lock_guard lock(mutex_);
  lines_.clear();
  fullTexts_.clear();
}

std::string RecordingLog::withoutPrefix(std::string_view fullText) {
  // "File.cpp:12:ostrel::Class::operation: text": the first blank ends the
  // prefix, for neither a file's nor a function's name holds ": ".
  const std::size_t end = fullText.find(": ");
  if (end == std::string_view::npos) return std::string(fullText);
  return std::string(fullText.substr(end + 2));
}

}  // namespace ostrel
