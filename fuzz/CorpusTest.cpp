// The seeds of the fuzzers and what they ever found, in every build. A fault aborts.
#include "Fuzzers.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <ostream>
#include <string>

namespace ostrel {

static std::ostream& operator<<(std::ostream& out, const Fuzzer& fuzzer) {
  return out << fuzzer.name;
}

namespace {

class Corpus : public testing::TestWithParam<Fuzzer> {};

TEST_P(Corpus, HoldsNothingThatIsAFault) {
  std::size_t count = 0;
  for (const auto& entry : std::filesystem::directory_iterator(
           OSTREL_CORPUS + std::string(GetParam().name))) {
    SCOPED_TRACE(entry.path());
    std::ifstream file(entry.path(), std::ios::binary);
    const std::string bytes(std::istreambuf_iterator<char>(file), {});
    GetParam().run(reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size());
    ++count;
  }
  EXPECT_GT(count, 1u);
}

INSTANTIATE_TEST_SUITE_P(Of, Corpus, testing::ValuesIn(kFuzzers),
                         [](const auto& of) { return std::string(of.param.name); });

}  // namespace
}  // namespace ostrel
