#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace ostrel::bench {

/// What a figure is called, and what it is held against.
struct FigureKind {
  std::string_view name;
  std::string_view unit;
  /// The name of the figure of the same run that it is divided by; empty: none.
  std::string_view ratioTo;
  std::optional<double> floor;
  std::optional<double> aim;
};

/// Every figure, in the order of the table.
const std::vector<FigureKind>& figureKinds();

/// The figures of one run: a value for each round.
class Figures {
 public:
  /// `name` must be one of `figureKinds`.
  void add(std::string_view name, double value);

  /// The last value of `name`; none before the first.
  std::optional<double> last(std::string_view name) const;

  void printTable() const;
  /// False when the file cannot be written.
  bool writeJSON(const std::string& path) const;

 private:
  struct Summary {
    double median;
    double least;
    double most;
    std::optional<double> ratio;
  };
  std::optional<Summary> summary(const FigureKind& kind) const;

  std::map<std::string, std::vector<double>, std::less<>> values_;
};

/// The middle value, or the mean of the two in the middle. Not of nothing.
double median(std::vector<double> values);

}  // namespace ostrel::bench
