#include "forwarder/ForwarderProgram.h"

#include <cstdlib>
#include <iostream>
#include <memory>

#include "forwarder/CurlTransport.h"
#include "forwarder/Forwarder.h"
#include "forwarder/MarkFile.h"
#include "forwarder/StoreReportSource.h"
#include "forwarder/StoreWatch.h"
#include "platform/Logging.h"
#include "platform/linux/JournalLog.h"
#include "platform/linux/Places.h"
#include "platform/linux/SystemClock.h"
#include "platform/linux/SystemRandom.h"
#include "platform/linux/TerminationSignals.h"

namespace ostrel {
namespace {

constexpr int kWrongUsage = 2;
constexpr const char* kMarkFile = "forwarder.json";
constexpr std::string_view kUsage =
    "usage: ostrelforwarder [--once]\n"
    "\n"
    "Forwards what the audio reporting service recorded to the OpenTelemetry collector\n"
    "that OTEL_EXPORTER_OTLP_ENDPOINT names.\n"
    "\n"
    "  --once     forward what there is, and end\n"
    "  --help     show this, and end\n"
    "  --version  show the version, and end\n";

enum class Manner { kForGood, kOnce };

int failed(const std::string& sentence, int status) {
  std::cerr << "ostrelforwarder: " << sentence << '\n';
  return status;
}

std::string pathOfStore(const Environment& environment) {
  const auto named = environment("OSTREL_STORE");
  return named && !named->empty() ? *named : storePath();
}

int forward(const ForwarderSettings& settings, const std::string& store, Manner manner) {
  MarkFile marks(stateDirectory(), kMarkFile);
  auto mark = marks.load();
  if (!mark.value) return failed(mark.error->description, EXIT_FAILURE);
  const TerminationSignals signals;
  StoreReportSource source(store);
  CurlTransport transport(settings, signals.descriptor());
  StoreWatch watch(store, signals.descriptor(), StoreWatch::kSettling);
  const SystemClock clock;
  SystemRandom random;
  Forwarder forwarder({source, transport, marks, watch, clock, random}, settings.resource,
                      *std::move(mark.value));
  if (manner == Manner::kOnce) {
    const Success success = forwarder.runOnce();
    if (!success.succeeded) return failed(success.error->description, EXIT_FAILURE);
    return EXIT_SUCCESS;
  }
  OSTREL_LOG_DEFAULT(processLogScope, "forwards %@ to %@", store, settings.logs.place);
  forwarder.run();
  return EXIT_SUCCESS;
}

}  // namespace

int runForwarder(const std::vector<std::string>& arguments,
                 const Environment& environment) {
  const std::string first = arguments.empty() ? "" : arguments.front();
  if (arguments.size() > 1 || (!first.empty() && first != "--once" && first != "--help" &&
                               first != "--version")) {
    std::cerr << kUsage;
    return kWrongUsage;
  }
  if (first == "--help") {
    std::cout << kUsage;
    return EXIT_SUCCESS;
  }
  if (first == "--version") {
    std::cout << "ostrelforwarder " OSTREL_VERSION "\n";
    return EXIT_SUCCESS;
  }
  const auto settings = forwarderSettings(environment);
  if (settings.error) return failed(settings.error->description, kWrongUsage);
  if (!settings.value) {
    return failed("no collector is named by OTEL_EXPORTER_OTLP_ENDPOINT: nothing is sent",
                  EXIT_SUCCESS);
  }
  setSystemLog(JournalLog::open());
  registerLogScope(processLogScope);
  const Manner manner = first == "--once" ? Manner::kOnce : Manner::kForGood;
  const int status = forward(*settings.value, pathOfStore(environment), manner);
  setSystemLog(nullptr);  // Lines that wait are written.
  return status;
}

}  // namespace ostrel
