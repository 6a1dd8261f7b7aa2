#include "platform/linux/wire/PayloadDecoder.h"

#include <gtest/gtest.h>

#include <chrono>
#include <cmath>
#include <limits>

#include "platform/fake/CountingAccount.h"
#include "platform/linux/wire/WireTesting.h"

namespace ostrel::wire {
namespace {

std::string encoded(const auto& encode) {
  std::string bytes;
  ValueEncoder encoder(bytes);
  encode(encoder);
  return bytes;
}

std::string nestedArrays(std::size_t depth) {
  return std::string(depth, bytesOf({0x81})[0]) + bytesOf({0x00});
}

std::string repeated(std::string_view text, std::size_t count) {
  std::string all;
  for (std::size_t i = 0; i < count; ++i) all += text;
  return all;
}

std::optional<Dictionary> decode(std::string_view bytes) {
  const ExactBytes exact(bytes);
  return decodeWhole(exact.span(), kTestLimits).dictionary;
}

struct Rejected {
  const char* what;
  std::string bytes;
};

class PayloadCheckRejects : public testing::TestWithParam<Rejected> {};

TEST_P(PayloadCheckRejects, Item) {
  EXPECT_TRUE(check(GetParam().bytes).error.has_value()) << GetParam().what;
}

INSTANTIATE_TEST_SUITE_P(
    Table, PayloadCheckRejects,
    testing::Values(
        Rejected{"nothing", ""}, Rejected{"byte string", bytesOf({0x41, 0x00})},
        Rejected{"empty byte string", bytesOf({0x40})}, Rejected{"null", bytesOf({0xF6})},
        Rejected{"undefined", bytesOf({0xF7})}, Rejected{"simple 0", bytesOf({0xE0})},
        Rejected{"simple 255", bytesOf({0xF8, 0xFF})},
        Rejected{"simple 20 in two bytes", bytesOf({0xF8, 0x14})},
        Rejected{"break", bytesOf({0xFF})},
        Rejected{"indefinite text", bytesOf({0x7F, 0x61, 0x61, 0xFF})},
        Rejected{"indefinite array", bytesOf({0x9F, 0xFF})},
        Rejected{"indefinite map", bytesOf({0xBF, 0xFF})},
        Rejected{"reserved 28", bytesOf({0x1C})},
        Rejected{"reserved 29", bytesOf({0x1D})},
        Rejected{"reserved 30", bytesOf({0x1E})},
        Rejected{"tag 0", bytesOf({0xC0, 0x60})},
        Rejected{"tag 2", bytesOf({0xC2, 0x40})},
        Rejected{"tag 1 without content", bytesOf({0xC1})},
        Rejected{"date of text", bytesOf({0xC1, 0x60})},
        Rejected{"date of a boolean", bytesOf({0xC1, 0xF5})},
        Rejected{"date of a date", bytesOf({0xC1, 0xC1, 0x00})},
        Rejected{"date of infinity in 16 bits", bytesOf({0xC1, 0xF9, 0x7C, 0x00})},
        Rejected{"date of no number in 16 bits", bytesOf({0xC1, 0xF9, 0x7E, 0x00})},
        Rejected{"date of infinity in 32 bits",
                 bytesOf({0xC1, 0xFA, 0xFF, 0x80, 0x00, 0x00})},
        Rejected{"date of no number in 64 bits",
                 bytesOf({0xC1, 0xFB, 0x7F, 0xF8, 0, 0, 0, 0, 0, 0})},
        Rejected{"date below the lowest integer",
                 bytesOf({0xC1, 0x3B, 0x80, 0, 0, 0, 0, 0, 0, 0})},
        Rejected{"integer of -2^63 - 1", bytesOf({0x3B, 0x80, 0, 0, 0, 0, 0, 0, 0})},
        Rejected{"integer of -2^64",
                 bytesOf({0x3B, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF})},
        Rejected{"boolean key", bytesOf({0xA1, 0xF5, 0x00})},
        Rejected{"double key", bytesOf({0xA1, 0xF9, 0, 0, 0x00})},
        Rejected{"array key", bytesOf({0xA1, 0x80, 0x00})},
        Rejected{"date key", bytesOf({0xA1, 0xC1, 0x00, 0x00})},
        Rejected{"byte string key", bytesOf({0xA1, 0x40, 0x00})},
        Rejected{"key of -2^63 - 1", bytesOf({0xA1, 0x3B, 0x80, 0, 0, 0, 0, 0, 0, 0, 0})},
        Rejected{"key without a value", bytesOf({0xA1, 0x00})},
        Rejected{"array of 2^64 - 1",
                 bytesOf({0x9B, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF})},
        Rejected{"map of 2^64 - 1",
                 bytesOf({0xBB, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF})},
        Rejected{"map of 2^63 + 1",
                 bytesOf({0xBB, 0x80, 0, 0, 0, 0, 0, 0, 1, 0x00, 0x00})},
        Rejected{"text of 2^64 - 1",
                 bytesOf({0x7B, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF})},
        Rejected{"lone continuation", bytesOf({0x61, 0x80})},
        Rejected{"overlong of two", bytesOf({0x62, 0xC0, 0x80})},
        Rejected{"overlong of three", bytesOf({0x63, 0xE0, 0x9F, 0xBF})},
        Rejected{"overlong of four", bytesOf({0x64, 0xF0, 0x8F, 0xBF, 0xBF})},
        Rejected{"surrogate", bytesOf({0x63, 0xED, 0xA0, 0x80})},
        Rejected{"above U+10FFFF", bytesOf({0x64, 0xF4, 0x90, 0x80, 0x80})},
        Rejected{"text that ends within a character", bytesOf({0x62, 0xE2, 0x82})},
        Rejected{"bad key text", bytesOf({0xA1, 0x61, 0xFF, 0x00})},
        Rejected{"bad byte in the middle of a long text", bytesOf({0x78, 0x20}) +
                                                              "0123456789abcde\xFF"
                                                              "fghijklmnopqrst"}));

TEST(PayloadCheck, TakesEveryKindOfValue) {
  for (const std::string& item :
       {bytesOf({0x00}),
        bytesOf({0x17}),
        bytesOf({0x18, 0x18}),
        bytesOf({0x20}),
        bytesOf({0x1B, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}),
        bytesOf({0x3B, 0x7F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}),
        bytesOf({0xF4}),
        bytesOf({0xF5}),
        bytesOf({0xF9, 0x7E, 0x00}),
        bytesOf({0xFA, 0x7F, 0x80, 0x00, 0x00}),
        bytesOf({0xFB, 0x40, 0x09, 0x21, 0xFB, 0x54, 0x44, 0x2D, 0x18}),
        bytesOf({0xC1, 0x00}),
        bytesOf({0xC1, 0x20}),
        bytesOf({0xD8, 0x01, 0x00}),
        bytesOf({0xC1, 0xF9, 0x3C, 0x00}),
        bytesOf({0x60}),
        bytesOf({0x61, 0x00}),
        bytesOf({0x64, 0xF0, 0x9F, 0x98, 0x80}),
        bytesOf({0x63, 0xEF, 0xBF, 0xBF}),
        bytesOf({0x80}),
        bytesOf({0xA0}),
        bytesOf({0x82, 0x80, 0xA0}),
        bytesOf({0xA2, 0x60, 0x80, 0x20, 0xA0}),
        bytesOf({0x1B, 0, 0, 0, 0, 0, 0, 0, 1})}) {
    const Checked checked = check(item);
    EXPECT_EQ(checked.error.value_or(""), "") << testing::PrintToString(item);
    EXPECT_EQ(checked.size, item.size());
  }
}

TEST(PayloadCheck, StopsBehindTheFirstItem) {
  EXPECT_EQ(check(bytesOf({0x81, 0x01, 0xFF, 0xFF})).size, 2U);
}

TEST(PayloadCheck, RejectsEveryItemThatIsCutShort) {
  const std::string item = encoded([](ValueEncoder& to) {
    to.beginDictionary(5);
    to.string("text");
    to.string("A longer text of more than sixteen bytes, \u20AC");
    to.signedInteger(-70000);
    to.date({1234567.5});
    to.string("list");
    to.beginArray(2);
    to.floatingPoint(0.5);
    to.unsignedInteger(1ULL << 40);
    to.string("map");
    to.beginDictionary(1);
    to.string("x");
    to.boolean(true);
    to.string("last");
    to.unsignedInteger(300);
  });
  for (std::size_t size = 0; size < item.size(); ++size) {
    EXPECT_TRUE(check(item.substr(0, size)).error) << size;
  }
  EXPECT_FALSE(check(item).error);
}

TEST(PayloadCheck, TakesNestingUpToTheLimit) {
  const PayloadLimits limits{.nesting = 32, .nodes = 1000, .keyBytes = 16};
  EXPECT_FALSE(check(nestedArrays(31), limits).error);
  EXPECT_FALSE(check(nestedArrays(32), limits).error);
  EXPECT_TRUE(check(nestedArrays(33), limits).error);
}

TEST(PayloadCheck, CountsAnEmptyArrayAsNesting) {
  const PayloadLimits limits{.nesting = 2, .nodes = 1000, .keyBytes = 16};
  EXPECT_FALSE(check(bytesOf({0x81, 0x80}), limits).error);
  EXPECT_TRUE(check(bytesOf({0x81, 0x81, 0x80}), limits).error);
}

TEST(PayloadCheck, RejectsAHundredThousandLevels) {
  EXPECT_TRUE(check(nestedArrays(100000)).error);
  EXPECT_TRUE(check(repeated(bytesOf({0xA1, 0x00}), 100000)).error);
}

TEST(PayloadCheck, NeverGoesDeeperThanItsStack) {
  const PayloadLimits limits{.nesting = 1000, .nodes = 10000, .keyBytes = 16};
  EXPECT_FALSE(check(nestedArrays(kDeepestNesting), limits).error);
  EXPECT_TRUE(check(nestedArrays(kDeepestNesting + 1), limits).error);
}

TEST(PayloadCheck, TakesValuesUpToTheLimit) {
  const PayloadLimits limits{.nesting = 32, .nodes = 100, .keyBytes = 16};
  const auto arrayOf = [](std::size_t size) {
    return encoded([&](ValueEncoder& to) {
      to.beginArray(size);
      for (std::size_t i = 0; i < size; ++i) to.unsignedInteger(1);
    });
  };
  EXPECT_FALSE(check(arrayOf(98), limits).error);
  EXPECT_FALSE(check(arrayOf(99), limits).error);
  EXPECT_TRUE(check(arrayOf(100), limits).error);
}

TEST(PayloadCheck, CountsKeysAsValues) {
  const PayloadLimits limits{.nesting = 32, .nodes = 5, .keyBytes = 16};
  EXPECT_FALSE(check(bytesOf({0xA2, 0x00, 0x00, 0x01, 0x00}), limits).error);
  EXPECT_TRUE(check(bytesOf({0xA3, 0x00, 0x00, 0x01, 0x00, 0x02, 0x00}), limits).error);
}

TEST(PayloadCheck, TakesKeysUpToTheLimit) {
  const PayloadLimits limits{.nesting = 32, .nodes = 100, .keyBytes = 20};
  const auto withKeyOf = [](std::size_t size) {
    return encoded([&](ValueEncoder& to) {
      to.beginDictionary(1);
      to.string(std::string(size, 'k'));
      to.boolean(true);
    });
  };
  EXPECT_FALSE(check(withKeyOf(19), limits).error);
  EXPECT_FALSE(check(withKeyOf(20), limits).error);
  EXPECT_TRUE(check(withKeyOf(21), limits).error);
}

// A limit below the longest text that has its size in its first byte turns the quick way
// over plain entries off.
TEST(PayloadCheck, FindsTheSameOnItsQuickWayWhateverByteIsWrong) {
  const std::string item = encoded([](ValueEncoder& to) {
    to.beginDictionary(8);
    to.string("route");
    to.string("Speaker");
    to.string("a key of 20 bytes...");
    to.string("a text of 23 bytes.....");
    to.string("rate");
    to.signedInteger(48000);
    to.string("gain");
    to.floatingPoint(-0.5);
    to.string("");
    to.signedInteger(-4);
    to.string("isMuted");
    to.boolean(false);
    to.string("list");
    to.beginArray(3);
    to.string("aac");
    to.signedInteger(7'000'000'000);
    to.string("");
    to.string("last");
    to.string("8 bytes.");
  });
  const PayloadLimits general{.nesting = 32, .nodes = 100, .keyBytes = 22};
  const PayloadLimits quick{.nesting = 32, .nodes = 100, .keyBytes = 23};
  int rejected = 0;
  for (std::size_t at = 0; at < item.size(); ++at) {
    for (int byte = 0; byte < 256; ++byte) {
      std::string other = item;
      other[at] = static_cast<char>(byte);
      const Checked expected = check(other, general);
      if (expected.error == "a key is too long") continue;
      const Checked seen = check(other, quick);
      ASSERT_EQ(seen.error, expected.error) << at << " " << byte;
      rejected += expected.error.has_value();
      if (expected.error) continue;
      ASSERT_EQ(seen.size, expected.size) << at << " " << byte;
      ASSERT_EQ(seen.hasRepeatedKeys, expected.hasRepeatedKeys) << at << " " << byte;
    }
  }
  EXPECT_GT(rejected, 5000);
}

TEST(PayloadCheck, FindsARepeatedKeyOnItsQuickWay) {
  for (std::size_t first = 0; first < 10; ++first) {
    for (std::size_t second = first + 1; second < 10; ++second) {
      const std::string item = encoded([&](ValueEncoder& to) {
        to.beginDictionary(10);
        for (std::size_t i = 0; i < 10; ++i) {
          to.string("key number " + std::to_string(i == second ? first : i));
          to.signedInteger(1);
        }
      });
      EXPECT_TRUE(check(item).hasRepeatedKeys) << first << " " << second;
    }
  }
}

TEST(PayloadCheck, SaysWhenAKeyIsRepeated) {
  EXPECT_TRUE(check(bytesOf({0xA2, 0x61, 'a', 0x00, 0x61, 'a', 0x00})).hasRepeatedKeys);
  EXPECT_FALSE(check(bytesOf({0xA2, 0x61, 'a', 0x00, 0x61, 'b', 0x00})).hasRepeatedKeys);
}

TEST(PayloadCheck, KnowsAKeyInAnotherEncoding) {
  EXPECT_TRUE(check(bytesOf({0xA2, 0x01, 0x00, 0x18, 0x01, 0x00})).hasRepeatedKeys);
  EXPECT_TRUE(
      check(bytesOf({0xA2, 0x61, 'a', 0x00, 0x78, 0x01, 'a', 0x00})).hasRepeatedKeys);
}

TEST(PayloadCheck, TellsKeysOfDifferentKindsApart) {
  EXPECT_FALSE(
      check(bytesOf({0xA3, 0x00, 0x00, 0x20, 0x00, 0x60, 0x00})).hasRepeatedKeys);
}

TEST(PayloadCheck, AllowsTheSameKeyInTwoDictionaries) {
  EXPECT_FALSE(
      check(bytesOf({0x82, 0xA1, 0x00, 0x00, 0xA1, 0x00, 0x00})).hasRepeatedKeys);
  EXPECT_FALSE(check(bytesOf({0xA1, 0x00, 0xA1, 0x00, 0x00})).hasRepeatedKeys);
}

TEST(PayloadCheck, FindsARepeatedKeyBehindANestedDictionary) {
  EXPECT_TRUE(check(bytesOf({0xA3, 0x00, 0xA1, 0x05, 0x00, 0x01, 0x00, 0x00, 0x00}))
                  .hasRepeatedKeys);
}

// Each pair of places of the repeated key, around the size at which the way of
// looking changes.
TEST(PayloadCheck, FindsARepeatedKeyWhereverItStands) {
  for (const std::size_t size : {2U, 15U, 16U, 17U, 18U, 40U}) {
    for (std::size_t first = 0; first < size; ++first) {
      for (std::size_t second = first + 1; second < size; ++second) {
        const std::string map = encoded([&](ValueEncoder& to) {
          to.beginDictionary(size);
          for (std::size_t i = 0; i < size; ++i) {
            to.string("key" + std::to_string(i == second ? first : i));
            to.unsignedInteger(i);
          }
        });
        ASSERT_TRUE(check(map).hasRepeatedKeys)
            << size << " entries, " << first << " and " << second;
      }
    }
  }
}

TEST(PayloadCheck, FindsNoRepeatedKeyAmongDistinctOnes) {
  for (std::size_t size = 0; size < 300; ++size) {
    const std::string map = encoded([&](ValueEncoder& to) {
      to.beginDictionary(size);
      for (std::size_t i = 0; i < size; ++i) {
        // Equal beginnings, ends and lengths.
        const std::string middle = std::to_string(1000 + i);
        to.string("beginning" + middle + "the end is near");
        to.unsignedInteger(i);
      }
    });
    ASSERT_FALSE(check(map).error);
    ASSERT_FALSE(check(map).hasRepeatedKeys) << size;
  }
}

// Short keys at the very end of the bytes are read another way.
TEST(PayloadCheck, FindsARepeatedKeyAtTheEndOfTheBytes) {
  for (std::size_t size = 0; size <= 20; ++size) {
    const std::string map = encoded([&](ValueEncoder& to) {
      to.beginDictionary(2);
      for (int i = 0; i < 2; ++i) {
        to.string(std::string("abcdefghijklmnopqrstuvwxyz", size));
        to.boolean(false);
      }
    });
    EXPECT_TRUE(check(map).hasRepeatedKeys) << size;
  }
}

TEST(PayloadDecoder, KeepsTheLastOfRepeatedKeys) {
  const auto dictionary = decode(encoded([](ValueEncoder& to) {
    to.beginDictionary(4);
    to.string("a");
    to.unsignedInteger(1);
    to.string("b");
    to.unsignedInteger(2);
    to.string("a");
    to.unsignedInteger(3);
    to.string("a");
    to.unsignedInteger(4);
  }));
  ASSERT_TRUE(dictionary);
  EXPECT_EQ(*dictionary, (Dictionary{{"a", 4}, {"b", 2}}));
}

TEST(PayloadDecoder, KeepsTheLastOfRepeatedKeysAtEveryDepth) {
  const auto inner = [](ValueEncoder& to, int first, int second) {
    to.beginDictionary(2);
    to.unsignedInteger(7);
    to.unsignedInteger(first);
    to.unsignedInteger(7);
    to.unsignedInteger(second);
  };
  const auto dictionary = decode(encoded([&](ValueEncoder& to) {
    to.beginDictionary(3);
    to.string("x");
    inner(to, 1, 2);
    to.string("list");
    to.beginArray(2);
    inner(to, 3, 4);
    to.beginDictionary(0);
    to.string("x");
    inner(to, 5, 6);
  }));
  ASSERT_TRUE(dictionary);
  EXPECT_EQ(description(*dictionary), "{list: [{7: 4}, {}], x: {7: 6}}");
}

TEST(PayloadDecoder, KeepsEverythingElseWhenItDropsAnEntry) {
  const auto dictionary = decode(encoded([](ValueEncoder& to) {
    to.beginDictionary(30);
    for (int i = 0; i < 28; ++i) {
      to.signedInteger(-i);
      to.string(std::string(static_cast<std::size_t>(i), 'v'));
    }
    to.string("gone");
    to.beginDictionary(1);
    to.string("gone");
    to.date({3.5});
    to.string("gone");
    to.date({4.5});
  }));
  ASSERT_TRUE(dictionary);
  EXPECT_EQ(dictionary->size(), 29U);
  EXPECT_EQ(dictionary->find("gone")->date(), Date{4.5});
  EXPECT_EQ(dictionary->view().find(Value(-27).view())->string(), std::string(27, 'v'));
}

TEST(PayloadDecoder, TakesADictionaryAsItStands) {
  const std::string bytes = bytesOf({0xA1, 0x18, 0x05, 0xF9, 0x3C, 0x00});
  const auto dictionary = decode(bytes);
  ASSERT_TRUE(dictionary);
  EXPECT_EQ(description(*dictionary), "{5: 1}");
  EXPECT_EQ(dictionary->value().bytes().size(), bytes.size());
}

TEST(PayloadDecoder, RejectsWhatIsNoDictionary) {
  EXPECT_FALSE(decode(bytesOf({0x80})));
  EXPECT_FALSE(decode(""));
}

TEST(PayloadDecoder, LeavesBytesBehindTheDictionary) {
  const std::string bytes = bytesOf({0xA1, 0x01, 0x02, 0xFF});
  const DecodedDictionary decoded =
      decodeDictionary(spanOf(bytes), kTestLimits, /*owner=*/{});
  ASSERT_TRUE(decoded.dictionary);
  EXPECT_EQ(decoded.size, 3U);
}

TEST(PayloadDecoder, CopiesADictionaryWithoutAnOwner) {
  std::optional<Dictionary> kept;
  {
    const ExactBytes bytes(bytesOf({0xA1, 0x01, 0x02}));
    kept = decodeDictionary(bytes.span(), kTestLimits, /*owner=*/{}).dictionary;
  }
  EXPECT_EQ(description(kept->value()), "{1: 2}");
}

TEST(PayloadDecoder, ChargesNothingForWhatItRejects) {
  const auto account = std::make_shared<CountingAccount>();
  const std::string bytes = bytesOf({0xA2, 0x01, 0x02, 0x01, 0xF6});
  const ValueBuffer owner = ValueBuffer::copyOfInput(spanOf(bytes), account);
  const auto decoded = decodeDictionary({owner.data(), bytes.size()}, kTestLimits, owner);
  EXPECT_FALSE(decoded.dictionary);
  EXPECT_EQ(account.use_count(), 2) << "the test's and the owner's";
  EXPECT_EQ(account->bytes(), 0U);
}

TEST(PayloadDecoder, LeavesADictionaryWhereItLies) {
  const std::string bytes = bytesOf({0x17, 0xA1, 0x01, 0x02});
  const ValueBuffer owner = ValueBuffer::copyOf(spanOf(bytes));
  const auto decoded =
      decodeDictionary({owner.data() + 1, owner.size() - 1}, kTestLimits, owner);
  ASSERT_TRUE(decoded.dictionary);
  EXPECT_EQ(decoded.dictionary->value().data(), owner.data() + 1);
}

TEST(PayloadDecoder, KeepsTheMemoryOfADictionaryThatItLeft) {
  std::optional<Dictionary> kept;
  {
    const std::string bytes = bytesOf({0xA1, 0x01, 0x02});
    const ValueBuffer owner = ValueBuffer::copyOf(spanOf(bytes));
    kept = decodeDictionary({owner.data(), owner.size()}, kTestLimits, owner).dictionary;
  }
  EXPECT_EQ(description(kept->value()), "{1: 2}");
}

TEST(PayloadDecoder, CopiesADictionaryWithRepeatedKeysAndChargesTheOwnersAccount) {
  const auto account = std::make_shared<CountingAccount>();
  {
    const std::string bytes = bytesOf({0xA2, 0x01, 0x02, 0x01, 0x03});
    const ValueBuffer owner = ValueBuffer::copyOfInput(spanOf(bytes), account);
    const auto decoded =
        decodeDictionary({owner.data(), bytes.size()}, kTestLimits, owner);
    ASSERT_TRUE(decoded.dictionary);
    EXPECT_EQ(description(decoded.dictionary->value()), "{1: 3}");
    EXPECT_EQ(decoded.size, bytes.size());
    EXPECT_GT(account->bytes(), 0U);
  }
  EXPECT_EQ(account->bytes(), 0U);
}

TEST(PayloadText, TellsUTF8ByTheWholeTableOfTwoBytes) {
  for (int first = 0; first < 256; ++first) {
    for (int second = 0; second < 256; ++second) {
      const bool expected = (first < 0x80 && second < 0x80) ||
                            (first >= 0xC2 && first <= 0xDF && (second & 0xC0) == 0x80);
      ASSERT_EQ(isUTF8(spanOf(bytesOf({first, second}))), expected)
          << first << " " << second;
    }
  }
}

TEST(PayloadText, TakesTheLastCharacterOfEachLength) {
  for (const std::string text :
       {"\x7F", "\xDF\xBF", "\xED\x9F\xBF", "\xEE\x80\x80", "\xF4\x8F\xBF\xBF"}) {
    EXPECT_TRUE(isUTF8(spanOf(text)));
  }
}

}  // namespace
}  // namespace ostrel::wire
