// The grammar is narrower than that of URLs: what two parsers might read in two ways is
// refused, since whether a request may leave the machine unencrypted hangs on the host.
#include "forwarder/Endpoint.h"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <optional>

namespace ostrel {
namespace {

Outcome<Endpoint> refused(std::string sentence) {
  return {{}, ErrorObject{std::string(kOstrelErrorDomain), 1, std::move(sentence)}};
}

std::string lowered(std::string_view text) {
  std::string out(text);
  for (char& each : out) {
    each = static_cast<char>(std::tolower(static_cast<unsigned char>(each)));
  }
  return out;
}

bool isPlain(std::string_view text) {
  return std::all_of(text.begin(), text.end(), [](char each) {
    return each > ' ' && each < 0x7F &&
           std::string_view("\"<>\\^`{|}#").find(each) == std::string_view::npos;
  });
}

std::optional<int> numberUpTo(std::string_view text, int most) {
  int number = 0;
  const auto [end, error] =
      std::from_chars(text.data(), text.data() + text.size(), number);
  const bool isNumber = error == std::errc() && end == text.data() + text.size() &&
                        !text.empty() && text.front() != '-';
  return isNumber && number <= most ? std::optional(number) : std::nullopt;
}

/// "127.x.y.z" with four decimal numbers. Shorter and other spellings of such an address
/// are no loopback here.
bool isLoopbackAddress(std::string_view host) {
  if (!host.starts_with("127.")) return false;
  int parts = 0;
  for (std::size_t begin = 0; begin <= host.size(); ++parts) {
    const std::size_t end = std::min(host.find('.', begin), host.size());
    const std::string_view part = host.substr(begin, end - begin);
    const bool isOctal = part.size() > 1 && part.front() == '0';
    if (isOctal || !numberUpTo(part, /*most=*/255)) return false;
    begin = end + 1;
  }
  return parts == 4;
}

bool isHost(std::string_view host) {
  const bool isIPv6 = host.size() > 2 && host.front() == '[' && host.back() == ']';
  const std::string_view name = isIPv6 ? host.substr(1, host.size() - 2) : host;
  return !name.empty() && std::all_of(name.begin(), name.end(), [&](char each) {
    const bool isDigit = std::isxdigit(static_cast<unsigned char>(each)) != 0;
    if (isIPv6) return isDigit || each == ':' || each == '.';
    return std::isalnum(static_cast<unsigned char>(each)) != 0 || each == '.' ||
           each == '-' || each == '_';
  });
}

/// Splits "host:port"; the port is empty when there is none.
struct Authority {
  explicit Authority(std::string_view text) {
    const std::size_t colon = text.rfind(':');
    const std::size_t bracket = text.rfind(']');
    const bool hasPort = colon != std::string_view::npos &&
                         (bracket == std::string_view::npos || colon > bracket);
    host = lowered(hasPort ? text.substr(0, colon) : text);
    if (hasPort) port = text.substr(colon);
  }
  bool isRight() const {
    const auto number =
        numberUpTo(std::string_view(port).substr(port.empty() ? 0 : 1), /*most=*/65535);
    return isHost(host) && (port.empty() || number.value_or(0) > 0);
  }

  std::string host;
  std::string port;  // With its colon.
};

std::string withPath(std::string_view rest, std::string_view signalPath) {
  const std::size_t query = std::min(rest.find('?'), rest.size());
  std::string path(rest.substr(0, query));
  if (path.empty() || path.back() != '/') path += '/';
  return path.append(signalPath).append(rest.substr(query));
}

}  // namespace

Outcome<Endpoint> endpointFrom(std::string_view text, std::string_view signalPath) {
  const std::size_t colon = text.find("://");
  if (colon == std::string_view::npos || !isPlain(text)) {
    return refused("it is no URL like \"https://collector.example:4318\"");
  }
  const std::string scheme = lowered(text.substr(0, colon));
  if (scheme != "http" && scheme != "https") {
    return refused("its scheme is neither https nor http");
  }
  text.remove_prefix(colon + 3);
  const std::size_t end = std::min(text.find_first_of("/?"), text.size());
  const std::string_view authority = text.substr(0, end);
  if (authority.find('@') != std::string_view::npos) {
    return refused("it has a user name; secrets belong into headers");
  }
  const Authority parts(authority);
  if (!parts.isRight()) return refused("its host or its port is none");

  Endpoint endpoint;
  endpoint.isSecure = scheme == "https";
  endpoint.isLoopback =
      parts.host == "localhost" || parts.host == "[::1]" || isLoopbackAddress(parts.host);
  endpoint.place = scheme + "://" + parts.host + parts.port;
  const std::string_view rest = text.substr(end);
  endpoint.url = endpoint.place + (signalPath.empty() && !rest.empty() && rest[0] == '/'
                                       ? std::string(rest)
                                       : withPath(rest, signalPath));
  if (!endpoint.isSecure && !endpoint.isLoopback) {
    return refused("it is on another machine, to which only https is spoken");
  }
  return {std::move(endpoint), {}};
}

}  // namespace ostrel
