#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <string_view>
#include <vector>

namespace ostrel {

/// What the store did since the service started. The table `service_status` shows
/// all but the first two, as of the last commit.
struct StoreCounters {
  std::atomic<std::uint64_t> accepted{0};  // Messages and events taken.
  std::atomic<std::uint64_t> written{0};   // Of these, durable.
  std::atomic<std::uint64_t> refused{0};   // Messages answered with an error.
  // Taken, then given up: in a long fault, or of rows that are too long.
  std::atomic<std::uint64_t> lost{0};
  std::atomic<std::uint64_t> droppedAnalytics{0};  // Events.
  std::atomic<std::uint64_t> droppedPower{0};      // Events.
  std::atomic<std::uint64_t> failures{0};          // Of the file, as they were found.
  std::atomic<std::uint64_t> setAside{0};          // Damaged files.
};

/// A count that somebody else keeps; it stands in `service_status` as well.
struct StatusCount {
  std::string_view key;
  std::uint64_t value;
};
/// Called on the writer's thread before each commit. May be none.
using StatusCounts = std::function<std::vector<StatusCount>()>;

}  // namespace ostrel
