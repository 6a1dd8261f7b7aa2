# What the test programs include is compiled once for all of them; of a program, since
# libraries are compiled with other options.
file(WRITE ${CMAKE_BINARY_DIR}/test_headers.cpp "int main() {}\n")
add_executable(ostrel_test_headers ${CMAKE_BINARY_DIR}/test_headers.cpp)
target_link_libraries(ostrel_test_headers PRIVATE GTest::gmock GTest::gtest Threads::Threads)
target_precompile_headers(ostrel_test_headers PRIVATE <gtest/gtest.h> <gmock/gmock.h>
  <functional> <map> <memory> <optional> <string> <vector>)
