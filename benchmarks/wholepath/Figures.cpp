#include "benchmarks/wholepath/Figures.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <sstream>

namespace ostrel::bench {
namespace {

// Four digits that count, whole numbers in full.
std::string text(double value) {
  char buffer[64];
  if (std::abs(value) >= 1000 || value == 0) {
    std::snprintf(buffer, sizeof buffer, "%.0f", value);
  } else {
    std::snprintf(buffer, sizeof buffer, "%.4g", value);
  }
  return buffer;
}

std::string text(const std::optional<double>& value, const char* none) {
  return value ? text(*value) : none;
}

// Precise, and never an "inf" that JSON does not know.
std::string json(const std::optional<double>& value) {
  if (!value || !std::isfinite(*value)) return "null";
  std::ostringstream out;
  out.precision(10);
  out << *value;
  return out.str();
}

// Where less is better the aim lies below the floor.
std::string_view verdict(const FigureKind& kind, double value) {
  if (!kind.aim) return "";
  const bool lessIsBetter = kind.floor ? *kind.aim <= *kind.floor : true;
  const auto reaches = [&](double wanted) {
    return lessIsBetter ? value <= wanted : value >= wanted;
  };
  if (reaches(*kind.aim)) return "aim";
  if (!kind.floor) return "short of aim";
  return reaches(*kind.floor) ? "floor" : "BELOW FLOOR";
}

}  // namespace

const std::vector<FigureKind>& figureKinds() {
  static const std::vector<FigureKind> kinds = {
      // The peers.
      {"raw_batched", "messages/s", "", {}, {}},
      {"raw_single", "messages/s", "", {}, {}},
      {"raw_cpu_per_message_ns", "ns", "", {}, {}},
      {"raw_round_trip_one_core_us", "us", "", {}, {}},
      {"dbus_one_way", "messages/s", "raw_batched", {}, {}},
      {"dbus_cpu_per_message_ns", "ns", "raw_cpu_per_message_ns", {}, {}},
      // The service.
      {"one_way", "messages/s", "raw_batched", 2e6, 6e6},
      {"one_way_stored", "messages/s", "raw_batched", 150e3, 500e3},
      {"client_send_ns", "ns", "", 120, 70},
      {"client_send_p999_ns", "ns", "", 5000, 2000},
      {"cpu_per_message_ns", "ns", "raw_cpu_per_message_ns", 600, 200},
      {"pipelined_replies", "messages/s", "raw_single", 400e3, 2e6},
      {"round_trip_one_core", "x raw", "", 1.5, 1.1},
      {"round_trip_one_core_us", "us", "raw_round_trip_one_core_us", {}, {}},
      {"delivered_round_trip_one_core_us", "us", "raw_round_trip_one_core_us", {}, {}},
      {"bytes_per_retained_message", "x wire bytes", "", 2, 1.1},
      {"bytes_per_session", "bytes", "", 2048, 500},
      {"bytes_per_started_session", "bytes", "", {}, {}},
      {"bytes_per_connection", "bytes", "", 4096, 1536},
      {"many_sessions", "x single", "", 0.6, 0.9},
      {"many_clients", "x single", "", 0.6, 0.9},
      {"idle_wakeups", "1/s", "", 0, 0},
      {"idle_threads", "threads", "", {}, {}},
      {"idle_rss", "MiB", "", {}, 6},
      {"start_ms", "ms", "", 10, 3},
      {"stop_million_s", "s", "", 3, 1},
      {"stop_million_memory", "x list", "", 2, 2},
  };
  return kinds;
}

void Figures::add(std::string_view name, double value) {
  const auto& kinds = figureKinds();
  if (std::none_of(kinds.begin(), kinds.end(),
                   [&](const FigureKind& kind) { return kind.name == name; })) {
    std::fprintf(stderr, "no figure is called %s\n", std::string(name).c_str());
    std::abort();
  }
  values_[std::string(name)].push_back(value);
}

std::optional<double> Figures::last(std::string_view name) const {
  const auto found = values_.find(name);
  if (found == values_.end()) return std::nullopt;
  return found->second.back();
}

// The ratio is the median of the rounds' own: both sides of a round meet the same
// moment of the machine.
std::optional<Figures::Summary> Figures::summary(const FigureKind& kind) const {
  const auto found = values_.find(kind.name);
  if (found == values_.end()) return std::nullopt;
  const auto& values = found->second;
  const auto [least, most] = std::minmax_element(values.begin(), values.end());
  Summary summary{median(values), *least, *most, std::nullopt};
  const auto other = values_.find(kind.ratioTo);
  if (other != values_.end()) {
    std::vector<double> ratios;
    for (std::size_t i = 0; i < std::min(values.size(), other->second.size()); ++i) {
      ratios.push_back(values[i] / other->second[i]);
    }
    summary.ratio = median(ratios);
  }
  return summary;
}

void Figures::printTable() const {
  std::printf("%-34s %12s %12s %12s %-13s %9s %9s %9s  %s\n", "figure", "median", "min",
              "max", "unit", "ratio", "floor", "aim", "reached");
  for (const FigureKind& kind : figureKinds()) {
    const auto found = summary(kind);
    if (!found) continue;
    std::printf("%-34s %12s %12s %12s %-13s %9s %9s %9s  %s\n",
                std::string(kind.name).c_str(), text(found->median).c_str(),
                text(found->least).c_str(), text(found->most).c_str(),
                std::string(kind.unit).c_str(), text(found->ratio, "-").c_str(),
                text(kind.floor, "-").c_str(), text(kind.aim, "-").c_str(),
                std::string(verdict(kind, found->median)).c_str());
  }
}

bool Figures::writeJSON(const std::string& path) const {
  std::ofstream out(path);
  out << "{\"figures\": [";
  const char* separator = "\n  ";
  for (const FigureKind& kind : figureKinds()) {
    const auto found = summary(kind);
    if (!found) continue;
    out << separator << "{\"name\": \"" << kind.name
        << "\", \"value\": " << json(found->median) << ", \"unit\": \"" << kind.unit
        << "\", \"min\": " << json(found->least) << ", \"max\": " << json(found->most)
        << ", \"ratio_to\": ";
    if (found->ratio) {
      out << '"' << kind.ratioTo << '"';
    } else {
      out << "null";
    }
    out << ", \"ratio\": " << json(found->ratio) << ", \"floor\": " << json(kind.floor)
        << ", \"aim\": " << json(kind.aim) << "}";
    separator = ",\n  ";
  }
  out << "\n]}\n";
  out.close();
  return !out.fail();
}

double median(std::vector<double> values) {
  std::sort(values.begin(), values.end());
  const std::size_t middle = values.size() / 2;
  return values.size() % 2 != 0 ? values[middle]
                                : (values[middle - 1] + values[middle]) / 2;
}

}  // namespace ostrel::bench
