// The parser's events build the value from the leaves up. The parser keeps its
// own stack of the open containers, so no text can exhaust ours.
#include "platform/linux/ValueJSONReader.h"

#include <chrono>
#include <memory>
#include <nlohmann/json.hpp>
#include <vector>

#include "platform/linux/Limits.h"

namespace ostrel {
namespace {

constexpr std::string_view kDateKey = "$date";

class ValueMaker : public nlohmann::json_sax<nlohmann::json> {
 public:
  ValueMaker(JSONDates dates, std::string& error) : dates_(dates), error_(error) {}

  std::optional<Value> take() { return std::move(whole_); }

  bool null() override { return fail("null stands for no value"); }
  bool boolean(bool value) override { return add(Value(value)); }
  bool number_integer(number_integer_t value) override { return add(Value(value)); }
  bool number_unsigned(number_unsigned_t value) override { return add(Value(value)); }
  bool number_float(number_float_t value, const string_t& text) override {
    if (text.find_first_of(".eE") == std::string::npos) {
      return fail("the integer " + text + " does not fit into 64 bits");
    }
    return add(Value(value));
  }
  bool string(string_t& value) override { return add(Value(value)); }
  bool binary(binary_t&) override { return fail("binary data in a text"); }

  bool start_object(std::size_t) override { return open(/*isDictionary=*/true); }
  bool key(string_t& value) override {
    open_.back().key = value;
    return true;
  }
  bool end_object() override {
    const Dictionary dictionary = open_.back().dictionary->build();
    open_.pop_back();
    const std::optional<ValueView> tagged = dictionary.find(kDateKey);
    if (dates_ == JSONDates::kPlain || !tagged || dictionary.size() != 1) {
      return add(Value(dictionary));
    }
    const auto date = dateFromISO8601(tagged->string().value_or(std::string_view()));
    return date ? add(Value(*date)) : fail("\"$date\" needs a date in ISO 8601");
  }

  bool start_array(std::size_t) override { return open(/*isDictionary=*/false); }
  bool end_array() override {
    const Array array = open_.back().array.build();
    open_.pop_back();
    return add(Value(array));
  }

  bool parse_error(std::size_t position, const std::string&,
                   const nlohmann::json::exception& exception) override {
    constexpr int kNumberOutOfRange = 406;
    return fail(exception.id == kNumberOutOfRange
                    ? "a number is too large for a double"
                    : "not JSON at byte " + std::to_string(position));
  }

 private:
  struct Open {
    bool isDictionary = false;
    std::string key;
    std::unique_ptr<DictionaryBuilder> dictionary;
    ArrayBuilder array;
  };

  bool fail(std::string error) {
    error_ = std::move(error);
    return false;
  }

  bool open(bool isDictionary) {
    if (open_.size() == limits::kNesting) return fail("nested too deeply");
    Open open;
    open.isDictionary = isDictionary;
    if (isDictionary) open.dictionary = std::make_unique<DictionaryBuilder>();
    open_.push_back(std::move(open));
    return true;
  }

  bool add(const Value& value) {
    if (open_.empty()) {
      whole_ = value;
    } else if (open_.back().isDictionary) {
      open_.back().dictionary->set(open_.back().key, value);
    } else {
      open_.back().array.append(value);
    }
    return true;
  }

  const JSONDates dates_;
  std::string& error_;
  std::vector<Open> open_;
  std::optional<Value> whole_;
};

// Reads a text from the front.
class Scanner {
 public:
  explicit Scanner(std::string_view text) : left_(text) {}

  bool isAtEnd() const { return left_.empty(); }

  bool skip(char c) {
    if (left_.empty() || left_.front() != c) return false;
    left_.remove_prefix(1);
    return true;
  }

  std::optional<int> number(std::size_t digits) {
    if (left_.size() < digits) return std::nullopt;
    int number = 0;
    for (std::size_t i = 0; i < digits; ++i) {
      if (left_[i] < '0' || left_[i] > '9') return std::nullopt;
      number = number * 10 + (left_[i] - '0');
    }
    left_.remove_prefix(digits);
    return number;
  }

  // The digits after the point as a fraction of 1.
  std::optional<double> fraction() {
    double value = 0;
    double unit = 1;
    while (const auto digit = number(/*digits=*/1)) value += *digit * (unit /= 10);
    if (unit == 1) return std::nullopt;
    return value;
  }

 private:
  std::string_view left_;
};

std::optional<int> offsetInMinutes(Scanner& scanner) {
  if (scanner.skip('Z')) return 0;
  const int sign = scanner.skip('+') ? 1 : scanner.skip('-') ? -1 : 0;
  if (sign == 0) return std::nullopt;
  const auto hours = scanner.number(/*digits=*/2);
  scanner.skip(':');
  const auto minutes = scanner.number(/*digits=*/2);
  if (!hours || !minutes || *hours > 23 || *minutes > 59) return std::nullopt;
  return sign * (*hours * 60 + *minutes);
}

}  // namespace

std::optional<Value> valueFromJSON(std::string_view text, JSONDates dates,
                                   std::string& error) {
  ValueMaker maker(dates, error);
  if (!nlohmann::json::sax_parse(text, &maker)) return std::nullopt;
  return maker.take();
}

std::optional<Date> dateFromISO8601(std::string_view text) {
  Scanner scanner(text);
  const auto year = scanner.number(/*digits=*/4);
  const bool hasMonth = scanner.skip('-');
  const auto month = scanner.number(/*digits=*/2);
  const bool hasDay = scanner.skip('-');
  const auto day = scanner.number(/*digits=*/2);
  const bool hasTime = scanner.skip('T');
  const auto hour = scanner.number(/*digits=*/2);
  const bool hasMinute = scanner.skip(':');
  const auto minute = scanner.number(/*digits=*/2);
  const bool hasSecond = scanner.skip(':');
  const auto second = scanner.number(/*digits=*/2);
  if (!hasMonth || !hasDay || !hasTime || !hasMinute || !hasSecond || !year || !month ||
      !day || !hour || !minute || !second) {
    return std::nullopt;
  }
  std::optional<double> fraction = 0.0;
  if (scanner.skip('.')) fraction = scanner.fraction();
  const auto offset = offsetInMinutes(scanner);
  using namespace std::chrono;
  const year_month_day calendar{std::chrono::year{*year},
                                std::chrono::month{static_cast<unsigned>(*month)},
                                std::chrono::day{static_cast<unsigned>(*day)}};
  if (!fraction || !offset || !scanner.isAtEnd() || !calendar.ok() || *hour > 23 ||
      *minute > 59 || *second > 59) {
    return std::nullopt;
  }
  const auto whole =
      sys_days{calendar} + hours{*hour} + minutes{*minute - *offset} + seconds{*second};
  return Date{static_cast<double>(whole.time_since_epoch().count()) + *fraction};
}

}  // namespace ostrel
