#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Outcome.h"

namespace ostrel {

struct ChannelValue {
  std::string name;  // UTF-8.
  std::int64_t value;

  friend bool operator==(const ChannelValue&, const ChannelValue&) = default;
};

/// Counters that can be read together, of one group and subgroup. Reading may
/// take long or hang, and may happen on any thread, one at a time.
class ChannelSource {
 public:
  virtual ~ChannelSource() = default;

  /// Distinct among all sources.
  virtual const std::string& identifier() const = 0;

  /// What is there now.
  virtual Outcome<std::vector<ChannelValue>> read() const = 0;
};

/// Finds sources by group and subgroup.
class ChannelFinder {
 public:
  struct Found {
    std::vector<std::shared_ptr<const ChannelSource>> sources;
    std::optional<ErrorObject> error;  // The first of what could not be looked at.
  };

  virtual ~ChannelFinder() = default;

  /// The sources in the group and subgroup; none matches any. May hang. Any thread.
  virtual Found find(const std::optional<std::string>& group,
                     const std::optional<std::string>& subgroup) const = 0;
};

}  // namespace ostrel
