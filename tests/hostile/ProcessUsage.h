// What a running service takes, for the tests that hold it to that.
#pragma once

#include <sys/types.h>
#include <time.h>

#include <chrono>
#include <cstddef>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <sstream>
#include <string>

namespace ostrel::hostile {

#ifdef OSTREL_SANITIZED
// Sanitizers keep several times the memory of what they watch, and what was freed too.
inline constexpr bool kMemoryIsBounded = false;
#else
inline constexpr bool kMemoryIsBounded = true;
#endif
inline constexpr std::size_t kMostResidentKiB = 96 * 1024;

struct Usage {
  std::size_t descriptors = 0;
  std::size_t threads = 0;
  std::size_t peakResidentKiB = 0;
};

inline Usage usageOf(pid_t pid) {
  const std::string process = "/proc/" + std::to_string(pid);
  Usage usage;
  for ([[maybe_unused]] const auto& each :
       std::filesystem::directory_iterator(process + "/fd")) {
    ++usage.descriptors;
  }
  std::ifstream status(process + "/status");
  for (std::string line; std::getline(status, line);) {
    std::istringstream words(line);
    std::string name;
    std::size_t value = 0;
    words >> name >> value;
    if (name == "Threads:") usage.threads = value;
    if (name == "VmHWM:") usage.peakResidentKiB = value;
  }
  return usage;
}

/// Of all threads, since it began.
inline std::chrono::duration<double> processorTimeOf(pid_t pid) {
  clockid_t clock{};
  timespec time{};
  if (::clock_getcpuclockid(pid, &clock) != 0) return {};
  ::clock_gettime(clock, &time);
  return std::chrono::seconds(time.tv_sec) + std::chrono::nanoseconds(time.tv_nsec);
}

/// What a variable of the environment says.
inline double numberIn(const char* variable, double usual) {
  const char* value = std::getenv(variable);
  return value != nullptr ? std::atof(value) : usual;
}

}  // namespace ostrel::hostile
