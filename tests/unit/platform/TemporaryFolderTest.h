#pragma once

#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <string>
#include <system_error>

namespace larder {

// A fresh folder for each test, removed with all it holds when the test ends.
class TemporaryFolderTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern =
        (std::filesystem::temp_directory_path() / "larder-platform-XXXXXX").string();
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    base_ = pattern;
  }

  void TearDown() override {
    std::error_code ignored;
    std::filesystem::remove_all(base_, ignored);
  }

  // Makes <base>/root the platform root and <base>/home the home folder, where the code under
  // test looks for them.
  void makeRootAndHome() {
    root_ = base_ + "/root";
    home_ = base_ + "/home";
    std::filesystem::create_directories(root_);
    std::filesystem::create_directories(home_);
    ::setenv("LARDER_ROOT", root_.c_str(), 1);
    ::setenv("HOME", home_.c_str(), 1);
  }

  std::string base_;
  std::string root_;
  std::string home_;
};

}  // namespace larder
