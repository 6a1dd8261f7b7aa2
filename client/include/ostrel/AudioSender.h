// Messages from audio threads.
#pragma once

#include <cstdint>
#include <memory>

#include "ostrel/Message.h"

namespace ostrel::reporting {

class ClientCore;

/// The way into the service for one audio thread: wait-free, without lock,
/// system call or allocation. Any number of them may share a client, each used
/// by one thread at a time.
///
/// `send` copies the message into a ring. The client's thread looks into the
/// ring every `period` while the sender is armed, up to 8 periods apart after a
/// quiet while: so long a message may wait, and so often the thread wakes. Arm
/// it while audio runs; an unarmed sender costs nothing, and what is sent then
/// stays in the ring until `arm` or `flush`.
class OSTREL_PUBLIC AudioSender {
 public:
  AudioSender(AudioSender&&) noexcept;
  AudioSender& operator=(AudioSender&&) noexcept;
  /// What is in the ring is still sent.
  ~AudioSender();

  /// False when it is not queued: the ring is full, or the message is invalid
  /// or longer than the ring. Messages to a service that is not there wait in
  /// the ring.
  bool send(const PreparedMessage& message) noexcept;

  /// Messages that `send` did not queue. Any thread.
  std::uint64_t droppedMessages() const noexcept;

  // The rest is not for audio threads.

  void arm();
  /// Has the ring looked into once more, then no longer.
  void disarm();
  /// Has the ring looked into now.
  void flush();

 private:
  friend class Client;
  friend class ClientCore;
  struct Ring;
  explicit AudioSender(std::shared_ptr<Ring> ring);

  std::shared_ptr<Ring> ring_;
};

}  // namespace ostrel::reporting
