#include "forwarder/ForwarderSettings.h"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <string_view>

namespace ostrel {
namespace {

constexpr std::string_view kGeneral = "OTEL_EXPORTER_OTLP_";
constexpr std::string_view kOfLogs = "OTEL_EXPORTER_OTLP_LOGS_";
constexpr std::int64_t kLongestTimeout = 600'000;
constexpr std::string_view kServiceName = "service.name";

/// A variable that is set.
struct Setting {
  std::string name;
  std::string value;
};

ErrorObject wrong(const std::string& name, std::string_view what) {
  return {std::string(kOstrelErrorDomain), 1, name + ": " + std::string(what)};
}

std::optional<Setting> setting(const Environment& environment, std::string name) {
  auto value = environment(name);
  if (!value || value->empty()) return std::nullopt;
  return Setting{std::move(name), *std::move(value)};
}

/// That of logs alone goes before that of all signals.
std::optional<Setting> exporterSetting(const Environment& environment,
                                       std::string_view what) {
  if (auto own = setting(environment, std::string(kOfLogs).append(what))) return own;
  return setting(environment, std::string(kGeneral).append(what));
}

std::string_view trimmed(std::string_view text) {
  while (!text.empty() && (text.front() == ' ' || text.front() == '\t')) {
    text.remove_prefix(1);
  }
  while (!text.empty() && (text.back() == ' ' || text.back() == '\t')) {
    text.remove_suffix(1);
  }
  return text;
}

std::optional<std::string> percentDecoded(std::string_view text) {
  std::string out;
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '%') {
      out += text[i];
      continue;
    }
    unsigned byte = 0;
    const std::string_view digits = text.substr(i + 1, 2);
    const char* const end = digits.data() + digits.size();
    if (digits.size() != 2 ||
        std::from_chars(digits.data(), end, byte, /*base=*/16).ptr != end) {
      return std::nullopt;
    }
    out += static_cast<char>(byte);
    i += 2;
  }
  return out;
}

/// "name=value,name=value", both percent-encoded. None when it is something else.
std::optional<NamesAndValues> namesAndValues(std::string_view text) {
  NamesAndValues all;
  for (std::size_t begin = 0; begin <= text.size();) {
    const std::size_t end = std::min(text.find(',', begin), text.size());
    const std::string_view pair = trimmed(text.substr(begin, end - begin));
    begin = end + 1;
    if (pair.empty()) continue;
    const std::size_t sign = pair.find('=');
    if (sign == std::string_view::npos) return std::nullopt;
    auto name = percentDecoded(trimmed(pair.substr(0, sign)));
    auto value = percentDecoded(trimmed(pair.substr(sign + 1)));
    if (!name || name->empty() || !value) return std::nullopt;
    all.emplace_back(*std::move(name), *std::move(value));
  }
  return all;
}

/// Nothing that could end the header's line, or begin another.
bool isHeader(const std::pair<std::string, std::string>& header) {
  const auto isInName = [](char each) {
    return std::isalnum(static_cast<unsigned char>(each)) != 0 ||
           std::string_view("!#$%&'*+-.^_`|~").find(each) != std::string_view::npos;
  };
  const auto isInValue = [](char each) {
    return static_cast<unsigned char>(each) >= ' ' && each != 0x7F;
  };
  return std::all_of(header.first.begin(), header.first.end(), isInName) &&
         std::all_of(header.second.begin(), header.second.end(), isInValue);
}

using Failure = std::optional<ErrorObject>;

Failure readEndpoint(const Environment& environment, ForwarderSettings& settings,
                     bool& isNamed) {
  // One for logs is taken as it is.
  auto named = setting(environment, std::string(kOfLogs) + "ENDPOINT");
  const bool isWhole = named.has_value();
  if (!named) named = setting(environment, std::string(kGeneral) + "ENDPOINT");
  isNamed = named.has_value();
  if (!named) return std::nullopt;
  auto endpoint = endpointFrom(named->value, isWhole ? "" : "v1/logs");
  if (!endpoint.value) return wrong(named->name, endpoint.error->description);
  settings.logs = *std::move(endpoint.value);
  return std::nullopt;
}

Failure checkProtocol(const Environment& environment) {
  const auto protocol = exporterSetting(environment, "PROTOCOL");
  if (!protocol || protocol->value == "http/json") return std::nullopt;
  return wrong(protocol->name, "only http/json is spoken");
}

Failure readTimeout(const Environment& environment, ForwarderSettings& settings) {
  const auto timeout = exporterSetting(environment, "TIMEOUT");
  if (!timeout) return std::nullopt;
  std::int64_t milliseconds = 0;
  const char* const end = timeout->value.data() + timeout->value.size();
  const auto parsed = std::from_chars(timeout->value.data(), end, milliseconds);
  if (parsed.ec != std::errc() || parsed.ptr != end || milliseconds < 1 ||
      milliseconds > kLongestTimeout) {
    return wrong(timeout->name, "it is not a number of milliseconds from 1 to 600000");
  }
  settings.timeout = std::chrono::milliseconds(milliseconds);
  return std::nullopt;
}

Failure readHeaders(const Environment& environment, ForwarderSettings& settings) {
  const auto headers = exporterSetting(environment, "HEADERS");
  if (!headers) return std::nullopt;
  auto all = namesAndValues(headers->value);
  if (!all || !std::all_of(all->begin(), all->end(), isHeader)) {
    return wrong(headers->name, "it is not a list like \"name=value,name=value\"");
  }
  settings.headers = *std::move(all);
  return std::nullopt;
}

void readFiles(const Environment& environment, ForwarderSettings& settings) {
  const auto file = [&](std::string_view what) {
    const auto named = exporterSetting(environment, what);
    return named ? named->value : std::string();
  };
  settings.authoritiesFile = file("CERTIFICATE");
  settings.certificateFile = file("CLIENT_CERTIFICATE");
  settings.keyFile = file("CLIENT_KEY");
}

void setNamed(NamesAndValues& all, std::string_view name, std::string value) {
  for (auto& [known, itsValue] : all) {
    if (known == name) {
      itsValue = std::move(value);
      return;
    }
  }
  all.emplace_back(name, std::move(value));
}

Failure readResource(const Environment& environment, ForwarderSettings& settings) {
  settings.resource = {{std::string(kServiceName), "ostrelreportingd"}};
  if (const auto named = setting(environment, "OTEL_RESOURCE_ATTRIBUTES")) {
    auto all = namesAndValues(named->value);
    if (!all) {
      return wrong(named->name, "it is not a list like \"name=value,name=value\"");
    }
    for (auto& [name, value] : *all) setNamed(settings.resource, name, std::move(value));
  }
  if (auto named = setting(environment, "OTEL_SERVICE_NAME")) {
    setNamed(settings.resource, kServiceName, std::move(named->value));
  }
  return std::nullopt;
}

}  // namespace

Outcome<ForwarderSettings> forwarderSettings(const Environment& environment) {
  ForwarderSettings settings;
  bool isNamed = false;
  Failure failed = readEndpoint(environment, settings, isNamed);
  if (!failed && !isNamed) return {};
  if (!failed) failed = checkProtocol(environment);
  if (!failed) failed = readTimeout(environment, settings);
  if (!failed) failed = readHeaders(environment, settings);
  if (!failed) failed = readResource(environment, settings);
  if (failed) return {{}, std::move(failed)};
  readFiles(environment, settings);
  return {std::move(settings), {}};
}

}  // namespace ostrel
