#include "forwarder/ForwarderSettings.h"

#include <gtest/gtest.h>

#include <map>

namespace ostrel {
namespace {

using Variables = std::map<std::string, std::string>;
using std::chrono::milliseconds;

Outcome<ForwarderSettings> read(const Variables& variables) {
  return forwarderSettings([&](const std::string& name) -> std::optional<std::string> {
    const auto found = variables.find(name);
    if (found == variables.end()) return std::nullopt;
    return found->second;
  });
}

/// With an endpoint besides.
Outcome<ForwarderSettings> readWith(Variables variables) {
  variables.emplace("OTEL_EXPORTER_OTLP_ENDPOINT", "https://c.example");
  return read(variables);
}

std::string errorWith(const Variables& variables) {
  const auto settings = readWith(variables);
  return settings.error ? settings.error->description : "none";
}

TEST(ForwarderSettings, AreNoneWithoutAnEndpoint) {
  for (const Variables& variables :
       {Variables(), Variables{{"OTEL_EXPORTER_OTLP_ENDPOINT", ""}},
        Variables{{"OTEL_EXPORTER_OTLP_PROTOCOL", "grpc"}}}) {
    const auto settings = read(variables);
    EXPECT_FALSE(settings.value);
    EXPECT_FALSE(settings.error);
  }
}

TEST(ForwarderSettings, HaveDefaults) {
  const auto settings = readWith({});
  ASSERT_TRUE(settings.value);
  EXPECT_EQ(settings.value->logs.url, "https://c.example/v1/logs");
  EXPECT_EQ(settings.value->timeout, milliseconds(30'000));
  EXPECT_TRUE(settings.value->headers.empty());
  EXPECT_EQ(settings.value->authoritiesFile, "");
  EXPECT_EQ(settings.value->resource,
            (NamesAndValues{{"service.name", "ostrelreportingd"}}));
}

TEST(ForwarderSettings, OfLogsGoBeforeThoseOfAllSignals) {
  const auto settings = read({
      {"OTEL_EXPORTER_OTLP_ENDPOINT", "https://all.example"},
      {"OTEL_EXPORTER_OTLP_LOGS_ENDPOINT", "https://logs.example/mine"},
      {"OTEL_EXPORTER_OTLP_TIMEOUT", "1000"},
      {"OTEL_EXPORTER_OTLP_LOGS_TIMEOUT", "2000"},
      {"OTEL_EXPORTER_OTLP_HEADERS", "a=1"},
      {"OTEL_EXPORTER_OTLP_LOGS_HEADERS", "b=2"},
      {"OTEL_EXPORTER_OTLP_PROTOCOL", "grpc"},
      {"OTEL_EXPORTER_OTLP_LOGS_PROTOCOL", "http/json"},
      {"OTEL_EXPORTER_OTLP_CERTIFICATE", "/all.pem"},
      {"OTEL_EXPORTER_OTLP_LOGS_CERTIFICATE", "/logs.pem"},
      {"OTEL_EXPORTER_OTLP_CLIENT_CERTIFICATE", "/client.pem"},
      {"OTEL_EXPORTER_OTLP_LOGS_CLIENT_KEY", "/key.pem"},
  });
  ASSERT_TRUE(settings.value);
  EXPECT_EQ(settings.value->logs.url, "https://logs.example/mine");
  EXPECT_EQ(settings.value->timeout, milliseconds(2000));
  EXPECT_EQ(settings.value->headers, (NamesAndValues{{"b", "2"}}));
  EXPECT_EQ(settings.value->authoritiesFile, "/logs.pem");
  EXPECT_EQ(settings.value->certificateFile, "/client.pem");
  EXPECT_EQ(settings.value->keyFile, "/key.pem");
}

TEST(ForwarderSettings, SpeakOneProtocol) {
  EXPECT_EQ(errorWith({{"OTEL_EXPORTER_OTLP_PROTOCOL", "http/json"}}), "none");
  for (const char* other : {"grpc", "http/protobuf", "HTTP/JSON"}) {
    EXPECT_EQ(errorWith({{"OTEL_EXPORTER_OTLP_PROTOCOL", other}}),
              "OTEL_EXPORTER_OTLP_PROTOCOL: only http/json is spoken");
  }
}

TEST(ForwarderSettings, TakeTimeoutsFrom1To600000Milliseconds) {
  const auto timeout = [](const char* text) {
    const auto settings = readWith({{"OTEL_EXPORTER_OTLP_TIMEOUT", text}});
    return settings.value ? settings.value->timeout.count() : -1;
  };
  EXPECT_EQ(timeout("0"), -1);
  EXPECT_EQ(timeout("1"), 1);
  EXPECT_EQ(timeout("600000"), 600'000);
  EXPECT_EQ(timeout("600001"), -1);
  EXPECT_EQ(timeout("99999999999999999999"), -1);
  EXPECT_EQ(timeout("10s"), -1);
}

TEST(ForwarderSettings, DecodeHeaders) {
  const auto settings =
      readWith({{"OTEL_EXPORTER_OTLP_HEADERS", " api-key = a%20b%3D , ,x-empty=,y=1=2"}});
  ASSERT_TRUE(settings.value);
  EXPECT_EQ(settings.value->headers,
            (NamesAndValues{{"api-key", "a b="}, {"x-empty", ""}, {"y", "1=2"}}));
}

TEST(ForwarderSettings, RefuseHeadersThatAreNoneAndDoNotRepeatThem) {
  for (const char* text : {"secret", "=secret", "a b=secret", "a=secret%0d%0ab: c",
                           "a=secret%00", "a=secret%2", "a=secret%zz", "a%3A=secret"}) {
    EXPECT_EQ(errorWith({{"OTEL_EXPORTER_OTLP_HEADERS", text}}),
              "OTEL_EXPORTER_OTLP_HEADERS: it is not a list like "
              "\"name=value,name=value\"")
        << text;
  }
}

TEST(ForwarderSettings, NameTheVariableOfABadEndpoint) {
  EXPECT_EQ(
      read({{"OTEL_EXPORTER_OTLP_LOGS_ENDPOINT", "http://c.example"}}).error->description,
      "OTEL_EXPORTER_OTLP_LOGS_ENDPOINT: it is on another machine, to which only "
      "https is spoken");
}

TEST(ForwarderSettings, SayWhatTheRecordsAreOf) {
  const auto resource = [](const Variables& variables) {
    return readWith(variables).value->resource;
  };
  const Variables attributes{
      {"OTEL_RESOURCE_ATTRIBUTES", "service.name=mine,host.name=a%2Cb"}};
  EXPECT_EQ(resource(attributes),
            (NamesAndValues{{"service.name", "mine"}, {"host.name", "a,b"}}));
  Variables withName = attributes;
  withName["OTEL_SERVICE_NAME"] = "other";
  EXPECT_EQ(resource(withName),
            (NamesAndValues{{"service.name", "other"}, {"host.name", "a,b"}}));
}

}  // namespace
}  // namespace ostrel
