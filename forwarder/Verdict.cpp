#include "forwarder/Verdict.h"

#include <algorithm>
#include <charconv>

#include "forwarder/RetryPauses.h"
#include "ostrelctl/JSONNode.h"

namespace ostrel {
namespace {

const JSONNode* member(const JSONNode* node, std::string_view key) {
  const JSONObject* object = node != nullptr ? node->object() : nullptr;
  return object != nullptr ? find(*object, key) : nullptr;
}

/// A 64-bit integer, which stands as text or, from lenient writers, as a number.
std::int64_t countOf(const JSONNode* node) {
  std::int64_t count = 0;
  if (node == nullptr) return 0;
  if (const std::string* text = node->string()) {
    std::from_chars(text->data(), text->data() + text->size(), count);
  } else {
    count = node->signedInteger().value_or(0);
  }
  return std::max<std::int64_t>(count, 0);
}

std::int64_t rejectedIn(const std::string& body) {
  const auto parsed = parseJSON(body);
  if (!parsed.value) return 0;
  return countOf(member(member(&*parsed.value, "partialSuccess"), "rejectedLogRecords"));
}

Verdict::Kind kindOf(int status) {
  if (status >= 200 && status < 300) return Verdict::Kind::kTaken;
  switch (status) {
    case 400:
    case 422:
      return Verdict::Kind::kRefused;
    case 413:
      return Verdict::Kind::kTooLarge;
    case 500:
      return Verdict::Kind::kBroken;
    default:
      return Verdict::Kind::kLater;
  }
}

}  // namespace

Verdict verdictOn(const Reply& reply, Date now) {
  Verdict verdict;
  if (reply.isInterrupted) {
    verdict.kind = Verdict::Kind::kInterrupted;
    return verdict;
  }
  verdict.kind = kindOf(reply.status);
  if (verdict.kind == Verdict::Kind::kTaken) verdict.rejected = rejectedIn(reply.body);
  if (verdict.kind == Verdict::Kind::kLater || verdict.kind == Verdict::Kind::kBroken) {
    verdict.pauseAsked = pauseAsked(reply.retryAfter, now);
  }
  verdict.reason = reply.status == 0
                       ? reply.failure
                       : "it answers with status " + std::to_string(reply.status);
  return verdict;
}

}  // namespace ostrel
