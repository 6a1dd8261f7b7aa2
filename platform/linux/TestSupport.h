// For the tests of the Linux bindings.
#pragma once

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/Logging.h"

namespace ostrel::testing_support {

/// A directory of its own, gone at the end of the test.
class TemporaryDirectory {
 public:
  TemporaryDirectory() : TemporaryDirectory(std::filesystem::temp_directory_path()) {}
  explicit TemporaryDirectory(const std::filesystem::path& parent)
      : path_(parent / "ostrel-test-XXXXXX") {
    if (::mkdtemp(path_.data()) == nullptr) std::abort();
  }
  TemporaryDirectory(const TemporaryDirectory&) = delete;
  TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;
  ~TemporaryDirectory() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }

  const std::string& path() const { return path_; }
  std::string operator/(std::string_view name) const {
    return path_ + "/" + std::string(name);
  }
  /// Writes a file and returns its path.
  std::string write(std::string_view name, std::string_view text) const {
    const std::string path = *this / name;
    std::ofstream(path, std::ios::binary) << text;
    return path;
  }

  /// A place in memory where there is one: for tests that write much.
  static std::filesystem::path inMemory() {
    const std::filesystem::path memory = "/dev/shm";
    return std::filesystem::exists(memory) ? memory
                                           : std::filesystem::temp_directory_path();
  }

 private:
  std::string path_;
};

/// Waits for what happens elsewhere; false when it takes far too long.
template <typename Condition>
bool eventually(const Condition& condition) {
  const auto end = std::chrono::steady_clock::now() + std::chrono::minutes(2);
  while (!condition()) {
    if (std::chrono::steady_clock::now() > end) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  return true;
}

/// The process's log while it lives: keeps every line's text.
class CapturedLog {
 public:
  CapturedLog() { setSystemLog(log_); }
  CapturedLog(const CapturedLog&) = delete;
  CapturedLog& operator=(const CapturedLog&) = delete;
  ~CapturedLog() { setSystemLog(nullptr); }

  std::vector<std::string> lines(LogLevel level) const {
    const std::lock_guard lock(log_->mutex);
    std::vector<std::string> found;
    for (const auto& [lineLevel, text] : log_->lines) {
      if (lineLevel == level) found.push_back(text);
    }
    return found;
  }

 private:
  struct Log final : ScopedLog {
    int verbosity(std::string_view) const override { return 0; }
    LogLevel lowestLevel() const override { return LogLevel::kInfo; }
    void write(const LogLine& line) override {
      const std::lock_guard lock(mutex);
      lines.emplace_back(line.level, std::string(line.text));
    }
    mutable std::mutex mutex;
    std::vector<std::pair<LogLevel, std::string>> lines;
  };

  const std::shared_ptr<Log> log_ = std::make_shared<Log>();
};

}  // namespace ostrel::testing_support
