#pragma once

#include <atomic>
#include <cstdint>
#include <string>

namespace ostrel::bench {

/// What reached the end of the counting service, in a file that it shares with the
/// runner. A file of zeros is a valid start. Each count has a cache line of its own.
struct ServiceCounts {
  alignas(64) std::atomic<std::uint64_t> messages;
  alignas(64) std::atomic<std::uint64_t> loneMessages;
  alignas(64) std::atomic<std::uint64_t> analyticsEvents;
  alignas(64) std::atomic<std::uint64_t> powerEvents;
  alignas(64) std::atomic<std::uint64_t> sessions;
};

/// Where the counts are in a service's runtime directory.
inline std::string countsPath(const std::string& runtimeDirectory) {
  return runtimeDirectory + "/bench-counts";
}

/// Maps the file at `path`, made when it is missing. Ends the process when that
/// cannot be done. Stays mapped for the life of the process.
ServiceCounts& mapServiceCounts(const std::string& path);

}  // namespace ostrel::bench
