// What a session kept, whatever its messages were, is a summary and a log that is JSON,
// from memory and from a file alike.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "Statistics/Service/OstrelReportingSessionSummary.h"
#include "fuzz/Fuzzing.h"
#include "platform/linux/FileEntryStorage.h"
#include "platform/linux/JSONTextSerialization.h"
#include "platform/linux/TestSupport.h"
#include "platform/linux/wire/PayloadDecoder.h"

namespace {

using namespace ostrel;
using fuzzing::expect;

// Each begins where the one before ended.
std::vector<Dictionary> decodeAll(std::span<const std::uint8_t> bytes) {
  std::vector<Dictionary> payloads;
  while (!bytes.empty() && payloads.size() < 64) {
    auto decoded = wire::decodeDictionary(bytes, fuzzing::kPayloadLimits,
                                          /*owner=*/{});
    if (!decoded.dictionary) break;
    bytes = bytes.subspan(decoded.size);
    payloads.push_back(*std::move(decoded.dictionary));
  }
  return payloads;
}

// None when the entries cannot be said in JSON.
std::optional<std::string> logOf(
    const OstrelReportingAggregatedPayloads::Snapshot& entries) {
  JSONTextSerialization serialization;
  const auto json = serialization.prettyPrintedArray(
      [&](const auto& element) { expect(entries.forEach(element)); });
  expect(json.value.has_value() != json.error.has_value());
  if (!json.value) return std::nullopt;
  std::string text;
  (*json.value)([&](std::string_view piece) { text += piece; });
  return text;
}

void tryWith(EntryStorage& storage, const std::vector<Dictionary>& payloads) {
  OstrelReportingAggregatedPayloads list(storage, ReporterID{7});
  for (std::size_t i = 0; i < payloads.size(); ++i) {
    list.append("Event_" + std::to_string(i % 3), SanitisedPayload(payloads[i]));
  }
  const auto entries = list.snapshot();
  std::size_t count = 0;
  expect(entries.forEach([&](ValueView) { ++count; }));
  expect(count == payloads.size());

  const Dictionary summary = summaryEvent(ServiceType{2}, entries);
  expect(summary.size() == 1 + std::min<std::size_t>(payloads.size(), 3));
  const auto log = logOf(entries);
  if (!log) return;
  const auto json = nlohmann::json::parse(*log, /*cb=*/nullptr,
                                          /*allow_exceptions=*/false);
  expect(json.is_array() && json.size() == payloads.size());
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const testing_support::TemporaryDirectory directory;
  const std::vector<Dictionary> payloads = decodeAll({data, size});
  FileEntryStorage inMemory(directory.path());
  tryWith(inMemory, payloads);
  FileEntryStorage::Limits small = FileEntryStorage::Limits::ofService();
  small.listBytesInMemory = 16;
  small.bytesInMemory = 64;
  FileEntryStorage inFile(directory.path(), small, SpillCalls::system());
  tryWith(inFile, payloads);
  return 0;
}
