#pragma once

#include <string>

#include "forwarder/ReportSource.h"

namespace ostrel {

/// The messages of the service's store, which is opened anew for each call: so neither a
/// store that takes its place is missed, nor does the service ever wait for a reader.
class StoreReportSource final : public ReportSource {
 public:
  explicit StoreReportSource(std::string path) : path_(std::move(path)) {}

  Outcome<ReportBatch> reportsAfter(std::int64_t id, BatchSize most) override;

 private:
  const std::string path_;
};

}  // namespace ostrel
