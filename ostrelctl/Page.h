#pragma once

#include <cstdint>
#include <ostream>
#include <string>
#include <string_view>
#include <vector>

namespace ostrel {

/// Text as a terminal may show it: control characters as "\u001b" and the like.
std::string printable(std::string_view text);

/// Microseconds since 1970 as local time, "2026-01-31 13:00:00.250".
std::string localTime(std::int64_t microseconds);

/// A page for a person.
class Page {
 public:
  using Cells = std::vector<std::string>;

  /// `out` outlives the page.
  Page(std::ostream& out, bool colours) : out_(out), colours_(colours) {}

  void heading(std::string_view text);
  /// One line per entry, what stands in front in even columns; the last cell of a
  /// row is not padded. `header` may be empty. Cells are made printable.
  void table(const Cells& header, const std::vector<Cells>& rows, std::size_t indent);
  void line(std::string_view text, std::size_t indent);

 private:
  void write(const Cells& row, const std::vector<std::size_t>& widths, std::size_t indent,
             std::string_view style);

  std::ostream& out_;
  const bool colours_;
};

}  // namespace ostrel
