#pragma once

#include <functional>

#include "platform/FileSystem.h"
#include "platform/Outcome.h"
#include "platform/Value.h"

namespace ostrel {

/// Calls its argument once for each element of an array, in order, as often as
/// it is asked: an array that need not stand in memory as one value. Each view
/// is valid during the call only.
using ElementSource = std::function<void(const std::function<void(ValueView)>&)>;

class JSONSerialization {
 public:
  virtual ~JSONSerialization() = default;

  /// The array of `elements` as pretty-printed JSON in UTF-8. Dates become
  /// ISO 8601 text. An error and no text when an element holds what JSON cannot
  /// say: a number that is not finite, a key that is not a string. The text
  /// asks `elements` again each time it is written.
  virtual Outcome<TextSource> prettyPrintedArray(ElementSource elements) = 0;
};

}  // namespace ostrel
