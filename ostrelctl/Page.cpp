#include "ostrelctl/Page.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <ctime>

namespace ostrel {
namespace {

constexpr std::string_view kBold = "\x1b[1m";
constexpr std::string_view kDim = "\x1b[2m";
constexpr std::string_view kPlain = "\x1b[0m";

/// In code points.
std::size_t width(std::string_view text) {
  return static_cast<std::size_t>(std::count_if(
      text.begin(), text.end(), [](char byte) { return (byte & 0xC0) != 0x80; }));
}

}  // namespace

std::string printable(std::string_view text) {
  std::string shown;
  for (std::size_t i = 0; i < text.size(); ++i) {
    unsigned code = static_cast<unsigned char>(text[i]);
    // The controls from 0x80 to 0x9F stand in two bytes.
    if (code == 0xC2 && i + 1 < text.size() &&
        static_cast<unsigned char>(text[i + 1]) < 0xA0) {
      code = static_cast<unsigned char>(text[++i]);
    } else if (code >= 0x20 && code != 0x7F) {
      shown += text[i];
      continue;
    }
    std::array<char, 8> escape;
    std::snprintf(escape.data(), escape.size(), "\\u%04x", code);
    shown += escape.data();
  }
  return shown;
}

std::string localTime(std::int64_t microseconds) {
  constexpr std::int64_t kPerSecond = 1'000'000;
  std::int64_t seconds = microseconds / kPerSecond;
  std::int64_t rest = microseconds % kPerSecond;
  if (rest < 0) {
    rest += kPerSecond;
    --seconds;
  }
  const auto time = static_cast<std::time_t>(seconds);
  std::tm local{};
  if (::localtime_r(&time, &local) == nullptr) return std::to_string(microseconds);
  std::array<char, 64> text;
  std::strftime(text.data(), text.size(), "%Y-%m-%d %H:%M:%S", &local);
  std::array<char, 8> milliseconds;
  std::snprintf(milliseconds.data(), milliseconds.size(), ".%03d",
                static_cast<int>(rest / 1000));
  return std::string(text.data()) + milliseconds.data();
}

void Page::heading(std::string_view text) {
  if (colours_) out_ << kBold;
  out_ << printable(text);
  if (colours_) out_ << kPlain;
  out_ << '\n';
}

void Page::table(const Cells& header, const std::vector<Cells>& rows,
                 std::size_t indent) {
  std::vector<Cells> shown;
  if (!header.empty()) shown.push_back(header);
  for (const Cells& row : rows) {
    Cells& cells = shown.emplace_back();
    for (const std::string& cell : row) cells.push_back(printable(cell));
  }
  std::vector<std::size_t> widths;
  for (const Cells& row : shown) {
    widths.resize(std::max(widths.size(), row.size()));
    for (std::size_t i = 0; i < row.size(); ++i) {
      widths[i] = std::max(widths[i], width(row[i]));
    }
  }
  for (std::size_t i = 0; i < shown.size(); ++i) {
    write(shown[i], widths, indent,
          i == 0 && !header.empty() ? kDim : std::string_view());
  }
}

void Page::line(std::string_view text, std::size_t indent) {
  out_ << std::string(indent, ' ') << printable(text) << '\n';
}

void Page::write(const Cells& row, const std::vector<std::size_t>& widths,
                 std::size_t indent, std::string_view style) {
  std::string text(indent, ' ');
  for (std::size_t i = 0; i < row.size(); ++i) {
    text += row[i];
    if (i + 1 < row.size()) text.append(widths[i] - width(row[i]) + 2, ' ');
  }
  text.erase(text.find_last_not_of(' ') + 1);
  if (colours_ && !style.empty()) {
    out_ << style << text << kPlain << '\n';
  } else {
    out_ << text << '\n';
  }
}

}  // namespace ostrel
