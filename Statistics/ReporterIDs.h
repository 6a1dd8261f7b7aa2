#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <iterator>
#include <utility>

namespace ostrel {

/// Names a session; chosen by the client. 0 is never a session.
enum class ReporterID : std::int64_t {};
inline constexpr ReporterID kNoReporter{0};

/// The IDs of one request in order, with what is used of a vector's interface. Nearly
/// every message names one session: up to two IDs take no memory of their own.
class ReporterIDs {
 public:
  using value_type = ReporterID;
  using const_iterator = const ReporterID*;

  ReporterIDs() = default;
  ReporterIDs(std::initializer_list<ReporterID> ids)
      : ReporterIDs(ids.begin(), ids.end()) {}
  ReporterIDs(std::size_t count, ReporterID id) {
    reserve(count);
    std::fill_n(begin(), count, id);
    size_ = count;
  }
  template <std::forward_iterator Iterator>
  ReporterIDs(Iterator first, Iterator last) {
    reserve(static_cast<std::size_t>(std::distance(first, last)));
    for (; first != last; ++first) push_back(*first);
  }
  ReporterIDs(const ReporterIDs& other) : ReporterIDs(other.begin(), other.end()) {}
  ReporterIDs(ReporterIDs&& other) noexcept { swap(other); }
  ReporterIDs& operator=(ReporterIDs other) noexcept {
    swap(other);
    return *this;
  }
  ~ReporterIDs() {
    if (!isInside()) delete[] storage_.outside;
  }

  bool empty() const { return size_ == 0; }
  std::size_t size() const { return size_; }
  ReporterID* begin() { return isInside() ? storage_.inside : storage_.outside; }
  ReporterID* end() { return begin() + size_; }
  const ReporterID* begin() const {
    return isInside() ? storage_.inside : storage_.outside;
  }
  const ReporterID* end() const { return begin() + size_; }
  ReporterID& operator[](std::size_t index) { return begin()[index]; }
  const ReporterID& operator[](std::size_t index) const { return begin()[index]; }

  void reserve(std::size_t count) {
    if (count <= capacity_) return;
    auto* const larger = new ReporterID[count];
    std::copy(begin(), end(), larger);
    if (!isInside()) delete[] storage_.outside;
    storage_.outside = larger;
    capacity_ = count;
  }

  void push_back(ReporterID id) {
    if (size_ == capacity_) reserve(2 * capacity_);
    begin()[size_++] = id;
  }

  void swap(ReporterIDs& other) noexcept {
    std::swap(storage_, other.storage_);
    std::swap(size_, other.size_);
    std::swap(capacity_, other.capacity_);
  }

  friend bool operator==(const ReporterIDs& a, const ReporterIDs& b) {
    return std::equal(a.begin(), a.end(), b.begin(), b.end());
  }

 private:
  static constexpr std::size_t kInside = 2;

  bool isInside() const { return capacity_ == kInside; }

  union {
    ReporterID inside[kInside] = {};
    ReporterID* outside;
  } storage_{};
  std::size_t size_ = 0;
  std::size_t capacity_ = kInside;
};

}  // namespace ostrel
