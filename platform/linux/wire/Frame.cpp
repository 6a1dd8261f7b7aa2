#include "platform/linux/wire/Frame.h"

#include <cstring>
#include <limits>

#include "platform/linux/wire/Head.h"
#include "platform/linux/wire/OperationTable.h"

namespace ostrel::wire {
namespace {

using Byte = std::uint8_t;

constexpr std::string_view kNotARequest = "the frame is not a request";
constexpr std::string_view kUnknownOperation = "the operation is unknown";
constexpr std::string_view kWrongNumber = "the request number is not one";
constexpr std::string_view kWrongCount = "the number of arguments is wrong";
constexpr std::string_view kWrongReporterID =
    "a reporter ID is not a signed integer of 64 bits";
constexpr std::string_view kWrongServiceType = "the service type is not from 0 to 65535";
constexpr std::string_view kWrongCategory = "the category is not from 0 to 4294967295";
constexpr std::string_view kWrongType = "the type is not from 0 to 65535";
constexpr std::string_view kWrongIDs = "the reporter IDs are neither an array nor null";
constexpr std::string_view kTooManyIDs = "there are too many reporter IDs";
constexpr std::string_view kTrailingBytes = "bytes follow the request";

constexpr std::string_view kNotAReply = "the frame is not a reply";
constexpr std::string_view kUnknownNumber = "the reply is to no request";
constexpr std::string_view kWrongValue = "the reply's value is not its operation's";
constexpr std::string_view kWrongError = "the reply's error is not one";
constexpr std::string_view kWrongReason = "the reason is not text";

// Reads the items of one frame one after the other. Each `take` says whether the
// next item was one.
class ItemReader {
 public:
  explicit ItemReader(std::span<const Byte> item)
      : at_(item.data()), end_(at_ + item.size()) {}

  bool isAtEnd() const { return at_ == end_; }
  std::span<const Byte> rest() const { return {at_, end_}; }
  void skip(std::size_t size) { at_ += size; }

  bool takeNull() {
    if (at_ == end_ || *at_ != kNullItem) return false;
    ++at_;
    return true;
  }

  bool takeBoolean(bool& value) {
    if (at_ == end_ || (*at_ != kTrueItem && *at_ != kFalseItem)) return false;
    value = *at_++ == kTrueItem;
    return true;
  }

  bool takeUnsigned(std::uint64_t most, std::uint64_t& value) {
    Head head;
    if (!takeHead(kUnsignedInteger, head) || head.argument > most) return false;
    value = head.argument;
    return true;
  }

  bool takeSigned(std::int64_t& value) {
    Head head;
    if (readHead(at_, end_, head) != nullptr || head.argument >> 63) return false;
    const auto magnitude = static_cast<std::int64_t>(head.argument);
    value = head.majorType == kUnsignedInteger ? magnitude : -1 - magnitude;
    return head.majorType <= kNegativeInteger;
  }

  bool takeText(std::string& text) {
    Head head;
    if (!takeHead(kTextString, head) || head.argument > rest().size()) return false;
    const std::span<const Byte> bytes = rest().first(head.argument);
    if (!isUTF8(bytes)) return false;
    text.assign(bytes.begin(), bytes.end());
    skip(bytes.size());
    return true;
  }

  // Each element takes a byte at least, so that a size beyond that is refused.
  bool takeArray(std::size_t& size) {
    Head head;
    if (!takeHead(kArrayItem, head) || head.argument > rest().size()) return false;
    size = head.argument;
    return true;
  }

 private:
  bool takeHead(MajorType majorType, Head& head) {
    return readHead(at_, end_, head) == nullptr && head.majorType == majorType;
  }

  const Byte* at_;
  const Byte* const end_;
};

DecodeError takeReporterIDs(ItemReader& reader, std::size_t mostIDs, ReporterIDs& ids) {
  std::size_t size;
  if (!reader.takeArray(size)) return kWrongIDs;
  if (size > mostIDs) return kTooManyIDs;
  ids.reserve(size);
  for (std::size_t i = 0; i < size; ++i) {
    std::int64_t id;
    if (!reader.takeSigned(id)) return kWrongReporterID;
    ids.push_back(ReporterID{id});
  }
  return std::nullopt;
}

DecodeError takeDictionary(ItemReader& reader, const PayloadLimits& limits,
                           const ValueBuffer& owner,
                           std::optional<Dictionary>& dictionary) {
  DecodedDictionary decoded = decodeDictionary(reader.rest(), limits, owner);
  if (decoded.error) return decoded.error;
  reader.skip(decoded.size);
  dictionary = std::move(decoded.dictionary);
  return std::nullopt;
}

template <typename Code>
DecodeError takeCode(ItemReader& reader, std::string_view error, Code& code) {
  using Integer = std::underlying_type_t<Code>;
  std::uint64_t value;
  if (!reader.takeUnsigned(std::numeric_limits<Integer>::max(), value)) return error;
  code = static_cast<Code>(value);
  return std::nullopt;
}

DecodeError takeArgument(ItemReader& reader, Argument argument,
                         const PayloadLimits& limits, std::size_t mostIDs,
                         const ValueBuffer& owner, Request& request) {
  switch (argument) {
    case Argument::kReporterID: {
      std::int64_t id;
      if (!reader.takeSigned(id)) return kWrongReporterID;
      request.reporterID = ReporterID{id};
      return std::nullopt;
    }
    case Argument::kServiceType:
      return takeCode(reader, kWrongServiceType, request.serviceType);
    case Argument::kCategory:
      return takeCode(reader, kWrongCategory, request.category);
    case Argument::kType:
      return takeCode(reader, kWrongType, request.type);
    case Argument::kOptionalConfiguration:
      if (reader.takeNull()) return std::nullopt;
      return takeDictionary(reader, limits, owner, request.dictionary);
    case Argument::kMessage:
      return takeDictionary(reader, limits, owner, request.dictionary);
    case Argument::kOptionalReporterIDs:
      if (reader.takeNull()) return std::nullopt;
      return takeReporterIDs(reader, mostIDs, request.reporterIDs.emplace());
  }
  return kNotARequest;
}

}  // namespace

ReporterID likelyReporterID(std::span<const std::uint8_t> item) {
  constexpr Byte kOneElement = 0x81;
  // The head of an integer of so many bytes, before it.
  struct Width {
    std::size_t bytes;
    Byte head;
  };
  constexpr Width kWidths[] = {{8, 0x1b}, {4, 0x1a}, {2, 0x19}, {1, 0x18}};
  const Byte* const end = item.data() + item.size();
  for (const auto& [bytes, head] : kWidths) {
    if (item.size() < bytes + 2) continue;
    const Byte* at = end - bytes;
    if (at[-1] != head || at[-2] != kOneElement) continue;
    std::uint64_t id = 0;
    for (; at != end; ++at) id = id << 8 | *at;
    return ReporterID{static_cast<std::int64_t>(id)};
  }
  return kNoReporter;
}

namespace {

// One frame in the making: its length is written when it ends.
class FrameWriter : public ValueEncoder {
 public:
  explicit FrameWriter(std::string& out)
      : ValueEncoder(out), out_(out), begin_(out.size()) {
    out_.append(kFrameHeaderSize, '\0');
  }

  ~FrameWriter() {
    const std::size_t length = out_.size() - begin_ - kFrameHeaderSize;
    for (std::size_t i = 0; i < kFrameHeaderSize; ++i) {
      out_[begin_ + i] = static_cast<char>(length >> (8 * i));
    }
  }

  void null() { out_.push_back(static_cast<char>(kNullItem)); }

  void reporterIDs(const ReporterIDs& ids) {
    makeRoom(ids);
    beginArray(ids.size());
    for (const ReporterID id : ids) signedInteger(static_cast<std::int64_t>(id));
  }

 private:
  // Many IDs may wait long for their reader, and a text that doubles until they fit is
  // half empty then. An eighth more, as others may follow.
  void makeRoom(const ReporterIDs& ids) {
    if (ids.size() < kManyIDs) return;
    std::size_t needed = out_.size() + kLargestHead;
    for (const ReporterID id : ids) needed += headSize(static_cast<std::int64_t>(id));
    if (needed <= out_.capacity()) return;
    std::string larger;
    larger.reserve(needed + needed / 8);
    larger.append(out_);
    out_.swap(larger);
  }

  // What an integer takes.
  static std::size_t headSize(std::int64_t value) {
    const auto argument = static_cast<std::uint64_t>(value < 0 ? ~value : value);
    if (argument < 24) return 1;
    if (argument <= 0xFF) return 2;
    if (argument <= 0xFFFF) return 3;
    return argument <= 0xFFFF'FFFF ? 5 : kLargestHead;
  }
  static constexpr std::size_t kLargestHead = 9;
  static constexpr std::size_t kManyIDs = 64;

  std::string& out_;
  const std::size_t begin_;
};

void writeArgument(FrameWriter& writer, Argument argument, const Request& request) {
  switch (argument) {
    case Argument::kReporterID:
      writer.signedInteger(static_cast<std::int64_t>(request.reporterID));
      return;
    case Argument::kServiceType:
      writer.unsignedInteger(static_cast<std::uint64_t>(request.serviceType));
      return;
    case Argument::kCategory:
      writer.unsignedInteger(static_cast<std::uint64_t>(request.category));
      return;
    case Argument::kType:
      writer.unsignedInteger(static_cast<std::uint64_t>(request.type));
      return;
    case Argument::kMessage:
    case Argument::kOptionalConfiguration:
      if (request.dictionary) {
        writer.item(request.dictionary->value());
      } else if (argument == Argument::kMessage) {
        writer.beginDictionary(0);
      } else {
        writer.null();
      }
      return;
    case Argument::kOptionalReporterIDs:
      if (request.reporterIDs) {
        writer.reporterIDs(*request.reporterIDs);
      } else {
        writer.null();
      }
      return;
  }
}

DecodeError takeReplyValue(ItemReader& reader, ReplyKind kind,
                           const PayloadLimits& limits, ReplyValue& value) {
  switch (kind) {
    case ReplyKind::kNone:
      return kUnknownNumber;
    case ReplyKind::kBoolean:
      return reader.takeBoolean(value.emplace<bool>()) ? DecodeError() : kWrongValue;
    case ReplyKind::kServiceType:
      return takeCode(reader, kWrongValue, value.emplace<ServiceType>());
    case ReplyKind::kNull:
      return reader.takeNull() ? DecodeError() : kWrongValue;
    case ReplyKind::kDictionary: {
      std::optional<Dictionary> dictionary;
      const DecodeError error = takeDictionary(reader, limits, /*owner=*/{}, dictionary);
      if (!error) value = std::move(*dictionary);
      return error;
    }
    case ReplyKind::kReporterIDs:
      return takeReporterIDs(reader, std::numeric_limits<std::size_t>::max(),
                             value.emplace<ReporterIDs>());
  }
  return kNotAReply;
}

bool takeError(ItemReader& reader, ErrorObject& error) {
  std::size_t size;
  return reader.takeNull() && reader.takeArray(size) && size == 3 &&
         reader.takeText(error.domain) && reader.takeSigned(error.code) &&
         reader.takeText(error.description);
}

}  // namespace

DecodeError decodeRequest(std::span<const std::uint8_t> item, const PayloadLimits& limits,
                          std::size_t mostIDs, const ValueBuffer& owner,
                          Request& request) {
  ItemReader reader(item);
  std::size_t size;
  std::uint64_t operation;
  if (!reader.takeArray(size) || size == 0) return kNotARequest;
  if (!reader.takeUnsigned(kOperationTable.size() - 1, operation)) {
    return kUnknownOperation;
  }
  const OperationRow& row = kOperationTable[operation];
  request.operation = row.operation;
  if (row.operation == Operation::kFarewell) {
    if (size != 1) return kWrongCount;
  } else {
    if (size != 2 + row.arguments.size()) return kWrongCount;
    if (!reader.takeUnsigned(std::numeric_limits<RequestNumber>::max(), request.number)) {
      return kWrongNumber;
    }
  }
  for (const Argument argument : row.arguments) {
    const DecodeError error =
        takeArgument(reader, argument, limits, mostIDs, owner, request);
    if (error) return error;
  }
  return reader.isAtEnd() ? DecodeError() : kTrailingBytes;
}

void appendRequest(std::string& out, const Request& request) {
  const OperationRow& row = rowOf(request.operation);
  FrameWriter writer(out);
  writer.beginArray(2 + row.arguments.size());
  writer.unsignedInteger(static_cast<std::uint64_t>(request.operation));
  writer.unsignedInteger(request.number);
  for (const Argument argument : row.arguments) {
    writeArgument(writer, argument, request);
  }
}

void appendFarewell(std::string& out) {
  FrameWriter writer(out);
  writer.beginArray(1);
  writer.unsignedInteger(static_cast<std::uint64_t>(Operation::kFarewell));
}

void appendReply(std::string& out, RequestNumber number, const ReplyValue& value) {
  FrameWriter writer(out);
  const auto* error = std::get_if<ErrorObject>(&value);
  writer.beginArray(error != nullptr ? 3 : 2);
  writer.unsignedInteger(number);
  if (error != nullptr) {
    writer.null();
    writer.beginArray(3);
    writer.string(error->domain);
    writer.signedInteger(error->code);
    writer.string(error->description);
  } else if (const auto* truth = std::get_if<bool>(&value)) {
    writer.boolean(*truth);
  } else if (const auto* type = std::get_if<ServiceType>(&value)) {
    writer.unsignedInteger(static_cast<std::uint64_t>(*type));
  } else if (const auto* dictionary = std::get_if<Dictionary>(&value)) {
    writer.item(dictionary->value());
  } else if (const auto* ids = std::get_if<ReporterIDs>(&value)) {
    writer.reporterIDs(*ids);
  } else {
    writer.null();
  }
}

void appendClosing(std::string& out, std::string_view reason) {
  FrameWriter writer(out);
  writer.beginArray(2);
  writer.unsignedInteger(0);
  writer.string(reason);
}

DecodeError decodeReply(
    std::span<const std::uint8_t> item, const PayloadLimits& limits,
    const std::function<std::optional<Operation>(RequestNumber)>& operationOf,
    Reply& reply) {
  ItemReader reader(item);
  std::size_t size;
  if (!reader.takeArray(size) || (size != 2 && size != 3) ||
      !reader.takeUnsigned(std::numeric_limits<RequestNumber>::max(), reply.number)) {
    return kNotAReply;
  }
  DecodeError error;
  if (reply.number == 0) {
    if (size != 2 || !reader.takeText(reply.closingReason)) error = kWrongReason;
  } else if (const auto operation = operationOf(reply.number); !operation) {
    error = kUnknownNumber;
  } else if (size == 3) {
    if (!takeError(reader, reply.value.emplace<ErrorObject>())) error = kWrongError;
  } else {
    error = takeReplyValue(reader, rowOf(*operation).reply, limits, reply.value);
  }
  if (!error && !reader.isAtEnd()) error = kTrailingBytes;
  return error;
}

std::span<std::uint8_t> FrameReader::room(std::size_t size) {
  if (begin_ == end_) begin_ = end_ = 0;
  if (buffer_.size() - end_ < size) {
    std::memmove(buffer_.data(), buffer_.data() + begin_, end_ - begin_);
    end_ -= begin_;
    begin_ = 0;
    if (buffer_.size() - end_ < size) buffer_.resize(end_ + size);
  }
  return {reinterpret_cast<Byte*>(buffer_.data()) + end_, buffer_.size() - end_};
}

void FrameReader::added(std::size_t size) { end_ += size; }

FrameReader::Next FrameReader::next(std::span<const std::uint8_t>& item) {
  const auto* at = reinterpret_cast<const Byte*>(buffer_.data()) + begin_;
  const std::size_t held = end_ - begin_;
  if (held < kFrameHeaderSize) return Next::kMoreNeeded;
  const std::size_t length = frameLength(at);
  if (length == 0) return Next::kEmpty;
  if (length > mostFrameBytes_) return Next::kTooLarge;
  if (held - kFrameHeaderSize < length) return Next::kMoreNeeded;
  item = {at + kFrameHeaderSize, length};
  begin_ += kFrameHeaderSize + length;
  return Next::kFrame;
}

}  // namespace ostrel::wire
