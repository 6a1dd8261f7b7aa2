// A session's end is the same wherever its list was: in the fake's memory, in the
// binding's, or in the binding's file.
#include <gtest/gtest.h>

#include <map>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "Statistics/OstrelReportingUtility.h"
#include "Statistics/Service/OstrelReportingSession.h"
#include "platform/fake/FakePlatform.h"
#include "platform/linux/FileEntryStorage.h"
#include "platform/linux/JSONTextSerialization.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

constexpr std::uint16_t kTelephony = 2;

// What can be seen of a session.
struct Record {
  std::vector<std::string> entries;
  std::vector<std::string> sent;
  std::vector<std::string> mirrored;
  std::map<std::string, std::string> files;

  friend bool operator==(const Record&, const Record&) = default;
};

std::vector<std::string> entriesOf(const AggregatedPayloadData& list) {
  std::vector<std::string> entries;
  EXPECT_TRUE(list.lock()->snapshot().forEach(
      [&](ValueView entry) { entries.push_back(description(entry)); }));
  return entries;
}

// A session of some messages and turns of the device, the same for the same seed, whose
// list lies in `storage`, or in the fake's where that is none. `listBytes` gets the
// list's.
Record runSession(unsigned seed, std::shared_ptr<EntryStorage> storage,
                  std::size_t* listBytes) {
  forgetIsInternalBuildForTesting();
  OstrelReportingPlatform platform;  // The fakes may hold the session to their end.
  FakePlatform fakes;
  fakes.deviceInfo->setAnswer("InternalBuild", Value(true));
  platform = fakes.platform();
  platform.json = std::make_shared<JSONTextSerialization>();
  if (storage) platform.entryStorage = std::move(storage);
  const auto session = OstrelReportingSession::initWithID(
      ReporterID{42}, /*processIdentifiers=*/{1}, platform);
  session->setServiceType(ServiceType{kTelephony});
  session->start();
  session->setConfiguration(Dictionary{{"HostApplicationDisplayID", "App"}});
  fakes.runUntilIdle();

  std::mt19937 random(seed);
  for (int i = 0; i < 300; ++i) {
    if (random() % 10 == 0) {
      fakes.clock->advance(std::chrono::milliseconds(random() % 5000));
      fakes.orientationService->turnDevice(
          static_cast<OrientationService::OrientationCode>(1 + random() % 4));
      continue;
    }
    DictionaryBuilder message;
    for (std::size_t keys = random() % 6; keys != 0; --keys) {
      message.set("key " + std::to_string(random() % 100),
                  Value(std::string(random() % (random() % 50 == 0 ? 5000 : 50), 'x')));
    }
    message.set("number", Value(random() % 1000 / 8.0));
    session->sendMessage(
        message.build(),
        MessageCategory{0x40000000 + static_cast<std::uint32_t>(random() % 9)},
        MessageType{static_cast<std::uint16_t>(random() % 4)},
        /*reply=*/nullptr);
    fakes.runUntilIdle();
  }

  Record record;
  const auto list = session->aggregatedPayloadData();
  record.entries = entriesOf(*list);
  *listBytes = 0;
  list->lock()->snapshot().forEach(
      [&](ValueView entry) { *listBytes += entry.bytes().size(); });
  const auto early = list->lock()->snapshot();
  session->stop();
  fakes.runUntilIdle();

  // The list that a late caller still holds: the user info stands first, the summary
  // last, and more can come.
  list->lock()->append("late", Dictionary{{"a", 1}});
  for (std::string& entry : entriesOf(*list)) record.entries.push_back(std::move(entry));
  EXPECT_TRUE(early.forEach(
      [&](ValueView entry) { record.entries.push_back(description(entry)); }));
  for (const auto& message : fakes.telemetryBackend->session(1)->messages()) {
    record.sent.push_back(description(message.payload));
  }
  for (std::size_t i = 0; i < fakes.analyticsSink->names().size(); ++i) {
    record.mirrored.push_back(description(fakes.analyticsSink->payload(i)));
  }
  record.files = fakes.fileSystem->files();
  EXPECT_EQ(record.files.size(), 1u);
  return record;
}

TEST(SpilledList, MakesNoDifferenceToTheSessionsRecord) {
  const testing_support::TemporaryDirectory directory;

  for (unsigned seed = 0; seed < 6; ++seed) {
    std::size_t bytes = 0;
    const Record expected = runSession(seed, /*storage=*/nullptr, &bytes);
    ASSERT_GT(bytes, 10'000u);
    for (const std::size_t share : {std::size_t{0}, std::size_t{3000}, bytes / 2,
                                    bytes - 1, bytes, bytes + 1, 4 * bytes}) {
      const auto storage = std::make_shared<FileEntryStorage>(
          directory.path(),
          FileEntryStorage::Limits{share, 4 * bytes, std::chrono::milliseconds(0)},
          SpillCalls::system());
      std::size_t again = 0;
      const Record record = runSession(seed, storage, &again);
      ASSERT_EQ(again, bytes);
      ASSERT_EQ(record.entries, expected.entries) << "share " << share;
      ASSERT_TRUE(record == expected) << "share " << share;
      EXPECT_EQ(storage->refusedEntries(), 0u);
      EXPECT_FALSE(storage->hasFile());
      EXPECT_EQ(storage->bytesInMemory(), 0u);
    }
  }
}

}  // namespace
}  // namespace ostrel
