#pragma once

#include <chrono>
#include <cstdint>
#include <string>

#include "forwarder/Forwarder.h"
#include "platform/linux/FileDescriptor.h"

namespace ostrel {

/// Waits for the kernel's word that the store was written, and for time on a clock that
/// goes on while the machine sleeps. Costs nothing while nothing happens.
class StoreWatch final : public Waits {
 public:
  /// What is written within this time is waited for, so that it goes in one request.
  static constexpr std::chrono::milliseconds kSettling{1'000};

  /// Watches from here on. The store need not be there, nor its directory. `end` becomes
  /// readable when the process is to end; it stays the caller's.
  StoreWatch(const std::string& storePath, int end, std::chrono::milliseconds settling);

  bool forChange() override;
  bool forTime(std::chrono::milliseconds pause) override;

 private:
  bool isChanged();
  bool watch();
  bool tryToWatch(const std::string& directory);
  bool waitForEvents();
  bool readEvents();
  bool isOfStore(std::uint32_t mask, const char* name) const;

  const std::string directory_;
  const std::string name_;
  const int end_;
  const std::chrono::milliseconds settling_;
  FileDescriptor inotify_;
  FileDescriptor timer_;
  int watch_ = -1;
  bool watchesStore_ = false;  // Its directory itself, and none above.
};

}  // namespace ostrel
