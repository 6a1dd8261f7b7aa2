// The client that `docs/protocol.md` shows works with the service as it runs.
#include <gtest/gtest.h>

#include <fstream>
#include <iterator>
#include <string>

#include "tests/integration/ServiceUnderTest.h"

namespace ostrel {
namespace {

std::string clientInDocument() {
  std::ifstream file(OSTREL_SOURCE_DIR "/docs/protocol.md");
  const std::string text(std::istreambuf_iterator<char>(file), {});
  const std::string mark = "```python\n";
  const auto begin = text.find(mark) + mark.size();
  return text.substr(begin, text.find("```", begin) - begin);
}

TEST(ProtocolDocument, ShowsAClientThatWorks) {
  ServiceUnderTest service;
  service.start();
  ASSERT_TRUE(eventually([&] { return std::filesystem::exists(service.socketPath()); }));
  service.write("client.py", clientInDocument());
  testing_support::ChildProcess client(
      {"/usr/bin/python3", service / "client.py", service.socketPath()},
      service / "client.log");
  EXPECT_EQ(client.wait(), 0) << service.read("client.log");
  EXPECT_EQ(service.read("client.log"), "[[1, True], [2, True], [3, None], [4, [7]]]\n");
}

}  // namespace
}  // namespace ostrel
