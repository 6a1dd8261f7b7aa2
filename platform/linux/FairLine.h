#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <queue>
#include <utility>
#include <vector>

namespace ostrel {

/// Who waits for a turn. Whoever asks for little goes before all that ask for much; of
/// these, who has had least goes first, so that one that asks for very much waits until
/// the others in line have had as much. (Start-time fair queueing.) Of those that ask for
/// little the groups take turns: however many of one group stand in line, another's goes
/// behind the first of them.
///
/// Work and time are in nanoseconds. An allowance of 5 % of the time, saved up to a
/// millisecond, is little.
class FairLine {
 public:
  using ID = std::uint64_t;

  static constexpr std::uint64_t kTimeForWork = 20;  // Of which one part is little.
  /// That may be asked for at once.
  static constexpr std::uint64_t kSavedWork = 1'000'000;
  /// Whoever asked for more at its last turn asks for much, however rarely it comes.
  static constexpr std::uint64_t kLittleAtOnce = 200'000;
  /// Of one that is new: a tenth of a second.
  static constexpr std::uint64_t kDebtOfNew = 5'000'000;
  /// Work of those that ask for little, after which one goes that does not.
  static constexpr std::uint64_t kLightWorkInARow = 1'000'000;
  /// Of each turn of theirs at least.
  static constexpr std::uint64_t kLeastWork = 1000;

  /// What the line knows of some that have no more turns together than one alone. Its
  /// owner keeps it.
  class Group {
   private:
    friend class FairLine;
    std::uint64_t next_ = 0;
    std::queue<ID> waiting_;  // Of those that ask for little.
    bool isInLine_ = false;
  };

  /// What the line knows of one that comes again and again. Its owner keeps it.
  class Place {
   public:
    bool isInLine() const { return isInLine_; }

   private:
    friend class FairLine;
    std::shared_ptr<Group> group_;
    std::uint64_t next_ = 0;
    std::uint64_t debt_ = 0;  // At `asOf_`.
    std::uint64_t asOf_ = 0;
    std::uint64_t last_ = 0;  // Work of its last turn.
    bool isInLine_ = false;
  };

  bool empty() const { return lightCount_ == 0 && others_.empty(); }

  /// Time goes on.
  void setTime(std::uint64_t now) { time_ = now; }

  /// One that is new asks for much until it has been there for a while: those that are
  /// there and ask for little go before any number of those.
  void introduce(Place& place, std::shared_ptr<Group> group) {
    place.group_ = std::move(group);
    place.next_ = now_;
    place.debt_ = kSavedWork + kDebtOfNew;
    place.asOf_ = time_;
  }

  /// Nothing when it stands in line already.
  void enter(ID id, Place& place) {
    if (place.isInLine_) return;
    place.isInLine_ = true;
    payOff(place);
    if (place.debt_ <= kSavedWork && place.last_ <= kLittleAtOnce) {
      if (!place.group_) place.group_ = std::make_shared<Group>();
      place.group_->waiting_.push(id);
      ++lightCount_;
      lineUp(place.group_);
    } else {
      others_.push({std::max(place.next_, now_), entered_++, id});
    }
  }

  /// Whether the next is one that asks for little.
  bool isNextLight() const {
    return lightCount_ != 0 && (others_.empty() || lightWork_ < kLightWorkInARow);
  }

  /// The next, which is out of line then: `leave` says so to its place.
  std::optional<ID> take() {
    if (empty()) return std::nullopt;
    if (isNextLight()) {
      isLightTurn_ = true;
      lightWork_ += kLeastWork;
      return takeLight();
    }
    isLightTurn_ = false;
    lightWork_ = 0;
    const auto first = others_.top();
    others_.pop();
    now_ = first.start;
    return first.who;
  }

  /// Of whom `take` gave. Those that have gone meanwhile need not say anything.
  void leave(Place& place) { place.isInLine_ = false; }

  /// So much was done for one that is not in line.
  void use(Place& place, std::uint64_t work) {
    payOff(place);
    place.debt_ += work;
    place.last_ = work;
    if (isLightTurn_) {
      lightWork_ += work;
      place.group_->next_ += work;
      lineUp(place.group_);
      takenLast_.reset();
    }
    place.next_ = std::max(place.next_, now_) + work;
  }

 private:
  template <typename Who>
  struct Waiting {
    std::uint64_t start;
    std::uint64_t order;  // Of those with one start, who came first.
    Who who;
    friend bool operator>(const Waiting& a, const Waiting& b) {
      return a.start != b.start ? a.start > b.start : a.order > b.order;
    }
  };

  // Where one of it waits. Not twice.
  void lineUp(const std::shared_ptr<Group>& group) {
    if (group->waiting_.empty() || std::exchange(group->isInLine_, true)) return;
    light_.push({std::max(group->next_, lightNow_), entered_++, group});
  }

  ID takeLight() {
    // Who was taken last has gone, and nobody said what was done for it.
    if (takenLast_) lineUp(takenLast_);
    const auto first = light_.top();
    light_.pop();
    --lightCount_;
    lightNow_ = first.start;
    Group& group = *first.who;
    group.isInLine_ = false;
    group.next_ = first.start + kLeastWork;
    const ID id = group.waiting_.front();
    group.waiting_.pop();
    takenLast_ = first.who;
    return id;
  }

  void payOff(Place& place) const {
    const std::uint64_t paid = (time_ - place.asOf_) / kTimeForWork;
    place.debt_ -= std::min(place.debt_, paid);
    place.asOf_ = time_;
  }

  template <typename Who>
  using Line =
      std::priority_queue<Waiting<Who>, std::vector<Waiting<Who>>, std::greater<>>;

  Line<std::shared_ptr<Group>> light_;
  Line<ID> others_;
  std::size_t lightCount_ = 0;
  std::shared_ptr<Group> takenLast_;  // Of those in `light_`, until `use`.
  std::uint64_t lightWork_ = 0;       // In a row.
  bool isLightTurn_ = false;          // That of whom was taken last.
  std::uint64_t time_ = 0;
  std::uint64_t now_ = 0;       // In work: the place of who was taken last.
  std::uint64_t lightNow_ = 0;  // Likewise, among those that ask for little.
  std::uint64_t entered_ = 0;
};

}  // namespace ostrel
