#include "platform/Task.h"

#include <gtest/gtest.h>

#include <array>
#include <cstdlib>
#include <memory>
#include <new>
#include <vector>

namespace {
thread_local int allocations = 0;
}

// Counts what this program allocates.
void* operator new(std::size_t size) {
  ++allocations;
  if (void* memory = std::malloc(size)) return memory;
  throw std::bad_alloc();
}
void operator delete(void* memory) noexcept { std::free(memory); }
void operator delete(void* memory, std::size_t) noexcept { std::free(memory); }

namespace ostrel {
namespace {

// A callable of `Size` bytes that counts its runs and how many of it live.
template <std::size_t Size>
class Callable {
 public:
  Callable(int& runs, int& alive) : runs_(&runs), alive_(&alive) { ++*alive_; }
  Callable(Callable&& other) noexcept : runs_(other.runs_), alive_(other.alive_) {
    ++*alive_;
  }
  Callable(const Callable&) = delete;
  ~Callable() { --*alive_; }
  void operator()() { ++*runs_; }

 private:
  int* runs_;
  int* alive_;
  std::array<char, Size - 2 * sizeof(int*)> rest_{};
};

template <std::size_t Size>
void expectRunsOnceAndEnds() {
  int runs = 0;
  int alive = 0;
  {
    Task task{Callable<Size>(runs, alive)};
    EXPECT_EQ(alive, 1);
    Task moved = std::move(task);
    EXPECT_FALSE(task);
    EXPECT_TRUE(moved);
    EXPECT_EQ(alive, 1);
    moved();
  }
  EXPECT_EQ(runs, 1);
  EXPECT_EQ(alive, 0);
}

TEST(Task, RunsAndEndsCallablesAroundItsInlineSize) {
  expectRunsOnceAndEnds<24>();
  expectRunsOnceAndEnds<Task::kInlineSize - 8>();
  expectRunsOnceAndEnds<Task::kInlineSize>();
  expectRunsOnceAndEnds<Task::kInlineSize + 8>();
  expectRunsOnceAndEnds<4096>();
}

TEST(Task, AllocatesNothingUpToItsInlineSize) {
  int runs = 0;
  int alive = 0;
  const int before = allocations;
  Task task{Callable<Task::kInlineSize>(runs, alive)};
  Task moved = std::move(task);
  moved();
  EXPECT_EQ(allocations, before);
}

TEST(Task, AllocatesOnceAboveItsInlineSize) {
  int runs = 0;
  int alive = 0;
  const int before = allocations;
  Task task{Callable<Task::kInlineSize + 8>(runs, alive)};
  Task moved = std::move(task);
  moved();
  EXPECT_EQ(allocations, before + 1);
}

struct alignas(64) Aligned {
  void operator()() const { EXPECT_EQ(reinterpret_cast<std::uintptr_t>(this) % 64, 0u); }
  char bytes[64] = {};
};

TEST(Task, KeepsTheAlignmentOfItsCallable) {
  Task task{Aligned{}};
  Task moved = std::move(task);
  moved();
}

struct ThrowingMove {
  ThrowingMove() = default;
  ThrowingMove(ThrowingMove&&) noexcept(false) {}
  void operator()() { ++runs; }
  int runs = 0;
};

TEST(Task, TakesACallableWhoseMoveMayThrow) {
  Task task{ThrowingMove{}};
  Task moved = std::move(task);
  moved();
  static_assert(std::is_nothrow_move_constructible_v<Task>);
  static_assert(std::is_nothrow_move_assignable_v<Task>);
}

TEST(OneShot, GivesWhatItsCallableGives) {
  const int before = allocations;
  OneShot<int, 16> small{[a = 20, b = 1] { return 2 * a + b; }};
  OneShot<int, 16> moved = std::move(small);
  EXPECT_EQ(moved(), 41);
  EXPECT_EQ(allocations, before);
  OneShot<int, 16> large{[a = std::array<int, 8>{1, 2}] { return a[0] + a[1]; }};
  moved = std::move(large);
  EXPECT_EQ(moved(), 3);
  EXPECT_EQ(allocations, before + 1);
}

TEST(Task, IsEmptyUnlessMadeOtherwise) {
  Task task;
  EXPECT_FALSE(task);
  Task moved = std::move(task);
  EXPECT_FALSE(moved);
}

TEST(Task, DropsItsOldCallableWhenAssigned) {
  int runs = 0;
  int alive = 0;
  Task task{Callable<24>(runs, alive)};
  task = Task();
  EXPECT_EQ(alive, 0);
  EXPECT_FALSE(task);
}

TEST(Task, SurvivesBeingAssignedToItself) {
  int runs = 0;
  int alive = 0;
  Task task{Callable<24>(runs, alive)};
  Task& same = task;
  task = std::move(same);
  ASSERT_TRUE(task);
  task();
  EXPECT_EQ(runs, 1);
}

TEST(Task, KeepsACopyOfWhatItIsGivenByReference) {
  int runs = 0;
  auto callable = [&runs] { ++runs; };
  Task task{callable};
  task();
  EXPECT_EQ(runs, 1);
}

}  // namespace
}  // namespace ostrel
