// A channel file: the counters of one group and subgroup, mapped into memory by
// the processes that publish them. `docs/channels.md` is the reference.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>

namespace ostrel::channels {

inline constexpr char kMagic[8] = {'O', 'S', 'T', 'R', 'C', 'H', 'A', 'N'};
inline constexpr std::uint32_t kVersion = 1;

/// With the NUL at the end.
inline constexpr std::size_t kGroupBytes = 40;
inline constexpr std::size_t kNameBytes = 56;

/// Of one file; 1 MiB of records.
inline constexpr std::uint32_t kMostCounters = 16384;

struct Header {
  char magic[sizeof kMagic];
  std::uint32_t version;
  std::uint32_t capacity;  // Records that the file has room for.
  std::uint32_t count;     // Records in use; set after the record is.
  std::uint32_t unused;
  char group[kGroupBytes];
  char subgroup[kGroupBytes];
  char reserved[24];
};

struct Record {
  char name[kNameBytes];
  std::int64_t value;  // Read and written as one.
};

static_assert(sizeof(Header) == 128 && std::is_trivial_v<Header>);
static_assert(sizeof(Record) == 64 && std::is_trivial_v<Record>);
static_assert(std::atomic_ref<std::int64_t>::is_always_lock_free);

inline constexpr std::size_t fileBytes(std::uint32_t capacity) {
  return sizeof(Header) + std::size_t{capacity} * sizeof(Record);
}

namespace internal {

inline constexpr std::string_view kDigits = "0123456789ABCDEF";

inline bool isPlain(char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') ||
         c == '-' || c == '_';
}

}  // namespace internal

/// A group's or subgroup's place in a file name: letters, digits, "-" and "_" as
/// they are, other bytes as "%" and two capital hexadecimal digits; "%" for an empty
/// one.
inline std::string escapedName(std::string_view name) {
  if (name.empty()) return "%";
  std::string text;
  for (const char c : name) {
    if (internal::isPlain(c)) {
      text += c;
    } else {
      const auto byte = static_cast<unsigned char>(c);
      text += '%';
      text += internal::kDigits[byte >> 4];
      text += internal::kDigits[byte & 15];
    }
  }
  return text;
}

/// What `escapedName` made `text` of; none when it did not.
inline std::optional<std::string> unescapedName(std::string_view text) {
  if (text == "%") return std::string();
  std::string name;
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '%') {
      name += text[i];
      continue;
    }
    if (i + 2 >= text.size()) return std::nullopt;
    const auto high = internal::kDigits.find(text[i + 1]);
    const auto low = internal::kDigits.find(text[i + 2]);
    if (high == std::string_view::npos || low == std::string_view::npos) {
      return std::nullopt;
    }
    name += static_cast<char>(high << 4 | low);
    i += 2;
  }
  if (escapedName(name) != text) return std::nullopt;
  return name;
}

/// "GROUP.SUBGROUP", both escaped.
inline std::string fileName(std::string_view group, std::string_view subgroup) {
  return escapedName(group) + "." + escapedName(subgroup);
}

struct GroupAndSubgroup {
  std::string group;
  std::string subgroup;
};
/// None for a name that `fileName` does not give.
inline std::optional<GroupAndSubgroup> namesOfFile(std::string_view fileName) {
  const auto dot = fileName.find('.');
  if (dot == std::string_view::npos) return std::nullopt;
  auto group = unescapedName(fileName.substr(0, dot));
  auto subgroup = unescapedName(fileName.substr(dot + 1));
  if (!group || !subgroup) return std::nullopt;
  return GroupAndSubgroup{std::move(*group), std::move(*subgroup)};
}

}  // namespace ostrel::channels
