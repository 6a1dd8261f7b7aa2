// The two places that log lines go to. Neither write ever blocks, and neither
// changes the flags of a descriptor that other processes may share: a pipe or a
// terminal is opened a second time, without blocking, through the process's own
// list of descriptors; a socket takes the wish with each call; a file is written
// as it is.
#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <sys/un.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdint>
#include <cstring>

#include "platform/linux/JournalLog.h"

namespace ostrel {
namespace {

bool wouldBlock(int error) { return error == EAGAIN || error == EWOULDBLOCK; }

class LineSink final : public LogSink {
 public:
  explicit LineSink(int descriptor) : original_(descriptor) {
    struct stat status {};
    if (::fstat(descriptor, &status) != 0) return;
    isSocket_ = S_ISSOCK(status.st_mode);
    if (!S_ISFIFO(status.st_mode) && !S_ISCHR(status.st_mode)) return;
    const std::string path = "/proc/self/fd/" + std::to_string(descriptor);
    reopened_.reset(::open(path.c_str(), O_WRONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    // Where that is not allowed, what a ready pipe takes at once must do.
    isPolledBefore_ = !reopened_;
  }

  Result tryWrite(const LogLine& line, std::size_t& written) override {
    encode(line);
    while (written < record_.size()) {
      const ssize_t size = writeSome(std::string_view(record_).substr(written));
      if (size >= 0) {
        written += static_cast<std::size_t>(size);
      } else if (wouldBlock(errno)) {
        return Result::kWouldBlock;
      } else if (errno != EINTR) {
        return Result::kFailed;
      }
    }
    return Result::kWritten;
  }

  int descriptor() const override { return reopened_ ? reopened_.get() : original_; }

 private:
  void encode(const LogLine& line) {
    record_ = '<';
    record_ += std::to_string(static_cast<int>(line.level));
    record_ += '>';
    record_ += line.text;
    // One line stays one line, or a text could forge others.
    std::replace(record_.begin(), record_.end(), '\n', ' ');
    record_ += '\n';
  }

  ssize_t writeSome(std::string_view bytes) {
    if (isSocket_) {
      return ::send(original_, bytes.data(), bytes.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
    }
    if (isPolledBefore_) {
      pollfd ready = {original_, POLLOUT, 0};
      if (::poll(&ready, 1, /*timeout=*/0) == 0) {
        errno = EAGAIN;
        return -1;
      }
      bytes = bytes.substr(0, PIPE_BUF);
    }
    return ::write(descriptor(), bytes.data(), bytes.size());
  }

  const int original_;
  FileDescriptor reopened_;
  bool isSocket_ = false;
  bool isPolledBefore_ = false;
  std::string record_;
};

class JournalSink final : public LogSink {
 public:
  explicit JournalSink(std::string path) : path_(std::move(path)) {}

  bool connect() {
    FileDescriptor socket(
        ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (!socket || path_.size() >= sizeof address.sun_path) return false;
    std::memcpy(address.sun_path, path_.data(), path_.size());
    // Room for more than one long line.
    const int bufferSize = 8 * 1024 * 1024;
    ::setsockopt(socket.get(), SOL_SOCKET, SO_SNDBUF, &bufferSize, sizeof bufferSize);
    if (::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address),
                  sizeof address) != 0) {
      return false;
    }
    socket_ = std::move(socket);
    return true;
  }

  Result tryWrite(const LogLine& line, std::size_t& written) override {
    if (standardError_) return standardError_->tryWrite(line, written);
    encode(line);
    if (send()) return Result::kWritten;
    if (wouldBlock(errno)) return Result::kWouldBlock;
    if (errno == EMSGSIZE) return Result::kFailed;
    // The journal was restarted.
    if (connect()) {
      if (send()) return Result::kWritten;
      if (wouldBlock(errno)) return Result::kWouldBlock;
    }
    standardError_ = makeLineSink(STDERR_FILENO);
    return standardError_->tryWrite(line, written);
  }

  int descriptor() const override {
    return standardError_ ? standardError_->descriptor() : socket_.get();
  }

 private:
  // Fields are "NAME=text\n"; a text with an end of line in it goes by its length.
  void encode(const LogLine& line) {
    record_ = "PRIORITY=";
    record_ += std::to_string(static_cast<int>(line.level));
    record_ += "\nSYSLOG_IDENTIFIER=ostrelreportingd\nOSTREL_SCOPE=";
    record_ += line.scopeCode;
    if (line.text.find('\n') == std::string_view::npos) {
      record_ += "\nMESSAGE=";
    } else {
      record_ += "\nMESSAGE\n";
      for (int i = 0; i < 8; ++i) {
        record_ +=
            static_cast<char>(static_cast<std::uint64_t>(line.text.size()) >> (8 * i));
      }
    }
    record_ += line.text;
    record_ += '\n';
  }

  bool send() const {
    ssize_t size = 0;
    do {
      size = ::send(socket_.get(), record_.data(), record_.size(),
                    MSG_DONTWAIT | MSG_NOSIGNAL);
    } while (size < 0 && errno == EINTR);
    return size >= 0;
  }

  const std::string path_;
  FileDescriptor socket_;
  std::unique_ptr<LogSink> standardError_;
  std::string record_;
};

}  // namespace

std::unique_ptr<LogSink> connectJournalSink(const std::string& path) {
  auto sink = std::make_unique<JournalSink>(path);
  if (!sink->connect()) return nullptr;
  return sink;
}

std::unique_ptr<LogSink> makeLineSink(int descriptor) {
  return std::make_unique<LineSink>(descriptor);
}

}  // namespace ostrel
