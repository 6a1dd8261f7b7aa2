#include "platform/linux/ExtentList.h"

#include <gtest/gtest.h>
#include <malloc.h>

#include <cerrno>
#include <string>
#include <vector>

#include "platform/Bytes.h"
#include "platform/linux/SpillFaults.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

constexpr std::size_t kAtHand = ExtentList::kAtHand;

class ExtentListTest : public testing::Test {
 protected:
  // Pieces are written one by one, so that each write may fail.
  std::shared_ptr<SpillFile> makeFile(std::size_t bytesInMemory = 0) {
    return std::make_shared<SpillFile>(directory_.path(), std::chrono::milliseconds(0),
                                       bytesInMemory, faults_.calls());
  }

  static bool write(ExtentList& list, const std::string& text) {
    const auto bytes = asBytes(text);
    return list.write({&bytes, 1});
  }

  /// Writes the extents "begin,", ... "end - 1,".
  static std::string writeNumbers(ExtentList& list, std::size_t begin, std::size_t end) {
    std::string all;
    for (std::size_t i = begin; i < end; ++i) {
      const std::string text = std::to_string(i) + ",";
      EXPECT_TRUE(write(list, text));
      all += text;
    }
    return all;
  }

  static std::string textOf(const ExtentList::View& view) {
    std::string all;
    const auto error = view.forEach(
        [&](ExtentList::Bytes bytes) { all.append(bytes.begin(), bytes.end()); });
    EXPECT_FALSE(error);
    return all;
  }

  testing_support::SpillFaults faults_;
  testing_support::TemporaryDirectory directory_;
};

TEST_F(ExtentListTest, HasWhatWasWrittenInItsOrder) {
  for (const std::size_t count :
       {std::size_t{0}, std::size_t{1}, kAtHand - 1, kAtHand, kAtHand + 1, 2 * kAtHand,
        2 * kAtHand + 1, 40 * kAtHand + 3}) {
    const auto file = makeFile(SpillFile::kMostBytesInMemory);
    {
      ExtentList list(file);
      const std::string all = writeNumbers(list, 0, count);
      EXPECT_EQ(list.size(), count);
      EXPECT_EQ(textOf(list.view()), all) << count;
    }
    EXPECT_FALSE(file->isOpen()) << count;
  }
}

TEST_F(ExtentListTest, ShowsWhatItWasWhileItGrows) {
  const auto file = makeFile();
  ExtentList list(file);
  std::vector<ExtentList::View> views;
  std::vector<std::string> expected;
  std::string all;
  for (std::size_t i = 0; i < 3 * kAtHand; ++i) {
    views.push_back(list.view());
    expected.push_back(all);
    all += writeNumbers(list, i, i + 1);
  }
  for (std::size_t i = 0; i < views.size(); ++i) EXPECT_EQ(textOf(views[i]), expected[i]);
}

TEST_F(ExtentListTest, TakesTheSameMemoryHoweverLongItIs) {
  const auto file = makeFile(SpillFile::kMostBytesInMemory);
  ExtentList list(file);
  writeNumbers(list, 0, 100);
  const std::size_t before = ::mallinfo2().uordblks;
  writeNumbers(list, 100, 20'000);
  // As many extents are 320,000 bytes.
  EXPECT_LT(::mallinfo2().uordblks, before + 16'384);
}

TEST_F(ExtentListTest, LosesNothingThatWasTakenWhenAWriteFails) {
  const auto file = makeFile();
  ExtentList list(file);
  std::string all;
  for (std::size_t i = 0; i < 5 * kAtHand; ++i) {
    faults_.writeError = ENOSPC;
    EXPECT_FALSE(write(list, "lost"));
    faults_.writeError = 0;
    all += writeNumbers(list, i, i + 1);
  }
  EXPECT_EQ(list.size(), 5 * kAtHand);
  EXPECT_EQ(textOf(list.view()), all);
}

TEST_F(ExtentListTest, SaysWhatCannotBeRead) {
  const auto file = makeFile();
  ExtentList list(file);
  writeNumbers(list, 0, kAtHand + 1);
  faults_.readError = EIO;
  const auto error = list.view().forEach([](ExtentList::Bytes) { FAIL(); });
  ASSERT_TRUE(error);
  EXPECT_EQ(error->description, directory_.path() + ": Input/output error");
}

TEST_F(ExtentListTest, ReleasesItsOwnExtentsAndNoOthers) {
  const auto file = makeFile();
  ExtentList other(file);
  const std::string all = writeNumbers(other, 1000, 1000 + 3 * kAtHand);
  {
    ExtentList list(file);
    writeNumbers(list, 0, 3 * kAtHand + 1);
  }
  EXPECT_TRUE(file->isOpen());
  EXPECT_EQ(textOf(other.view()), all);
}

TEST_F(ExtentListTest, LeavesNoFileOpenForWhatItCannotFindAnyMore) {
  const auto file = makeFile();
  auto other = std::make_unique<ExtentList>(file);
  const std::string all = writeNumbers(*other, 0, 3);
  {
    ExtentList list(file);
    writeNumbers(list, 0, 3 * kAtHand + 1);
    faults_.readError = EIO;
  }
  faults_.readError = 0;
  EXPECT_TRUE(file->isOpen());
  EXPECT_EQ(textOf(other->view()), all);
  other.reset();
  EXPECT_FALSE(file->isOpen());
}

}  // namespace
}  // namespace ostrel
