#include "platform/linux/ChannelFile.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/stat.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <random>
#include <thread>

#include "platform/linux/AlsaChannels.h"
#include "platform/linux/ChannelFileFormat.h"
#include "platform/linux/FileDescriptor.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

using channels::Header;
using channels::Record;
using testing_support::TemporaryDirectory;
using Values = std::vector<ChannelValue>;

Header header(std::string_view group, std::string_view subgroup, std::uint32_t count) {
  Header made{};
  std::memcpy(made.magic, channels::kMagic, sizeof made.magic);
  made.version = channels::kVersion;
  made.capacity = count;
  made.count = count;
  group.copy(made.group, sizeof made.group);
  subgroup.copy(made.subgroup, sizeof made.subgroup);
  return made;
}

std::string bytesOf(const Header& header, const Values& values) {
  std::string bytes(reinterpret_cast<const char*>(&header), sizeof header);
  for (const ChannelValue& value : values) {
    Record record{};
    value.name.copy(record.name, sizeof record.name);
    record.value = value.value;
    bytes.append(reinterpret_cast<const char*>(&record), sizeof record);
  }
  return bytes;
}

class ChannelFileReading : public testing::Test {
 protected:
  Outcome<Values> read(const std::string& bytes) const {
    return readChannelFile(directory_.write("G.S", bytes));
  }
  std::int64_t errorOf(const std::string& bytes) const {
    const auto outcome = read(bytes);
    EXPECT_FALSE(outcome.value.has_value());
    return outcome.error ? outcome.error->code : 0;
  }
  std::int64_t errorOfFile() const {
    const auto outcome = readChannelFile(directory_ / "G.S");
    EXPECT_FALSE(outcome.value.has_value());
    return outcome.error ? outcome.error->code : 0;
  }

  const TemporaryDirectory directory_;
  const Values values_ = {{"frames", 5}, {"underruns", INT64_MIN}, {"ü", INT64_MAX}};
};

TEST_F(ChannelFileReading, GivesNamesAndValuesInOrder) {
  EXPECT_EQ(read(bytesOf(header("G", "S", 3), values_)).value, values_);
  EXPECT_EQ(read(bytesOf(header("G", "S", 0), {})).value, Values());
}

TEST_F(ChannelFileReading, LeavesRecordsThatAreNotInUseAlone) {
  Header made = header("G", "S", 3);
  made.count = 1;
  EXPECT_EQ(read(bytesOf(made, values_)).value, (Values{values_[0]}));
}

TEST_F(ChannelFileReading, RefusesEveryTruncation) {
  const std::string bytes = bytesOf(header("G", "S", 3), values_);
  for (std::size_t size = 0; size < bytes.size(); ++size) {
    EXPECT_EQ(errorOf(bytes.substr(0, size)), EBADMSG) << size;
  }
}

TEST_F(ChannelFileReading, RefusesAHeaderThatIsWrong) {
  const auto errorWith = [&](auto change) {
    Header made = header("G", "S", 3);
    change(made);
    return errorOf(bytesOf(made, values_));
  };
  EXPECT_EQ(errorWith([](Header& h) { h.magic[7] = '?'; }), EBADMSG);
  EXPECT_EQ(errorWith([](Header& h) { h.version = 2; }), EBADMSG);
  EXPECT_EQ(errorWith([](Header& h) { h.count = 4; }), EBADMSG);
  EXPECT_EQ(errorWith([](Header& h) { h.capacity = 4; }), EBADMSG);
  EXPECT_EQ(errorWith([](Header& h) { h.count = h.capacity = UINT32_MAX; }), EFBIG);
  EXPECT_EQ(errorWith([](Header& h) { h.group[0] = 'X'; }), EBADMSG);
  EXPECT_EQ(errorWith([](Header& h) { h.subgroup[0] = 0; }), EBADMSG);
  EXPECT_EQ(errorWith([](Header& h) { std::memset(h.group, 'G', sizeof h.group); }),
            EBADMSG);
}

TEST_F(ChannelFileReading, RefusesNamesThatAreNone) {
  EXPECT_EQ(errorOf(bytesOf(header("G", "S", 1), {{"\xff", 1}})), EBADMSG);
  EXPECT_EQ(errorOf(bytesOf(header("G", "S", 1), {{"", 1}})), EBADMSG);
  EXPECT_EQ(errorOf(bytesOf(header("G", "S", 1), {{std::string(56, 'x'), 1}})), EBADMSG);
  EXPECT_EQ(read(bytesOf(header("G", "S", 1), {{std::string(55, 'x'), 1}})).error,
            std::nullopt);
}

TEST_F(ChannelFileReading, ReadsUpToTheMostCounters) {
  const auto counters = [](std::uint32_t count) {
    return bytesOf(header("G", "S", count), Values(count, {"x", 1}));
  };
  EXPECT_EQ(read(counters(channels::kMostCounters - 1)).value->size(),
            channels::kMostCounters - 1);
  EXPECT_EQ(read(counters(channels::kMostCounters)).value->size(),
            channels::kMostCounters);
  EXPECT_EQ(errorOf(counters(channels::kMostCounters + 1)), EFBIG);
}

TEST_F(ChannelFileReading, ReadsTheStartOfAHugeFileOnly) {
  read(bytesOf(header("G", "S", 3), values_));
  std::filesystem::resize_file(directory_ / "G.S", 1ull << 40);
  EXPECT_EQ(readChannelFile(directory_ / "G.S").value, values_);
}

TEST_F(ChannelFileReading, RefusesWhatIsNoFile) {
  const std::string path = directory_ / "G.S";
  EXPECT_EQ(errorOfFile(), ENOENT);
  ASSERT_EQ(::mkfifo(path.c_str(), 0600), 0);
  EXPECT_EQ(errorOfFile(), EINVAL);
  std::filesystem::remove(path);
  std::filesystem::create_directory(path);
  EXPECT_EQ(errorOfFile(), EINVAL);
  std::filesystem::remove(path);
  const std::string target =
      directory_.write("target", bytesOf(header("G", "S", 3), values_));
  std::filesystem::create_symlink(target, path);
  EXPECT_EQ(errorOfFile(), ELOOP);
}

TEST_F(ChannelFileReading, SurvivesRandomBytes) {
  std::mt19937_64 random(20260131);
  const std::string bytes = bytesOf(header("G", "S", 3), values_);
  for (int i = 0; i < 5000; ++i) {
    std::string changed = bytes;
    for (std::uint64_t n = random() % 4; n != UINT64_MAX; --n) {
      changed[random() % changed.size()] = static_cast<char>(random());
    }
    changed.resize(random() % (changed.size() + 64));
    const auto outcome = read(changed);
    EXPECT_NE(outcome.value.has_value(), outcome.error.has_value());
  }
}

TEST_F(ChannelFileReading, SurvivesAFileThatIsCutShortMeanwhile) {
  const std::string bytes =
      bytesOf(header("G", "S", 4096), Values(4096, ChannelValue{"x", 1}));
  const std::string path = directory_.write("G.S", bytes);
  std::atomic<bool> isDone = false;
  std::thread vandal([&] {
    const FileDescriptor file(::open(path.c_str(), O_RDWR | O_CLOEXEC));
    while (!isDone) {
      if (::ftruncate(file.get(), 100) != 0) break;
      if (::pwrite(file.get(), bytes.data(), bytes.size(), 0) < 0) break;
    }
  });
  int values = 0;
  int errors = 0;
  for (int i = 0; i < 2000; ++i) {
    const auto outcome = readChannelFile(path);
    if (outcome.value) ++values;
    if (outcome.error) ++errors;
  }
  isDone = true;
  vandal.join();
  EXPECT_EQ(values + errors, 2000);
}

TEST_F(ChannelFileReading, SeesWholeValuesWhileTheyChange) {
  constexpr std::uint32_t kCounters = 256;
  const std::string path = directory_.write(
      "G.S", bytesOf(header("G", "S", kCounters), Values(kCounters, {"x", 0})));
  const FileDescriptor file(::open(path.c_str(), O_RDWR | O_CLOEXEC));
  void* at = ::mmap(nullptr, channels::fileBytes(kCounters), PROT_READ | PROT_WRITE,
                    MAP_SHARED, file.get(), 0);
  ASSERT_NE(at, MAP_FAILED);
  std::atomic<bool> isDone = false;
  std::thread writer([&] {
    auto* records = reinterpret_cast<Record*>(static_cast<char*>(at) + sizeof(Header));
    for (std::int64_t value = 0; !isDone; value = ~value) {
      for (std::uint32_t i = 0; i < kCounters; ++i) {
        std::atomic_ref(records[i].value).store(value, std::memory_order_relaxed);
      }
    }
  });
  int torn = 0;
  for (int i = 0; i < 5000; ++i) {
    const auto outcome = readChannelFile(path);
    ASSERT_TRUE(outcome.value.has_value());
    for (const ChannelValue& value : *outcome.value) {
      if (value.value != 0 && value.value != -1) ++torn;
    }
  }
  isDone = true;
  writer.join();
  ::munmap(at, channels::fileBytes(kCounters));
  EXPECT_EQ(torn, 0);
}

class ChannelFileFinding : public testing::Test {
 protected:
  void add(const std::string& group, const std::string& subgroup) const {
    directory_.write(channels::fileName(group, subgroup),
                     bytesOf(header(group, subgroup, 1), {{"x", 1}}));
  }
  std::vector<std::string> found(const std::optional<std::string>& group,
                                 const std::optional<std::string>& subgroup) const {
    std::vector<std::string> names;
    for (const auto& source : finder_.find(group, subgroup).sources) {
      names.push_back(source->identifier().substr(directory_.path().size() + 1));
    }
    return names;
  }

  const TemporaryDirectory directory_;
  const ChannelFileFinder finder_{directory_.path()};
};

TEST_F(ChannelFileFinding, MatchesGroupAndSubgroup) {
  add("Speaker", "Stats");
  add("Speaker", "QDL");
  add("Haptics", "Stats");
  add("", "QDL");
  using Names = std::vector<std::string>;
  EXPECT_EQ(found("Speaker", "Stats"), (Names{"Speaker.Stats"}));
  EXPECT_EQ(found("Speaker", std::nullopt), (Names{"Speaker.QDL", "Speaker.Stats"}));
  EXPECT_EQ(found(std::nullopt, "QDL"), (Names{"%.QDL", "Speaker.QDL"}));
  EXPECT_EQ(found(std::nullopt, std::nullopt).size(), 4u);
  EXPECT_EQ(found("", std::nullopt), (Names{"%.QDL"}));
  EXPECT_EQ(found("Other", std::nullopt), Names());
}

TEST_F(ChannelFileFinding, FindsNamesOfAnyBytes) {
  add("a b/ü.", "%");
  EXPECT_EQ(found("a b/ü.", "%").size(), 1u);
}

TEST_F(ChannelFileFinding, PassesOverOtherFiles) {
  add("Speaker", "Stats");
  directory_.write("README", "");
  directory_.write("new-a1b2c3", "");
  directory_.write("a.b.c", "");
  directory_.write("a.%2f", "");
  directory_.write("a.%41", "");
  directory_.write("a.%4", "");
  directory_.write("a.", "");
  const auto all = finder_.find(std::nullopt, std::nullopt);
  EXPECT_EQ(all.sources.size(), 1u);
  EXPECT_EQ(all.error, std::nullopt);
}

TEST_F(ChannelFileFinding, LooksAtTheMostFilesAndNoMore) {
  // The directory itself and the one above it are entries too.
  std::size_t made = 2;
  for (; made < ChannelFileFinder::kMostFiles - 1; ++made) {
    directory_.write("other-" + std::to_string(made), "");
  }
  EXPECT_EQ(finder_.find(std::nullopt, std::nullopt).error, std::nullopt);
  directory_.write("other-last", "");
  EXPECT_EQ(finder_.find(std::nullopt, std::nullopt).error, std::nullopt);
  directory_.write("other-too-many", "");
  const auto found = finder_.find(std::nullopt, std::nullopt);
  ASSERT_TRUE(found.error);
  EXPECT_EQ(found.error->code, EFBIG);
}

TEST_F(ChannelFileFinding, GivesAnErrorForAFileThatCannotBeRead) {
  add("Speaker", "Stats");
  directory_.write("Speaker.Bad", "junk");
  const auto speaker = finder_.find("Speaker", std::nullopt);
  EXPECT_EQ(speaker.sources.size(), 1u);
  ASSERT_TRUE(speaker.error.has_value());
  EXPECT_EQ(speaker.error->code, EBADMSG);
  EXPECT_EQ(finder_.find("Speaker", "Stats").error, std::nullopt);
}

TEST_F(ChannelFileFinding, FindsNothingWithoutADirectory) {
  const auto found =
      ChannelFileFinder(directory_ / "missing").find(std::nullopt, std::nullopt);
  EXPECT_TRUE(found.sources.empty());
  EXPECT_EQ(found.error, std::nullopt);
}

TEST_F(ChannelFileFinding, GivesAnErrorWhereThereIsNoDirectory) {
  const auto found =
      ChannelFileFinder(directory_.write("file", "")).find(std::nullopt, std::nullopt);
  EXPECT_EQ(found.error->code, ENOTDIR);
}

class AlsaChannels : public testing::Test {
 protected:
  void add(const std::string& stream, std::string_view status) const {
    std::filesystem::create_directories(root_ / stream);
    root_.write(stream + "/status", status);
  }
  Outcome<Values> read() const {
    const auto found = finder_.find("Speaker", std::nullopt);
    if (found.sources.size() != 1) return {};
    return found.sources.front()->read();
  }

  const TemporaryDirectory root_;
  const AlsaChannelFinder finder_{root_.path()};
};

TEST_F(AlsaChannels, CountFramesOfStreams) {
  add("card0/pcm0p/sub0",
      "state: RUNNING\nowner_pid   : 812\ntrigger_time: 5.123\ntstamp      : 0.0\n"
      "delay       : 1024\navail       : 3072\navail_max   : 4096\n-----\n"
      "hw_ptr      : 123456\nappl_ptr    : 124480\n");
  add("card1/pcm3p/sub1", "closed\n");
  std::filesystem::create_directory_symlink(root_ / "card0", root_ / "cardLink");
  EXPECT_EQ(read().value, (Values{{"card0_pcm0p_sub0_hw_ptr", 123456},
                                  {"card0_pcm0p_sub0_appl_ptr", 124480},
                                  {"card1_pcm3p_sub1_hw_ptr", 0},
                                  {"card1_pcm3p_sub1_appl_ptr", 0}}));
}

TEST_F(AlsaChannels, BelongToTheSpeaker) {
  add("card0/pcm0p/sub0", "closed\n");
  EXPECT_EQ(finder_.find("Speaker", "ALSA").sources.size(), 1u);
  EXPECT_EQ(finder_.find(std::nullopt, std::nullopt).sources.size(), 1u);
  EXPECT_EQ(finder_.find("Haptics", std::nullopt).sources.size(), 0u);
  EXPECT_EQ(finder_.find(std::nullopt, "QDL").sources.size(), 0u);
}

TEST_F(AlsaChannels, AreNoneWithoutACard) {
  EXPECT_TRUE(finder_.find("Speaker", std::nullopt).sources.empty());
  EXPECT_TRUE(
      AlsaChannelFinder(root_ / "missing").find("Speaker", std::nullopt).sources.empty());
}

TEST_F(AlsaChannels, GiveAnErrorWhenAStreamGoesAway) {
  add("card0/pcm0p/sub0", "closed\n");
  const auto found = finder_.find("Speaker", std::nullopt);
  std::filesystem::remove_all(root_ / "card0");
  EXPECT_EQ(found.sources.front()->read().error->code, ENOENT);
}

TEST_F(AlsaChannels, SurviveAnyStatus) {
  add("card0/pcm0p/sub0",
      "hw_ptr\nhw_ptr:\nhw_pointer : 1\nappl_ptr : 99999999999999999999");
  EXPECT_EQ(read().value,
            (Values{{"card0_pcm0p_sub0_hw_ptr", 0}, {"card0_pcm0p_sub0_appl_ptr", 0}}));
  add("card0/pcm0p/sub0", std::string(AlsaChannelFinder::kMostStatusBytes + 1, 'x'));
  EXPECT_EQ(read().error->code, EFBIG);
}

}  // namespace
}  // namespace ostrel
