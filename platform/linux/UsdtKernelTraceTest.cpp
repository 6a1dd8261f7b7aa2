#include "platform/linux/UsdtKernelTrace.h"

#include <gtest/gtest.h>

#include <array>
#include <cstdio>
#include <string>

namespace ostrel {
namespace {

std::string outputOf(const char* command) {
  std::string output;
  std::array<char, 4096> buffer;
  FILE* pipe = ::popen(command, "r");
  if (pipe == nullptr) return output;
  while (std::fgets(buffer.data(), buffer.size(), pipe) != nullptr) {
    output += buffer.data();
  }
  ::pclose(pipe);
  return output;
}

TEST(UsdtKernelTrace, HasOneProbeWithFiveArguments) {
  UsdtKernelTrace trace;
  for (const TraceCode code : {TraceCode::kCreate, TraceCode::kMessageDelivery}) {
    trace.trace(code);
  }
  // The shell's parent is this program.
  const std::string notes = outputOf("readelf -n /proc/$PPID/exe");
  const auto name = notes.find("Name: kernel_trace");
  ASSERT_NE(name, std::string::npos) << notes;
  EXPECT_NE(notes.rfind("Provider: ostrel", name), std::string::npos);
  EXPECT_EQ(notes.find("Name: kernel_trace", name + 1), std::string::npos);
  const auto begin = notes.find("Arguments: ", name);
  const std::string arguments = notes.substr(begin, notes.find('\n', begin) - begin);
  EXPECT_EQ(std::count(arguments.begin(), arguments.end(), '@'), 5) << arguments;
  EXPECT_EQ(arguments.rfind("Arguments: 4@", 0), 0u) << arguments;
}

}  // namespace
}  // namespace ostrel
