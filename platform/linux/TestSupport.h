// For the tests of the Linux bindings.
#pragma once

#include <sys/socket.h>
#include <sys/un.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Logging.h"
#include "platform/linux/FileDescriptor.h"

namespace ostrel::testing_support {

/// A directory of its own, gone at the end of the test.
class TemporaryDirectory {
 public:
  TemporaryDirectory() {
    std::string pattern = "/tmp/ostrel-test-XXXXXX";
    if (::mkdtemp(pattern.data()) == nullptr) std::abort();
    path_ = pattern;
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

 private:
  std::string path_;
};

/// Whether a connection to the Unix socket at `path` is taken. The file is there a moment
/// before anybody listens.
inline bool isListenedTo(const std::string& path) {
  const FileDescriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  return ::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address),
                   sizeof address) == 0;
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
