#include "platform/linux/ExtentList.h"

#include <algorithm>
#include <vector>

namespace ostrel {

ExtentList::~ExtentList() {
  std::size_t left = size_ + tables_;
  if (left == 0 || file_->releaseIfAll(left)) return;
  const auto release = [&](std::span<const Extent> extents) {
    file_->release(extents);
    left -= extents.size();
  };
  release(std::span(latest_.extents).first(atHand_));
  for (Extent at = latest_.previous; at.size != 0;) {
    Table table;
    if (readTable(*file_, at, table)) {
      file_->forget(left);
      return;
    }
    release(table.extents);
    release({&at, 1});
    at = table.previous;
  }
}

bool ExtentList::write(std::span<const Bytes> parts) {
  if (atHand_ == kAtHand && !writeTable()) return false;
  const auto extent = file_->write(parts);
  if (!extent) return false;
  latest_.extents[atHand_++] = *extent;
  ++size_;
  largest_ = std::max(largest_, extent->size);
  return true;
}

bool ExtentList::writeTable() {
  const Bytes bytes(reinterpret_cast<const std::uint8_t*>(&latest_), sizeof latest_);
  const auto extent = file_->write({&bytes, 1});
  if (!extent) return false;
  ++tables_;
  latest_.previous = *extent;
  atHand_ = 0;
  return true;
}

std::optional<ErrorObject> ExtentList::readTable(SpillFile& file, Extent at,
                                                 Table& table) {
  return file.read(at, reinterpret_cast<std::uint8_t*>(&table));
}

ExtentList::View ExtentList::view() const {
  View view;
  view.file_ = file_.get();
  view.latest_ = latest_;
  view.atHand_ = atHand_;
  view.largest_ = largest_;
  return view;
}

std::optional<ErrorObject> ExtentList::View::forEach(
    const std::function<void(Bytes)>& callback) const {
  std::vector<Extent> tables;  // The latest first.
  Table table = latest_;
  while (table.previous.size != 0) {
    tables.push_back(table.previous);
    if (auto error = readTable(*file_, tables.back(), table)) return error;
  }
  const std::unique_ptr<std::uint8_t[]> buffer(new std::uint8_t[largest_]);
  const auto readEach = [&](std::span<const Extent> extents) {
    std::optional<ErrorObject> error;
    for (const Extent& extent : extents) {
      error = file_->read(extent, buffer.get());
      if (error) break;
      callback({buffer.get(), extent.size});
    }
    return error;
  };
  for (auto at = tables.rbegin(); at != tables.rend(); ++at) {
    if (auto error = readTable(*file_, *at, table)) return error;
    if (auto error = readEach(table.extents)) return error;
  }
  return readEach(std::span(latest_.extents).first(atHand_));
}

}  // namespace ostrel
