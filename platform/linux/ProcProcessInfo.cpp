#include "platform/linux/ProcProcessInfo.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <utility>

#include "platform/linux/wire/PayloadDecoder.h"

namespace ostrel {
namespace {

// The kernel keeps 16 bytes, the last of them a NUL, and ends the file's line.
constexpr std::size_t kMostNameBytes = 16;

bool isRunning(const FileDescriptor& process) {
  pollfd waited{process.get(), POLLIN, 0};
  return ::poll(&waited, 1, /*timeout=*/0) == 0;
}

}  // namespace

FileDescriptor openProcess(ProcessID pid) {
  return FileDescriptor(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
}

ProcProcessInfo::ProcProcessInfo(std::shared_ptr<PeerRegistry> peers,
                                 std::string procDirectory,
                                 std::function<void()> farewell)
    : peers_(std::move(peers)),
      procDirectory_(std::move(procDirectory)),
      farewell_(std::move(farewell)) {}

ProcessID ProcProcessInfo::processIdentifier() const { return ::getpid(); }

std::string ProcProcessInfo::processName() const {
  return readCommandName(::getpid()).value_or(std::string());
}

std::optional<std::string> ProcProcessInfo::commandName(ProcessID pid) const {
  if (pid <= 0) return std::nullopt;
  PeerRegistry::Peer peer = peers_->takePeer(pid);
  if (peer.wasConnected && !peer.isConnected) return std::nullopt;
  FileDescriptor process =
      peer.wasConnected ? std::move(peer.descriptor) : openProcess(pid);
  if (!process) return std::nullopt;
  std::optional<std::string> name = readCommandName(pid);
  // A process that still lives had the id all along.
  if (!isRunning(process)) return std::nullopt;
  return name;
}

std::optional<std::string> ProcProcessInfo::readCommandName(ProcessID pid) const {
  const std::string path = procDirectory_ + "/" + std::to_string(pid) + "/comm";
  const FileDescriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!file) return std::nullopt;
  char bytes[kMostNameBytes + 1];
  const ssize_t size = ::read(file.get(), bytes, sizeof bytes);
  if (size <= 0) return std::nullopt;
  std::string name(bytes, static_cast<std::size_t>(size));
  if (name.back() != '\n' && name.size() > kMostNameBytes) return std::nullopt;
  if (name.back() == '\n') name.pop_back();
  const auto* text = reinterpret_cast<const std::uint8_t*>(name.data());
  if (!wire::isUTF8({text, name.size()})) return std::nullopt;
  return name;
}

void ProcProcessInfo::endProcess(int status) {
  if (farewell_) farewell_();
  ::_exit(status);
}

}  // namespace ostrel
