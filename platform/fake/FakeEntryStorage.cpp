#include "platform/fake/FakeEntryStorage.h"

#include <algorithm>
#include <string>
#include <utility>
#include <vector>

#include "platform/KeptBytes.h"
#include "platform/Logging.h"

namespace ostrel {
namespace {

constexpr std::size_t kEntriesOfRun = 3;

using Entry = std::shared_ptr<const std::string>;

}  // namespace

class FakeEntries final : public StoredEntries {
 public:
  FakeEntries(ReporterID session, std::shared_ptr<FakeEntryStorage::State> state)
      : session_(session), state_(std::move(state)) {}

  bool append(std::span<const Bytes> parts,
              const std::shared_ptr<PayloadAccount>& account) override {
    std::string entry;
    for (const Bytes part : parts) entry.append(part.begin(), part.end());
    const std::size_t size = entry.size();
    if (!kept_.keep(account, size)) return refuse();
    if (size > state_->mostBytes - std::min<std::size_t>(bytes_, state_->mostBytes)) {
      kept_.undo(account, size);
      return refuse();
    }
    entries_.push_back(std::make_shared<const std::string>(std::move(entry)));
    bytes_ += size;
    return true;
  }

  std::shared_ptr<const Snapshot> snapshot() override {
    return std::make_shared<const Entries>(entries_, state_);
  }

 private:
  class Entries final : public Snapshot {
   public:
    Entries(std::vector<Entry> entries, std::shared_ptr<FakeEntryStorage::State> state)
        : entries_(std::move(entries)), state_(std::move(state)) {}

    bool forEachRun(const RunCallback& callback) const override {
      for (std::size_t first = 0; first < entries_.size(); first += kEntriesOfRun) {
        if (state_->readableRuns == 0) {
          OSTREL_LOG_ERROR(processLogScope, "cannot read the list back");
          return false;
        }
        --state_->readableRuns;
        std::string run;
        const std::size_t end = std::min(first + kEntriesOfRun, entries_.size());
        for (std::size_t i = first; i < end; ++i) run += *entries_[i];
        callback({reinterpret_cast<const std::uint8_t*>(run.data()), run.size()});
      }
      return true;
    }

   private:
    const std::vector<Entry> entries_;
    const std::shared_ptr<FakeEntryStorage::State> state_;
  };

  bool refuse() {
    ++state_->refused;
    if (!std::exchange(hasRefused_, true)) {
      OSTREL_LOG_ERROR(processLogScope, "%lli: an entry is not kept", session_);
    }
    return false;
  }

  const ReporterID session_;
  const std::shared_ptr<FakeEntryStorage::State> state_;
  KeptBytes kept_;
  std::vector<Entry> entries_;
  std::size_t bytes_ = 0;
  bool hasRefused_ = false;
};

std::unique_ptr<StoredEntries> FakeEntryStorage::makeEntries(ReporterID session) {
  return std::make_unique<FakeEntries>(session, state_);
}

}  // namespace ostrel
