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
#include "tests/unit/platform/TemporaryFolderTest.h"

namespace larder {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::Not;
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

// One event as the test writes it down.
std::string event(int watch, std::uint32_t mask, const std::string& name) {
  return " " + std::to_string(watch) + " " + std::to_string(mask) + " " + name + ";";
}

// What a batch decoded from `bytes` holds, written down the same way.
std::string decoded(const std::vector<std::uint8_t>& bytes) {
  MetadataIndexWatcher::Batch batch;
  MetadataIndexWatcher::decode(bytes, batch);
  std::string text =
      std::string(batch.overflowed ? "overflowed;" : "") + (batch.failed ? "failed;" : "");
  for (const auto& found : batch.events) text += event(found.watch, found.mask, found.name);
  return text;
}

TEST(MetadataQueryWatcher, DecodesRecordsAndFailsOnTruncatedOnes) {
  std::vector<std::uint8_t> mixed;
  appendRecord(mixed, 3, IN_CREATE | IN_ISDIR, "Notes.app", 16);
  appendRecord(mixed, -1, IN_Q_OVERFLOW, "", 0);
  appendRecord(mixed, 4, IN_DELETE_SELF, "", 0);
  EXPECT_EQ(decoded(mixed), "overflowed;" + event(3, IN_CREATE | IN_ISDIR, "Notes.app") +
                                event(4, IN_DELETE_SELF, ""));
  std::vector<std::uint8_t> one;
  appendRecord(one, 3, IN_CREATE, "Notes.app", 16);
  EXPECT_EQ(decoded({one.begin(), one.end() - 4}), "failed;") << "name cut short";
  EXPECT_EQ(decoded({one.begin(), one.begin() + 6}), "failed;") << "header cut short";
  std::vector<std::uint8_t> unterminated;  // a name that fills its length
  appendRecord(unterminated, 1, IN_CREATE, "abcdefgh", 8);
  EXPECT_EQ(decoded(unterminated), event(1, IN_CREATE, "abcdefgh"));
}

class MetadataQueryWatcherOnDisk : public TemporaryFolderTest {
 protected:
  void SetUp() override {
    TemporaryFolderTest::SetUp();
    ASSERT_EQ(watcher_.initializationError(), 0);
  }

  // Names of the events that come, up to the first named `name`; none if that does not come
  // within a second.
  std::vector<std::string> namesUntil(std::string_view name) {
    std::vector<std::string> names;
    const auto end = std::chrono::steady_clock::now() + 1s;
    while (std::chrono::steady_clock::now() < end) {
      for (const auto& event : watcher_.waitForEvents(50ms).events) {
        names.push_back(event.name);
        if (event.name == name) return names;
      }
    }
    return {};
  }

  bool sawEventNamed(std::string_view name) { return !namesUntil(name).empty(); }

  MetadataIndexWatcher watcher_;
};

TEST_F(MetadataQueryWatcherOnDisk, ReportsWhatHappensWhileAnyRoleWatches) {
  EXPECT_EQ(watcher_.addWatch(base_ + "/missing", MetadataIndexWatcher::kFolderMask), -ENOENT);
  std::ofstream(base_ + "/file") << "x";
  EXPECT_EQ(watcher_.addWatch(base_ + "/file", MetadataIndexWatcher::kFolderMask), -ENOTDIR);
  const int first = watcher_.addWatch(base_, MetadataIndexWatcher::kFolderMask);
  const int second = watcher_.addWatch(base_, MetadataIndexWatcher::kBundleMask);
  ASSERT_GE(first, 0);
  EXPECT_EQ(first, second);
  EXPECT_EQ(watcher_.watchCount(), 1u);
  fs::create_directory(base_ + "/Notes.app");
  EXPECT_TRUE(sawEventNamed("Notes.app"));

  watcher_.removeWatch(first);
  std::ofstream(base_ + "/still") << "x";
  EXPECT_TRUE(sawEventNamed("still")) << "one role still watches";

  watcher_.removeWatch(first);
  EXPECT_EQ(watcher_.watchCount(), 0u);
  // Events come in order: one for "gone" would come before the marker's.
  fs::create_directory(base_ + "/Other");
  ASSERT_GE(watcher_.addWatch(base_ + "/Other", MetadataIndexWatcher::kFolderMask), 0);
  std::ofstream(base_ + "/gone") << "x";
  std::ofstream(base_ + "/Other/marker") << "x";
  const std::vector<std::string> names = namesUntil("marker");
  EXPECT_THAT(names, Contains("marker"));
  EXPECT_THAT(names, Not(Contains("gone")));
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
  // Reported once: the batch that brings the next event has none.
  ASSERT_GE(watcher_.addWatch(base_, MetadataIndexWatcher::kFolderMask), 0);
  std::ofstream(base_ + "/after") << "x";
  const MetadataIndexWatcher::Batch next = watcher_.waitForEvents(1s);
  EXPECT_FALSE(next.events.empty());
  EXPECT_FALSE(next.overflowed);
}

TEST_F(MetadataQueryWatcherOnDisk, KernelDropOfAWatchIsForgotten) {
  fs::create_directory(base_ + "/Sub");
  ASSERT_GE(watcher_.addWatch(base_ + "/Sub", MetadataIndexWatcher::kFolderMask), 0);
  fs::remove(base_ + "/Sub");
  const auto end = std::chrono::steady_clock::now() + 1s;
  while (watcher_.watchCount() > 0 && std::chrono::steady_clock::now() < end) {
    watcher_.waitForEvents(50ms);
  }
  EXPECT_EQ(watcher_.watchCount(), 0u);
}

class MetadataQuerySearchScope : public TemporaryFolderTest {
 protected:
  void SetUp() override {
    TemporaryFolderTest::SetUp();
    makeRootAndHome();
  }
};

TEST_F(MetadataQuerySearchScope, EveryApplicationFolderAndItsAnchors) {
  EXPECT_THAT(MetadataSearchScope::current().folders(),
              ElementsAre(Folder{root_, Role::PlatformRoot}, Folder{home_, Role::Home}));
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
