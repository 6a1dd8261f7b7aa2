#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>

#include "platform/ErrorObject.h"
#include "platform/linux/SpillFile.h"

namespace ostrel {

/// What one list has in the file, in its order. Takes the same memory however much that
/// is: where the latest extents are is kept here, where the others are in the file, in
/// tables of which each names the one before. One thread at a time, readers aside.
class ExtentList {
 public:
  using Extent = SpillFile::Extent;
  using Bytes = SpillFile::Bytes;

  /// How many extents are known without a look at the file: the most of a short list.
  static constexpr std::size_t kAtHand = 16;

  explicit ExtentList(std::shared_ptr<SpillFile> file) : file_(std::move(file)) {}
  /// Gives the room on the disk back.
  ~ExtentList();
  ExtentList(const ExtentList&) = delete;
  ExtentList& operator=(const ExtentList&) = delete;

  /// Writes `parts` one after the other as one extent behind the others. False when the
  /// file cannot be written.
  bool write(std::span<const Bytes> parts);

  /// How many were written.
  std::size_t size() const { return size_; }

 private:
  /// As it lies in the file.
  struct Table {
    std::array<Extent, kAtHand> extents{};
    Extent previous{};  // Of size 0: it is the first.
  };

 public:
  /// The list as it is now, to be read while it grows, as long as it lives.
  class View {
   public:
    /// Calls `callback` with each extent, which is valid during the call. The error, if
    /// there was one, ended it.
    std::optional<ErrorObject> forEach(const std::function<void(Bytes)>& callback) const;

   private:
    friend class ExtentList;
    SpillFile* file_ = nullptr;
    Table latest_;
    std::size_t atHand_ = 0;
    std::size_t largest_ = 0;
  };
  View view() const;

 private:
  bool writeTable();
  static std::optional<ErrorObject> readTable(SpillFile& file, Extent at, Table& table);

  const std::shared_ptr<SpillFile> file_;
  Table latest_;
  std::size_t atHand_ = 0;  // Of `latest_`.
  std::size_t size_ = 0;
  std::size_t tables_ = 0;
  std::size_t largest_ = 0;
};

}  // namespace ostrel
