// What the service asks of the store, as it waits for the writer thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <variant>
#include <vector>

#include "platform/AnalyticsSink.h"
#include "platform/TelemetryBackend.h"
#include "platform/Value.h"
#include "platform/linux/Burden.h"

namespace ostrel {

/// One telemetry session as the store knows it. Lives until its end is written.
struct StoreSession {
  // Constant.
  Dictionary sessionInfo;
  Dictionary userInfo;
  std::int64_t startedAt = 0;
  std::int64_t user = PayloadAccount::kNobody;  // Whose client caused it.

  // The writer thread's. The row may be in a file that has been set aside since:
  // then the session gets a new one.
  std::int64_t row = 0;
  std::uint64_t file = 0;
};

struct SessionBegin {
  StoreSession* session;
};

struct SessionMessage {
  StoreSession* session;
  std::uint16_t category;
  std::uint16_t type;
  Dictionary payload;
};

struct SessionFlush {
  StoreSession* session;
  TelemetrySession::FlushCallback completion;  // Empty once called.
};

/// The last operation of its session.
struct SessionEnd {
  std::unique_ptr<StoreSession> session;
};

struct LoneMessage {
  Dictionary sessionInfo;
  Dictionary userInfo;
  std::uint16_t category;
  std::uint16_t type;
  Dictionary payload;
};

struct AnalyticsEvent {
  std::string name;
  AnalyticsSink::PayloadProvider provider;  // Empty once called.
  std::optional<Dictionary> payload;        // None: not asked for, or not wanted.
};

struct PowerEvent {
  std::int32_t clientID;
  std::string name;
  Dictionary event;
  std::optional<Dictionary> attachment;
};

/// Somebody else's counts are to be written.
struct StatusChange {};

struct StoreOperation {
  std::int64_t time = 0;  // Microseconds since 1970.
  std::variant<SessionBegin, SessionMessage, SessionFlush, SessionEnd, LoneMessage,
               AnalyticsEvent, PowerEvent, StatusChange>
      what;
  BurdenShare burden = BurdenShare::current();
  /// Who caused it, unless its payload says so: `Burden::currentUser`.
  std::int64_t user = Burden::currentUser();

  /// The memory of the payloads that it keeps; those of their clients bear it.
  std::size_t payloadBytes() const;
  /// All the memory that it keeps, roughly.
  std::size_t bytes() const { return sizeof *this + payloadBytes(); }
};

using StoreBatch = std::vector<StoreOperation>;

/// A queue in pieces of fixed size: it grows without moving what it holds, and
/// uses pieces again. Has no lock of its own.
class StoreQueue {
 public:
  static constexpr std::size_t kBatch = 256;

  bool empty() const { return size_ == 0; }
  std::size_t size() const { return size_; }
  std::size_t bytes() const { return bytes_; }

  void push(StoreOperation operation) {
    if (batches_.empty() || batches_.back().size() == kBatch) addBatch();
    bytes_ += operation.bytes();
    ++size_;
    batches_.back().push_back(std::move(operation));
  }

  std::vector<StoreBatch> take() {
    size_ = 0;
    bytes_ = 0;
    return std::exchange(batches_, {});
  }

  /// Takes an empty batch back.
  void recycle(StoreBatch batch) {
    if (spare_.size() < kSpareBatches) spare_.push_back(std::move(batch));
  }

 private:
  static constexpr std::size_t kSpareBatches = 4;

  void addBatch() {
    if (spare_.empty()) {
      StoreBatch batch;
      batch.reserve(kBatch);
      batches_.push_back(std::move(batch));
    } else {
      batches_.push_back(std::move(spare_.back()));
      spare_.pop_back();
    }
  }

  std::vector<StoreBatch> batches_;
  std::vector<StoreBatch> spare_;
  std::size_t size_ = 0;
  std::size_t bytes_ = 0;
};

}  // namespace ostrel
