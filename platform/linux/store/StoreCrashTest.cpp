// What stays when the process is killed, or the power goes.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <random>
#include <thread>

#include "platform/linux/store/StoreFaultVFS.h"
#include "platform/linux/store/StoreTelemetryBackend.h"
#include "platform/linux/store/StoreTesting.h"

namespace ostrel {
namespace {

namespace fs = std::filesystem;

// Sends numbered messages for ever and writes the last durable number to `out`.
[[noreturn]] void sendForEver(const std::string& path, std::int64_t first, int out) {
  StoreOptions options;
  options.flushPause = std::chrono::milliseconds(0);
  const auto store = Store::open(path, options);
  StoreTelemetryBackend backend(store);
  std::mt19937 random(static_cast<unsigned>(first));
  std::int64_t number = first;
  for (;;) {
    const auto session = backend.createSession(sessionInfo(number), userInfo(), {});
    for (unsigned i = random() % 50; i != 0; --i) {
      if (!session->sendMessage(1, 1, {{"i", Value(number)}}).succeeded) ::_exit(1);
      ++number;
    }
    Awaited<bool> done;
    session->flush([&](std::optional<ErrorObject> error) { done.set(!error); });
    if (done.get() != true) ::_exit(2);
    const std::int64_t last = number - 1;
    if (::write(out, &last, sizeof last) != sizeof last) ::_exit(3);
  }
}

// For longer runs, and to make one again.
std::int64_t numberFrom(const char* variable, std::int64_t usual) {
  const char* text = std::getenv(variable);
  return text != nullptr ? std::atoll(text) : usual;
}

// Each number up to `last` once, and nothing else but what follows it.
void expectAllUpTo(OtherConnection& reader, std::int64_t last) {
  EXPECT_EQ(reader.one("PRAGMA integrity_check"), "ok");
  EXPECT_EQ(
      reader.one("SELECT count(*) = count(DISTINCT n) AND count(*) = ifnull(max(n), "
                 "0) AND ifnull(max(n), 0) >= " +
                 std::to_string(last) +
                 " FROM (SELECT json_extract(payload, '$.i') AS n FROM "
                 "telemetry_messages)"),
      "1")
      << "up to " << last;
  EXPECT_EQ(reader.one("SELECT count(*) FROM telemetry_messages WHERE "
                       "telemetry_session_id NOT IN (SELECT id FROM "
                       "telemetry_sessions)"),
            "0");
}

TEST(StoreCrash, KeepsWhatWasDurableThroughFortyKills) {
  TemporaryDirectory directory;
  const std::string path = directory.path() + "/state/reports.db";
  std::mt19937 random(20260131);
  std::int64_t last = 0;
  for (int kill = 0; kill < 40; ++kill) {
    int pipe[2];
    ASSERT_EQ(::pipe(pipe), 0);
    std::int64_t present = 0;
    if (fs::exists(path)) {
      present = std::stoll(OtherConnection(path).one(
          "SELECT ifnull(max(json_extract(payload, '$.i')), 0) FROM telemetry_messages"));
    }
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      ::close(pipe[0]);
      sendForEver(path, present + 1, pipe[1]);
    }
    ::close(pipe[1]);
    // Every other one dies while it opens the store.
    std::int64_t number = 0;
    if (kill % 2 == 0 && ::read(pipe[0], &number, sizeof number) == sizeof number) {
      last = number;
    }
    std::this_thread::sleep_for(std::chrono::microseconds(random() % 20'000));
    ::kill(child, SIGKILL);
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, /*options=*/0), child);
    ASSERT_TRUE(WIFSIGNALED(status)) << "exit status " << WEXITSTATUS(status);
    while (::read(pipe[0], &number, sizeof number) == sizeof number) last = number;
    ::close(pipe[0]);
    if (!fs::exists(path)) continue;
    OtherConnection reader(path);
    if (reader.one("PRAGMA user_version") == "0") continue;  // Killed in making it.
    expectAllUpTo(reader, last);
  }
  EXPECT_GT(last, 0);
}

// Sends messages in a few lives of the store, some with a checkpoint from outside.
std::vector<FileEvent> recordWork(const std::string& path) {
  FaultVFS& vfs = FaultVFS::instance();
  vfs.clearPlan();
  vfs.startRecording();
  StoreOptions options;
  options.vfs = FaultVFS::kName;
  options.flushPause = std::chrono::milliseconds(0);
  std::int64_t number = 0;
  for (int life = 0; life < 3; ++life) {
    const auto store = Store::open(path, options);
    StoreTelemetryBackend backend(store);
    for (int round = 0; round < 20; ++round) {
      const auto session = backend.createSession(sessionInfo(round), userInfo(), {});
      const std::string text(static_cast<std::size_t>(round) * 200, 'x');
      for (int i = 0; i < 10; ++i) {
        ++number;
        session->sendMessage(1, 1, {{"i", Value(number)}, {"text", Value(text)}});
      }
      Awaited<bool> done;
      session->flush([&](std::optional<ErrorObject> error) {
        vfs.mark(number);
        done.set(!error);
      });
      EXPECT_EQ(done.get(), true);
      if (round % 8 == 7) {
        sqlite3* other = nullptr;
        sqlite3_open_v2(path.c_str(), &other, SQLITE_OPEN_READWRITE, FaultVFS::kName);
        sqlite3_exec(other, "PRAGMA wal_checkpoint(PASSIVE)", nullptr, nullptr, nullptr);
        sqlite3_close(other);
      }
    }
  }
  return vfs.stopRecording();
}

TEST(StoreCrash, KeepsWhatWasDurableThroughTwoThousandPowerCuts) {
  TemporaryDirectory directory(TemporaryDirectory::inMemory());
  const auto events = recordWork(directory.path() + "/state/reports.db");
  const std::string image = directory.path() + "/image";
  const std::string path = image + "/reports.db";
  const auto wanted = static_cast<std::size_t>(numberFrom("OSTREL_POWER_CUTS", 2000));
  const auto seed = static_cast<std::uint64_t>(numberFrom("OSTREL_SEED", 20260131));
  SCOPED_TRACE("OSTREL_SEED=" + std::to_string(seed));
  PowerCut power(seed);
  StoreOptions options;
  options.vfs = FaultVFS::kName;
  FaultVFS::instance().setSkipsSync(true);
  std::int64_t durable = 0;
  std::size_t cuts = 0;
  for (std::size_t i = 0; i < events.size(); ++i) {
    power.apply(events[i]);
    if (events[i].kind == FileEvent::Kind::kMark) durable = events[i].offset;
    for (; cuts * events.size() < wanted * (i + 1); ++cuts) {
      testing_support::writeFiles(image, power.cut());
      // The next life of the store: nothing is set aside, unless there was nothing.
      {
        const auto store = Store::open(path, options);
        StoreTelemetryBackend backend(store);
        ASSERT_EQ(flushed(*backend.createSession(sessionInfo(0), userInfo(), {})),
                  std::nullopt);
        if (durable > 0) {
          ASSERT_EQ(store->counters().setAside, 0u) << "after event " << i;
        }
      }
      OtherConnection reader(path);
      expectAllUpTo(reader, durable);
      ASSERT_FALSE(::testing::Test::HasFailure()) << "after event " << i;
    }
  }
  FaultVFS::instance().setSkipsSync(false);
  EXPECT_EQ(cuts, wanted);
  EXPECT_EQ(durable, 600);
}

}  // namespace
}  // namespace ostrel
