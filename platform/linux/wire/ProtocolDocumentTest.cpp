// The bytes and the limits in `docs/protocol.md` are the codec's.
#include <gtest/gtest.h>

#include <fstream>
#include <iterator>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include "platform/linux/Limits.h"
#include "platform/linux/wire/Frame.h"
#include "platform/linux/wire/OperationTable.h"
#include "platform/linux/wire/WireTesting.h"

namespace ostrel::wire {
namespace {

std::string document() {
  std::ifstream file(OSTREL_SOURCE_DIR "/docs/protocol.md");
  return {std::istreambuf_iterator<char>(file), {}};
}

struct Example {
  bool isFromClient;
  std::string frame;
};

std::vector<Example> examples() {
  const std::string text = document();
  const std::string mark = "```frames\n";
  const auto begin = text.find(mark) + mark.size();
  std::istringstream lines(text.substr(begin, text.find("```", begin) - begin));
  std::vector<Example> found;
  for (std::string line; std::getline(lines, line);) {
    Example example{line.front() == '>', ""};
    std::istringstream bytes(line.substr(32));
    for (int byte; bytes >> std::hex >> byte;) {
      example.frame.push_back(static_cast<char>(byte));
    }
    EXPECT_TRUE(bytes.eof()) << line;
    found.push_back(example);
  }
  return found;
}

std::span<const std::uint8_t> itemOf(const std::string& frame) {
  EXPECT_EQ(frameLength(spanOf(frame).data()), frame.size() - kFrameHeaderSize);
  return spanOf(frame).subspan(kFrameHeaderSize);
}

TEST(ProtocolDocument, ShowsARequestOfEveryOperation) {
  std::map<Operation, int> seen;
  for (const Example& example : examples()) {
    if (!example.isFromClient) continue;
    Request request;
    const DecodeError error =
        decodeRequest(itemOf(example.frame), kTestLimits, limits::kReporterIDs,
                      /*owner=*/{}, request);
    EXPECT_EQ(error.value_or(""), "");
    ++seen[request.operation];
    std::string written;
    if (request.operation == Operation::kFarewell) {
      appendFarewell(written);
    } else {
      appendRequest(written, request);
    }
    EXPECT_EQ(written, example.frame) << rowOf(request.operation).name;
  }
  EXPECT_EQ(seen.size(), kOperationTable.size());
}

TEST(ProtocolDocument, ShowsRepliesAsTheyAreWritten) {
  std::size_t count = 0;
  for (const Example& example : examples()) {
    if (example.isFromClient) continue;
    Reply reply;
    // The examples number a request by its operation.
    const auto operationOf = [](RequestNumber number) {
      return std::optional(static_cast<Operation>(number));
    };
    const DecodeError error =
        decodeReply(itemOf(example.frame), kTestLimits, operationOf, reply);
    EXPECT_EQ(error.value_or(""), "");
    std::string written;
    if (reply.number == 0) {
      appendClosing(written, reply.closingReason);
    } else {
      appendReply(written, reply.number, reply.value);
    }
    EXPECT_EQ(written, example.frame) << "to " << reply.number;
    ++count;
  }
  EXPECT_EQ(count, 12U);
}

TEST(ProtocolDocument, SaysTheLimits) {
  const std::string text = document();
  const auto says = [&](const std::string& what, std::size_t limit) {
    EXPECT_NE(text.find("| " + what + " | " + std::to_string(limit) + " |"),
              std::string::npos)
        << what;
  };
  says("bytes of a frame without its length", limits::kFrameBytes);
  says("arrays and dictionaries within one another", limits::kNesting);
  says("values in a payload, keys included", limits::kNodes);
  says("bytes of a text key", limits::kKeyBytes);
  says("IDs in a request", limits::kReporterIDs);
  says("connections, in all", limits::kConnections);
  says("connections of one user", limits::kConnectionsOfUser);
  says("bytes of one connection's requests that wait", limits::kQueuedBytes);
  says("the same of all connections of one user", limits::kQueuedBytesOfUser);
  says("reply bytes that a client has not read", limits::kUnreadReplyBytes);
  says("reply bytes that all clients of one user have not read",
       limits::kUnreadReplyBytesOfUser);
  says("the limit of each client beyond that", limits::kUnreadReplyBytesInNeed);
  says("bytes of frames that are not whole yet, of all connections of one user",
       limits::kHalfFrameBytesOfUser);
  says("sessions, in all", limits::kSessions);
  says("sessions of one user", limits::kSessionsOfUser);
}

}  // namespace
}  // namespace ostrel::wire
