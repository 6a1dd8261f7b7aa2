#pragma once

#include <cstdint>
#include <mutex>

namespace ostrel {

/// Something with descriptors that a child made by fork must not keep: as long
/// as a child holds a socket, the service sees no end of the connection.
class ForkAware {
 public:
  virtual ~ForkAware() = default;

  /// In the child, before fork returns, with `ForkGuard::lock` held. Only closes
  /// descriptors.
  virtual void closeInChild() noexcept = 0;
};

/// Watches over forks of this process.
class ForkGuard {
 public:
  static void add(ForkAware* object);
  static void remove(ForkAware* object);

  /// No fork happens while it is held. Taken before any other lock.
  static std::unique_lock<std::mutex> lock();

  /// Differs between a process and its children.
  static std::uint64_t generation();
};

}  // namespace ostrel
