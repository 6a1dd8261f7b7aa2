// What the tests of the core share: a platform of fakes on manual time, and
// short forms for log lines.
#pragma once

#include <gtest/gtest.h>

#include <ostream>
#include <string>
#include <utility>
#include <vector>

#include "Statistics/OstrelReportingUtility.h"
#include "platform/OstrelReportingPlatform.h"
#include "platform/fake/FakePlatform.h"

namespace ostrel {

inline void PrintTo(const Dictionary& value, std::ostream* out) {
  *out << description(value);
}
inline void PrintTo(const Value& value, std::ostream* out) { *out << description(value); }
inline void PrintTo(const RecordingLog::Line& line, std::ostream* out) {
  *out << static_cast<int>(line.level) << ' ' << line.scopeCode << ' ' << line.text;
}

using LogLines = std::vector<RecordingLog::Line>;

class CoreTest : public ::testing::Test {
 protected:
  CoreTest() {
    platform = fakes.platform();
    forgetIsInternalBuildForTesting();
  }
  ~CoreTest() override { forgetIsInternalBuildForTesting(); }

  void makeInternalBuild() { fakes.deviceInfo->setAnswer("InternalBuild", true); }

  /// Debug lines too, of the scopes with that key.
  void makeVerbose(const char* verbosityKey) {
    fakes.log->setVerbosity(verbosityKey, /*verbosity=*/5);
  }

  /// The lines since the last `takeLines`.
  LogLines takeLines() {
    LogLines lines = fakes.log->lines();
    fakes.log->clear();
    return lines;
  }

  /// The events since the last `takeEvents`.
  std::vector<std::string> takeEvents() {
    std::vector<std::string> events = fakes.events->all();
    fakes.events->clear();
    return events;
  }

  OstrelReportingPlatform platform;  // What the fakes let go still uses it.
  FakePlatform fakes;
};

inline RecordingLog::Line errorLine(std::string scope, std::string text) {
  return {LogLevel::kError, std::move(scope), std::move(text)};
}
inline RecordingLog::Line defaultLine(std::string scope, std::string text) {
  return {LogLevel::kDefault, std::move(scope), std::move(text)};
}
inline RecordingLog::Line infoLine(std::string scope, std::string text) {
  return {LogLevel::kInfo, std::move(scope), std::move(text)};
}
inline RecordingLog::Line debugLine(std::string scope, std::string text) {
  return {LogLevel::kDebug, std::move(scope), std::move(text)};
}

}  // namespace ostrel
