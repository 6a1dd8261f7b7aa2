#pragma once

#include <array>
#include <cstdint>
#include <map>
#include <string>
#include <string_view>
#include <vector>

#include "Statistics/OstrelReportingUtility.h"

namespace ostrel {

/// The name of one message, such as "Routing_RouteChange_Start_1", made without an
/// allocation.
class MessageIdentifier {
 public:
  MessageIdentifier(std::string_view name, std::int64_t number);

  std::string_view text() const { return {text_.data(), size_}; }

 private:
  // The longest name has 39 characters, the longest number 20.
  std::array<char, 64> text_;
  std::size_t size_;
};

/// How many messages of a session had each name. A session knows few names, most of
/// them one, so that the first stands here and the others in a row.
class MessageCounts {
 public:
  /// Counts a message with these names, which are those of `messageNames`, and
  /// identifies it.
  MessageIdentifier next(const MessageNames& names);

  /// The counts by the names, without those that are 0.
  std::map<std::string, std::int64_t> byName() const;

 private:
  struct Count {
    const MessageNames* names = nullptr;
    std::int64_t count = 0;
  };

  Count& countOf(const MessageNames& names);

  Count first_;
  std::vector<Count> others_;  // By address.
};

}  // namespace ostrel
