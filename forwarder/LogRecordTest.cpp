#include "forwarder/LogRecord.h"

#include <gtest/gtest.h>

#include <limits>

namespace ostrel {
namespace {

constexpr const char* kToken = "00-0123456789abcdef0123456789abcdef-00f067aa0ba902b7-01";

JSONNode json(const std::string& text) {
  auto parsed = parseJSON(text);
  EXPECT_TRUE(parsed.value) << text;
  return parsed.value ? *parsed.value : JSONNode();
}

Report report() {
  Report report;
  report.id = 7;
  report.sessionID = 3;
  report.reporterID = -4711;
  report.category = 7;
  report.type = 1;
  report.payload = json(R"({"route":"Speaker"})");
  report.userInfo = json(R"({"kTelvarUserInfoClientName":"phone"})");
  report.hierarchyToken = kToken;
  report.createdAt = 1769860800250000;
  return report;
}

/// The record's body, of this payload.
std::string bodyOf(const std::string& payload) {
  Report one = report();
  one.payload = json(payload);
  const JSONNode record = json(logRecordJSON(one, "abc"));
  std::string text;
  appendJSON(text, *find(*record.object(), "body"), JSONSpacing::kCompact);
  return text;
}

TEST(LogRecord, HoldsAMessage) {
  EXPECT_EQ(
      logRecordJSON(report(), "abc"),
      R"({"timeUnixNano":"1769860800250000000",)"
      R"("observedTimeUnixNano":"1769860800250000000",)"
      R"("severityNumber":9,"severityText":"INFO",)"
      R"("eventName":"com.orbisk.ostrel.RouteChange.Start",)"
      R"("body":{"kvlistValue":{"values":[)"
      R"({"key":"route","value":{"stringValue":"Speaker"}}]}},)"
      R"("attributes":[)"
      R"({"key":"log.record.uid","value":{"stringValue":"abc-7-1769860800250000"}},)"
      R"({"key":"ostrel.category","value":{"intValue":"7"}},)"
      R"({"key":"ostrel.type","value":{"intValue":"1"}},)"
      R"({"key":"ostrel.session.id","value":{"intValue":"3"}},)"
      R"({"key":"ostrel.reporter.id","value":{"intValue":"-4711"}},)"
      R"({"key":"ostrel.user_info.kTelvarUserInfoClientName",)"
      R"("value":{"stringValue":"phone"}}],)"
      R"("flags":1,"traceId":"0123456789abcdef0123456789abcdef",)"
      R"("spanId":"00f067aa0ba902b7"})");
}

TEST(LogRecord, LeavesOutWhatAMessageDoesNotHave) {
  Report one = report();
  one.sessionID.reset();
  one.reporterID.reset();
  one.userInfo = JSONNode();
  one.hierarchyToken.clear();
  const std::string record = logRecordJSON(one, "abc");
  for (const char* name :
       {"session.id", "reporter.id", "user_info", "traceId", "spanId", "flags"}) {
    EXPECT_EQ(record.find(name), std::string::npos) << name;
  }
}

TEST(LogRecord, IsCalledASummaryWhenItIsOne) {
  Report one = report();
  one.category = 0xFFFF;
  one.type = 0xFFFF;
  one.payload = json(R"({"Ostrel_Session_Summary_Event":"2"})");
  EXPECT_NE(
      logRecordJSON(one, "abc").find(R"("eventName":"com.orbisk.ostrel.SessionSummary")"),
      std::string::npos);
}

TEST(LogRecord, KeepsEachKindOfValue) {
  EXPECT_EQ(bodyOf(R"({"a":true,"b":1.5,"c":null,"d":[1,"x"],"e":{"f":-2}})"),
            R"({"kvlistValue":{"values":[)"
            R"({"key":"a","value":{"boolValue":true}},)"
            R"({"key":"b","value":{"doubleValue":1.5}},)"
            R"({"key":"c","value":{}},)"
            R"({"key":"d","value":{"arrayValue":{"values":[)"
            R"({"intValue":"1"},{"stringValue":"x"}]}}},)"
            R"({"key":"e","value":{"kvlistValue":{"values":[)"
            R"({"key":"f","value":{"intValue":"-2"}}]}}}]}})");
  EXPECT_EQ(bodyOf("{}"), R"({"kvlistValue":{"values":[]}})");
  EXPECT_EQ(bodyOf("[]"), R"({"arrayValue":{"values":[]}})");
}

TEST(LogRecord, KeepsIntegersExact) {
  EXPECT_EQ(bodyOf("[9223372036854775807,-9223372036854775808,18446744073709551615]"),
            R"({"arrayValue":{"values":[{"intValue":"9223372036854775807"},)"
            R"({"intValue":"-9223372036854775808"},)"
            R"({"stringValue":"18446744073709551615"}]}})");
}

TEST(LogRecord, TakesAnyText) {
  EXPECT_EQ(bodyOf(R"("\u0000\n\"ä")"), R"({"stringValue":"\u0000\n\"ä"})");
  Report one = report();
  one.payload.value = std::string("\xff");
  EXPECT_NE(logRecordJSON(one, "abc").find("\xef\xbf\xbd"), std::string::npos);
}

TEST(LogRecord, HasNoTimeWhereItCannotBeSaid) {
  for (const std::int64_t time :
       {std::int64_t{-1}, std::numeric_limits<std::int64_t>::min(),
        std::numeric_limits<std::int64_t>::max(), std::int64_t{9223372036854776}}) {
    Report one = report();
    one.createdAt = time;
    EXPECT_NE(logRecordJSON(one, "abc").find(R"("timeUnixNano":"0")"), std::string::npos)
        << time;
  }
  Report one = report();
  one.createdAt = 9223372036854775;
  EXPECT_NE(logRecordJSON(one, "abc").find(R"("timeUnixNano":"9223372036854775000")"),
            std::string::npos);
}

TEST(LogRecord, HasAnIDOfItsOwnInEachStore) {
  EXPECT_NE(recordID(report(), "abc"), recordID(report(), "abd"));
  Report other = report();
  other.id = 8;
  EXPECT_NE(recordID(report(), "abc"), recordID(other, "abc"));
  other = report();
  other.createdAt += 1;
  EXPECT_NE(recordID(report(), "abc"), recordID(other, "abc"));
}

TEST(TraceContext, IsThatOfATraceparent) {
  const auto context = traceContext(kToken);
  ASSERT_TRUE(context);
  EXPECT_EQ(context->traceID, "0123456789abcdef0123456789abcdef");
  EXPECT_EQ(context->spanID, "00f067aa0ba902b7");
  EXPECT_EQ(context->flags, 1);
}

TEST(TraceContext, IsNoneOfAnythingElse) {
  for (const char* text :
       {"", "00-token", "00-0123456789ABCDEF0123456789ABCDEF-00f067aa0ba902b7-01",
        "01-0123456789abcdef0123456789abcdef-00f067aa0ba902b7-01",
        "00-00000000000000000000000000000000-00f067aa0ba902b7-01",
        "00-0123456789abcdef0123456789abcdef-0000000000000000-01",
        "00-0123456789abcdef0123456789abcdef-00f067aa0ba902b7-01-"}) {
    EXPECT_FALSE(traceContext(text)) << text;
  }
}

TEST(LogsRequest, HoldsRecordsOfOneResource) {
  EXPECT_EQ(logsRequestJSON({{"service.name", "a\"b"}}, "1.2", {"{\"x\":1}", "{}"}),
            R"({"resourceLogs":[{"resource":{"attributes":[)"
            R"({"key":"service.name","value":{"stringValue":"a\"b"}}]},)"
            R"("scopeLogs":[{"scope":{"name":"ostrelforwarder","version":"1.2"},)"
            R"("logRecords":[{"x":1},{}]}]}]})");
}

}  // namespace
}  // namespace ostrel
