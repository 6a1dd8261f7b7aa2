#include "client/RequestFrame.h"

#include "platform/Value.h"

namespace ostrel::reporting {
namespace {
constexpr char kNull = static_cast<char>(0xF6);
}

void setFrameLength(std::string& out, std::size_t begin) {
  const std::size_t length = out.size() - begin - wire::kFrameHeaderSize;
  for (std::size_t i = 0; i < wire::kFrameHeaderSize; ++i) {
    out[begin + i] = static_cast<char>(length >> (8 * i));
  }
}

std::size_t appendSendMessage(std::string& out, wire::RequestNumber number,
                              std::string_view payload, Category category,
                              MessageType type,
                              const std::optional<ReporterIDs>& reporterIDs) {
  const std::size_t begin = out.size();
  out.append(wire::kFrameHeaderSize, '\0');
  ValueEncoder encoder(out);
  encoder.beginArray(/*size=*/6);
  encoder.unsignedInteger(static_cast<std::uint8_t>(wire::Operation::kSendMessage));
  encoder.unsignedInteger(number);
  const std::size_t payloadBegin = out.size();
  out.append(payload);
  encoder.unsignedInteger(static_cast<std::uint32_t>(category));
  encoder.unsignedInteger(static_cast<std::uint16_t>(type));
  if (reporterIDs) {
    encoder.beginArray(reporterIDs->size());
    for (const ReporterID id : *reporterIDs) {
      encoder.signedInteger(static_cast<std::int64_t>(id));
    }
  } else {
    out.push_back(kNull);
  }
  setFrameLength(out, begin);
  return payloadBegin;
}

void appendRequest(std::string& out, wire::Operation operation,
                   wire::RequestNumber number, ReporterID reporterID) {
  wire::Request request;
  request.operation = operation;
  request.number = number;
  request.reporterID = ostrel::ReporterID{static_cast<std::int64_t>(reporterID)};
  wire::appendRequest(out, request);
}

void appendSetServiceType(std::string& out, wire::RequestNumber number,
                          ServiceType serviceType, ReporterID reporterID) {
  wire::Request request;
  request.operation = wire::Operation::kSetServiceType;
  request.number = number;
  request.serviceType = ostrel::ServiceType{static_cast<std::uint16_t>(serviceType)};
  request.reporterID = ostrel::ReporterID{static_cast<std::int64_t>(reporterID)};
  wire::appendRequest(out, request);
}

void appendSetConfiguration(std::string& out, wire::RequestNumber number,
                            const Message& configuration, ReporterID reporterID) {
  wire::Request request;
  request.operation = wire::Operation::kSetConfiguration;
  request.number = number;
  request.dictionary = ostrel::Dictionary(
      ValueBuffer(),
      reinterpret_cast<const std::uint8_t*>(configuration.encoded().data()));
  request.reporterID = ostrel::ReporterID{static_cast<std::int64_t>(reporterID)};
  wire::appendRequest(out, request);
}

}  // namespace ostrel::reporting
