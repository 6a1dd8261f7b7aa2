#include "ostrelctl/ChannelsCommand.h"

#include <cerrno>
#include <charconv>
#include <memory>
#include <nlohmann/json.hpp>
#include <system_error>

#include "ostrel/channels.h"
#include "ostrelctl/Page.h"
#include "platform/linux/ChannelFile.h"
#include "platform/linux/ChannelFileFormat.h"

namespace ostrel {
namespace {

constexpr int kDone = 0;
constexpr int kFailed = 1;
constexpr int kWrongUsage = 2;

// Room for what later calls publish in the same file.
constexpr std::uint32_t kCapacity = 1024;

int fail(std::ostream& err, int status, const std::string& sentence) {
  err << "ostrelctl: " << sentence << "\n";
  return status;
}

std::string groupText(const channels::GroupAndSubgroup& names) {
  return (names.group.empty() ? "-" : names.group) + " " +
         (names.subgroup.empty() ? "-" : names.subgroup);
}

int list(const ChannelsCommand& command, const std::string& directory, std::ostream& out,
         std::ostream& err) {
  const auto wanted = [](const std::string& name) {
    return name.empty() ? std::nullopt : std::optional(name);
  };
  const auto found =
      ChannelFileFinder(directory).find(wanted(command.group), wanted(command.subgroup));
  auto listed = nlohmann::ordered_json::array();
  std::optional<ErrorObject> error = found.error;
  for (const auto& source : found.sources) {
    const std::string& path = source->identifier();
    const auto names = channels::namesOfFile(path.substr(path.rfind('/') + 1));
    const auto values = source->read();
    if (!values.value || !names) {
      error = values.error;
      continue;
    }
    if (!command.asJSON) out << printable(groupText(*names)) << "\n";
    auto counters = nlohmann::ordered_json::object();
    for (const ChannelValue& one : *values.value) {
      if (!command.asJSON) out << "  " << printable(one.name) << " " << one.value << "\n";
      counters[one.name] = one.value;
    }
    listed.push_back({{"group", names->group},
                      {"subgroup", names->subgroup},
                      {"counters", std::move(counters)}});
  }
  if (command.asJSON) out << listed.dump(/*indent=*/2) << "\n";
  return error ? fail(err, kFailed, error->description) : kDone;
}

int publish(const ChannelsCommand& command, const std::string& directory,
            std::ostream& err) {
  if (command.assignments.empty()) {
    return fail(err, kWrongUsage, "nothing to publish: give NAME=VALUE");
  }
  std::vector<ChannelAssignment> assignments;
  for (const std::string& text : command.assignments) {
    auto assignment = channelAssignment(text);
    if (!assignment) {
      return fail(err, kWrongUsage,
                  "\"" + text + "\" is not NAME=VALUE with a 64-bit number");
    }
    assignments.push_back(std::move(*assignment));
  }
  const auto failBy = [&](int error, const std::string& what) {
    return fail(err, error == EINVAL ? kWrongUsage : kFailed,
                "cannot publish " + what + ": " + std::generic_category().message(error));
  };
  ostrel_channels* opened = nullptr;
  if (const int error =
          ostrel_channels_open_in(directory.c_str(), command.group.c_str(),
                                  command.subgroup.c_str(), kCapacity, &opened)) {
    return failBy(error, "in " + directory);
  }
  const std::unique_ptr<ostrel_channels, void (*)(ostrel_channels*)> closer(
      opened, &ostrel_channels_close);
  for (const ChannelAssignment& assignment : assignments) {
    ostrel_counter* counter = nullptr;
    const int error = ostrel_channels_counter(opened, assignment.name.c_str(), &counter);
    if (error != 0) return failBy(error, assignment.name);
    ostrel_channels_set(counter, assignment.value);
  }
  return kDone;
}

}  // namespace

std::optional<ChannelAssignment> channelAssignment(std::string_view text) {
  const auto equals = text.rfind('=');
  if (equals == std::string_view::npos || equals == 0) return std::nullopt;
  std::string_view number = text.substr(equals + 1);
  if (!number.empty() && number.front() == '+') number.remove_prefix(1);
  ChannelAssignment assignment{std::string(text.substr(0, equals)), 0};
  const auto [end, error] =
      std::from_chars(number.data(), number.data() + number.size(), assignment.value);
  if (error != std::errc() || end != number.data() + number.size()) {
    return std::nullopt;
  }
  return assignment;
}

int runChannels(const ChannelsCommand& command, const std::string& directory,
                std::ostream& out, std::ostream& err) {
  if (command.action == ChannelsCommand::Action::kPublish) {
    return publish(command, directory, err);
  }
  return list(command, directory, out, err);
}

}  // namespace ostrel
