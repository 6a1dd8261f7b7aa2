#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/Outcome.h"

namespace ostrel {

/// A file descriptor that is closed with its owner.
class OwnedDescriptor {
 public:
  OwnedDescriptor() = default;
  explicit OwnedDescriptor(int descriptor) : descriptor_(descriptor) {}
  OwnedDescriptor(OwnedDescriptor&& other) noexcept : descriptor_(other.release()) {}
  OwnedDescriptor& operator=(OwnedDescriptor&& other) noexcept;
  ~OwnedDescriptor() { reset(); }

  explicit operator bool() const { return descriptor_ >= 0; }
  int get() const { return descriptor_; }
  int release();
  void reset();

 private:
  int descriptor_ = -1;
};

/// The client's end of a stream to the service. Never blocks, never raises
/// SIGPIPE, and is closed by exec.
class ClientSocket {
 public:
  ClientSocket() = default;

  /// Connects at once or says why not, in a sentence with the path. A service
  /// that has too many clients waiting is an error too.
  static Outcome<ClientSocket> connect(const std::string& path);

  explicit operator bool() const { return static_cast<bool>(descriptor_); }
  int descriptor() const { return descriptor_.get(); }

  /// How many bytes the kernel took, 0 when it has no room now, or none when
  /// the connection is broken.
  std::optional<std::size_t> send(std::string_view bytes);

  enum class Received { kBytes, kNothingYet, kEnd };
  /// Reads what is there into `room`; `size` becomes its length. `kEnd` stands
  /// for an orderly end and for a broken connection.
  Received receive(std::span<std::uint8_t> room, std::size_t& size);

  void close() { descriptor_.reset(); }

 private:
  explicit ClientSocket(OwnedDescriptor descriptor)
      : descriptor_(std::move(descriptor)) {}

  OwnedDescriptor descriptor_;
};

/// Wakes one thread that polls `descriptor()`.
class WakeEvent {
 public:
  /// Fails when the process is out of descriptors.
  static Outcome<WakeEvent> make();

  int descriptor() const { return descriptor_.get(); }
  void wake();
  /// Takes the wakes so far away; the polling thread calls it.
  void clear();

  void close() { descriptor_.reset(); }

 private:
  explicit WakeEvent(OwnedDescriptor descriptor) : descriptor_(std::move(descriptor)) {}

  OwnedDescriptor descriptor_;
};

}  // namespace ostrel
