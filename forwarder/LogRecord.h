// Reports as the log records of OTLP, in its JSON encoding: 64-bit integers are decimal
// strings, trace and span IDs are hexadecimal.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "forwarder/ForwarderSettings.h"
#include "forwarder/ReportSource.h"

namespace ostrel {

/// What a W3C `traceparent` says.
struct TraceContext {
  std::string traceID;  // 32 hexadecimal digits, lower case.
  std::string spanID;   // 16 of them.
  int flags = 0;
};

/// None for any other text.
std::optional<TraceContext> traceContext(std::string_view traceparent);

/// The ID by which a receiver knows a record that comes twice: the store, the row and
/// its time.
std::string recordID(const Report& report, std::string_view store);

/// One log record.
std::string logRecordJSON(const Report& report, std::string_view store);

/// A request with these records.
std::string logsRequestJSON(const NamesAndValues& resource, std::string_view version,
                            const std::vector<std::string>& records);

}  // namespace ostrel
