#include "platform/linux/EtcDeviceInfo.h"

#include <cerrno>
#include <cstdlib>
#include <memory>
#include <utility>

#include "platform/Logging.h"
#include "platform/linux/DeadlineRunner.h"
#include "platform/linux/SmallFile.h"

namespace ostrel {
namespace {

bool isNameCharacter(char c, bool isFirst) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || c == '_' ||
         (!isFirst && c >= '0' && c <= '9');
}

bool isBlank(char c) { return c == ' ' || c == '\t' || c == '\r'; }

std::string_view trimmed(std::string_view text) {
  while (!text.empty() && isBlank(text.front())) text.remove_prefix(1);
  while (!text.empty() && isBlank(text.back())) text.remove_suffix(1);
  return text;
}

// One assignment's value at the start of `text`, up to the end of its line; what
// was read is cut off. A quoted part may go over several lines.
std::string takeValue(std::string_view& text) {
  std::string value;
  std::size_t keptBlanks = 0;  // Up to here, blanks at the end belong to it.
  char quote = 0;
  std::size_t i = 0;
  for (; i < text.size(); ++i) {
    const char c = text[i];
    if (quote == 0 && c == '\n') break;
    if (quote == 0 && (c == '"' || c == '\'')) {
      quote = c;
    } else if (c == quote && quote != 0) {
      quote = 0;
      keptBlanks = value.size();
    } else if (c == '\\' && quote != '\'' && i + 1 < text.size()) {
      const char next = text[++i];
      const bool isEscaped =
          quote == 0 || next == '"' || next == '\\' || next == '$' || next == '`';
      if (next == '\n') continue;
      if (!isEscaped) value += c;
      value += next;
      keptBlanks = value.size();
    } else {
      value += c;
    }
  }
  text.remove_prefix(i);
  while (value.size() > keptBlanks && isBlank(value.back())) value.pop_back();
  return value;
}

void skipLine(std::string_view& text) {
  const auto end = text.find('\n');
  text.remove_prefix(end == std::string_view::npos ? text.size() : end + 1);
}

using Variables = std::map<std::string, std::string, std::less<>>;

// None when there is no such file.
std::optional<Variables> readVariables(const std::string& path) {
  const auto text =
      readSmallFile(path, EtcDeviceInfo::kMostFileBytes, FileLinks::kFollow);
  if (text.value) return parseEnvironmentFile(*text.value);
  if (text.error->code != ENOENT) {
    OSTREL_LOG_ERROR(processLogScope, "cannot read device facts: %@", *text.error);
  }
  return std::nullopt;
}

std::string_view valueOf(const std::optional<Variables>& variables,
                         std::string_view name) {
  if (!variables) return {};
  const auto found = variables->find(name);
  return found == variables->end() ? std::string_view() : found->second;
}

std::int32_t deviceClassOfChassis(std::string_view chassis) {
  static constexpr std::pair<std::string_view, std::int32_t> kClasses[] = {
      {"handset", 1},     {"tablet", 2}, {"laptop", 3},  {"desktop", 4},
      {"convertible", 5}, {"watch", 6},  {"embedded", 7}};
  for (const auto& [name, deviceClass] : kClasses) {
    if (name == chassis) return deviceClass;
  }
  return 0;
}

}  // namespace

Variables parseEnvironmentFile(std::string_view text) {
  Variables variables;
  while (!text.empty()) {
    const std::string_view line = text.substr(0, text.find('\n'));
    const std::string_view start = trimmed(line);
    const auto equals = line.find('=');
    if (start.empty() || start.front() == '#' || start.front() == ';' ||
        equals == std::string_view::npos) {
      skipLine(text);
      continue;
    }
    const std::string_view name = trimmed(line.substr(0, equals));
    bool isName = !name.empty();
    for (std::size_t i = 0; i < name.size(); ++i) {
      isName = isName && isNameCharacter(name[i], /*isFirst=*/i == 0);
    }
    text.remove_prefix(equals + 1);
    while (!text.empty() && isBlank(text.front())) text.remove_prefix(1);
    std::string value = takeValue(text);
    if (isName) variables.insert_or_assign(std::string(name), std::move(value));
    skipLine(text);
  }
  return variables;
}

EtcDeviceInfo::Files EtcDeviceInfo::systemFiles() {
  const auto named = [](const char* name) {
    const char* value = std::getenv(name);
    return std::string(value != nullptr ? value : "");
  };
  Files files{named("SYSTEMD_ETC_MACHINE_INFO"), {named("SYSTEMD_OS_RELEASE")}};
  if (files.machineInfo.empty()) files.machineInfo = "/etc/machine-info";
  if (files.osRelease.front().empty()) {
    files.osRelease = {"/etc/os-release", "/usr/lib/os-release"};
  }
  return files;
}

std::optional<Value> EtcDeviceInfo::answer(std::string_view key) const {
  if (key != "InternalBuild" || !facts().isInternalBuild) return std::nullopt;
  return Value(*facts().isInternalBuild);
}

std::int32_t EtcDeviceInfo::deviceClass() const { return facts().deviceClass; }

EtcDeviceInfo::Facts EtcDeviceInfo::read(const Files& files) {
  const auto machineInfo = readVariables(files.machineInfo);
  std::optional<Variables> osRelease;
  for (const std::string& path : files.osRelease) {
    if (!osRelease) osRelease = readVariables(path);
  }
  Facts facts;
  if (machineInfo || osRelease) {
    facts.isInternalBuild = valueOf(machineInfo, "DEPLOYMENT") == "development" ||
                            valueOf(osRelease, "VARIANT_ID") == "internal";
  }
  facts.deviceClass = deviceClassOfChassis(valueOf(machineInfo, "CHASSIS"));
  return facts;
}

const EtcDeviceInfo::Facts& EtcDeviceInfo::facts() const {
  std::call_once(once_, [this] {
    const auto found = std::make_shared<Facts>();
    DeadlineRunner runner(/*mostThreads=*/1);
    const auto result =
        runner.run([files = files_, found] { *found = read(files); }, kMostWait);
    if (result == DeadlineRunner::Result::kDone) {
      facts_ = *found;
    } else {
      OSTREL_LOG_ERROR(processLogScope,
                       "reading device facts takes too long: going on without");
    }
  });
  return facts_;
}

}  // namespace ostrel
