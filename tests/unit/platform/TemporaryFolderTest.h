#pragma once

#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <optional>
#include <string>

#include "tests/unit/TemporaryFolder.h"

namespace larder {

// A fresh folder for each test, removed with all it holds when the test ends.
class TemporaryFolderTest : public ::testing::Test {
 protected:
  void SetUp() override {
    folder_.emplace("larder-platform");
    base_ = folder_->path();
  }

  void TearDown() override { folder_.reset(); }

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

  std::optional<testing::TemporaryFolder> folder_;
  std::string base_;
  std::string root_;
  std::string home_;
};

}  // namespace larder
