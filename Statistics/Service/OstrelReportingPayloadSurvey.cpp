#include "Statistics/Service/OstrelReportingPayloadSurvey.h"

#include <bit>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string_view>

#include "Statistics/OstrelReportingWattlogUtility.h"

namespace ostrel {
namespace {

// Not 0 where one of the eight characters from `text` on is a blank: the lowest byte of
// it that is not 0 is that of the first.
std::uint64_t blanksIn8(const char* text) {
  constexpr std::uint64_t kOnes = 0x0101010101010101;
  std::uint64_t word;
  std::memcpy(&word, text, sizeof word);
  word ^= kOnes * ' ';
  return (word - kOnes) & ~word & (kOnes << 7);
}

// Keys are short: a call of `memchr` takes longer than the search. Up to `readableEnd`
// there are bytes, be it other ones than of the text; null: nothing is known of any.
bool holdsBlank(std::string_view text, const char* readableEnd) {
  if (text.size() < 8) {
    const bool hasWord = readableEnd != nullptr && readableEnd - text.data() >= 8;
    if (std::endian::native == std::endian::little && hasWord) {
      const std::uint64_t ofText = (std::uint64_t{1} << (8 * text.size())) - 1;
      return (blanksIn8(text.data()) & ofText) != 0;
    }
    bool isFound = false;
    for (const char character : text) isFound |= character == ' ';
    return isFound;
  }
  std::uint64_t found = blanksIn8(text.data() + text.size() - 8);
  for (std::size_t at = 0; at + 8 < text.size(); at += 8) {
    found |= blanksIn8(text.data() + at);
  }
  return found != 0;
}

// Messages of usual size that were read together lie as far from one another. The next
// one is asked for while this one is looked over: it comes from another core, and without
// that costs 40 ns more. Nothing need be there, only the address is used.
void fetchNextMessage(const std::uint8_t* payload) {
  constexpr std::size_t kDistance = 256;
  constexpr std::size_t kLine = 64;
  const auto next = reinterpret_cast<std::uintptr_t>(payload) + kDistance;
  for (std::size_t at = 0; at < kDistance; at += kLine) {
    __builtin_prefetch(reinterpret_cast<const void*>(next + at));
  }
}

}  // namespace

PayloadSurvey::PayloadSurvey(const Dictionary& payload) : begin_(payload.value().data()) {
  fetchNextMessage(begin_);
  const DictionaryView entries = payload.view();
  const ValueBuffer& owner = payload.owner();
  const auto* const readableEnd =
      owner ? reinterpret_cast<const char*>(owner.data() + owner.size()) : nullptr;
  ValueView last = payload.value();
  for (const auto& [key, value] : entries) {
    last = value;
    const auto text = key.string();
    if (!text) continue;
    hasBlankInKey_ |= holdsBlank(*text, readableEnd);
    hasEngineOnTime_ |= *text == OstrelReportingWattlogUtility::kEngineOnTimeKey;
  }
  end_ = last.end();  // Of the last value, or of the dictionary without any.
}

}  // namespace ostrel
