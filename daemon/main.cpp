#include <chrono>
#include <cstdio>
#include <cstdlib>

#include "Statistics/Service/OstrelReportingServiceMain.h"
#include "platform/linux/LinuxPlatform.h"

namespace {

// An orderly end takes less than 2 s.
constexpr std::chrono::milliseconds kFarewell{1700};

}  // namespace

int main() {
  const auto opened = ostrel::LinuxPlatform::open();
  if (!opened.value) {
    std::fprintf(stderr, "ostrelreportingd: %s\n", opened.error->description.c_str());
    return EXIT_FAILURE;
  }
  ostrel::LinuxPlatform& platform = **opened.value;
  const int status =
      ostrel::OstrelReportingServiceMain(platform.platform(), platform.listener());
  platform.finish(std::chrono::steady_clock::now() + kFarewell);
  // Threads that hang on the outside must not hold the end up.
  std::_Exit(status);
}
