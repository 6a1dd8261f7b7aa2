// The throttle's key of any payload is made, the same each time, and blind to what is not
// compared; the wait of any payload is one that a timer can have.
#include <cmath>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "Statistics/OstrelReportingUtility.h"
#include "Statistics/Service/OstrelReportingBlockThrottle.h"
#include "fuzz/Fuzzing.h"
#include "platform/linux/wire/PayloadDecoder.h"

namespace {

using namespace ostrel;
using fuzzing::expect;
using Throttle = OstrelReportingBlockThrottle;

std::string keyOf(const Dictionary& payload, std::int64_t id = 7) {
  return Throttle::buildMessageKey(payload, ReporterID{id}, MessageCategory{0x40000007},
                                   MessageType{2});
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  fuzzing::silenceLog();
  const auto decoded = wire::decodeDictionary({data, size}, fuzzing::kPayloadLimits,
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
