#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <new>

#include "Statistics/Service/OstrelReportingServiceMain.h"
#include "platform/linux/LinuxPlatform.h"

namespace {

// An orderly end takes less than 2 s.
constexpr std::chrono::milliseconds kFarewell{1700};

// Without memory there is nothing left to do but to say so: who comes after recovers.
[[noreturn]] void endForWantOfMemory() {
  std::fputs("ostrelreportingd: no memory is left\n", stderr);
  std::_Exit(EXIT_FAILURE);
}

// On whatever thread nobody caught it.
[[noreturn]] void endForAnException() {
  try {
    if (std::current_exception()) std::rethrow_exception(std::current_exception());
  } catch (const std::bad_alloc&) {
    endForWantOfMemory();
  } catch (...) {
  }
  std::abort();
}

}  // namespace

int main() {
  std::set_terminate(endForAnException);
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
