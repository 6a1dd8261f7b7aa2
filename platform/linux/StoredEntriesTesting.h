// Entries as texts, for the tests of what sessions collect.
#pragma once

#include <gtest/gtest.h>

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "platform/Bytes.h"
#include "platform/EntryStorage.h"

namespace ostrel::testing_support {

inline bool append(StoredEntries& entries, std::string_view text,
                   const std::shared_ptr<PayloadAccount>& account) {
  const StoredEntries::Bytes parts[] = {asBytes(text)};
  return entries.append(parts, account);
}
/// For nobody's account.
inline bool append(StoredEntries& entries, std::string_view text) {
  return append(entries, text, /*account=*/nullptr);
}

inline std::string bytesOf(const StoredEntries::Snapshot& snapshot) {
  std::string all;
  EXPECT_TRUE(snapshot.forEachRun(
      [&](StoredEntries::Bytes run) { all.append(run.begin(), run.end()); }));
  return all;
}

}  // namespace ostrel::testing_support
