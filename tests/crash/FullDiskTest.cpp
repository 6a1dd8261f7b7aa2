// The service on a file system of 2 MiB that fills up.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <string>

#include "platform/linux/SmallFileSystem.h"
#include "tests/crash/LoadedService.h"

namespace ostrel::crash {
namespace {

constexpr ReporterID kReporter{7};

void sendOne(RecordingClient& client, const std::string& text, int number) {
  client->sendMessage({{"i", Value(number)}, {"text", Value(text)}}, MessageCategory{1},
                      MessageType{1}, ReporterIDs{kReporter}, nullptr);
}

std::string last(const ServiceUnderTest& service) {
  const auto rows = service.rows(
      "SELECT json_extract(payload, '$.i') FROM telemetry_messages WHERE category = 1 "
      "ORDER BY id DESC LIMIT 1");
  return rows.empty() ? "" : rows.front();
}

// 0, or the step that was not as expected.
int fillAndEmpty() {
  ServiceUnderTest service;
  const std::string state = service / "state";
  std::filesystem::create_directories(state);
  testing_support::SmallFileSystem disk(state, "2m");
  service.start();
  RecordingClient client(service.socketPath());
  client->createReportingSession(kReporter, nullptr);
  client->startReportingSessionForID(kReporter, nullptr);
  const std::string text(10'000, 'x');
  int number = 0;
  const auto isSaid = [&](const std::string& what) {
    return service.read("log.txt").find(what) != std::string::npos;
  };
  if (!eventually([&] {
        sendOne(client, text, ++number);
        client.takeReplies();
        return isSaid("database or disk is full");
      })) {
    return 1;
  }
  // It serves on, and refuses once its queue is full of what cannot be written.
  for (int i = 0; i < 200; ++i) sendOne(client, text, ++number);
  if (!client.takeReplies().empty()) return 2;
  if (!disk.resize("64m")) return 3;
  if (!eventually([&] {
        sendOne(client, "", ++number);
        client.takeReplies();
        return last(service) == std::to_string(number);
      })) {
    return 4;
  }
  if (!isSaid("the store can be used again")) return 5;
  if (service.terminate() != 0) return 6;
  // Each message is there once, or counted.
  const auto counts = service.rows(
      "SELECT count(*), count(DISTINCT json_extract(payload, '$.i')), (SELECT sum(value) "
      "FROM service_status WHERE key IN ('refused', 'lost')) FROM telemetry_messages "
      "WHERE category = 1");
  long long there = 0;
  long long distinct = 0;
  long long told = 0;
  if (counts.size() != 1 || std::sscanf(counts.front().c_str(), "%lld|%lld|%lld", &there,
                                        &distinct, &told) != 3) {
    return 7;
  }
  std::printf("%d messages sent, %lld stored, %lld told as refused or lost\n", number,
              there, told);
  std::fflush(stdout);
  if (there != distinct) return 8;
  if (there + told < number) return 9;
  if (service.rows("PRAGMA integrity_check") != ServiceUnderTest::Rows{"ok"}) return 10;
  return told > 0 ? 0 : 11;
}

TEST(FullDisk, IsBorneAndWhatItCostIsTold) {
  testing_support::expectInChildWithSmallFileSystem(fillAndEmpty);
}

}  // namespace
}  // namespace ostrel::crash
