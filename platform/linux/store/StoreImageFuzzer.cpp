// Whatever bytes stand at the store's place, the store can be used after two
// attempts at most, in that file or a new one.
#include <sqlite3.h>

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>

#include "fuzz/Fuzzing.h"
#include "platform/linux/TestSupport.h"
#include "platform/linux/store/StoreWriter.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace ostrel;
  using testing_support::TemporaryDirectory;
  static const TemporaryDirectory directory(TemporaryDirectory::inMemory());
  fuzzing::silenceLog();
  const std::string state = directory / "state";
  const std::string path = state + "/reports.db";
  std::filesystem::remove_all(state);
  std::filesystem::create_directories(state);
  std::ofstream(path, std::ios::binary)
      .write(reinterpret_cast<const char*>(data), static_cast<std::streamsize>(size));

  StoreCounters counters;
  StoreWriter writer(path, /*vfs=*/nullptr, StoreRetention(), counters);
  StoreBatch batch;
  batch.push_back({1, LoneMessage{Dictionary(), Dictionary(), 1, 2, Dictionary()}});
  batch.push_back(
      {2, AnalyticsEvent{"event", [] { return Dictionary(); }, std::nullopt}});
  writer.add({});
  std::vector<StoreBatch> batches;
  batches.push_back(std::move(batch));
  writer.add(std::move(batches));
  for (int attempt = 0; attempt < 3 && writer.hasUncommitted(); ++attempt) {
    if (writer.fault()) writer.recover();
    if (writer.fault() && writer.fault()->kind == StoreFault::Kind::kNewer) return 0;
    writer.commit();
  }
  fuzzing::expect(!writer.hasUncommitted());
  return 0;
}
