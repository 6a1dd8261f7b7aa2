// The throttle's key of any payload is made, the same each time, and blind to what is not
// compared; the wait of any payload is one that a timer can have.
#include <cmath>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>
#include <string_view>

#include "Statistics/OstrelReportingUtility.h"
#include "Statistics/Service/OstrelReportingBlockThrottle.h"
#include "platform/Logging.h"
#include "platform/linux/Limits.h"
#include "platform/linux/wire/PayloadDecoder.h"

namespace {

using namespace ostrel;
using Throttle = OstrelReportingBlockThrottle;

struct QuietLog final : ScopedLog {
  int verbosity(std::string_view) const override { return 9; }
  LogLevel lowestLevel() const override { return LogLevel::kDebug; }
  void write(const LogLine&) override {}
};

void expect(bool condition) {
  if (!condition) std::abort();
}

std::string keyOf(const Dictionary& payload, std::int64_t id = 7) {
  return Throttle::buildMessageKey(payload, ReporterID{id}, MessageCategory{0x40000007},
                                   MessageType{2});
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const bool isQuiet = [] {
    setSystemLog(std::make_shared<QuietLog>());
    return true;
  }();
  static_cast<void>(isQuiet);
  const auto decoded = wire::decodeDictionary(
      {data, size}, {limits::kNesting, limits::kNodes, limits::kKeyBytes},
      /*owner=*/{});
  if (!decoded.dictionary) return 0;
  const Dictionary& payload = *decoded.dictionary;

  const double seconds = Throttle::determineSleepTime(payload).count();
  expect(std::isnan(seconds) || seconds <= 5);

  const std::string key = keyOf(payload);
  expect(key == keyOf(payload));
  expect(key != keyOf(payload, INT64_MIN));
  for (const std::string_view excluded : ThrottleExcludedKeys) {
    // That one says what else is not compared.
    if (excluded == "_comparison_field_blacklist" || !payload.get(excluded)) continue;
    expect(key == keyOf(payload.with(excluded, Value("something else"))));
  }
  return 0;
}
