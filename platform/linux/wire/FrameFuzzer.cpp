// Any stream of bytes is frames, whole or not, and each is a request or a reply or an
// error. A request that was taken is written as a frame that is taken as the same.
#include "platform/linux/wire/Frame.h"

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <string>

#include "fuzz/Fuzzing.h"

namespace {

using namespace ostrel;
using fuzzing::expect;
using Bytes = std::span<const std::uint8_t>;

wire::DecodeError decode(Bytes item, wire::Request& request) {
  return wire::decodeRequest(item, fuzzing::kPayloadLimits, limits::kReporterIDs,
                             /*owner=*/{}, request);
}

void tryRequest(Bytes item) {
  wire::Request request;
  if (decode(item, request) || request.operation == wire::Operation::kFarewell) return;
  std::string frame;
  wire::appendRequest(frame, request);
  const Bytes written(reinterpret_cast<const std::uint8_t*>(frame.data()), frame.size());
  wire::Request again;
  expect(!decode(written.subspan(wire::kFrameHeaderSize), again));
  expect(again.operation == request.operation && again.number == request.number &&
         again.reporterID == request.reporterID && again.category == request.category &&
         again.type == request.type && again.serviceType == request.serviceType &&
         again.reporterIDs == request.reporterIDs);
  expect(again.dictionary.has_value() == request.dictionary.has_value());
}

void tryReply(Bytes item) {
  wire::Reply reply;
  const auto operationOf = [](wire::RequestNumber number) {
    return std::optional(static_cast<wire::Operation>(number % 12));
  };
  static_cast<void>(wire::decodeReply(item, fuzzing::kPayloadLimits, operationOf, reply));
}

}  // namespace

// The first byte says in which pieces the rest arrives.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size == 0) return 0;
  const std::size_t piece = std::size_t{data[0]} + 1;
  wire::FrameReader reader(limits::kFrameBytes);
  for (std::size_t at = 1; at < size;) {
    const std::size_t count = std::min(piece, size - at);
    std::copy_n(data + at, count, reader.room(count).begin());
    reader.added(count);
    at += count;
    Bytes item;
    auto next = reader.next(item);
    for (; next == wire::FrameReader::Next::kFrame; next = reader.next(item)) {
      tryRequest(item);
      tryReply(item);
    }
    if (next != wire::FrameReader::Next::kMoreNeeded) return 0;
  }
  return 0;
}
