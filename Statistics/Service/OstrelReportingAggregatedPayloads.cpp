#include "Statistics/Service/OstrelReportingAggregatedPayloads.h"

#include <algorithm>
#include <cstring>
#include <string>

namespace ostrel {
namespace {

// An idle session has no chunk, a short one a small chunk, and a long one
// wastes little at the end of its last.
constexpr std::size_t kFirstChunk = 1024;
constexpr std::size_t kLargestChunk = 256 * 1024;

}  // namespace

void OstrelReportingAggregatedPayloads::Snapshot::forEach(
    const EntryCallback& callback) const {
  for (const Dictionary& entry : front_) callback(entry.value());
  for (const Part& part : parts_) {
    const std::uint8_t* at = part.bytes.get();
    const std::uint8_t* const end = at + part.size;
    while (at != end) {
      const ValueView entry(at);
      at = entry.end();
      callback(entry);
    }
  }
}

void OstrelReportingAggregatedPayloads::append(std::string_view identifier,
                                               const Dictionary& payload) {
  head_.clear();
  ValueEncoder encoder(head_);
  encoder.beginDictionary(1);
  encoder.string(identifier);
  const auto bytes = payload.value().bytes();
  std::uint8_t* at = room(head_.size() + bytes.size());
  std::memcpy(at, head_.data(), head_.size());
  std::memcpy(at + head_.size(), bytes.data(), bytes.size());
  ++size_;
}

void OstrelReportingAggregatedPayloads::append(const Dictionary& entry) {
  const auto bytes = entry.value().bytes();
  std::memcpy(room(bytes.size()), bytes.data(), bytes.size());
  ++size_;
}

void OstrelReportingAggregatedPayloads::insertFront(
    std::shared_ptr<const MutableDictionary> entry) {
  front_.push_back(std::move(entry));
  ++size_;
}

OstrelReportingAggregatedPayloads::Snapshot OstrelReportingAggregatedPayloads::snapshot()
    const {
  Snapshot snapshot;
  for (auto entry = front_.rbegin(); entry != front_.rend(); ++entry) {
    snapshot.front_.push_back((*entry)->snapshot());
  }
  for (const Chunk& chunk : chunks_) {
    snapshot.parts_.push_back({chunk.bytes, chunk.used});
  }
  return snapshot;
}

// Chunks are never moved nor written before their `used`, so that a snapshot
// may be read while entries are appended.
std::uint8_t* OstrelReportingAggregatedPayloads::room(std::size_t bytes) {
  if (chunks_.empty() || chunks_.back().capacity - chunks_.back().used < bytes) {
    const std::size_t wanted = chunks_.empty()
                                   ? kFirstChunk
                                   : std::min(2 * chunks_.back().capacity, kLargestChunk);
    const std::size_t capacity = std::max(wanted, bytes);
    chunks_.push_back(
        {std::shared_ptr<std::uint8_t[]>(new std::uint8_t[capacity]), capacity});
  }
  Chunk& chunk = chunks_.back();
  std::uint8_t* at = chunk.bytes.get() + chunk.used;
  chunk.used += bytes;
  return at;
}

}  // namespace ostrel
