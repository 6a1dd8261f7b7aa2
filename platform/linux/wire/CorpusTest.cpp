// What the fuzzers of the codec found, and their seeds, in every build.
#include <gtest/gtest.h>

#include <cstdint>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>

#define LLVMFuzzerTestOneInput tryPayload
#include "platform/linux/wire/PayloadDecoderFuzzer.cpp"
#undef LLVMFuzzerTestOneInput
#define LLVMFuzzerTestOneInput tryFrames
#include "platform/linux/wire/FrameFuzzer.cpp"
#undef LLVMFuzzerTestOneInput

namespace {

// A fault aborts. The number of files tried.
std::size_t replay(const std::string& name,
                   int (*run)(const std::uint8_t*, std::size_t)) {
  std::size_t count = 0;
  for (const auto& entry :
       std::filesystem::directory_iterator(OSTREL_SOURCE_DIR "/fuzz/corpus/" + name)) {
    std::ifstream file(entry.path(), std::ios::binary);
    const std::string bytes(std::istreambuf_iterator<char>(file), {});
    run(reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size());
    ++count;
  }
  return count;
}

TEST(Corpus, OfThePayloadDecoderHoldsNothingThatBreaksIt) {
  EXPECT_GE(replay("PayloadDecoder", tryPayload), 5U);
}

TEST(Corpus, OfFramesHoldsNothingThatBreaksThem) {
  EXPECT_GE(replay("Frame", tryFrames), 2U);
}

}  // namespace
