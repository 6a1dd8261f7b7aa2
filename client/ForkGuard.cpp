#include "client/ForkGuard.h"

#include <pthread.h>

#include <algorithm>
#include <atomic>
#include <vector>

namespace ostrel {
namespace {

struct Guard {
  Guard() { ::pthread_atfork(beforeFork, inParent, inChild); }

  static void beforeFork();
  static void inParent();
  static void inChild();

  std::mutex mutex;
  std::vector<ForkAware*> objects;
};

std::atomic<std::uint64_t> forkGeneration{0};

// Never destroyed: the handlers stay until the process ends.
Guard& guard() {
  static Guard& guard = *new Guard;
  return guard;
}

void Guard::beforeFork() { guard().mutex.lock(); }

void Guard::inParent() { guard().mutex.unlock(); }

void Guard::inChild() {
  forkGeneration.fetch_add(1, std::memory_order_relaxed);
  for (ForkAware* object : guard().objects) object->closeInChild();
  guard().objects.clear();
  guard().mutex.unlock();
}

}  // namespace

void ForkGuard::add(ForkAware* object) {
  const std::lock_guard held(guard().mutex);
  guard().objects.push_back(object);
}

void ForkGuard::remove(ForkAware* object) {
  const std::lock_guard held(guard().mutex);
  auto& objects = guard().objects;
  objects.erase(std::remove(objects.begin(), objects.end(), object), objects.end());
}

std::unique_lock<std::mutex> ForkGuard::lock() { return std::unique_lock(guard().mutex); }

std::uint64_t ForkGuard::generation() {
  return forkGeneration.load(std::memory_order_relaxed);
}

}  // namespace ostrel
