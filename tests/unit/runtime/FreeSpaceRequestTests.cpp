// The free space request: the statuses it goes through at each urgency, the
// bound on its wait, and what it takes from the service's caches.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <mutex>
#include <vector>

#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/system/FileIO.h"
#include "store-runtime/host/FreeSpaceRequest.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "tests/unit/ScopedEnvironment.h"
#include "tests/unit/TemporaryFolder.h"

namespace larder {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using testing::ScopedEnvironment;
using testing::TemporaryFolder;

constexpr auto kGenerous = 10s;

// Every status a request hands over, and a signal at the final one.
class StatusLog {
 public:
  FreeSpaceRequest::StatusHandler handler() {
    return [this](std::int64_t status, const OptionalError& error) {
      std::lock_guard lock(mutex_);
      statuses_.push_back(status);
      errors_ += error ? 1 : 0;
      if (FreeSpaceRequest::isFinalStatus(status)) final_.signal();
      if (status == FreeSpaceRequest::kWaitingForSpace) waiting_.signal();
    };
  }
  std::vector<std::int64_t> statuses() {
    std::lock_guard lock(mutex_);
    return statuses_;
  }
  int errors() {
    std::lock_guard lock(mutex_);
    return errors_;
  }
  DispatchSemaphore final_;
  DispatchSemaphore waiting_;

 private:
  std::mutex mutex_;
  std::vector<std::int64_t> statuses_;
  int errors_ = 0;
};

class FreeSpaceRequestTest : public ::testing::Test {
 protected:
  void SetUp() override {
    environment_.set("LARDER_ROOT", folder_ / "root");
    environment_.set("XDG_CACHE_HOME", folder_ / "cache");
  }

  static void setState(PlistDictionary state) {
    ASSERT_TRUE(PlatformStateFile::named(FreeSpaceRequest::kStateFileName)
                    .updateDictionary([&](PlistDictionary& stored) { stored = state; }));
  }

  // A file of `bytes` bytes written `age` ago.
  void writeAged(const std::string& relative, std::size_t bytes, std::chrono::hours age) {
    const std::string path = folder_ / ("cache/com.orvane.larderd/" + relative);
    ASSERT_TRUE(FileIO::writeAtomically(path, std::string(bytes, 'x')));
    fs::last_write_time(path, fs::file_time_type::clock::now() - age);
  }
  bool exists(const std::string& relative) const {
    return fs::exists(folder_ / ("cache/com.orvane.larderd/" + relative));
  }

  TemporaryFolder folder_;
  ScopedEnvironment environment_;
};

TEST_F(FreeSpaceRequestTest, EachUrgencyEndsInOneFinalStatus) {
  struct Case {
    const char* name;
    std::int64_t urgency;
    std::uint64_t freeBytes;
    std::vector<std::int64_t> expected;
  };
  const std::vector<Case> cases = {
      {"room at once", 1, 100, {2, 1}},
      {"no room, only measured", 1, 10, {2, 4}},
      {"no room after reclaiming", 2, 10, {3, 2, 4}},
      {"room after reclaiming", 3, 100, {3, 2, 1}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    setState({{"freeBytes", c.freeBytes}});
    StatusLog log;
    auto request = FreeSpaceRequest::requestFreeSpace(50);
    request->setUrgency(c.urgency);
    request->begin(log.handler());
    ASSERT_TRUE(log.final_.waitFor(kGenerous));
    EXPECT_EQ(log.statuses(), c.expected);
    EXPECT_EQ(log.errors(), 0);
  }
}

// Urgency 3 keeps measuring: the space another process frees is seen, and
// without it the bound ends the wait.
TEST_F(FreeSpaceRequestTest, TheMostUrgentRequestWaitsForRoomUntilItsBound) {
  setState({{"freeBytes", 10}, {"timeoutSeconds", 30}});
  StatusLog freed;
  auto request = FreeSpaceRequest::requestFreeSpace(50);
  request->setUrgency(3);
  request->begin(freed.handler());
  ASSERT_TRUE(freed.waiting_.waitFor(kGenerous));
  setState({{"freeBytes", 100}, {"timeoutSeconds", 30}});
  ASSERT_TRUE(freed.final_.waitFor(kGenerous));
  EXPECT_EQ(freed.statuses().back(), FreeSpaceRequest::kSatisfied);

  setState({{"freeBytes", 10}, {"timeoutSeconds", 0.5}});
  StatusLog bounded;
  const auto started = std::chrono::steady_clock::now();
  auto hopeless = FreeSpaceRequest::requestFreeSpace(50);
  hopeless->setUrgency(3);
  hopeless->begin(bounded.handler());
  ASSERT_TRUE(bounded.final_.waitFor(kGenerous));
  EXPECT_LT(std::chrono::steady_clock::now() - started, 5s);
  const std::vector<std::int64_t> statuses = bounded.statuses();
  EXPECT_EQ(statuses.back(), FreeSpaceRequest::kTimedOut);
  EXPECT_EQ(std::count(statuses.begin(), statuses.end(), FreeSpaceRequest::kSatisfied), 0);
  EXPECT_GE(std::count(statuses.begin(), statuses.end(), FreeSpaceRequest::kWaitingForSpace), 1);
}

TEST_F(FreeSpaceRequestTest, ReclaimingTakesOnlyStaleDownloadsAndOldAuditSideFiles) {
  writeAged("Downloads/7001/1.partial", 1000, 24h * 8);
  writeAged("Downloads/7002/1.partial", 300, 24h * 8);
  writeAged("Downloads/7002/2.pkg", 300, 1h);  // resumed lately: still wanted
  writeAged("UpdateOperationAuditInfoCache-old.plist", 200, 24h * 8);
  writeAged("UpdateOperationAuditInfoCache-new.plist", 200, 1h);
  writeAged("updates.plist", 50, 24h * 30);  // the update queue's own list

  EXPECT_EQ(FreeSpaceRequest::reclaimServiceCaches(), 1200U);
  EXPECT_FALSE(exists("Downloads/7001"));
  EXPECT_TRUE(exists("Downloads/7002/1.partial"));
  EXPECT_FALSE(exists("UpdateOperationAuditInfoCache-old.plist"));
  EXPECT_TRUE(exists("UpdateOperationAuditInfoCache-new.plist"));
  EXPECT_TRUE(exists("updates.plist"));

  // Measuring alone takes nothing.
  writeAged("Downloads/7003/1.partial", 10, 24h * 8);
  setState({{"freeBytes", 100}});
  StatusLog log;
  auto request = FreeSpaceRequest::requestFreeSpace(50);
  request->setUrgency(1);
  request->begin(log.handler());
  ASSERT_TRUE(log.final_.waitFor(kGenerous));
  EXPECT_TRUE(exists("Downloads/7003/1.partial"));
}

}  // namespace
}  // namespace larder
