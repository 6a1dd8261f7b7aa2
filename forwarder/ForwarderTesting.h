// For the tests of the forwarder: a store, a collector and time that are all in memory.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <random>
#include <string>
#include <utility>
#include <vector>

#include "forwarder/Forwarder.h"
#include "forwarder/LogRecord.h"
#include "platform/fake/ManualClock.h"

namespace ostrel::testing_support {

/// What of a request a collector looks at.
struct ReceivedRequest {
  explicit ReceivedRequest(const std::string& body) : bytes(body.size()) {
    const auto parsed = parseJSON(body);
    if (!parsed.value) {
      ADD_FAILURE() << "no JSON: " << body;
      return;
    }
    for (const JSONNode& record :
         *at(at(at(*parsed.value, "resourceLogs"), "scopeLogs"), "logRecords").array()) {
      std::string text;
      appendJSON(text, record, JSONSpacing::kCompact);
      records.emplace_back(uidOf(record), std::move(text));
    }
  }

  bool has(std::string_view text) const {
    for (const auto& [uid, record] : records) {
      if (record.find(text) != std::string::npos) return true;
    }
    return false;
  }

  std::size_t bytes;
  std::vector<std::pair<std::string, std::string>> records;  // Their IDs first.

 private:
  /// A member; of an array, that of its first element.
  static const JSONNode& at(const JSONNode& node, std::string_view key) {
    const JSONNode& holder = node.array() != nullptr ? node.array()->at(0) : node;
    return *find(*holder.object(), key);
  }
  static std::string uidOf(const JSONNode& record) {
    for (const JSONNode& attribute : *at(record, "attributes").array()) {
      if (*at(attribute, "key").string() == "log.record.uid") {
        return *at(at(attribute, "value"), "stringValue").string();
      }
    }
    ADD_FAILURE() << "a record without an ID";
    return {};
  }
};

/// What a collector took, by record ID: of a record that came again, once.
class TakenRecords {
 public:
  void take(const ReceivedRequest& request) {
    for (const auto& [uid, record] : request.records) {
      const auto [place, isNew] = records_.emplace(uid, record);
      if (isNew) continue;
      ++repeated_;
      EXPECT_EQ(place->second, record) << "two records under one ID";
    }
  }
  bool has(const std::string& uid) const { return records_.count(uid) != 0; }
  std::size_t size() const { return records_.size(); }
  std::size_t repeated() const { return repeated_; }

 private:
  std::map<std::string, std::string> records_;
  std::size_t repeated_ = 0;
};

/// A store that is given its messages by the test.
class FakeReportSource final : public ReportSource {
 public:
  Outcome<ReportBatch> reportsAfter(std::int64_t id, BatchSize most) override {
    if (beforeRead) beforeRead();
    if (fault) {
      return {{}, ErrorObject{std::string(kOstrelErrorDomain), 1, *fault}};
    }
    ReportBatch batch;
    batch.store = store;
    if (!reports.empty()) batch.newestID = reports.rbegin()->first;
    std::size_t bytes = 0;
    for (auto each = reports.upper_bound(id); each != reports.end(); ++each) {
      if (batch.reports.size() == most.reports || bytes >= most.bytes) break;
      bytes += each->second.payload.string()->size();
      batch.reports.push_back(each->second);
    }
    return {std::move(batch), {}};
  }

  void add(std::string payload) {
    Report report;
    report.id = reports.empty() ? 1 : reports.rbegin()->first + 1;
    report.createdAt = 1'000'000 + report.id;
    report.payload.value = std::move(payload);
    reports.emplace(report.id, std::move(report));
  }
  std::vector<std::string> uids() const {
    std::vector<std::string> all;
    for (const auto& [id, report] : reports) all.push_back(recordID(report, store));
    return all;
  }

  std::string store = "store";
  std::map<std::int64_t, Report> reports;
  std::optional<std::string> fault;
  std::function<void()> beforeRead;
};

/// A collector that answers as the test says.
class FakeTransport final : public Transport {
 public:
  using Answer = std::function<Reply(const ReceivedRequest&)>;

  Reply post(const std::string& body) override {
    const ReceivedRequest request(body);
    sizes.push_back(request.records.size());
    bytes.push_back(request.bytes);
    return answer(request);
  }

  static Reply status(int status) {
    Reply reply;
    reply.status = status;
    return reply;
  }

  Answer answer = [](const ReceivedRequest&) { return status(200); };
  std::vector<std::size_t> sizes;  // Of the requests, in records,
  std::vector<std::size_t> bytes;  // and in bytes.
};

class FakeMarkKeeper final : public MarkKeeper {
 public:
  Success save(const ForwardMark& mark) override {
    if (fails) {
      return {/*succeeded=*/false,
              ErrorObject{std::string(kOstrelErrorDomain), 1, "no room is left"}};
    }
    saved = mark;
    return {/*succeeded=*/true, {}};
  }

  bool fails = false;
  ForwardMark saved;
};

/// Passes time on a manual clock. The end of all waits comes where nothing is left to
/// wait for.
class FakeWaits final : public Waits {
 public:
  explicit FakeWaits(ManualClock& clock) : clock_(clock) {}

  bool forChange() override { return nextChange && nextChange(); }
  bool forTime(std::chrono::milliseconds pause) override {
    pauses.push_back(pause);
    clock_.advance(pause);
    return pauses.size() < mostPauses;
  }

  /// Advances to the next change; false when there will be none.
  std::function<bool()> nextChange;
  std::size_t mostPauses = 1'000'000;
  std::vector<std::chrono::milliseconds> pauses;

 private:
  ManualClock& clock_;
};

class SeededRandom final : public Random {
 public:
  explicit SeededRandom(std::uint32_t seed) : engine_(seed) {}
  std::uint32_t uniform(std::uint32_t bound) override {
    return std::uniform_int_distribution<std::uint32_t>(0, bound - 1)(engine_);
  }

 private:
  std::mt19937 engine_;
};

}  // namespace ostrel::testing_support
