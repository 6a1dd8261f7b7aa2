#include "forwarder/Verdict.h"

#include <gtest/gtest.h>

namespace ostrel {
namespace {

using Kind = Verdict::Kind;
using std::chrono::milliseconds;

Verdict verdictOf(int status, const std::string& body = "",
                  const std::string& retryAfter = "") {
  Reply reply;
  reply.status = status;
  reply.body = body;
  reply.retryAfter = retryAfter;
  return verdictOn(reply, Date{0});
}

TEST(Verdict, GoesByTheStatus) {
  for (const int status : {200, 202, 204}) {
    EXPECT_EQ(verdictOf(status).kind, Kind::kTaken) << status;
  }
  for (const int status : {400, 422}) {
    EXPECT_EQ(verdictOf(status).kind, Kind::kRefused) << status;
  }
  EXPECT_EQ(verdictOf(413).kind, Kind::kTooLarge);
  EXPECT_EQ(verdictOf(500).kind, Kind::kBroken);
  for (const int status : {0, 100, 301, 302, 307, 308, 401, 403, 404, 405, 408, 415, 429,
                           501, 502, 503, 504, 999}) {
    EXPECT_EQ(verdictOf(status).kind, Kind::kLater) << status;
  }
}

TEST(Verdict, CountsWhatWasTakenOut) {
  EXPECT_EQ(verdictOf(200, R"({"partialSuccess":{"rejectedLogRecords":"3"}})").rejected,
            3);
  EXPECT_EQ(verdictOf(200, R"({"partialSuccess":{"rejectedLogRecords":4}})").rejected, 4);
}

TEST(Verdict, TakesAnyOtherBodyOfASuccessForOne) {
  for (const char* body :
       {"", "{}", "<html>", "[]", "{\"partialSuccess\":5}", "{\"partialSuccess\":{}}",
        R"({"partialSuccess":{"rejectedLogRecords":"-1"}})",
        R"({"partialSuccess":{"rejectedLogRecords":"x"}})",
        R"({"partialSuccess":{"rejectedLogRecords":[]}})",
        R"({"partialSuccess":{"errorMessage":"a warning"}})"}) {
    const Verdict verdict = verdictOf(200, body);
    EXPECT_EQ(verdict.kind, Kind::kTaken) << body;
    EXPECT_EQ(verdict.rejected, 0) << body;
  }
}

TEST(Verdict, SaysWhatPauseIsAskedFor) {
  EXPECT_EQ(verdictOf(429, "", "7").pauseAsked, milliseconds(7000));
  EXPECT_EQ(verdictOf(503, "", "Thu, 01 Jan 1970 00:00:09 GMT").pauseAsked,
            milliseconds(9000));
  EXPECT_EQ(verdictOf(500, "", "7").pauseAsked, milliseconds(7000));
  EXPECT_EQ(verdictOf(503, "", "soon").pauseAsked, std::nullopt);
  EXPECT_EQ(verdictOf(200, "", "7").pauseAsked, std::nullopt);
}

TEST(Verdict, SaysWhyThereWasNoReply) {
  Reply reply;
  reply.failure = "Connection refused";
  EXPECT_EQ(verdictOn(reply, Date{0}).reason, "Connection refused");
  EXPECT_EQ(verdictOf(503).reason, "it answers with status 503");
}

TEST(Verdict, OnAnInterruptedRequestIsNone) {
  Reply reply;
  reply.status = 200;
  reply.isInterrupted = true;
  EXPECT_EQ(verdictOn(reply, Date{0}).kind, Kind::kInterrupted);
}

}  // namespace
}  // namespace ostrel
