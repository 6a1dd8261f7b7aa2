// What sessions collect until they stop.
#include <thread>

#include "platform/Bytes.h"
#include "platform/KeptBytes.h"
#include "platform/fake/CountingAccount.h"
#include "platform/fake/FakeEntryStorage.h"
#include "platform/linux/FileEntryStorage.h"
#include "platform/linux/StoredEntriesTesting.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

constexpr ReporterID kSession{42};

struct EntriesInMemory {
  FakeEntryStorage storage;
};

struct EntriesOfService {
  testing_support::TemporaryDirectory directory;
  FileEntryStorage storage{directory.path()};
};

// So little memory that nearly everything is in the file.
struct EntriesInFile {
  testing_support::TemporaryDirectory directory;
  FileEntryStorage storage{directory.path(),
                           {.listBytesInMemory = 1,
                            .bytesInMemory = 1,
                            .pauseOfFile = std::chrono::milliseconds(0)},
                           SpillCalls::system()};
};

using testing_support::append;
using testing_support::bytesOf;

std::string entryOf(std::size_t number, std::size_t size) {
  std::string entry = std::to_string(number) + ':';
  while (entry.size() < size) entry += static_cast<char>('a' + entry.size() % 26);
  return entry;
}

template <typename Subject>
class EntryStorageContract : public testing::Test {
 protected:
  testing_support::CapturedLog log_;
  Subject subject_;
  EntryStorage& storage_ = subject_.storage;
};
using EntryStorages = testing::Types<EntriesInMemory, EntriesOfService, EntriesInFile>;
TYPED_TEST_SUITE(EntryStorageContract, EntryStorages);

TYPED_TEST(EntryStorageContract, BeginsEmpty) {
  const auto entries = this->storage_.makeEntries(kSession);
  EXPECT_EQ(bytesOf(*entries->snapshot()), "");
}

TYPED_TEST(EntryStorageContract, GivesTheEntriesBackInOrder) {
  const auto entries = this->storage_.makeEntries(kSession);
  EXPECT_TRUE(append(*entries, "one,"));
  const StoredEntries::Bytes parts[] = {asBytes("t"), asBytes(""), asBytes("wo,")};
  EXPECT_TRUE(entries->append(parts, nullptr));
  EXPECT_TRUE(append(*entries, "three"));
  const auto snapshot = entries->snapshot();
  EXPECT_EQ(bytesOf(*snapshot), "one,two,three");
  EXPECT_EQ(bytesOf(*snapshot), "one,two,three");
}

TYPED_TEST(EntryStorageContract, KeepsListsApart) {
  const auto first = this->storage_.makeEntries(kSession);
  const auto second = this->storage_.makeEntries(kSession);
  for (int i = 0; i < 2000; ++i) {
    append(*first, "a");
    append(*second, "b");
  }
  EXPECT_EQ(bytesOf(*first->snapshot()), std::string(2000, 'a'));
  EXPECT_EQ(bytesOf(*second->snapshot()), std::string(2000, 'b'));
}

TYPED_TEST(EntryStorageContract, HoldsEntriesOfEverySizeWhole) {
  const auto entries = this->storage_.makeEntries(kSession);
  std::vector<std::string> expected;
  for (const std::size_t size :
       {3u, 1023u, 1024u, 1025u, 131071u, 131072u, 131073u, 262143u, 262144u, 262145u,
        700000u, 5u, 300u, 200000u, 3u}) {
    expected.push_back(entryOf(expected.size(), size));
    ASSERT_TRUE(append(*entries, expected.back()));
  }

  std::size_t next = 0;
  entries->snapshot()->forEachRun([&](StoredEntries::Bytes run) {
    std::string_view left(reinterpret_cast<const char*>(run.data()), run.size());
    while (!left.empty()) {
      ASSERT_LT(next, expected.size());
      ASSERT_TRUE(left.starts_with(expected[next])) << next;
      left.remove_prefix(expected[next++].size());
    }
  });
  EXPECT_EQ(next, expected.size());
}

TYPED_TEST(EntryStorageContract, SnapshotDoesNotShowWhatComesLater) {
  const auto entries = this->storage_.makeEntries(kSession);
  append(*entries, "early");
  const auto snapshot = entries->snapshot();
  for (int i = 0; i < 1000; ++i) append(*entries, entryOf(i, 700));
  EXPECT_EQ(bytesOf(*snapshot), "early");
}

TYPED_TEST(EntryStorageContract, SnapshotOutlivesItsList) {
  auto entries = this->storage_.makeEntries(kSession);
  std::string expected;
  for (int i = 0; i < 1000; ++i) {
    expected += entryOf(i, 700);
    append(*entries, entryOf(i, 700));
  }
  const auto snapshot = entries->snapshot();
  entries.reset();
  EXPECT_EQ(bytesOf(*snapshot), expected);
}

TYPED_TEST(EntryStorageContract, SnapshotIsReadWhileEntriesAreAppended) {
  const auto entries = this->storage_.makeEntries(kSession);
  std::string expected;
  for (int i = 0; i < 500; ++i) {
    expected += entryOf(i, 700);
    append(*entries, entryOf(i, 700));
  }
  const auto snapshot = entries->snapshot();
  std::thread reader([&] {
    for (int i = 0; i < 5; ++i) EXPECT_EQ(bytesOf(*snapshot), expected);
  });
  for (int i = 0; i < 2000; ++i) append(*entries, entryOf(i, 700));
  reader.join();
}

TYPED_TEST(EntryStorageContract, TakesNoMoreThanTheAccountKeeps) {
  for (const std::size_t room : {299u, 300u, 301u}) {
    const auto account = std::make_shared<CountingAccount>(room);
    const auto entries = this->storage_.makeEntries(kSession);
    EXPECT_TRUE(append(*entries, std::string(200, 'a'), account));
    EXPECT_EQ(append(*entries, std::string(100, 'b'), account), room >= 300) << room;
    EXPECT_EQ(append(*entries, "c", account), room != 300) << room;
    EXPECT_TRUE(append(*entries, "nobody's"));
  }
}

TYPED_TEST(EntryStorageContract, GivesEachAccountItsBytesBackAtTheEndOfTheList) {
  const auto first = std::make_shared<CountingAccount>(/*mostKept=*/10000);
  const auto second = std::make_shared<CountingAccount>(/*mostKept=*/10000);
  auto entries = this->storage_.makeEntries(kSession);
  for (int i = 0; i < 10; ++i) {
    append(*entries, std::string(30, 'a'), first);
    append(*entries, std::string(50, 'b'), second);
  }
  EXPECT_EQ(first->kept(), KeptBytes::inUnits(300));
  EXPECT_EQ(second->kept(), KeptBytes::inUnits(500));
  entries.reset();
  EXPECT_EQ(first->kept(), 0u);
  EXPECT_EQ(second->kept(), 0u);
}

TYPED_TEST(EntryStorageContract, LogsTheFirstRefusalOfEachListAndCountsAll) {
  const auto account = std::make_shared<CountingAccount>(/*mostKept=*/0);
  for (int list = 0; list < 2; ++list) {
    const auto entries = this->storage_.makeEntries(kSession);
    for (int i = 0; i < 3; ++i) EXPECT_FALSE(append(*entries, "x", account));
    EXPECT_TRUE(append(*entries, "nobody's"));
    EXPECT_EQ(bytesOf(*entries->snapshot()), "nobody's");
  }
  const auto lines = this->log_.lines(LogLevel::kError);
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_NE(lines[0].find("42: "), std::string::npos) << lines[0];
  EXPECT_EQ(this->subject_.storage.refusedEntries(), 6u);
}

}  // namespace
}  // namespace ostrel
