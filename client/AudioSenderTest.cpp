// What an audio thread may call makes no system call and allocates nothing: a
// thread under a filter that ends the process on any system call does it.
#include "ostrel/AudioSender.h"

#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <new>
#include <thread>

#include "ostrel/OstrelReportingClient.h"

// The sanitizers make system calls and allocate on their own.
#ifndef OSTREL_SANITIZED

namespace {

thread_local bool countsAllocations = false;
std::atomic<int> allocations{0};

}  // namespace

// Out of line, or g++ 12 takes their pairing for a mistake.
[[gnu::noinline]] void* operator new(std::size_t size) {
  if (countsAllocations) ++allocations;
  if (void* memory = std::malloc(size != 0 ? size : 1)) return memory;
  throw std::bad_alloc();
}
[[gnu::noinline]] void operator delete(void* memory) noexcept { std::free(memory); }
[[gnu::noinline]] void operator delete(void* memory, std::size_t) noexcept {
  std::free(memory);
}

namespace ostrel::reporting {
namespace {

constexpr int kMessages = 10'000;

bool forbidSystemCalls() {
  sock_filter kill[] = {{BPF_RET | BPF_K, 0, 0, SECCOMP_RET_KILL_PROCESS}};
  const sock_fprog program{1, kill};
  return ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
         ::prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program) == 0;
}

/// In a process of its own; its status says what went wrong.
[[noreturn]] void sendWithoutSystemCalls() {
  Options options;
  options.socketPath = "/nonexistent/reporting.sock";
  Client client(options);
  AudioSender sender =
      client.makeAudioSender(/*ringBytes=*/64 * 1024, std::chrono::milliseconds(1));
  PreparedMessage message(Message{{"underruns", 0}, {"load", 0.5}}, Category{0x1000000A},
                          MessageType{0}, ReporterIDs{ReporterID{7}});
  const auto underruns = message.field("underruns");
  const auto load = message.field("load");
  std::atomic<bool> isDone{false};
  std::atomic<int> queued{0};
  std::thread audio([&] {
    if (!forbidSystemCalls()) ::_exit(3);
    countsAllocations = true;
    for (int i = 0; i < kMessages; ++i) {
      message.set(underruns, i);
      message.set(load, i * 0.5);
      queued += sender.send(message) ? 1 : 0;
    }
    countsAllocations = false;
    isDone = true;
    for (;;) {  // Ending would be a system call.
    }
  });
  while (!isDone) ::usleep(1000);
  if (allocations != 0) ::_exit(4);
  if (queued == 0) ::_exit(5);
  if (queued + static_cast<int>(sender.droppedMessages()) != kMessages) ::_exit(6);
  ::_exit(0);
}

TEST(AudioSender, MakesNoSystemCallAndAllocatesNothing) {
  const pid_t child = ::fork();
  if (child == 0) sendWithoutSystemCalls();
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);

  EXPECT_TRUE(WIFEXITED(status)) << "ended by signal " << WTERMSIG(status);
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

TEST(AudioSender, IsSeenToMakeASystemCallWhenItDoes) {
  const pid_t child = ::fork();
  if (child == 0) {
    if (!forbidSystemCalls()) ::_exit(3);
    ::getppid();
    ::_exit(0);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);

  EXPECT_TRUE(WIFSIGNALED(status));
}

}  // namespace
}  // namespace ostrel::reporting

#endif

namespace ostrel::reporting {
namespace {

TEST(AudioSender, CountsWhatDoesNotFitItsRing) {
  Options options;
  options.socketPath = "/nonexistent/reporting.sock";
  Client client(options);
  AudioSender sender = client.makeAudioSender(/*ringBytes=*/4096, std::chrono::hours(1));
  sender.disarm();
  const PreparedMessage message(Message{{"text", std::string(1000, 'x')}}, Category{1},
                                MessageType{0}, std::nullopt);

  int queued = 0;
  for (int i = 0; i < 10; ++i) queued += sender.send(message) ? 1 : 0;

  EXPECT_GE(queued, 3);
  EXPECT_LT(queued, 10);
  EXPECT_EQ(sender.droppedMessages(), static_cast<std::uint64_t>(10 - queued));
}

}  // namespace
}  // namespace ostrel::reporting
