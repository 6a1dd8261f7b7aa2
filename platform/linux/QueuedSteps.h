#pragma once

#include <memory>
#include <utility>

#include "platform/FetchAhead.h"
#include "platform/Task.h"
#include "platform/linux/Burden.h"

namespace ostrel {

/// A step that waits in a queue, or the memory of one.
///
/// Steps are made on one thread and end on another, once a message or more. Their
/// memory goes round between the threads, some dozens at a time, rather than
/// through the allocator, at whose lock the two would meet each time.
class QueuedStep {
 public:
  /// A step with `task`, which bears what the calling thread bears. Any thread.
  static QueuedStep* make(Task&& task);
  /// Takes back the memory of a step that was ended. Any thread.
  static void takeBack(QueuedStep* step) noexcept;

  /// How many steps' memory is kept at most for steps to come, beside a few dozen a
  /// thread.
  static constexpr std::size_t kMostKept = 4096;

  /// Asks for its memory, which another thread wrote last, before it is needed: each
  /// line takes some 70 ns to come from another core. Only the address is used.
  void fetchAhead() const { fetchToWrite(this, sizeof(QueuedStep)); }

  /// Runs the task and ends it.
  void run() {
    if (!burden) {
      task();
      task = Task();
      return;
    }
    const Burden::Scope bearing(burden.get());
    task();
    end();
  }
  /// What the task holds goes first, then the burden.
  void end() noexcept {
    task = Task();
    burden = BurdenShare();
  }

  Task task;
  QueuedStep* next = nullptr;
  BurdenShare burden;
};

/// Steps in a row. Owns them; what is left at its end is dropped unrun.
class StepList {
 public:
  StepList() = default;
  StepList(StepList&& other) noexcept
      : first_(std::exchange(other.first_, nullptr)), last_(other.last_) {}
  StepList& operator=(StepList&&) = delete;
  ~StepList() {
    while (first_ != nullptr) dropFirst();
  }

  bool empty() const { return first_ == nullptr; }
  QueuedStep& first() { return *first_; }

  void append(QueuedStep* step) {
    step->next = nullptr;
    if (first_ == nullptr) {
      first_ = step;
    } else {
      last_->next = step;
    }
    last_ = step;
  }

  void prepend(QueuedStep* step) {
    step->next = first_;
    if (first_ == nullptr) last_ = step;
    first_ = step;
  }

  /// Puts all of `other` behind what is there.
  void append(StepList& other) {
    if (other.first_ == nullptr) return;
    if (first_ == nullptr) {
      first_ = other.first_;
    } else {
      last_->next = other.first_;
    }
    last_ = other.last_;
    other.first_ = nullptr;
  }

  /// Puts all of `other` before what is there.
  void prepend(StepList& other) {
    if (other.first_ == nullptr) return;
    other.last_->next = first_;
    if (first_ == nullptr) last_ = other.last_;
    first_ = std::exchange(other.first_, nullptr);
  }

  void swap(StepList& other) noexcept {
    std::swap(first_, other.first_);
    std::swap(last_, other.last_);
  }

  /// Runs the first step and ends it before the next is looked at.
  void runFirst() {
    QueuedStep* const step = takeFirst();
    if (first_ != nullptr) first_->fetchAhead();
    step->run();
    QueuedStep::takeBack(step);
  }

  /// Ends the first step unrun.
  void dropFirst() {
    QueuedStep* const step = takeFirst();
    step->end();
    QueuedStep::takeBack(step);
  }

 private:
  QueuedStep* takeFirst() { return std::exchange(first_, first_->next); }

  QueuedStep* first_ = nullptr;
  QueuedStep* last_ = nullptr;  // Of any use only while there is a first.
};

}  // namespace ostrel
