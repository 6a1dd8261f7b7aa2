// What the keeper of the heap does to the process's own.
#include "platform/linux/HeapKeeper.h"

#include <gtest/gtest.h>
#include <malloc.h>
#include <unistd.h>

#include <chrono>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <latch>
#include <memory>
#include <thread>
#include <vector>

namespace ostrel {
namespace {

std::size_t residentBytes() {
  std::size_t all = 0;
  std::size_t resident = 0;
  std::ifstream("/proc/self/statm") >> all >> resident;
  return resident * static_cast<std::size_t>(::sysconf(_SC_PAGESIZE));
}

// Exits with 0, or with the number of what went wrong. For a process of its own: one that
// is large already gives memory back in the middle of the burst.
[[noreturn]] void exitAfterABurst() {
  constexpr std::size_t kPieces = 40'000;
  constexpr std::size_t kPieceBytes = 1000;
  const auto timers = std::make_shared<TimerThread>();
  const auto keeper = std::make_shared<HeapKeeper>(timers);
  std::vector<std::unique_ptr<char[]>> pieces(kPieces);
  const std::size_t before = residentBytes();
  for (auto& piece : pieces) {
    piece.reset(new char[kPieceBytes]);
    std::memset(piece.get(), 1, kPieceBytes);
  }
  const std::size_t during = residentBytes();
  // All but the last: the heap cannot shrink by itself.
  for (std::size_t i = 0; i + 1 < kPieces; ++i) pieces[i].reset();
  if (during <= before + kPieces * kPieceBytes / 2) std::_Exit(1);

  for (std::size_t i = 0; i < HeapKeeper::kRoundsOfBurst; ++i) {
    keeper->noteWork(std::chrono::steady_clock::now());
  }
  const auto isGivenBack = [&] {
    return residentBytes() < before + kPieces * kPieceBytes / 4;
  };
  if (isGivenBack()) std::_Exit(2);
  const auto patience = std::chrono::steady_clock::now() + std::chrono::seconds(30);
  while (!isGivenBack() && std::chrono::steady_clock::now() < patience) {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  std::_Exit(isGivenBack() ? 0 : 3);
}

TEST(ProcessHeap, GivesBackWhatABurstTook) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(exitAfterABurst(), testing::ExitedWithCode(0), "");
}

#ifndef OSTREL_SANITIZED  // Sanitizers have heaps of their own.
// Exits with the number of heaps that eight threads made.
[[noreturn]] void exitWithHeaps() {
  shareHeaps();
  constexpr std::size_t kThreads = 8;
  std::latch haveSome(kThreads + 1);
  std::latch mayEnd(1);
  for (std::size_t i = 0; i < kThreads; ++i) {
    std::thread([&] {
      const std::vector<char> some(1000);
      haveSome.arrive_and_wait();
      mayEnd.wait();
    }).detach();
  }
  haveSome.arrive_and_wait();
  char* text = nullptr;
  std::size_t size = 0;
  std::FILE* const file = ::open_memstream(&text, &size);
  ::malloc_info(/*options=*/0, file);
  std::fclose(file);
  int heaps = 0;
  for (const char* at = text; (at = std::strstr(at, "<heap nr")) != nullptr; ++at)
    ++heaps;
  std::_Exit(heaps);
}

TEST(ProcessHeap, IsOneOfTwoForAllThreads) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(exitWithHeaps(), testing::ExitedWithCode(2), "");
}
#endif

}  // namespace
}  // namespace ostrel
