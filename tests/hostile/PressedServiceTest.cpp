// The service where much is asked of it at once, or where something that it needs is
// missing: it bounds what it takes, and serves.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/ioctl.h>
#include <sys/stat.h>

#include <algorithm>
#include <charconv>
#include <iostream>
#include <map>

#include "platform/linux/TestSockets.h"
#include "platform/linux/wire/Frame.h"
#include "tests/hostile/ProcessUsage.h"
#include "tests/integration/ServiceUnderTest.h"

namespace ostrel {
namespace {

using namespace std::chrono_literals;
using hostile::numberIn;
using hostile::processorTimeOf;
using hostile::usageOf;
using std::chrono::steady_clock;

class PressedService : public testing::Test {
 protected:
  static constexpr MessageCategory kProbe{0};

  /// Sessions from 1 on, all of them started.
  void startSessions(RecordingClient& client, std::int64_t sessions) const {
    ReporterIDs ids;
    for (std::int64_t id = 1; id <= sessions; ++id) {
      client->createReportingSession(ReporterID{id}, /*reply=*/nullptr);
      client->startReportingSessionForID(ReporterID{id}, /*reply=*/nullptr);
      ids.push_back(ReporterID{id});
    }
    // A message goes through each, behind its start.
    client->sendMessage({{"is", "started"}}, kProbe, MessageType{0}, std::move(ids),
                        /*reply=*/nullptr);
    ASSERT_TRUE(service.waitForRows(
        "SELECT id FROM telemetry_messages WHERE telemetry_session_id NOT NULL",
        static_cast<std::size_t>(sessions)));
  }

  /// Whether a client that connects now is served, down to the store.
  bool serves() {
    RecordingClient client(service.socketPath());
    client->createReportingSession(ReporterID{1'000'000}, client.boolean("create"));
    client->sendMessage({{"is", "served"}}, MessageCategory{0x4000}, MessageType{1},
                        ReporterIDs{ReporterID{1'000'000}}, /*reply=*/nullptr);
    return client.wait(1) == RecordingClient::Replies{"create true"} &&
           service.waitForRows("SELECT id FROM telemetry_messages WHERE category = 16384",
                               /*count=*/1);
  }

  /// Of the log, so far.
  std::size_t linesWith(const std::string& text) const {
    std::ifstream log(service / "log.txt");
    std::size_t count = 0;
    for (std::string line; std::getline(log, line);) {
      if (line.find(text) != std::string::npos) ++count;
    }
    return count;
  }

  ServiceUnderTest service;
};

// Each message is to be written to every session's list and to the store, more than any
// memory has room for.
TEST_F(PressedService, SendsLargeMessagesToAllSessionsInTheirOrder) {
  const auto sessions = static_cast<std::int64_t>(numberIn("OSTREL_SESSIONS_OF_ALL", 50));
  const auto messages =
      static_cast<std::uint32_t>(numberIn("OSTREL_MESSAGES_TO_ALL", 10));
  constexpr std::size_t kBytes = 64 * 1024;
  service.start();
  RecordingClient client(service.socketPath());
  startSessions(client, sessions);

  for (std::uint32_t number = 1; number <= messages; ++number) {
    client->sendMessage({{"with a blank", 1}, {"text", std::string(kBytes, 'x')}},
                        MessageCategory{number}, MessageType{1},
                        /*reportingIDs=*/std::nullopt, client.error("send"));
  }
  // Each waits until those before it are written.
  for (std::size_t before = 0, now = 0; now < messages; before = now) {
    now = client.wait(messages).size();
    ASSERT_GT(now, before);
  }
  const std::string last =
      "SELECT id FROM telemetry_messages WHERE category = " + std::to_string(messages);
  ASSERT_TRUE(service.waitForRows(last, static_cast<std::size_t>(sessions)));

  // Of a great many the store has given the oldest up.
  std::map<std::string, std::uint32_t> latest;
  for (const std::string& row :
       service.rows("SELECT category, telemetry_session_id FROM telemetry_messages "
                    "WHERE type = 1 AND substr(payload, 2, 14) = '\"with_a_blank\"' "
                    "ORDER BY id")) {
    const auto bar = row.find('|');
    std::uint32_t number = 0;
    std::from_chars(row.data(), row.data() + bar, number);
    const auto [place, isFirst] = latest.try_emplace(row.substr(bar + 1), number);
    if (isFirst) continue;
    ASSERT_EQ(number, place->second + 1) << "of session " << place->first;
    place->second = number;
  }
  EXPECT_EQ(latest.size(), static_cast<std::size_t>(sessions));
  for (const auto& [session, number] : latest) EXPECT_EQ(number, messages) << session;
  const std::size_t peak = usageOf(service.process().pid()).peakResidentKiB;
  std::cout << "peak of resident memory " << peak / 1024 << " MiB\n";
  if (hostile::kMemoryIsBounded) {
    EXPECT_LT(peak, hostile::kMostResidentKiB);
  }
}

// A user may keep 240 MiB, which is reached by a thousand such messages.
TEST_F(PressedService, StopsASessionThatHasKeptMuch) {
  const auto messages = static_cast<std::size_t>(numberIn("OSTREL_KEPT_MESSAGES", 20));
  constexpr std::size_t kBytes = 256 * 1024;
  constexpr std::size_t kMostKept = limits::kKeptBytesOfUser / kBytes;
  constexpr std::size_t kMostKiBAtStop = 1024 * 1024;
  service.start();
  RecordingClient client(service.socketPath());
  startSessions(client, /*sessions=*/1);
  for (std::size_t i = 0; i < messages; ++i) {
    client->sendMessage({{"text", std::string(kBytes, 'x')}}, MessageCategory{1},
                        MessageType{1}, ReporterIDs{ReporterID{1}}, client.error("send"));
  }
  for (std::size_t before = 0, now = 0; now < messages; before = now) {
    now = client.wait(messages).size();
    ASSERT_GT(now, before);
  }
  client->stopReportingSessionForID(ReporterID{1}, /*reply=*/nullptr);

  const std::string summary =
      "SELECT length(payload) FROM telemetry_messages WHERE category = 65535 AND "
      "type = 65535 AND substr(payload, 1, 40) LIKE '%Summary%'";
  ASSERT_TRUE(eventually([&] { return !service.rows(summary).empty(); }));
  const std::size_t kept =
      (std::stoul(service.rows(summary).front()) + kBytes / 2) / kBytes;
  std::cout << kept << " of " << messages << " messages in the summary, peak of "
            << "resident memory "
            << usageOf(service.process().pid()).peakResidentKiB / 1024 << " MiB\n";
  EXPECT_LE(kept, kMostKept);
  EXPECT_GE(kept, std::min(messages, kMostKept - kMostKept / 16));
  EXPECT_EQ(linesWith("goes without some messages"), messages > kMostKept ? 1u : 0u);
  if (hostile::kMemoryIsBounded) {
    EXPECT_LT(usageOf(service.process().pid()).peakResidentKiB, kMostKiBAtStop);
  }
  EXPECT_TRUE(serves());
}

// A list of so many sessions is more than half of what a socket holds.
TEST_F(PressedService, HasLittleInMemoryForManyClientsThatDoNotReadLargeReplies) {
  constexpr std::int64_t kSessions = 16'384;
  constexpr std::int64_t kFirstID = std::int64_t{1} << 40;
  constexpr std::size_t kClients = 700;
  constexpr std::size_t kQuestions = 3;
  service.start();
  RecordingClient owner(service.socketPath());
  for (std::int64_t i = 0; i < kSessions; ++i) {
    owner->createReportingSession(ReporterID{kFirstID + i}, /*reply=*/nullptr);
  }
  owner->createReportingSession(ReporterID{1}, owner.boolean("create"));
  ASSERT_EQ(owner.wait(1), RecordingClient::Replies{"create true"});

  std::string questions;
  for (std::size_t number = 1; number <= kQuestions; ++number) {
    wire::Request question;
    question.operation = wire::Operation::kGetAllReporters;
    question.number = number;
    wire::appendRequest(questions, question);
  }
  std::vector<FileDescriptor> clients;
  for (std::size_t i = 0; i < kClients; ++i) {
    clients.push_back(testing_support::connectedSocket(service.socketPath()));
    ASSERT_TRUE(clients.back());
    ASSERT_EQ(::send(clients.back().get(), questions.data(), questions.size(), 0),
              static_cast<ssize_t>(questions.size()));
  }
  // Each has been served, or cut off, once nothing of it is in memory but what is unread.
  for (const FileDescriptor& client : clients) {
    char byte = 0;
    EXPECT_EQ(::recv(client.get(), &byte, 1, MSG_PEEK), 1);
  }
  ASSERT_TRUE(serves());
  const std::size_t peak = usageOf(service.process().pid()).peakResidentKiB;
  std::cout << "peak of resident memory " << peak / 1024 << " MiB\n";
  if (hostile::kMemoryIsBounded) {
    EXPECT_LT(peak, hostile::kMostResidentKiB / 2);
  }

  // Who reads has all of it.
  owner->getAllReporters(owner.reporterIDs("all"));
  const std::string all = owner.wait(2).back();
  EXPECT_GE(std::ranges::count(all, ' '), kSessions + 1);
}

TEST_F(PressedService, HardlyRunsWhileItHasNoDescriptorAndServesOnceItHas) {
  constexpr int kClients = 100;
  service.start({"prlimit", "--nofile=64", programBeside("ostrelreportingd")}, {});
  ASSERT_TRUE(serves());
  const auto refusals = [&] { return linesWith("can be accepted now"); };

  std::vector<FileDescriptor> clients;
  for (int i = 0; i < kClients; ++i) {
    clients.push_back(testing_support::connectedSocket(service.socketPath()));
    ASSERT_TRUE(clients.back());
  }
  ASSERT_TRUE(eventually([&] { return refusals() > 0; }));
  const std::size_t refusedBefore = refusals();
  const auto processorBefore = processorTimeOf(service.process().pid());
  const auto begin = steady_clock::now();
  ASSERT_TRUE(eventually([&] { return refusals() > refusedBefore + 5; }));
  const std::chrono::duration<double> took = steady_clock::now() - begin;
  const auto processor = processorTimeOf(service.process().pid()) - processorBefore;
  EXPECT_LT(processor / took, 0.05);
  EXPECT_LT(static_cast<double>(refusals() - refusedBefore), took / 100ms + 2);

  clients.clear();
  EXPECT_TRUE(serves());
}

TEST_F(PressedService, AnswersThoughNobodyReadsItsLog) {
  constexpr std::int64_t kSessions = 20;
  constexpr std::size_t kMessages = 1000;
  constexpr int kPipeBytes = 64 * 1024;
  const std::string log = service / "log.txt";
  ASSERT_EQ(::mkfifo(log.c_str(), 0600), 0);
  // There to be written to, and never read.
  const FileDescriptor reader(::open(log.c_str(), O_RDWR | O_CLOEXEC));
  ASSERT_TRUE(reader);
  service.start();
  RecordingClient client(service.socketPath());
  startSessions(client, kSessions);

  // Each of these logs all sessions twice.
  for (std::size_t i = 0; i < kMessages; ++i) {
    client->sendMessage({{"i", static_cast<int>(i)}}, MessageCategory{1}, MessageType{1},
                        /*reportingIDs=*/std::nullopt, client.error("send"));
  }
  EXPECT_EQ(client.wait(kMessages), RecordingClient::Replies(kMessages, "send no error"));
  EXPECT_TRUE(service.waitForRows("SELECT id FROM telemetry_messages WHERE type = 1",
                                  kMessages * kSessions));
  int unread = 0;
  ASSERT_EQ(::ioctl(reader.get(), FIONREAD, &unread), 0);
  EXPECT_GT(unread, kPipeBytes / 2) << "it is full, in pages";
  EXPECT_TRUE(serves());
  EXPECT_EQ(service.terminate(), 0);
}

TEST_F(PressedService, ReadsItsDefaultsTenTimesASecondHoweverOftenTheyChange) {
  constexpr std::int64_t kSessions = 10'000;
  constexpr double kChangesPerSecond = 10'000;
  service.start();
  RecordingClient client(service.socketPath());
  for (std::int64_t id = 1; id <= kSessions; ++id) {
    client->createReportingSession(ReporterID{id}, /*reply=*/nullptr);
  }
  ASSERT_EQ(service.ostrelctl({"defaults", "write", "device_name", "Kitchen"}), 0);
  ASSERT_EQ(service.ostrelctl({"notify"}), 0);
  const auto readings = [&] { return linesWith("re-reading"); };
  ASSERT_TRUE(eventually([&] { return readings() == 1; }));

  const std::string notification = service / "run/notify/com.orbisk.ostrel.reporting";
  const auto processorBefore = processorTimeOf(service.process().pid());
  const auto begin = steady_clock::now();
  const auto seconds = [&] {
    return std::chrono::duration<double>(steady_clock::now() - begin).count();
  };
  int changes = 0;
  while (seconds() < 1) {
    for (; changes < kChangesPerSecond * seconds(); ++changes) {
      ASSERT_EQ(::utimensat(AT_FDCWD, notification.c_str(), nullptr, 0), 0);
    }
    std::this_thread::sleep_for(100us);
  }
  const auto processor = processorTimeOf(service.process().pid()) - processorBefore;
  std::cout << changes / seconds() << " changes a second, "
            << processor.count() / seconds() << " of a processor\n";
  ASSERT_TRUE(serves());
  EXPECT_GE(readings(), 3u);
  EXPECT_LE(static_cast<double>(readings()), 10 * seconds() + 3);
  EXPECT_EQ(service.terminate(), 0);
}

}  // namespace
}  // namespace ostrel
