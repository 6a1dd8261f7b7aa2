#pragma once

#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <string>

namespace ostrel {

/// A directory of its own for one test; gone with the object.
class TemporaryDirectory {
 public:
  TemporaryDirectory() {
    std::string path = ::testing::TempDir() + "ostrelctl.XXXXXX";
    if (::mkdtemp(path.data()) == nullptr) ADD_FAILURE() << "no temporary directory";
    path_ = path;
  }
  ~TemporaryDirectory() {
    std::error_code error;
    std::filesystem::remove_all(path_, error);
  }
  TemporaryDirectory(const TemporaryDirectory&) = delete;
  TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;

  std::string operator/(const std::string& name) const { return path_ + "/" + name; }

 private:
  std::string path_;
};

}  // namespace ostrel
