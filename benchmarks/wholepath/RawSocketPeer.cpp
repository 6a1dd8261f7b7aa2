#include "benchmarks/wholepath/RawSocketPeer.h"

#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <string>
#include <vector>

#include "benchmarks/wholepath/Payload.h"

namespace ostrel::bench {
namespace {

constexpr std::size_t kBatchBytes = 64 * 1024;
constexpr std::size_t kReadBytes = 64 * 1024;
constexpr char kDone = 1;

// Both ends; the runner's is `ends[0]`.
struct Pair {
  Pair() {
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, /*protocol=*/0, ends) != 0) {
      failWithErrno("socketpair");
    }
  }
  ~Pair() {
    ::close(ends[0]);
    ::close(ends[1]);
  }
  int ends[2];
};

void writeAll(int socket, const char* bytes, std::size_t size) {
  while (size > 0) {
    const ssize_t written = ::send(socket, bytes, size, MSG_NOSIGNAL);
    if (written < 0) failWithErrno("send");
    bytes += written;
    size -= static_cast<std::size_t>(written);
  }
}

// Calls `frame` at each whole frame until it returns false.
template <typename Frame>
void readFrames(int socket, const Frame& frame) {
  std::vector<char> buffer(2 * kReadBytes);
  std::size_t begin = 0;
  std::size_t end = 0;
  while (true) {
    const ssize_t size = ::read(socket, buffer.data() + end, kReadBytes);
    if (size <= 0) return;
    end += static_cast<std::size_t>(size);
    while (end - begin >= 4) {
      std::uint32_t length = 0;
      std::memcpy(&length, buffer.data() + begin, sizeof length);
      if (end - begin < 4 + length) break;
      begin += 4 + length;
      if (!frame()) return;
    }
    std::memmove(buffer.data(), buffer.data() + begin, end - begin);
    end -= begin;
    begin = 0;
  }
}

PeerResult runOneWay(std::uint64_t messages, std::uint64_t messagesAWrite) {
  const Pair pair;
  auto reader = ChildProcess::fork([&] {
    std::uint64_t count = 0;
    readFrames(pair.ends[1], [&] { return ++count != messages; });
    writeAll(pair.ends[1], &kDone, 1);
    ::pause();
  });
  std::string batch;
  for (std::uint64_t i = 0; i < messagesAWrite; ++i) batch += rawFrame();
  const std::size_t frameSize = batch.size() / messagesAWrite;

  const auto began = Clock::now();
  const Seconds ownBefore = ownProcessorTime();
  const Seconds readerBefore = reader.processorTime();
  for (std::uint64_t sent = 0; sent < messages; sent += messagesAWrite) {
    const std::uint64_t count = std::min(messagesAWrite, messages - sent);
    writeAll(pair.ends[0], batch.data(), count * frameSize);
  }
  char answer = 0;
  if (::read(pair.ends[0], &answer, 1) != 1) failWithErrno("read");
  const Seconds took = Clock::now() - began;
  const Seconds processor =
      ownProcessorTime() - ownBefore + reader.processorTime() - readerBefore;
  const double count = static_cast<double>(messages);
  return {count / took.count(), processor.count() * 1e9 / count};
}

}  // namespace

PeerResult runRawBatched(std::uint64_t messages) {
  return runOneWay(messages, kBatchBytes / rawFrame().size());
}

PeerResult runRawSingle(std::uint64_t messages) {
  return runOneWay(messages, /*messagesAWrite=*/1);
}

double runRawRoundTripOnOneCore(std::uint64_t roundTrips) {
  constexpr char kReply[7] = {3, 0, 0, 0, 'a', 'b', 'c'};
  const Pair pair;
  const auto server = ChildProcess::fork(
      [&] {
        readFrames(pair.ends[1], [&] {
          writeAll(pair.ends[1], kReply, sizeof kReply);
          return true;
        });
      },
      /*onlyCPU=*/0);
  useOnlyCPU(0);
  const std::string frame = rawFrame();
  const auto began = Clock::now();
  for (std::uint64_t i = 0; i < roundTrips; ++i) {
    writeAll(pair.ends[0], frame.data(), frame.size());
    char reply[sizeof kReply];
    if (::recv(pair.ends[0], reply, sizeof reply, MSG_WAITALL) != sizeof reply) {
      failWithErrno("recv");
    }
  }
  const Seconds took = Clock::now() - began;
  useOnlyCPU(-1);
  return took.count() * 1e6 / static_cast<double>(roundTrips);
}

}  // namespace ostrel::bench
