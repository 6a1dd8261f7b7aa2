#pragma once

#include "platform/JSONSerialization.h"

namespace ostrel {

/// Pretty-printed JSON with an indentation of two spaces, written element by
/// element.
class JSONTextSerialization final : public JSONSerialization {
 public:
  Outcome<TextSource> prettyPrintedArray(ElementSource elements) override;
};

}  // namespace ostrel
