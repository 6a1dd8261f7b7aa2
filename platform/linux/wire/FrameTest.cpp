#include "platform/linux/wire/Frame.h"

#include <gtest/gtest.h>

#include <cstring>
#include <limits>

#include "platform/linux/wire/OperationTable.h"
#include "platform/linux/wire/WireTesting.h"

namespace ostrel::wire {
namespace {

constexpr std::size_t kMostIDs = 4;

std::span<const std::uint8_t> itemOf(const std::string& frame) {
  EXPECT_GE(frame.size(), kFrameHeaderSize);
  const auto bytes = spanOf(frame);
  EXPECT_EQ(frameLength(bytes.data()), frame.size() - kFrameHeaderSize);
  return bytes.subspan(kFrameHeaderSize);
}

Request sampleRequest(Operation operation) {
  Request request;
  request.operation = operation;
  request.number = 70000;
  for (const Argument argument : rowOf(operation).arguments) {
    switch (argument) {
      case Argument::kReporterID:
        request.reporterID = ReporterID{-5};
        break;
      case Argument::kServiceType:
        request.serviceType = ServiceType{0xFFFF};
        break;
      case Argument::kCategory:
        request.category = MessageCategory{0xFFFFFFFF};
        break;
      case Argument::kType:
        request.type = MessageType{0xFFFF};
        break;
      case Argument::kMessage:
      case Argument::kOptionalConfiguration:
        request.dictionary = Dictionary{{"key", 1.5}};
        break;
      case Argument::kOptionalReporterIDs:
        request.reporterIDs =
            ReporterIDs{ReporterID{std::numeric_limits<std::int64_t>::min()},
                        ReporterID{std::numeric_limits<std::int64_t>::max()}};
        break;
    }
  }
  return request;
}

DecodeError decode(const std::string& item, Request& request,
                   std::size_t mostIDs = kMostIDs) {
  const ExactBytes exact(item);
  return decodeRequest(exact.span(), kTestLimits, mostIDs, /*owner=*/{}, request);
}

DecodeError decodeErrorOf(const std::string& item, std::size_t mostIDs = kMostIDs) {
  Request request;
  return decode(item, request, mostIDs);
}

void expectEqual(const Request& a, const Request& b) {
  EXPECT_EQ(a.operation, b.operation);
  EXPECT_EQ(a.number, b.number);
  EXPECT_EQ(a.reporterID, b.reporterID);
  EXPECT_EQ(a.serviceType, b.serviceType);
  EXPECT_EQ(a.category, b.category);
  EXPECT_EQ(a.type, b.type);
  EXPECT_EQ(a.dictionary, b.dictionary);
  EXPECT_EQ(a.reporterIDs, b.reporterIDs);
}

std::string itemFrom(const auto& encode) {
  std::string bytes;
  ValueEncoder encoder(bytes);
  encode(encoder);
  return bytes;
}

TEST(RequestFrame, ComesBackAsItWasForEveryOperation) {
  for (std::size_t i = 1; i < kOperationTable.size(); ++i) {
    const Request sent = sampleRequest(static_cast<Operation>(i));
    std::string frame;
    appendRequest(frame, sent);
    const auto item = itemOf(frame);
    Request received;
    const DecodeError error =
        decodeRequest(item, kTestLimits, kMostIDs, /*owner=*/{}, received);
    EXPECT_EQ(error.value_or(""), "") << kOperationTable[i].name;
    expectEqual(sent, received);
  }
}

TEST(RequestFrame, RowsStandInTheOrderOfTheirNumbers) {
  for (std::size_t i = 0; i < kOperationTable.size(); ++i) {
    EXPECT_EQ(static_cast<std::size_t>(kOperationTable[i].operation), i);
  }
}

TEST(RequestFrame, TellsAnAbsentListFromAnEmptyOne) {
  for (const bool isPresent : {true, false}) {
    Request sent = sampleRequest(Operation::kSendMessage);
    sent.reporterIDs.reset();
    if (isPresent) sent.reporterIDs.emplace();
    std::string frame;
    appendRequest(frame, sent);
    Request received;
    EXPECT_FALSE(decodeRequest(itemOf(frame), kTestLimits, kMostIDs,
                               /*owner=*/{}, received));
    EXPECT_EQ(received.reporterIDs.has_value(), isPresent);
  }
}

TEST(RequestFrame, CarriesNoConfigurationAsNull) {
  Request sent = sampleRequest(Operation::kSetConfiguration);
  sent.dictionary.reset();
  std::string frame;
  appendRequest(frame, sent);
  Request received;
  EXPECT_FALSE(
      decodeRequest(itemOf(frame), kTestLimits, kMostIDs, /*owner=*/{}, received));
  EXPECT_FALSE(received.dictionary);
}

TEST(RequestFrame, TakesAFarewell) {
  std::string frame;
  appendFarewell(frame);
  Request request;
  EXPECT_FALSE(
      decodeRequest(itemOf(frame), kTestLimits, kMostIDs, /*owner=*/{}, request));
  EXPECT_EQ(request.operation, Operation::kFarewell);
}

TEST(RequestFrame, RejectsEveryRequestThatIsCutShort) {
  for (std::size_t i = 1; i < kOperationTable.size(); ++i) {
    std::string frame;
    appendRequest(frame, sampleRequest(static_cast<Operation>(i)));
    const std::string item = frame.substr(kFrameHeaderSize);
    for (std::size_t size = 0; size < item.size(); ++size) {
      EXPECT_TRUE(decodeErrorOf(item.substr(0, size))) << kOperationTable[i].name;
    }
  }
}

TEST(RequestFrame, RejectsBytesBehindTheRequest) {
  for (std::size_t i = 1; i < kOperationTable.size(); ++i) {
    std::string frame;
    appendRequest(frame, sampleRequest(static_cast<Operation>(i)));
    EXPECT_TRUE(decodeErrorOf(frame.substr(kFrameHeaderSize) + '\0'));
  }
}

// Each argument of each operation in turn becomes something that it is not.
TEST(RequestFrame, RejectsEachArgumentOfAWrongKindOrRange) {
  const std::string values[] = {
      bytesOf({0xF5}),                                   // true
      bytesOf({0xF6}),                                   // null
      bytesOf({0xF9, 0x3C, 0x00}),                       // 1.0
      bytesOf({0x60}),                                   // ""
      bytesOf({0x41, 0x01}),                             // a byte string
      bytesOf({0x81, 0xF5}),                             // [true]
      bytesOf({0xC1, 0x00}),                             // a date
      bytesOf({0x3B, 0x80, 0, 0, 0, 0, 0, 0, 0}),        // -2^63 - 1
      bytesOf({0x1B, 0x80, 0, 0, 0, 0, 0, 0, 0}),        // 2^63
      bytesOf({0x20}),                                   // -1
      bytesOf({0x1A, 0x00, 0x01, 0x00, 0x00}),           // 2^16
      bytesOf({0x1B, 0, 0, 0, 1, 0, 0, 0, 0}),           // 2^32
      bytesOf({0x80}),                                   // []
      bytesOf({0xA0}),                                   // {}
      bytesOf({0x81, 0x1B, 0x80, 0, 0, 0, 0, 0, 0, 0}),  // [2^63]
  };
  const auto isLegal = [](Argument argument, std::size_t value) {
    switch (argument) {
      case Argument::kReporterID:
        return value >= 9 && value <= 11;
      case Argument::kServiceType:
      case Argument::kType:
        return false;
      case Argument::kCategory:
        return value == 10;
      case Argument::kMessage:
        return value == 13;
      case Argument::kOptionalConfiguration:
        return value == 1 || value == 13;
      case Argument::kOptionalReporterIDs:
        return value == 1 || value == 12;
    }
    return false;
  };
  for (const OperationRow& row : std::span(kOperationTable).subspan(1)) {
    const Request sample = sampleRequest(row.operation);
    for (std::size_t wrong = 0; wrong < row.arguments.size(); ++wrong) {
      for (std::size_t v = 0; v < std::size(values); ++v) {
        std::string frame;
        appendRequest(frame, sample);
        // [operation, number 70000, ...]: the arguments begin at byte 7.
        std::string item = frame.substr(kFrameHeaderSize, 7);
        const std::string sampleItem = frame.substr(kFrameHeaderSize);
        const auto* at = spanOf(sampleItem).data() + 7;
        for (std::size_t i = 0; i < row.arguments.size(); ++i) {
          const auto bytes = ValueView(at).bytes();
          item += i == wrong ? values[v] : std::string(bytes.begin(), bytes.end());
          at += bytes.size();
        }
        EXPECT_EQ(!decodeErrorOf(item).has_value(), isLegal(row.arguments[wrong], v))
            << row.name << " argument " << wrong << " value " << v;
      }
    }
  }
}

TEST(RequestFrame, RejectsOperationsThatThereAreNot) {
  for (const std::string& operation :
       {bytesOf({0x0C}), bytesOf({0x18, 0xFF}), bytesOf({0x20}), bytesOf({0xF6}),
        bytesOf({0x61, '1'}), bytesOf({0x1B, 1, 0, 0, 0, 0, 0, 0, 1})}) {
    EXPECT_TRUE(decodeErrorOf(bytesOf({0x83}) + operation + bytesOf({0x01, 0x01})));
  }
}

TEST(RequestFrame, RejectsNumbersThatAreNone) {
  for (const std::string& number : {bytesOf({0x20}), bytesOf({0xF6}), bytesOf({0x60})}) {
    EXPECT_TRUE(decodeErrorOf(bytesOf({0x82, 0x0A}) + number));
  }
  EXPECT_FALSE(decodeErrorOf(
      bytesOf({0x82, 0x0A, 0x1B, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF})));
}

TEST(RequestFrame, RejectsTooFewAndTooManyArguments) {
  for (const OperationRow& row : std::span(kOperationTable).subspan(1)) {
    std::string frame;
    appendRequest(frame, sampleRequest(row.operation));
    std::string item = frame.substr(kFrameHeaderSize);
    ++item[0];
    EXPECT_TRUE(decodeErrorOf(item + '\0')) << row.name;
    item[0] = static_cast<char>(item[0] - 2);
    EXPECT_TRUE(decodeErrorOf(item)) << row.name;
  }
}

TEST(RequestFrame, RejectsAFarewellWithMore) {
  EXPECT_TRUE(decodeErrorOf(bytesOf({0x82, 0x00, 0x00})));
}

TEST(RequestFrame, RejectsWhatIsNoArray) {
  for (const std::string& item : {bytesOf({0x80}), bytesOf({0xA0}), bytesOf({0x00}),
                                  bytesOf({0xA1, 0x0A, 0x01}), bytesOf({0x9F, 0xFF})}) {
    EXPECT_TRUE(decodeErrorOf(item));
  }
}

TEST(RequestFrame, TakesIDsUpToTheLimit) {
  for (std::size_t size = 3; size <= 5; ++size) {
    Request request = sampleRequest(Operation::kSendMessage);
    request.reporterIDs = ReporterIDs(size, ReporterID{1});
    std::string frame;
    appendRequest(frame, request);
    EXPECT_EQ(decodeErrorOf(frame.substr(kFrameHeaderSize), /*mostIDs=*/4).has_value(),
              size > 4);
  }
}

TEST(RequestFrame, RejectsAListOfAHugeSizeBeforeItTakesMemory) {
  const std::string head = itemFrom([](ValueEncoder& to) {
    to.beginArray(6);
    to.unsignedInteger(6);
    to.unsignedInteger(1);
    to.beginDictionary(0);
    to.unsignedInteger(1);
    to.unsignedInteger(1);
    to.beginArray(std::size_t{1} << 60);
  });
  EXPECT_TRUE(decodeErrorOf(head, std::numeric_limits<std::size_t>::max()));
}

class ReplyFrame : public testing::Test {
 protected:
  DecodeError decode(const std::string& item) {
    reply_ = {};
    const ExactBytes exact(item);
    return decodeReply(
        exact.span(), kTestLimits,
        [this](RequestNumber number) -> std::optional<Operation> {
          if (number == kNumber) return operation_;
          return std::nullopt;
        },
        reply_);
  }

  void expectBack(Operation operation, const ReplyValue& value) {
    operation_ = operation;
    std::string frame;
    appendReply(frame, kNumber, value);
    itemOf(frame);
    EXPECT_EQ(decode(frame.substr(kFrameHeaderSize)).value_or(""), "");
    EXPECT_EQ(reply_.number, kNumber);
    EXPECT_TRUE(reply_.value == value);
  }

  static constexpr RequestNumber kNumber = 0x123456789;
  Operation operation_ = Operation::kCreateReportingSession;
  Reply reply_;
};

TEST_F(ReplyFrame, ComesBackAsItWas) {
  expectBack(Operation::kCreateReportingSession, true);
  expectBack(Operation::kStartReportingSessionForID, false);
  expectBack(Operation::kGetServiceNameForReporterID, kServiceTypeUnknown);
  expectBack(Operation::kSendMessage, std::monostate());
  expectBack(Operation::kSendMessage,
             ErrorObject{std::string(kOstrelErrorDomain), -1, "no"});
  expectBack(Operation::kReporterIDValid,
             Dictionary{{"reporterID", 0}, {"serviceType", 65535}});
  expectBack(Operation::kGetAllReporters, ReporterIDs{});
  expectBack(Operation::kGetAllReporters, ReporterIDs{ReporterID{-1}, ReporterID{1}});
}

TEST_F(ReplyFrame, CarriesAClosingWithItsReason) {
  std::string frame;
  appendClosing(frame, "the frame is empty");
  EXPECT_FALSE(decode(frame.substr(kFrameHeaderSize)));
  EXPECT_EQ(reply_.number, 0U);
  EXPECT_EQ(reply_.closingReason, "the frame is empty");
}

TEST_F(ReplyFrame, RejectsAReplyToNoRequest) {
  EXPECT_TRUE(decode(bytesOf({0x82, 0x05, 0xF5})));
}

TEST_F(ReplyFrame, RejectsAValueOfAnotherOperation) {
  std::string frame;
  appendReply(frame, kNumber, true);
  operation_ = Operation::kGetAllReporters;
  EXPECT_TRUE(decode(frame.substr(kFrameHeaderSize)));
}

TEST_F(ReplyFrame, RejectsEveryReplyThatIsCutShort) {
  std::string frame;
  appendReply(frame, kNumber, ErrorObject{"domain", 100000, "text"});
  const std::string item = frame.substr(kFrameHeaderSize);
  for (std::size_t size = 0; size < item.size(); ++size) {
    EXPECT_TRUE(decode(item.substr(0, size)));
  }
  EXPECT_TRUE(decode(item + '\0'));
}

class FrameStream : public testing::Test {
 protected:
  void add(std::string_view bytes) {
    const auto room = reader_.room(bytes.size());
    ASSERT_GE(room.size(), bytes.size());
    std::memcpy(room.data(), bytes.data(), bytes.size());
    reader_.added(bytes.size());
  }

  std::string takeFrame() {
    std::span<const std::uint8_t> item;
    if (reader_.next(item) != FrameReader::Next::kFrame) return "none";
    return {item.begin(), item.end()};
  }

  static std::string frameOf(std::string_view item) {
    std::string frame;
    for (int i = 0; i < 4; ++i)
      frame.push_back(static_cast<char>(item.size() >> (8 * i)));
    return frame += item;
  }

  static constexpr std::size_t kMost = 300;
  FrameReader reader_{kMost};
  std::span<const std::uint8_t> item_;
};

TEST_F(FrameStream, FindsFramesThatComeTogether) {
  add(frameOf("one") + frameOf("two") + frameOf("three"));
  EXPECT_EQ(takeFrame(), "one");
  EXPECT_EQ(takeFrame(), "two");
  EXPECT_TRUE(reader_.isWithinFrame());
  EXPECT_EQ(takeFrame(), "three");
  EXPECT_FALSE(reader_.isWithinFrame());
  EXPECT_EQ(reader_.next(item_), FrameReader::Next::kMoreNeeded);
}

TEST_F(FrameStream, FindsFramesThatComeByteByByte) {
  for (int round = 0; round < 50; ++round) {
    const std::string item(static_cast<std::size_t>(round + 1), 'x');
    const std::string frame = frameOf(item);
    for (std::size_t i = 0; i < frame.size(); ++i) {
      EXPECT_EQ(reader_.next(item_), FrameReader::Next::kMoreNeeded);
      add(frame.substr(i, 1));
      EXPECT_TRUE(reader_.isWithinFrame());
    }
    EXPECT_EQ(takeFrame(), item);
  }
}

TEST_F(FrameStream, KeepsHalfAFrameBehindWholeOnes) {
  const std::string last = frameOf(std::string(200, 'z'));
  add(frameOf("a") + last.substr(0, 100));
  EXPECT_EQ(takeFrame(), "a");
  EXPECT_EQ(reader_.next(item_), FrameReader::Next::kMoreNeeded);
  add(last.substr(100));
  EXPECT_EQ(takeFrame(), std::string(200, 'z'));
}

TEST_F(FrameStream, TakesFramesUpToTheLimit) {
  for (const std::size_t size : {kMost - 1, kMost}) {
    add(frameOf(std::string(size, 'x')));
    EXPECT_EQ(takeFrame().size(), size);
  }
  add(frameOf(std::string(kMost + 1, 'x')).substr(0, kFrameHeaderSize));
  EXPECT_EQ(reader_.next(item_), FrameReader::Next::kTooLarge);
}

TEST_F(FrameStream, RejectsTheLargestLengthAsSoonAsItIsThere) {
  add(bytesOf({0xFF, 0xFF, 0xFF, 0xFF}));
  EXPECT_EQ(reader_.next(item_), FrameReader::Next::kTooLarge);
}

TEST_F(FrameStream, RejectsAnEmptyFrame) {
  add(bytesOf({0, 0, 0, 0}));
  EXPECT_EQ(reader_.next(item_), FrameReader::Next::kEmpty);
}

TEST(RequestFrame, TellsWhomAMessageIsForByItsLastBytes) {
  for (const std::int64_t id :
       {std::int64_t{24}, std::int64_t{255}, std::int64_t{256}, std::int64_t{65'535},
        std::int64_t{65'536}, std::int64_t{0xFFFFFFFF}, std::int64_t{0x100000000},
        std::numeric_limits<std::int64_t>::max()}) {
    Request request = sampleRequest(Operation::kSendMessage);
    request.reporterIDs = ReporterIDs{ReporterID{id}};
    std::string frame;
    appendRequest(frame, request);
    EXPECT_EQ(likelyReporterID(itemOf(frame)), ReporterID{id}) << id;
  }
}

TEST(RequestFrame, DoesNotGuessWhereAMessageIsForNoneOrSeveral) {
  const std::optional<ReporterIDs> kOthers[] = {
      std::nullopt, ReporterIDs{}, ReporterIDs{ReporterID{1000}, ReporterID{1001}}};
  for (const auto& ids : kOthers) {
    Request request = sampleRequest(Operation::kSendMessage);
    request.reporterIDs = ids;
    std::string frame;
    appendRequest(frame, request);
    EXPECT_EQ(likelyReporterID(itemOf(frame)), kNoReporter);
  }
  for (std::size_t size = 0; size < 12; ++size) {
    const std::string item(size, '\x18');
    EXPECT_EQ(likelyReporterID(spanOf(item)), kNoReporter) << size;
  }
}

}  // namespace
}  // namespace ostrel::wire
