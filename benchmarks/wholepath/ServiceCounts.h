#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <string>

namespace ostrel::bench {

/// A count of which each thread has a part: two that count in turn would wait for one
/// another, and be what is measured.
class Count {
 public:
  void add() {
    static std::atomic<std::size_t> threads{0};
    static thread_local const std::size_t own = threads++ % kParts;
    parts_[own].value.fetch_add(1, std::memory_order_relaxed);
  }
  operator std::uint64_t() const {
    std::uint64_t sum = 0;
    for (const Part& part : parts_) sum += part.value.load(std::memory_order_relaxed);
    return sum;
  }

 private:
  static constexpr std::size_t kParts = 16;
  struct alignas(64) Part {
    std::atomic<std::uint64_t> value;
  };
  std::array<Part, kParts> parts_;
};

/// What reached the end of the counting service, in a file that it shares with the
/// runner. A file of zeros is a valid start.
struct ServiceCounts {
  Count messages;
  Count loneMessages;
  Count analyticsEvents;
  Count powerEvents;
  Count sessions;
};

/// Where the counts are in a service's runtime directory.
inline std::string countsPath(const std::string& runtimeDirectory) {
  return runtimeDirectory + "/bench-counts";
}

/// Maps the file at `path`, made when it is missing. Ends the process when that
/// cannot be done. Stays mapped for the life of the process.
ServiceCounts& mapServiceCounts(const std::string& path);

}  // namespace ostrel::bench
