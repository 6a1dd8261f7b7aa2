#pragma once

#include <cstdint>
#include <optional>
#include <ostream>
#include <string>
#include <string_view>
#include <vector>

namespace ostrel {

/// One counter to publish, of "NAME=VALUE".
struct ChannelAssignment {
  std::string name;
  std::int64_t value;

  friend bool operator==(const ChannelAssignment&, const ChannelAssignment&) = default;
};

/// None unless `text` is a name, "=" and a decimal number of 64 bits. The name may
/// hold "=" too: the last one counts.
std::optional<ChannelAssignment> channelAssignment(std::string_view text);

/// `ostrelctl channels`.
struct ChannelsCommand {
  enum class Action { kList, kPublish };

  Action action = Action::kList;
  bool asJSON = false;                   // Of a list.
  std::string group;                     // Empty: left out.
  std::string subgroup;                  // Empty: left out.
  std::vector<std::string> assignments;  // "NAME=VALUE", to publish.
};

/// Lists or publishes the driver channels in `directory`. Writes what was found to
/// `out`, and a sentence to `err` when it fails. Returns the exit status: 0 done, 1
/// failed, 2 wrong usage.
int runChannels(const ChannelsCommand& command, const std::string& directory,
                std::ostream& out, std::ostream& err);

}  // namespace ostrel
