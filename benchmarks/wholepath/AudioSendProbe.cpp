// What sending costs an audio thread, and that it asks the system for nothing: the
// sends run on a thread whose filter ends the process at any system call, and in
// which any allocation does the same.
//
//   ostrel_bench_audio_send SOCKET SENDS
//
// prints "median_ns N p999_ns N".
#include <linux/audit.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <semaphore>
#include <string>
#include <thread>
#include <vector>

#include "benchmarks/wholepath/Payload.h"
#include "ostrel/AudioSender.h"
#include "ostrel/OstrelReportingClient.h"

extern "C" void* __libc_malloc(std::size_t size);

namespace {
thread_local bool mustNotAllocate = false;
}  // namespace

extern "C" void* malloc(std::size_t size) {
  if (mustNotAllocate) __builtin_trap();
  return __libc_malloc(size);
}

namespace ostrel::bench {
namespace {

using namespace ostrel::reporting;

constexpr std::int64_t kSession = 4711;
constexpr std::size_t kRingBytes = 8 * 1024 * 1024;
constexpr std::chrono::milliseconds kPeriod{5};
constexpr double kNanosecondsBetweenSends = 3000;
constexpr std::chrono::seconds kPatience{10};

// A counter that is read without a system call, at a constant rate.
std::uint64_t ticks() {
#if defined(__x86_64__)
  unsigned int processor = 0;
  return __builtin_ia32_rdtscp(&processor);
#elif defined(__aarch64__)
  std::uint64_t value = 0;
  asm volatile("isb; mrs %0, cntvct_el0" : "=r"(value));
  return value;
#else
#error "no counter is known for this processor"
#endif
}

double measureTicksPerNanosecond() {
  const auto began = std::chrono::steady_clock::now();
  const std::uint64_t first = ticks();
  std::this_thread::sleep_for(std::chrono::milliseconds(100));
  const std::chrono::duration<double, std::nano> took =
      std::chrono::steady_clock::now() - began;
  return static_cast<double>(ticks() - first) / took.count();
}

// From here on any system call of the calling thread ends the process.
void forbidSystemCalls() {
  sock_filter code[] = {BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_KILL_PROCESS)};
  const sock_fprog program = {std::size(code), code};
  if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0 ||
      ::syscall(SYS_seccomp, SECCOMP_SET_MODE_FILTER, 0, &program) != 0) {
    std::perror("seccomp");
    std::_Exit(EXIT_FAILURE);
  }
}

struct Samples {
  explicit Samples(std::size_t count) : sends(count), nothing(count) {}
  std::vector<std::uint32_t> sends;
  std::vector<std::uint32_t> nothing;  // The same without a send.
  std::uint64_t refused = 0;
};

// Never returns: even the end of a thread is a system call.
[[noreturn]] void runAudioThread(AudioSender& sender, PreparedMessage& message,
                                 PreparedMessage::Field field, std::uint64_t pause,
                                 Samples& samples, std::atomic<bool>& isDone) {
  forbidSystemCalls();
  mustNotAllocate = true;
  std::uint64_t next = ticks();
  for (std::size_t i = 0; i < samples.sends.size(); ++i) {
    const std::uint64_t idle = ticks();
    samples.nothing[i] = static_cast<std::uint32_t>(ticks() - idle);
    const std::uint64_t began = ticks();
    message.set(field, i);
    const bool isQueued = sender.send(message);
    samples.sends[i] = static_cast<std::uint32_t>(ticks() - began);
    if (!isQueued) ++samples.refused;
    next += pause;
    while (ticks() < next) {
    }
  }
  isDone.store(true, std::memory_order_release);
  while (true) {
  }
}

double at(std::vector<std::uint32_t>& samples, double quantile) {
  const auto index =
      static_cast<std::ptrdiff_t>(quantile * static_cast<double>(samples.size() - 1));
  std::nth_element(samples.begin(), samples.begin() + index, samples.end());
  return samples[static_cast<std::size_t>(index)];
}

bool openSession(Client& client) {
  std::binary_semaphore isReplied{0};
  bool isThere = false;
  client.createReportingSession(ReporterID{kSession}, [&](const Reply<bool>& reply) {
    isThere = static_cast<bool>(reply);
    isReplied.release();
  });
  isReplied.acquire();
  client.startReportingSessionForID(ReporterID{kSession});
  return isThere && client.flush(kPatience);
}

int run(const std::string& socketPath, std::size_t sends) {
  Options options;
  options.socketPath = socketPath;
  Client client(options);
  if (!openSession(client)) {
    std::fprintf(stderr, "ostrel_bench_audio_send: no service at %s\n",
                 socketPath.c_str());
    return EXIT_FAILURE;
  }
  AudioSender sender = client.makeAudioSender(kRingBytes, kPeriod);
  PreparedMessage message(examplePayload(), kExampleCategory, kExampleType,
                          {{ReporterID{kSession}}});
  const auto field = message.field("underruns");
  Samples samples(sends);
  std::atomic<bool> isDone{false};
  const double ticksPerNanosecond = measureTicksPerNanosecond();
  const auto pause =
      static_cast<std::uint64_t>(kNanosecondsBetweenSends * ticksPerNanosecond);
  std::thread([&] {
    runAudioThread(sender, message, field, pause, samples, isDone);
  }).detach();
  while (!isDone.load(std::memory_order_acquire)) {
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  sender.flush();
  if (!client.flush(kPatience) || samples.refused != 0) {
    std::fprintf(stderr, "ostrel_bench_audio_send: %llu messages were not queued\n",
                 static_cast<unsigned long long>(samples.refused));
    std::_Exit(EXIT_FAILURE);
  }
  const double reading = at(samples.nothing, 0.5);
  std::printf("median_ns %.1f p999_ns %.1f\n",
              (at(samples.sends, 0.5) - reading) / ticksPerNanosecond,
              (at(samples.sends, 0.999) - reading) / ticksPerNanosecond);
  std::fflush(stdout);
  std::_Exit(EXIT_SUCCESS);
}

}  // namespace
}  // namespace ostrel::bench

int main(int argc, char** argv) {
  const long sends = argc == 3 ? std::atol(argv[2]) : 0;
  if (sends <= 0) {
    std::fprintf(stderr, "usage: ostrel_bench_audio_send SOCKET SENDS\n");
    return 2;
  }
  return ostrel::bench::run(argv[1], static_cast<std::size_t>(sends));
}
