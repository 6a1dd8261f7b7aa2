// Whatever bytes stand at the store's place, the store can be used after two
// attempts at most, in that file or a new one.
#include <sqlite3.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>

#include "platform/Logging.h"
#include "platform/linux/store/StoreWriter.h"

namespace {

using namespace ostrel;

struct QuietLog final : ScopedLog {
  int verbosity(std::string_view) const override { return 0; }
  LogLevel lowestLevel() const override { return LogLevel::kError; }
  void write(const LogLine&) override {}
};

std::string place() {
  setSystemLog(std::make_shared<QuietLog>());
  const std::filesystem::path memory = "/dev/shm";
  const auto parent =
      std::filesystem::exists(memory) ? memory : std::filesystem::temp_directory_path();
  return parent / ("ostrel-image-" + std::to_string(::getpid()));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const std::string directory = place();
  const std::string path = directory + "/reports.db";
  std::filesystem::remove_all(directory);
  std::filesystem::create_directories(directory);
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
  if (writer.hasUncommitted()) std::abort();
  return 0;
}
