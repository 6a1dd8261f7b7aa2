#include <gtest/gtest.h>

#include <random>
#include <string>
#include <vector>

#include "platform/Bytes.h"
#include "platform/Value.h"
#include "platform/fake/CountingAccount.h"

namespace ostrel {
namespace {

std::string encoded(const Dictionary& dictionary) {
  return std::string(asText(dictionary.value().bytes()));
}

Dictionary built(const Dictionary& start, std::string_view key, const Value& value) {
  return DictionaryBuilder(start).set(key, value).build();
}

TEST(DictionaryWith, AppendsAKeyThatIsNew) {
  const Dictionary start{{"a", 1}, {"b", 2}};
  EXPECT_EQ(description(start.with("c", "x")), "{a: 1, b: 2, c: x}");
  EXPECT_EQ(description(Dictionary().with("c", "x")), "{c: x}");
}

TEST(DictionaryWith, ReplacesInThePlaceOfTheEarlierEntry) {
  const Dictionary start{{"a", 1}, {"b", 2}, {"c", 3}};
  EXPECT_EQ(description(start.with("a", "x")), "{a: x, b: 2, c: 3}");
  EXPECT_EQ(description(start.with("b", "x")), "{a: 1, b: x, c: 3}");
  EXPECT_EQ(description(start.with("c", "x")), "{a: 1, b: 2, c: x}");
}

TEST(DictionaryWith, LeavesTheOriginalAsItWas) {
  const Dictionary start{{"a", 1}};
  start.with("a", 2);
  EXPECT_EQ(start, (Dictionary{{"a", 1}}));
}

TEST(DictionaryWith, TellsATextKeyFromAnIntegerKey) {
  const Value five(5);
  const Dictionary start =
      DictionaryBuilder().set(five.view(), Value("integer").view()).build();
  EXPECT_EQ(encoded(start.with("5", "text")), encoded(built(start, "5", "text")));
}

// As a builder writes them: what is asked for both ways is the same afterwards.
TEST(DictionaryWith, WritesKeysShortThatTheirSenderWroteAtLength) {
  const std::vector<std::uint8_t> bytes{0xA2, 0x78, 0x01, 'a', 0x01, 0x18, 0x05, 0x02};
  const ValueBuffer buffer = ValueBuffer::copyOf(bytes);
  const Dictionary start(buffer, buffer.data());
  for (const char* key : {"a", "b", "5"}) {
    const std::string result = encoded(start.with(key, 3));
    EXPECT_EQ(result, encoded(built(start, key, 3))) << key;
    EXPECT_EQ(result.find('\x78'), std::string::npos) << key;
    EXPECT_EQ(result.find('\x18'), std::string::npos) << key;
  }
}

TEST(DictionaryWith, IsOneBufferOfTheSameAccount) {
  const auto account = std::make_shared<CountingAccount>();
  const Dictionary start = chargedTo(account, {{"a", "text"}, {"b", 2}});
  const std::size_t before = account->timesCharged();

  const Dictionary result = start.with("c", Value(3));

  EXPECT_EQ(result.owner().account(), account);
  EXPECT_EQ(account->timesCharged(), before + 1);
}

// Writes dictionaries as other encoders may: with heads that are longer than they
// need to be, and keys of both kinds.
class Writer {
 public:
  explicit Writer(unsigned seed) : random_(seed) {}

  Dictionary dictionary() {
    bytes_.clear();
    const std::size_t size = random_() % 40;
    head(/*majorType=*/5, size);
    for (std::size_t i = 0; i < size; ++i) {
      if (random_() % 8 == 0) {
        head(static_cast<unsigned>(random_() % 2), 1000 * i + random_() % 1000);
      } else {
        text(nameOf(i));
      }
      item();
    }
    return Dictionary::copyOf(bytes_);
  }

  std::string key() { return random_() % 4 == 0 ? "elsewhere" : nameOf(random_() % 40); }

  Value value() {
    bytes_.clear();
    item();
    return Value(ValueView(reinterpret_cast<const std::uint8_t*>(bytes_.data())));
  }

 private:
  // Of 0 to some 300 bytes, each its own, the same for the same number.
  static std::string nameOf(std::size_t number) {
    if (number == 0) return "";
    const std::size_t lengths[] = {2, 22, 23, 24, 255, 256, 300};
    return std::to_string(number + 10) + std::string(lengths[number % 7] - 2, 'k');
  }

  void head(unsigned majorType, std::uint64_t argument) {
    std::string shortest;
    ValueEncoder encoder(shortest);
    encoder.beginArray(argument);
    const bool isLong = random_() % 16 == 0 && shortest.size() < 3;
    if (isLong) {
      bytes_ += static_cast<char>(majorType << 5 | 25);
      bytes_ += static_cast<char>(argument >> 8);
      bytes_ += static_cast<char>(argument);
      return;
    }
    shortest[0] = static_cast<char>((static_cast<unsigned char>(shortest[0]) & 0x1F) |
                                    majorType << 5);
    bytes_ += shortest;
  }

  void text(std::string_view text) {
    head(/*majorType=*/3, text.size());
    bytes_ += text;
  }

  void item() {
    switch (random_() % 4) {
      case 0:
        head(/*majorType=*/0, random_() % 70000);
        return;
      case 1:
        text(std::string(random_() % 30, 'v'));
        return;
      case 2:
        head(/*majorType=*/4, 2);
        text("x");
        head(/*majorType=*/1, random_() % 300);
        return;
      default:
        head(/*majorType=*/5, 1);
        text("key");
        text("inner");
        return;
    }
  }

  std::mt19937 random_;
  std::string bytes_;
};

TEST(DictionaryWith, IsByteForByteWhatABuilderMakes) {
  Writer writer(/*seed=*/11);
  for (int i = 0; i < 3000; ++i) {
    const Dictionary start = writer.dictionary();
    const std::string key = writer.key();
    const Value value = writer.value();
    ASSERT_EQ(encoded(start.with(key, value)), encoded(built(start, key, value))) << i;
  }
}

}  // namespace
}  // namespace ostrel
