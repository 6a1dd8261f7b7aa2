// The session log's two halves: text of values, and files of text.
#include <sys/stat.h>

#include <cmath>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "platform/fake/FakeFileSystem.h"
#include "platform/fake/FakeJSONSerialization.h"
#include "platform/linux/DirectoryFileSystem.h"
#include "platform/linux/JSONTextSerialization.h"
#include "platform/linux/TestSupport.h"

namespace ostrel {
namespace {

struct FilesInMemory {
  std::optional<std::string> text(const std::string& path) { return files.file(path); }
  std::optional<std::uint32_t> mode(const std::string& path) {
    const auto all = files.directories();
    const auto found = all.find(path);
    if (found == all.end()) return std::nullopt;
    return found->second;
  }
  std::size_t fileCount() { return files.files().size(); }

  FakeFileSystem files{std::make_shared<EventLog>()};
};

struct FilesOnDisk {
  std::optional<std::string> text(const std::string& path) {
    std::ifstream file(path, std::ios::binary);
    if (!file) return std::nullopt;
    return std::string(std::istreambuf_iterator<char>(file), {});
  }
  std::optional<std::uint32_t> mode(const std::string& path) {
    struct stat status {};
    if (lstat(path.c_str(), &status) != 0 || !S_ISDIR(status.st_mode)) {
      return std::nullopt;
    }
    return status.st_mode & 07777;
  }
  std::size_t fileCount() {
    std::size_t count = 0;
    for (const auto& entry :
         std::filesystem::recursive_directory_iterator(directory.path())) {
      count += entry.is_directory() ? 0 : 1;
    }
    return count;
  }

  testing_support::TemporaryDirectory directory;
  DirectoryFileSystem files{directory / "logs"};
};

TextSource textOf(std::vector<std::string> pieces) {
  return [pieces = std::move(pieces)](const TextWriter& write) {
    for (const std::string& piece : pieces) write(piece);
  };
}

template <typename Subject>
class FileSystemContract : public testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(subject_.files.createDirectory(reports_, 0777).succeeded);
  }

  Success write(const std::string& name, std::optional<TextSource> text) {
    return subject_.files.writeFileAtomically(reports_, name, text);
  }

  Subject subject_;
  const std::string root_ = subject_.files.diagnosticLogDirectory();
  const std::string reports_ = root_ + "/Audio/Reporting";
};
using FileSystems = testing::Types<FilesInMemory, FilesOnDisk>;
TYPED_TEST_SUITE(FileSystemContract, FileSystems);

TYPED_TEST(FileSystemContract, NamesItsRootWithoutASlashAtTheEnd) {
  EXPECT_TRUE(this->root_.starts_with('/'));
  EXPECT_FALSE(this->root_.ends_with('/'));
}

TYPED_TEST(FileSystemContract, MakesTheDirectoriesThatAreMissing) {
  EXPECT_EQ(this->subject_.mode(this->root_ + "/Audio"), 0777u);
  EXPECT_EQ(this->subject_.mode(this->reports_), 0777u);
}

TYPED_TEST(FileSystemContract, GivesADirectoryItsPermissionsWhateverTheUmask) {
  const mode_t before = umask(077);
  const Success made = this->subject_.files.createDirectory(this->root_ + "/open", 0777);
  umask(before);
  EXPECT_TRUE(made.succeeded);
  EXPECT_EQ(this->subject_.mode(this->root_ + "/open"), 0777u);
}

TYPED_TEST(FileSystemContract, LeavesADirectoryThatExistsAsItIs) {
  const Success again = this->subject_.files.createDirectory(this->reports_, 0700);
  EXPECT_TRUE(again.succeeded);
  EXPECT_FALSE(again.error);
  EXPECT_EQ(this->subject_.mode(this->reports_), 0777u);
}

TYPED_TEST(FileSystemContract, MakesNoDirectoryInPlaceOfAFile) {
  ASSERT_TRUE(this->write("file", textOf({"x"})).succeeded);
  const Success made =
      this->subject_.files.createDirectory(this->reports_ + "/file/below", 0777);
  EXPECT_FALSE(made.succeeded);
  EXPECT_TRUE(made.error);
  EXPECT_EQ(this->subject_.text(this->reports_ + "/file"), "x");
}

TYPED_TEST(FileSystemContract, MakesNoDirectoryOutsideItsRoot) {
  const Success made = this->subject_.files.createDirectory("/elsewhere-ostrel", 0777);
  EXPECT_FALSE(made.succeeded);
  EXPECT_FALSE(std::filesystem::exists("/elsewhere-ostrel"));
}

TYPED_TEST(FileSystemContract, WritesTextPieceByPiece) {
  const Success written = this->write("log.json", textOf({"[", "1, ", "", "2]"}));
  EXPECT_TRUE(written.succeeded);
  EXPECT_FALSE(written.error);
  EXPECT_EQ(this->subject_.text(this->reports_ + "/log.json"), "[1, 2]");
}

TYPED_TEST(FileSystemContract, WritesAnEmptyFile) {
  ASSERT_TRUE(this->write("empty", textOf({})).succeeded);
  EXPECT_EQ(this->subject_.text(this->reports_ + "/empty"), "");
}

TYPED_TEST(FileSystemContract, WritesMoreThanFitsABuffer) {
  const std::vector<std::string> pieces(5000, std::string(999, 'x'));
  ASSERT_TRUE(this->write("large", textOf(pieces)).succeeded);
  EXPECT_EQ(this->subject_.text(this->reports_ + "/large")->size(), 5000u * 999);
}

TYPED_TEST(FileSystemContract, ReplacesAFile) {
  ASSERT_TRUE(this->write("log", textOf({"a long old text"})).succeeded);
  ASSERT_TRUE(this->write("log", textOf({"new"})).succeeded);
  EXPECT_EQ(this->subject_.text(this->reports_ + "/log"), "new");
  EXPECT_EQ(this->subject_.fileCount(), 1u);
}

TYPED_TEST(FileSystemContract, FailsWithoutAText) {
  ASSERT_TRUE(this->write("log", textOf({"old"})).succeeded);
  const Success written = this->write("log", std::nullopt);
  EXPECT_FALSE(written.succeeded);
  EXPECT_EQ(this->subject_.text(this->reports_ + "/log"), "old");
}

TYPED_TEST(FileSystemContract, FailsForANameThatCannotExist) {
  for (const std::string& name :
       {std::string(), std::string("."), std::string(".."), std::string("a/b"),
        std::string("../up"), std::string("/absolute"), std::string("a\0b", 3)}) {
    const Success written = this->write(name, textOf({"x"}));
    EXPECT_FALSE(written.succeeded);
    EXPECT_TRUE(written.error);
  }
  EXPECT_EQ(this->subject_.fileCount(), 0u);
}

TYPED_TEST(FileSystemContract, TakesNamesOfUpTo255Bytes) {
  EXPECT_TRUE(this->write(std::string(254, 'n'), textOf({"x"})).succeeded);
  EXPECT_TRUE(this->write(std::string(255, 'n'), textOf({"x"})).succeeded);
  const Success tooLong = this->write(std::string(256, 'n'), textOf({"x"}));
  EXPECT_FALSE(tooLong.succeeded);
  EXPECT_TRUE(tooLong.error);
  EXPECT_EQ(this->subject_.fileCount(), 2u);
}

TYPED_TEST(FileSystemContract, FailsInADirectoryThatIsMissing) {
  const Success written = this->subject_.files.writeFileAtomically(
      this->root_ + "/missing", "log", textOf({"x"}));
  EXPECT_FALSE(written.succeeded);
  EXPECT_TRUE(written.error);
}

struct FakeJSON {
  FakeJSONSerialization json{std::make_shared<EventLog>()};
};
struct RealJSON {
  JSONTextSerialization json;
};

template <typename Subject>
class JSONSerializationContract : public testing::Test {
 protected:
  // The elements of a list, counting how often they are asked for.
  ElementSource elementsOf(std::vector<Value> values) {
    return [this, values = std::move(values)](const auto& take) {
      ++asked_;
      for (const Value& value : values) take(value.view());
    };
  }

  Outcome<TextSource> serialize(std::vector<Value> values) {
    return subject_.json.prettyPrintedArray(elementsOf(std::move(values)));
  }

  static std::string written(const TextSource& source) {
    std::string text;
    source([&text](std::string_view piece) { text += piece; });
    return text;
  }

  Subject subject_;
  int asked_ = 0;
};
using Serializations = testing::Types<FakeJSON, RealJSON>;
TYPED_TEST_SUITE(JSONSerializationContract, Serializations);

TYPED_TEST(JSONSerializationContract, WritesTheElementsInOrder) {
  const auto outcome = this->serialize({Value(Dictionary{{"first", Value("one")}}),
                                        Value(Dictionary{{"second", Value(2)}})});
  ASSERT_TRUE(outcome.value);
  EXPECT_FALSE(outcome.error);
  const std::string text = this->written(*outcome.value);
  EXPECT_TRUE(text.starts_with("["));
  EXPECT_LT(text.find("first"), text.find("one"));
  EXPECT_LT(text.find("one"), text.find("second"));
  EXPECT_LT(text.find("second"), text.find("2"));
  EXPECT_NE(text.find("]"), std::string::npos);
}

TYPED_TEST(JSONSerializationContract, WritesAnEmptyArray) {
  const auto outcome = this->serialize({});
  ASSERT_TRUE(outcome.value);
  const std::string text = this->written(*outcome.value);
  EXPECT_TRUE(text.starts_with("["));
  EXPECT_NE(text.find("]"), std::string::npos);
}

TYPED_TEST(JSONSerializationContract, WritesTheSameTextAsOftenAsItIsAsked) {
  const auto outcome = this->serialize({Value(Dictionary{{"a", Value(1.5)}})});
  ASSERT_TRUE(outcome.value);
  const int before = this->asked_;
  const std::string once = this->written(*outcome.value);
  EXPECT_EQ(this->written(*outcome.value), once);
  EXPECT_EQ(this->asked_, before + 2);
}

TYPED_TEST(JSONSerializationContract, WritesDatesAsText) {
  const auto outcome = this->serialize({Value(Dictionary{{"at", Value(Date{0.25})}})});
  ASSERT_TRUE(outcome.value);
  EXPECT_NE(this->written(*outcome.value).find("1970-01-01T00:00:00.250Z"),
            std::string::npos);
}

TYPED_TEST(JSONSerializationContract, FailsForANumberThatIsNotFinite) {
  for (const double number : {std::nan(""), HUGE_VAL, -HUGE_VAL}) {
    const Array list = ArrayBuilder().append(Value(1)).append(Value(number)).build();
    const auto outcome =
        this->serialize({Value("fine"), Value(Dictionary{{"deep", Value(list)}})});
    EXPECT_FALSE(outcome.value);
    ASSERT_TRUE(outcome.error);
    EXPECT_FALSE(outcome.error->description.empty());
  }
}

TYPED_TEST(JSONSerializationContract, FailsForAKeyThatIsNoString) {
  DictionaryBuilder builder;
  builder.set(Value(7).view(), Value("x").view());
  const auto outcome =
      this->serialize({Value(Dictionary{{"outer", Value(builder.build())}})});
  EXPECT_FALSE(outcome.value);
  ASSERT_TRUE(outcome.error);
}

}  // namespace
}  // namespace ostrel
