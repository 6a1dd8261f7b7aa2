#pragma once

#include <string>

#include "benchmarks/wholepath/Measurements.h"

namespace ostrel::bench {

/// Measures how the cost of a message grows with clients, sessions and messages kept,
/// and writes `{"curves": [{"name", "x_label", "y_label", "points": [[x, y], ...]}]}`.
/// False when the file cannot be written.
bool writeGrowthCurves(const Scale& scale, const std::string& path);

}  // namespace ostrel::bench
