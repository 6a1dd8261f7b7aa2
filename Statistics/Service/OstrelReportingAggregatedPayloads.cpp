#include "Statistics/Service/OstrelReportingAggregatedPayloads.h"

#include <array>
#include <cstdint>

#include "platform/Bytes.h"

namespace ostrel {
namespace {

// A payload that no account bears was made by the service itself. From this size on
// it is a summary, which is dropped with the list soon; to copy it would take as much
// memory again.
constexpr std::size_t kLargePayload = 64 * 1024;

}  // namespace

bool OstrelReportingAggregatedPayloads::Snapshot::forEach(
    const EntryCallback& callback) const {
  for (const Dictionary& entry : front_) callback(entry.value());
  auto reference = references_.begin();
  std::size_t storedBefore = 0;
  const auto giveReferences = [&] {
    while (reference != references_.end() && reference->storedBefore == storedBefore) {
      callback(Dictionary().with(reference->identifier, reference->payload).value());
      ++reference;
    }
  };
  giveReferences();
  if (!stored_) return true;
  return stored_->forEachRun([&](StoredEntries::Bytes entries) {
    const std::uint8_t* at = entries.data();
    const std::uint8_t* const end = at + entries.size();
    while (at != end) {
      const ValueView entry(at);
      at = entry.end();
      callback(entry);
      ++storedBefore;
      giveReferences();
    }
  });
}

void OstrelReportingAggregatedPayloads::append(std::string_view identifier,
                                               const Dictionary& payload,
                                               StoredEntries::Bytes encoded) {
  if (payload.owner().size() >= kLargePayload && !payload.owner().account()) {
    references_.push_back({storedCount_, std::string(identifier), payload});
    return;
  }
  std::string head;  // So short that it takes no memory of its own.
  ValueEncoder encoder(head);
  encoder.beginDictionary(1);
  encoder.beginString(identifier.size());
  store(std::array{asBytes(head), asBytes(identifier), encoded}, payload);
}

void OstrelReportingAggregatedPayloads::append(const Dictionary& entry) {
  store(std::array{entry.value().bytes()}, entry);
}

void OstrelReportingAggregatedPayloads::store(std::span<const StoredEntries::Bytes> parts,
                                              const Dictionary& bearer) {
  if (!stored_) stored_ = storage_.makeEntries(session_);
  if (stored_->append(parts, bearer.owner().account())) ++storedCount_;
}

void OstrelReportingAggregatedPayloads::insertFront(
    std::shared_ptr<const MutableDictionary> entry) {
  front_.push_back(std::move(entry));
}

OstrelReportingAggregatedPayloads::Snapshot OstrelReportingAggregatedPayloads::snapshot()
    const {
  Snapshot snapshot;
  for (auto entry = front_.rbegin(); entry != front_.rend(); ++entry) {
    snapshot.front_.push_back((*entry)->snapshot());
  }
  if (stored_) snapshot.stored_ = stored_->snapshot();
  snapshot.references_ = references_;
  return snapshot;
}

}  // namespace ostrel
