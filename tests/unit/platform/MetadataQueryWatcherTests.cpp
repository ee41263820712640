#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/inotify.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/metadata/MetadataIndexWatcher.h"
#include "platform/metadata/MetadataSearchScope.h"

namespace larder {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using ::testing::ElementsAre;
using Role = MetadataSearchScope::Role;
using Folder = MetadataSearchScope::Folder;

void appendRecord(std::vector<std::uint8_t>& bytes, int watch, std::uint32_t mask,
                  std::string_view name, std::uint32_t paddedLength) {
  inotify_event header{};
  header.wd = watch;
  header.mask = mask;
  header.len = paddedLength;
  const auto* raw = reinterpret_cast<const std::uint8_t*>(&header);
  bytes.insert(bytes.end(), raw, raw + sizeof header);
  std::vector<std::uint8_t> padded(paddedLength, 0);
  std::copy_n(name.begin(), std::min<std::size_t>(name.size(), paddedLength), padded.begin());
  bytes.insert(bytes.end(), padded.begin(), padded.end());
}

TEST(MetadataQueryWatcher, DecodesRecordsAndNoticesOverflow) {
  std::vector<std::uint8_t> bytes;
  appendRecord(bytes, 3, IN_CREATE | IN_ISDIR, "Notes.app", 16);
  appendRecord(bytes, -1, IN_Q_OVERFLOW, "", 0);
  appendRecord(bytes, 4, IN_DELETE_SELF, "", 0);
  MetadataIndexWatcher::Batch batch;
  MetadataIndexWatcher::decode(bytes, batch);
  EXPECT_TRUE(batch.overflowed);
  EXPECT_FALSE(batch.failed);
  ASSERT_EQ(batch.events.size(), 2u);
  EXPECT_EQ(batch.events[0].watch, 3);
  EXPECT_EQ(batch.events[0].name, "Notes.app");
  EXPECT_EQ(batch.events[0].mask, IN_CREATE | IN_ISDIR);
  EXPECT_EQ(batch.events[1].watch, 4);
  EXPECT_EQ(batch.events[1].name, "");
}

TEST(MetadataQueryWatcher, TruncatedRecordsFailTheBatch) {
  std::vector<std::uint8_t> bytes;
  appendRecord(bytes, 3, IN_CREATE, "Notes.app", 16);
  std::vector<std::uint8_t> shortName(bytes.begin(), bytes.end() - 4);
  MetadataIndexWatcher::Batch first;
  MetadataIndexWatcher::decode(shortName, first);
  EXPECT_TRUE(first.failed);
  EXPECT_TRUE(first.events.empty());

  std::vector<std::uint8_t> shortHeader(bytes.begin(), bytes.begin() + 6);
  MetadataIndexWatcher::Batch second;
  MetadataIndexWatcher::decode(shortHeader, second);
  EXPECT_TRUE(second.failed);
}

TEST(MetadataQueryWatcher, NameWithoutTerminatorStopsAtItsLength) {
  std::vector<std::uint8_t> bytes;
  appendRecord(bytes, 1, IN_CREATE, "abcdefgh", 8);
  MetadataIndexWatcher::Batch batch;
  MetadataIndexWatcher::decode(bytes, batch);
  ASSERT_EQ(batch.events.size(), 1u);
  EXPECT_EQ(batch.events[0].name, "abcdefgh");
}

class MetadataQueryWatcherOnDisk : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (fs::temp_directory_path() / "larder-mdwatch-XXXXXX").string();
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    folder_ = pattern;
    ASSERT_EQ(watcher_.initializationError(), 0);
  }
  void TearDown() override {
    std::error_code ignored;
    fs::remove_all(folder_, ignored);
  }

  // Events up to `limit`, until one named `name` arrives.
  bool sawEventNamed(std::string_view name, std::chrono::milliseconds limit = 1000ms) {
    const auto end = std::chrono::steady_clock::now() + limit;
    while (std::chrono::steady_clock::now() < end) {
      MetadataIndexWatcher::Batch batch = watcher_.waitForEvents(50ms);
      for (const auto& event : batch.events) {
        if (event.name == name) return true;
      }
    }
    return false;
  }

  std::string folder_;
  MetadataIndexWatcher watcher_;
};

TEST_F(MetadataQueryWatcherOnDisk, ReportsWhatHappensInAWatchedFolder) {
  const int watch = watcher_.addWatch(folder_, MetadataIndexWatcher::kFolderMask);
  ASSERT_GE(watch, 0);
  fs::create_directory(folder_ + "/Notes.app");
  EXPECT_TRUE(sawEventNamed("Notes.app"));
}

TEST_F(MetadataQueryWatcherOnDisk, WatchesAreCountedPerRole) {
  const int first = watcher_.addWatch(folder_, MetadataIndexWatcher::kFolderMask);
  const int second = watcher_.addWatch(folder_, MetadataIndexWatcher::kBundleMask);
  ASSERT_GE(first, 0);
  EXPECT_EQ(first, second);
  EXPECT_EQ(watcher_.watchCount(), 1u);

  watcher_.removeWatch(first);
  std::ofstream(folder_ + "/still") << "x";
  EXPECT_TRUE(sawEventNamed("still")) << "one role still watches";

  watcher_.removeWatch(first);
  EXPECT_EQ(watcher_.watchCount(), 0u);
  std::ofstream(folder_ + "/gone") << "x";
  EXPECT_FALSE(sawEventNamed("gone", 200ms));
}

TEST_F(MetadataQueryWatcherOnDisk, MissingFolderGivesTheError) {
  EXPECT_EQ(watcher_.addWatch(folder_ + "/missing", MetadataIndexWatcher::kFolderMask), -ENOENT);
  std::ofstream(folder_ + "/file") << "x";
  EXPECT_EQ(watcher_.addWatch(folder_ + "/file", MetadataIndexWatcher::kFolderMask), -ENOTDIR);
}

TEST_F(MetadataQueryWatcherOnDisk, WakeEndsAWaitWithoutTimeout) {
  std::thread waker([this] {
    std::this_thread::sleep_for(20ms);
    watcher_.wake();
  });
  const auto start = std::chrono::steady_clock::now();
  MetadataIndexWatcher::Batch batch = watcher_.waitForEvents(std::nullopt);
  waker.join();
  EXPECT_TRUE(batch.events.empty());
  EXPECT_FALSE(batch.overflowed);
  EXPECT_LT(std::chrono::steady_clock::now() - start, 2s);
}

TEST_F(MetadataQueryWatcherOnDisk, InjectedOverflowLooksLikeTheKernels) {
  watcher_.injectQueueOverflowForTesting();
  EXPECT_TRUE(watcher_.waitForEvents(std::nullopt).overflowed);
  EXPECT_FALSE(watcher_.waitForEvents(10ms).overflowed) << "reported once";
}

TEST_F(MetadataQueryWatcherOnDisk, KernelDropOfAWatchIsForgotten) {
  fs::create_directory(folder_ + "/Sub");
  ASSERT_GE(watcher_.addWatch(folder_ + "/Sub", MetadataIndexWatcher::kFolderMask), 0);
  fs::remove(folder_ + "/Sub");
  const auto end = std::chrono::steady_clock::now() + 1s;
  while (watcher_.watchCount() > 0 && std::chrono::steady_clock::now() < end) {
    watcher_.waitForEvents(50ms);
  }
  EXPECT_EQ(watcher_.watchCount(), 0u);
}

class MetadataQuerySearchScope : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (fs::temp_directory_path() / "larder-mdscope-XXXXXX").string();
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    base_ = pattern;
    root_ = base_ + "/root";
    home_ = base_ + "/home";
    fs::create_directories(root_);
    fs::create_directories(home_);
    ::setenv("LARDER_ROOT", root_.c_str(), 1);
    ::setenv("HOME", home_.c_str(), 1);
  }
  void TearDown() override {
    std::error_code ignored;
    fs::remove_all(base_, ignored);
  }

  std::string base_;
  std::string root_;
  std::string home_;
};

TEST_F(MetadataQuerySearchScope, OnlyTheAnchorsOfAnEmptyRoot) {
  EXPECT_THAT(MetadataSearchScope::current().folders(),
              ElementsAre(Folder{root_, Role::PlatformRoot}, Folder{home_, Role::Home}));
}

TEST_F(MetadataQuerySearchScope, EveryApplicationFolderAndItsAnchors) {
  fs::create_directories(root_ + "/Applications/Utilities");
  fs::create_directories(root_ + "/Applications/Notes.app");
  fs::create_directories(home_ + "/Applications");
  fs::create_directories(root_ + "/Volumes/Disk/Applications");
  fs::create_directories(root_ + "/Volumes/Empty");
  std::ofstream(root_ + "/Applications/readme") << "x";
  fs::create_symlink("Loop", root_ + "/Applications/Loop");

  const MetadataSearchScope scope = MetadataSearchScope::current();
  EXPECT_THAT(
      scope.folders(),
      ElementsAre(
          Folder{root_, Role::PlatformRoot}, Folder{root_ + "/Applications", Role::TopApplications},
          Folder{root_ + "/Applications/Utilities", Role::ApplicationFolder},
          Folder{home_, Role::Home}, Folder{home_ + "/Applications", Role::ApplicationFolder},
          Folder{root_ + "/Volumes", Role::Volumes}, Folder{root_ + "/Volumes/Disk", Role::Volume},
          Folder{root_ + "/Volumes/Disk/Applications", Role::ApplicationFolder},
          Folder{root_ + "/Volumes/Empty", Role::Volume}));
  EXPECT_TRUE(scope.holdsBundleFolder(root_ + "/Applications/Utilities"));
  EXPECT_FALSE(scope.holdsBundleFolder(root_ + "/Volumes/Disk"));
}

TEST_F(MetadataQuerySearchScope, HomeAtTheRootIsOneFolderInTwoRoles) {
  fs::create_directories(root_ + "/Applications");
  ::setenv("HOME", root_.c_str(), 1);
  EXPECT_THAT(MetadataSearchScope::current().folders(),
              ElementsAre(Folder{root_, Role::PlatformRoot},
                          Folder{root_ + "/Applications", Role::TopApplications},
                          Folder{root_, Role::Home}));
}

TEST(MetadataQuerySearchScopeRoles, WhichNamesChangeTheScope) {
  EXPECT_TRUE(MetadataSearchScope::childChangesScope(Role::PlatformRoot, "Volumes"));
  EXPECT_TRUE(MetadataSearchScope::childChangesScope(Role::PlatformRoot, "Applications"));
  EXPECT_FALSE(MetadataSearchScope::childChangesScope(Role::PlatformRoot, "tmp"));
  EXPECT_TRUE(MetadataSearchScope::childChangesScope(Role::Home, "Applications"));
  EXPECT_FALSE(MetadataSearchScope::childChangesScope(Role::Home, ".cache"));
  EXPECT_TRUE(MetadataSearchScope::childChangesScope(Role::Volumes, "Anything"));
  EXPECT_TRUE(MetadataSearchScope::childChangesScope(Role::TopApplications, "Games"));
  EXPECT_FALSE(MetadataSearchScope::childChangesScope(Role::TopApplications, "Games.app"));
  EXPECT_FALSE(MetadataSearchScope::childChangesScope(Role::ApplicationFolder, "Sub"));
  EXPECT_TRUE(MetadataSearchScope::holdsBundles(Role::TopApplications));
  EXPECT_FALSE(MetadataSearchScope::holdsBundles(Role::Volume));
}

}  // namespace
}  // namespace larder
