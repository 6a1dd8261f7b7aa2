// Rows on their way into a table, many at a time.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/ValueBuffer.h"

namespace ostrel {

/// Empties a text that is used again. What a very long one took is given back.
inline void emptyText(std::string& text) {
  constexpr std::size_t kKept = 2 * 1024 * 1024;
  text.clear();
  if (text.capacity() > kKept) text = std::string();
}

/// A piece of a batch's text. Not there: NULL.
struct RowText {
  std::size_t begin = 0;
  std::size_t size = 0;
  bool isThere = false;
};

/// What rows are of; a number of the store.
enum class RowKind : std::int64_t { kMessages, kAnalytics, kPower, kSessions };
inline constexpr std::size_t kRowKinds = 4;

struct MessageRow {
  std::optional<std::int64_t> session;
  RowText sessionInfo;
  RowText userInfo;
  std::uint16_t category = 0;
  std::uint16_t type = 0;
  RowText payload;
  std::int64_t createdAt = 0;
  std::int64_t user = PayloadAccount::kNobody;
};

struct AnalyticsRow {
  RowText name;
  RowText payload;
  std::int64_t createdAt = 0;
  std::int64_t user = PayloadAccount::kNobody;
};

/// Rows that share one growing text.
struct RowBatch {
  std::string text;
  std::vector<MessageRow> messages;
  std::vector<AnalyticsRow> analytics;

  std::string_view of(RowText piece) const {
    return std::string_view(text).substr(piece.begin, piece.size);
  }
  bool empty() const { return messages.empty() && analytics.empty(); }
  void clear() {
    emptyText(text);
    messages.clear();
    analytics.clear();
  }
};

}  // namespace ostrel
