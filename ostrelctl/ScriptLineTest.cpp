#include "ostrelctl/ScriptLine.h"

#include <gtest/gtest.h>

#include <limits>

#include "ostrelctl/FakeServiceConnection.h"

namespace ostrel {
namespace {

/// The message of a `sendMessage` line with this text in it.
std::optional<Dictionary> messageOf(const std::string& json) {
  const auto line = parseScriptLine(
      "{\"op\":\"sendMessage\",\"category\":1,\"type\":0,"
      "\"message\":" +
      json + "}");
  if (!line.command) return std::nullopt;
  FakeServiceConnection service;
  std::get<ScriptRequest>(*line.command).send(service, [](const std::string&) {});
  return service.lastMessage;
}

std::string errorOf(std::string_view text) {
  const auto line = parseScriptLine(text);
  EXPECT_FALSE(line.command) << text;
  return line.error;
}

bool isRequest(const std::string& text) {
  return parseScriptLine(text).command.has_value();
}

TEST(ScriptLine, KeepsIntegersExactOverBothRanges) {
  const auto message = messageOf(
      R"({"a":9223372036854775807,"b":-9223372036854775808,"c":18446744073709551615})");
  ASSERT_TRUE(message);
  EXPECT_EQ(message->find("a")->signedInteger(),
            std::numeric_limits<std::int64_t>::max());
  EXPECT_EQ(message->find("b")->signedInteger(),
            std::numeric_limits<std::int64_t>::min());
  EXPECT_EQ(message->find("c")->unsignedInteger(),
            std::numeric_limits<std::uint64_t>::max());
}

TEST(ScriptLine, RefusesIntegersBeyondBothRanges) {
  EXPECT_FALSE(messageOf("{\"a\":18446744073709551616}"));
  EXPECT_FALSE(messageOf("{\"a\":-9223372036854775809}"));
}

TEST(ScriptLine, ReadsNumbersWithAFractionOrAnExponentAsDoubles) {
  const auto message = messageOf(R"({"a":1.0,"b":1e3,"c":-0.5,"d":1})");
  ASSERT_TRUE(message);
  EXPECT_EQ(message->find("a")->floatingPoint(), 1.0);
  EXPECT_EQ(message->find("b")->floatingPoint(), 1000.0);
  EXPECT_EQ(message->find("c")->floatingPoint(), -0.5);
  EXPECT_EQ(message->find("d")->floatingPoint(), std::nullopt);
}

TEST(ScriptLine, ReadsDatesAtAnyDepth) {
  const auto message = messageOf(R"({"a":[{"$date":"2026-01-31T12:00:00.250Z"}]})");
  ASSERT_TRUE(message);
  const auto date = (*message->find("a")->array()->begin()).date();
  ASSERT_TRUE(date);
  EXPECT_EQ(date->secondsSince1970, 1769860800.25);
}

TEST(ScriptLine, RefusesADateThatIsNone) {
  EXPECT_FALSE(messageOf(R"({"a":{"$date":"yesterday"}})"));
  EXPECT_FALSE(messageOf(R"({"a":{"$date":5}})"));
}

TEST(ScriptLine, ReadsADateKeyAmongOthersAsADictionary) {
  const auto message = messageOf(R"({"a":{"$date":"yesterday","b":1}})");
  ASSERT_TRUE(message);
  EXPECT_EQ(message->find("a")->dictionary()->find("$date")->string(), "yesterday");
}

TEST(ScriptLine, KeepsTheOrderOfTheKeys) {
  EXPECT_EQ(description(*messageOf(R"({"z":1,"a":[true,"x"],"m":{}})")),
            "{z: 1, a: [true, x], m: {}}");
}

TEST(ScriptLine, KeepsANULInText) {
  EXPECT_EQ(messageOf(R"({"a":"x\u0000y"})")->find("a")->string(),
            std::string_view("x\0y", 3));
}

TEST(ScriptLine, RefusesWhatNoValueIs) {
  EXPECT_EQ(errorOf(R"({"op":"sendMessage","message":{"a":null},"category":1,"type":0})"),
            "sendMessage: message is no dictionary: null stands where a value must");
  EXPECT_FALSE(messageOf("{\"a\":NaN}"));
  EXPECT_FALSE(messageOf("{\"a\":1e999}"));
  EXPECT_FALSE(messageOf("{\"a\":1,\"a\":2}"));
  EXPECT_FALSE(messageOf("[]"));
  EXPECT_FALSE(messageOf("null"));
  EXPECT_FALSE(messageOf(R"({"$date":"2026-01-31T12:00:00Z"})"));
}

TEST(ScriptLine, ReadsPayloadsThatNestDeeperThanTheServiceAllows) {
  std::string deep = "1";
  for (int i = 0; i < 100; ++i) deep = "[" + deep + "]";
  EXPECT_TRUE(messageOf("{\"a\":" + deep + "}"));
}

TEST(ScriptLine, RefusesEndlessNesting) {
  EXPECT_EQ(errorOf(std::string(100000, '[')), "not a JSON object: it nests too deeply");
}

TEST(ScriptLine, RefusesWhatIsNoObject) {
  EXPECT_EQ(errorOf("5"), "not a JSON object");
  EXPECT_EQ(errorOf("[]"), "not a JSON object");
  EXPECT_EQ(errorOf("{\"op\":"), "not a JSON object: it is not JSON from character 7 on");
  EXPECT_EQ(errorOf("{\"wait\":1} {\"wait\":1}"),
            "not a JSON object: it is not JSON from character 12 on");
  EXPECT_EQ(errorOf("{\"wait\":1,\"wait\":1}"),
            "not a JSON object: the key \"wait\" stands twice in one object");
  EXPECT_EQ(errorOf("\xff"), "not a JSON object: it is not JSON from character 1 on");
}

TEST(ScriptLine, RefusesAnObjectWithNoneOrTwoCommands) {
  EXPECT_EQ(errorOf("{}"),
            R"(the object has none of "op", "wait", "sleep", "close", "abort")");
  EXPECT_EQ(errorOf(R"({"op":"getAllReporters","wait":1})"),
            R"("op" and "wait" stand in one object)");
}

TEST(ScriptLine, RefusesAnOperationThatIsNone) {
  EXPECT_EQ(errorOf(R"({"op":"getallreporters"})"),
            "there is no operation \"getallreporters\"");
  EXPECT_EQ(errorOf(R"({"op":7})"), "op must be a text");
  EXPECT_EQ(errorOf(R"({"op":"getAllReporters","client":7})"),
            "getAllReporters: client must be a text");
}

TEST(ScriptLine, RefusesAMissingArgument) {
  EXPECT_EQ(errorOf(R"({"op":"createReportingSession"})"),
            "createReportingSession: reporterID is missing");
  EXPECT_EQ(errorOf(R"({"op":"setServiceType","reporterID":1})"),
            "setServiceType: serviceType is missing");
  EXPECT_EQ(errorOf(R"({"op":"setConfiguration","reporterID":1})"),
            "setConfiguration: configuration is missing");
  EXPECT_EQ(errorOf(R"({"op":"sendMessage","category":1,"type":0})"),
            "sendMessage: message is missing");
  EXPECT_EQ(errorOf(R"({"op":"sendMessage","message":{},"type":0})"),
            "sendMessage: category is missing");
  EXPECT_EQ(errorOf(R"({"op":"sendMessage","message":{},"category":1})"),
            "sendMessage: type is missing");
}

TEST(ScriptLine, ChecksTheRangeOfAReporterID) {
  const auto withID = [](const std::string& id) {
    return "{\"op\":\"reporterIDValid\",\"reporterID\":" + id + "}";
  };
  EXPECT_TRUE(isRequest(withID("9223372036854775807")));
  EXPECT_FALSE(isRequest(withID("9223372036854775808")));
  EXPECT_TRUE(isRequest(withID("-9223372036854775808")));
  EXPECT_FALSE(isRequest(withID("-9223372036854775809")));
  EXPECT_FALSE(isRequest(withID("1.0")));
  EXPECT_FALSE(isRequest(withID("\"one\"")));
  EXPECT_FALSE(isRequest(withID("null")));
  EXPECT_FALSE(isRequest(withID("true")));
}

TEST(ScriptLine, ChecksTheRangeOfCodes) {
  const auto withCodes = [](const std::string& category, const std::string& type) {
    return "{\"op\":\"sendMessage\",\"message\":{},\"category\":" + category +
           ",\"type\":" + type + "}";
  };
  EXPECT_TRUE(isRequest(withCodes("4294967295", "65535")));
  EXPECT_TRUE(isRequest(withCodes("\"0xFFFFFFFF\"", "\"0xffff\"")));
  EXPECT_TRUE(isRequest(withCodes("\"12\"", "0")));
  EXPECT_FALSE(isRequest(withCodes("4294967296", "0")));
  EXPECT_FALSE(isRequest(withCodes("\"0x100000000\"", "0")));
  EXPECT_FALSE(isRequest(withCodes("0", "65536")));
  EXPECT_FALSE(isRequest(withCodes("0", "\"0x10000\"")));
  EXPECT_FALSE(isRequest(withCodes("-1", "0")));
  EXPECT_FALSE(isRequest(withCodes("1.0", "0")));
  EXPECT_FALSE(isRequest(withCodes("\"0x\"", "0")));
  EXPECT_FALSE(isRequest(withCodes("\"\"", "0")));
  EXPECT_FALSE(isRequest(withCodes("\"-1\"", "0")));
  EXPECT_FALSE(isRequest(withCodes("\"7 \"", "0")));
  EXPECT_FALSE(isRequest(withCodes("\"0x0x1\"", "0")));
}

TEST(ScriptLine, ChecksTheIDsOfAMessage) {
  const auto withIDs = [](const std::string& ids) {
    return R"({"op":"sendMessage","message":{},"category":1,"type":0,"reporterIDs":)" +
           ids + "}";
  };
  EXPECT_TRUE(isRequest(withIDs("[]")));
  EXPECT_TRUE(isRequest(withIDs("null")));
  EXPECT_FALSE(isRequest(withIDs("5")));
  EXPECT_FALSE(isRequest(withIDs("[\"5\"]")));
  EXPECT_FALSE(isRequest(withIDs("[9223372036854775808]")));
}

TEST(ScriptLine, ChecksTimes) {
  EXPECT_FALSE(isRequest("{\"wait\":-1}"));
  EXPECT_FALSE(isRequest("{\"wait\":\"1\"}"));
  EXPECT_FALSE(isRequest("{\"sleep\":null}"));
  const auto line = parseScriptLine("{\"wait\":1e300}");
  ASSERT_TRUE(line.command);
  EXPECT_GT(std::get<ScriptWait>(*line.command).longest, std::chrono::hours(24 * 365));
}

TEST(ScriptLine, WantsNamesOfConnectionsAsText) {
  EXPECT_EQ(errorOf("{\"close\":1}"), "close must be a text");
  EXPECT_EQ(errorOf("{\"abort\":null}"), "abort must be a text");
}

TEST(ScriptLine, TellsBlankLines) {
  EXPECT_TRUE(isBlankLine(""));
  EXPECT_TRUE(isBlankLine(" \t\r"));
  EXPECT_FALSE(isBlankLine(" {"));
}

}  // namespace
}  // namespace ostrel
