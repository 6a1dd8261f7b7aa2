// The service with its Linux bindings, except that backend and sinks only count
// what they are given: what is measured on it is the service, not the disk.
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <memory>

#include "Statistics/Service/OstrelReportingServiceMain.h"
#include "benchmarks/wholepath/CountingRoles.h"
#include "benchmarks/wholepath/ServiceCounts.h"
#include "platform/linux/LinuxPlatform.h"
#include "platform/linux/Places.h"

namespace ostrel::bench {
namespace {

int run() {
  const auto opened = LinuxPlatform::open();
  if (!opened.value) {
    std::fprintf(stderr, "ostrel_bench_counting_service: %s\n",
                 opened.error->description.c_str());
    return EXIT_FAILURE;
  }
  LinuxPlatform& bindings = **opened.value;
  ServiceCounts& counts = mapServiceCounts(countsPath(runtimeDirectory()));
  OstrelReportingPlatform platform = bindings.platform();
  platform.telemetryBackend = std::make_shared<CountingBackend>(counts);
  platform.analyticsSink = std::make_shared<CountingAnalyticsSink>(counts);
  platform.wattlogSink = std::make_shared<CountingWattlogSink>(counts);
  const int status = OstrelReportingServiceMain(platform, bindings.listener());
  bindings.finish(std::chrono::steady_clock::now() + std::chrono::seconds(1));
  std::_Exit(status);
}

}  // namespace
}  // namespace ostrel::bench

int main() { return ostrel::bench::run(); }
