// How often the service makes the disk work, counted in its calls.
#include <gtest/gtest.h>
#include <sys/mman.h>

#include <cstdio>
#include <fstream>

#include "platform/linux/FileDescriptor.h"
#include "tests/crash/FaultPlan.h"
#include "tests/crash/LoadedService.h"

namespace ostrel::crash {
namespace {

using namespace std::chrono_literals;

class WriteRate : public ::testing::Test {
 protected:
  void SetUp() override {
    const std::string path = service_ / "faults";
    std::ofstream(path).close();
    std::filesystem::resize_file(path, sizeof(SharedFaults));
    const FileDescriptor file(::open(path.c_str(), O_RDWR | O_CLOEXEC));
    void* memory = ::mmap(nullptr, sizeof(SharedFaults), PROT_READ | PROT_WRITE,
                          MAP_SHARED, file.get(), /*offset=*/0);
    ASSERT_NE(memory, MAP_FAILED);
    calls_ = new (memory) SharedFaults;
    service_.start({programBeside("ostrelreportingd_with_faults")},
                   {"OSTREL_FAULTS=" + path});
    RecordingClient(service_.socketPath()).takeReplies();
  }
  void TearDown() override {
    service_.kill();
    ::munmap(calls_, sizeof(SharedFaults));
  }

  std::int64_t count(Call call) const {
    return calls_->calls[static_cast<std::size_t>(call)];
  }

  // Four clients for a while, each with sessions of that length; gives the syncs a
  // second after a first while, in which it may catch up.
  double syncsASecond(int sessionLength) {
    std::vector<std::unique_ptr<NumberedClient>> clients;
    for (int i = 0; i < 4; ++i) {
      NumberedClientOptions options;
      options.socketPath = service_.socketPath();
      options.name = i;
      options.window = 64;
      options.pause = 200us;
      options.sessionLength = sessionLength;
      clients.push_back(std::make_unique<NumberedClient>(options));
    }
    std::this_thread::sleep_for(1500ms);
    const std::int64_t before = count(Call::kSync);
    const auto begin = SteadyClock::now();
    const auto accepted = [&] {
      std::int64_t sum = 0;
      for (const auto& client : clients) sum += client->acceptedCount();
      return sum;
    };
    const std::int64_t acceptedBefore = accepted();
    std::this_thread::sleep_for(kMeasured);
    const double seconds = static_cast<double>(since(begin).count()) / 1e6;
    const double rate = static_cast<double>(count(Call::kSync) - before) / seconds;
    std::printf("%.1f syncs a second at %.0f messages a second\n", rate,
                static_cast<double>(accepted() - acceptedBefore) / seconds);
    return rate;
  }

  const std::chrono::seconds kMeasured{timesFrom("OSTREL_RATE_SECONDS", /*usual=*/2)};
  ServiceUnderTest service_;
  SharedFaults* calls_ = nullptr;
};

TEST_F(WriteRate, StaysBelowTwentySyncsASecondUnderLoad) {
  EXPECT_LE(syncsASecond(/*sessionLength=*/0), 20);
}

// The first flushes are made durable at once; after these it is ten a second.
TEST_F(WriteRate, StaysBelowTwentySyncsASecondWhenSessionsStopAllTheTime) {
  EXPECT_LE(syncsASecond(/*sessionLength=*/2), 20);
}

TEST_F(WriteRate, IsNothingWhenNobodySends) {
  NumberedClientOptions options;
  options.socketPath = service_.socketPath();
  auto client = std::make_unique<NumberedClient>(options);
  EXPECT_TRUE(eventually([&] { return client->acceptedCount() > 10; }));
  client.reset();
  std::this_thread::sleep_for(500ms);
  const std::int64_t writes = count(Call::kWrite);
  const std::int64_t syncs = count(Call::kSync);
  std::this_thread::sleep_for(kMeasured);
  EXPECT_EQ(count(Call::kWrite), writes);
  EXPECT_EQ(count(Call::kSync), syncs);
  EXPECT_GT(writes, 0);
}

}  // namespace
}  // namespace ostrel::crash
