#include "platform/linux/JSONTextSerialization.h"

#include <string>
#include <utility>

#include "platform/ValueJSON.h"

namespace ostrel {
namespace {

void writeArray(const ElementSource& elements, const TextWriter& write) {
  std::string piece;
  bool isFirst = true;
  elements([&](ValueView element) {
    piece = isFirst ? "[\n  " : ",\n  ";
    isFirst = false;
    appendJSON(piece, element, JSONLayout::kPretty, JSONStrictness::kError,
               /*indent=*/1);
    write(piece);
  });
  write(isFirst ? "[]" : "\n]");
}

}  // namespace

Outcome<TextSource> JSONTextSerialization::prettyPrintedArray(ElementSource elements) {
  // The text is not made yet: it would take as much memory as the list itself.
  std::optional<ErrorObject> error;
  elements([&](ValueView element) {
    if (!error) error = findJSONError(element);
  });
  if (error) return {std::nullopt, std::move(error)};
  return {[elements = std::move(elements)](const TextWriter& write) {
            writeArray(elements, write);
          },
          std::nullopt};
}

}  // namespace ostrel
