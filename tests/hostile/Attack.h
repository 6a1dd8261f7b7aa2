// What the behaviours of the hostile client are made of: a connection that is spoken to
// in bytes, frames written out by hand, and the frame of an attack.
#pragma once

#include <chrono>
#include <cstdint>
#include <initializer_list>
#include <optional>
#include <random>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/linux/FileDescriptor.h"
#include "platform/linux/wire/Frame.h"

namespace ostrel::hostile {

using Clock = std::chrono::steady_clock;
using TimePoint = Clock::time_point;
using wire::Operation;

// CBOR, as far as it is needed. `head` takes one of the eight major types.
enum class Major : unsigned {
  kUnsigned,
  kNegative,
  kBytes,
  kText,
  kArray,
  kMap,
  kTag,
  kSimple
};
std::string head(Major major, std::uint64_t value);
std::string integer(std::int64_t value);
std::string text(std::string_view value);
inline const std::string kNull = "\xf6";
inline const std::string kEmptyMap = "\xa0";
inline const std::string kEmptyArray = "\x80";

/// An item with its length before it.
std::string frame(std::string_view item);
/// The length of a frame, alone.
std::string lengthField(std::uint32_t length);

/// A whole frame; number 0 wants no reply.
std::string request(Operation operation, std::uint64_t number,
                    const std::vector<std::string>& arguments = {});

/// One connection, or none. No call blocks beyond the time that it is given.
class Peer {
 public:
  Peer() = default;
  explicit Peer(FileDescriptor socket) : socket_(std::move(socket)) {}

  explicit operator bool() const { return static_cast<bool>(socket_); }
  int descriptor() const { return socket_.get(); }

  /// Sends all of it, reading nothing meanwhile. False: the connection has ended, or the
  /// service did not take it in time.
  bool send(std::string_view bytes, TimePoint deadline);
  /// As `send`; reads and forgets replies as they come.
  bool sendAndDrain(std::string_view bytes, TimePoint deadline);

  /// The next frame's item. None: the connection has ended, or time is over.
  std::optional<std::string> receive(TimePoint deadline);
  /// Reads until the service ends the connection. False: it did not in time.
  bool waitForEnd(TimePoint deadline);
  /// Reads what is there and forgets it. False: the connection has ended.
  bool drain();

  void shutDown(int how);
  void close() { socket_.reset(); }

 private:
  bool waitFor(short events, TimePoint deadline) const;
  bool sendAll(std::string_view bytes, TimePoint deadline, bool drains);

  FileDescriptor socket_;
  std::string received_;
};

/// One run of one behaviour.
class Attack {
 public:
  struct Target {
    std::string socketPath;
    std::string logDirectory;  // May be empty.
  };

  Attack(Target target, std::chrono::milliseconds time, std::uint64_t seed)
      : target_(std::move(target)), end_(Clock::now() + time), random_(seed) {}

  const Target& target() const { return target_; }
  TimePoint end() const { return end_; }
  bool isOver() const { return Clock::now() >= end_; }
  /// Until when the service must have done what it must do, however busy it is.
  static TimePoint patience() { return Clock::now() + std::chrono::minutes(1); }
  /// Sleeps, not beyond the end.
  void rest(std::chrono::milliseconds time) const;

  /// Between both, inclusive.
  std::uint64_t pick(std::uint64_t least, std::uint64_t most);
  std::string randomBytes(std::size_t count);

  /// Says that the service did not do what it must.
  void expect(bool isSo, const char* sentence);
  /// One more of whatever the behaviour does.
  void step() { ++steps_; }

  /// A connection, which may be refused behind it; none when time is over.
  Peer connect();
  /// A connection that the service has served a request of; none when time is over.
  Peer admitted();
  /// `admitted`, with these started sessions.
  Peer withSessions(std::int64_t first, int count, std::uint16_t serviceType);

  std::uint64_t steps() const { return steps_; }
  const std::vector<std::string>& failures() const { return failures_; }

 private:
  const Target target_;
  const TimePoint end_;
  std::mt19937_64 random_;
  std::uint64_t steps_ = 0;
  std::vector<std::string> failures_;
};

}  // namespace ostrel::hostile
