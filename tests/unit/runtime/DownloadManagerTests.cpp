// The download layer end to end against a package server on 127.0.0.1:
// installs, replacements, every way a transfer fails, staging, pausing,
// many downloads at once, application locks and preflight checks.
#include <gtest/gtest.h>

#include <set>
#include <string>
#include <thread>
#include <vector>

#include "DownloadTestSupport.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/download/VendApplicationLocks.h"
#include "store-runtime/download/VendDownloadError.h"
#include "store-runtime/download/VendDownloadManager.h"
#include "store-runtime/http/VendHTTPTransfer.h"
#include "store-runtime/services/VendDownloadService.h"

namespace larder {
namespace {

namespace fs = std::filesystem;
using testing::assetFor;
using testing::bundlePackage;
using testing::downloadFor;
using testing::installBundleDirectly;
using testing::PackageServer;
using testing::PrivateRoot;
using testing::randomBytes;
using testing::readFile;
using testing::ReplyWaiter;
using testing::treeOf;
using Fault = PackageServer::Fault;

constexpr std::size_t kChunk = 16 * 1024;

// Polls `condition` until it holds or `limit` has passed.
template <typename Condition>
bool eventually(Condition condition, std::chrono::milliseconds limit = std::chrono::seconds(20)) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  while (std::chrono::steady_clock::now() < deadline) {
    if (condition()) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return condition();
}

class DownloadManagerTest : public ::testing::Test {
 protected:
  // Serves a package for `name` and gives a download of it.
  std::shared_ptr<TillDownload> servedDownload(std::uint64_t item, const std::string& name,
                                               const std::string& identifier,
                                               const std::string& version,
                                               std::size_t payload = 200'000,
                                               Fault fault = Fault::kNone,
                                               std::int64_t type = TillDownload::kInstall) {
    const std::string bytes =
        bundlePackage(name, identifier, version, payload, static_cast<unsigned>(item));
    packages_[item] = bytes;
    const std::string path = "/assets/" + std::to_string(item) + "/" + name + ".tar";
    const std::string url = server_.add(path, bytes, fault);
    return downloadFor(item, identifier, assetFor(url, bytes, kChunk), type);
  }
  static std::string assetPath(std::uint64_t item, const std::string& name) {
    return "/assets/" + std::to_string(item) + "/" + name + ".tar";
  }

  ReplyWaiter::Answer run(VendDownloadManager& manager, std::shared_ptr<TillDownload> download) {
    ReplyWaiter waiter;
    manager.performDownload(std::move(download), waiter.callback());
    std::optional<ReplyWaiter::Answer> answer = waiter.wait();
    EXPECT_TRUE(answer) << "no reply";
    return answer.value_or(ReplyWaiter::Answer{false, std::nullopt});
  }

  // Files left in the downloads folder (folders themselves do not count).
  std::vector<std::string> filesUnderDownloads() const {
    std::vector<std::string> files;
    for (const std::string& path : treeOf(root_.downloads())) {
      if (!fs::is_directory(root_.downloads() / path)) files.push_back(path);
    }
    return files;
  }

  PrivateRoot root_;
  PackageServer server_;
  std::map<std::uint64_t, std::string> packages_;
};

TEST_F(DownloadManagerTest, InstallsANewBundleAndCleansUp) {
  VendDownloadManager manager(root_.configuration());
  auto download = servedDownload(101, "Fresh", "com.example.fresh", "1.0");
  const ReplyWaiter::Answer answer = run(manager, download);
  ASSERT_TRUE(answer.success) << answer.error->description;
  EXPECT_FALSE(answer.error);
  const fs::path bundle = root_.applications() / "Fresh.app";
  EXPECT_EQ(readFile(bundle / "resources/payload.bin"), randomBytes(200'000, 101));
  EXPECT_EQ(download->progress(), 1.0);
  EXPECT_FALSE(download->status().isFailed);
  EXPECT_TRUE(filesUnderDownloads().empty());
  EXPECT_FALSE(fs::exists(root_.downloads() / "101")) << "the item's folder goes with its package";
  EXPECT_TRUE(manager.downloadsWithTypeMask(3).empty());
  EXPECT_EQ(server_.requestCount(assetPath(101, "Fresh")), 1);
}

TEST_F(DownloadManagerTest, ReplacesAnInstalledBundleWhileItsApplicationsAreLocked) {
  installBundleDirectly(root_.applications() / "Thing.app", "com.example.thing", "1.0");
  VendDownloadManager manager(root_.configuration());
  std::vector<std::string> lockedDuringInstall;
  std::mutex linesMutex;
  // The installer's level 2 line comes while the bundle is being put in
  // place; what the lock file says then is what a launch would see.
  TillLogManager& log = TillLogManager::sharedManager();
  const int previousLevel = log.level();
  log.setLevel(std::max(previousLevel, 2));
  auto sink = TillLogManager::sharedManager().addSink([&](int, const std::string& line) {
    if (line.find("Installed") == std::string::npos) return;
    std::lock_guard lock(linesMutex);
    lockedDuringInstall = VendApplicationLocks::persistedIdentifiers();
  });
  const ReplyWaiter::Answer answer =
      run(manager, servedDownload(102, "Thing", "com.example.thing", "2.0"));
  ASSERT_TRUE(answer.success) << answer.error->description;
  const fs::path bundle = root_.applications() / "Thing.app";
  EXPECT_EQ(readFile(bundle / "resources/version.txt"), "2.0");
  EXPECT_FALSE(fs::exists(bundle / "resources/only-in-old.txt"));
  EXPECT_EQ(readFile(bundle / "resources/payload.bin"), randomBytes(200'000, 102));
  for (const std::string& path : treeOf(root_.applications())) {
    EXPECT_EQ(path.rfind("Thing.app", 0), 0u) << "left beside the bundle: " << path;
  }
  sink.reset();
  log.setLevel(previousLevel);
  std::lock_guard lock(linesMutex);
  EXPECT_EQ(lockedDuringInstall, std::vector<std::string>{"com.example.thing"});
  EXPECT_TRUE(VendApplicationLocks::persistedIdentifiers().empty());
}

struct FailureCase {
  std::string name;
  Fault fault;
  bool refusedPort;
  VendDownloadError::Code code;
  std::string phrase;
};

TEST_F(DownloadManagerTest, EveryFailedTransferSaysWhyAndLeavesNothing) {
  const std::vector<FailureCase> cases = {
      {"digest mismatch", Fault::kCorrupt, false, VendDownloadError::kDigestMismatch,
       "does not match its manifest"},
      {"truncated", Fault::kTruncate, false, VendDownloadError::kTransferFailed,
       "before the whole file"},
      {"status 500", Fault::kStatus500, false, VendDownloadError::kHTTPStatus, "answered HTTP 500"},
      {"stalled", Fault::kStall, false, VendDownloadError::kTransferFailed,
       "sent nothing for 1 seconds"},
      {"refused", Fault::kNone, true, VendDownloadError::kTransferFailed, "refused the connection"},
  };
  installBundleDirectly(root_.applications() / "Kept.app", "com.example.kept", "1.0");
  const std::vector<std::string> applicationsBefore = treeOf(root_.applications());
  VendDownloadManager manager(root_.configuration(/*requestTimeout=*/1));
  std::uint64_t item = 200;
  for (const FailureCase& failure : cases) {
    ++item;
    // Half of them would replace an installed bundle, half install anew.
    const bool replacing = item % 2 == 0;
    auto download = servedDownload(item, replacing ? "Kept" : "New" + std::to_string(item),
                                   replacing ? "com.example.kept" : "com.example.new", "2.0",
                                   300'000, failure.fault);
    if (failure.refusedPort) {
      auto assets = download->assets();
      assets[0].setURLRequest(VendURLRequest(
          "http://127.0.0.1:" + std::to_string(PackageServer::refusingPort()) + "/assets/x.tar"));
      download->setAssets(assets);
    }
    const auto started = std::chrono::steady_clock::now();
    const ReplyWaiter::Answer answer = run(manager, download);
    EXPECT_FALSE(answer.success) << failure.name;
    ASSERT_TRUE(answer.error) << failure.name;
    EXPECT_EQ(answer.error->domain, VendDownloadError::kDomain) << failure.name;
    EXPECT_EQ(answer.error->code, failure.code)
        << failure.name << ": " << answer.error->description;
    EXPECT_NE(answer.error->description.find(failure.phrase), std::string::npos)
        << failure.name << ": " << answer.error->description;
    EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(10)) << failure.name;
    EXPECT_TRUE(download->status().isFailed) << failure.name;
    EXPECT_EQ(treeOf(root_.applications()), applicationsBefore) << failure.name;
    EXPECT_TRUE(filesUnderDownloads().empty()) << failure.name;
  }
  EXPECT_EQ(readFile(root_.applications() / "Kept.app/resources/version.txt"), "1.0");
}

TEST_F(DownloadManagerTest, ADigestMismatchStopsTheTransferEarly) {
  // A package of many chunks, corrupt in the middle: the transfer stops
  // soon after the bad chunk, well before the end, and the error names it.
  // "Soon" allows for the bytes the writer holds in its buffers while the
  // hashing thread catches up (a few 4 MiB buffers).
  constexpr std::uint64_t kBufferedAllowance = 20u << 20u;
  VendDownloadManager manager(root_.configuration());
  auto download = servedDownload(250, "Big", "com.example.big", "1.0", 48u << 20u, Fault::kCorrupt);
  const ReplyWaiter::Answer answer = run(manager, download);
  ASSERT_TRUE(answer.error);
  EXPECT_EQ(answer.error->code, VendDownloadError::kDigestMismatch);
  const std::uint64_t size = packages_[250].size();
  const std::uint64_t badChunk = size / 2 / kChunk;
  EXPECT_NE(answer.error->description.find("chunk " + std::to_string(badChunk) + " "),
            std::string::npos)
      << answer.error->description;
  const auto received =
      static_cast<std::uint64_t>(download->progress() * static_cast<double>(size));
  EXPECT_LT(received, (badChunk + 1) * kChunk + kBufferedAllowance);
  EXPECT_LT(received, size);
}

TEST_F(DownloadManagerTest, StagesThenInstallsWithoutASecondRequest) {
  VendDownloadManager manager(root_.configuration());
  auto download = servedDownload(301, "Staged", "com.example.staged", "1.0", 200'000, Fault::kNone,
                                 TillDownload::kStageOnly);
  ReplyWaiter::Answer answer = run(manager, download);
  ASSERT_TRUE(answer.success) << answer.error->description;
  EXPECT_EQ(filesUnderDownloads(), std::vector<std::string>{"301/0.pkg"});
  EXPECT_EQ(readFile(root_.downloads() / "301/0.pkg"), packages_[301]);
  EXPECT_FALSE(fs::exists(root_.applications() / "Staged.app")) << "staging installs nothing";
  EXPECT_EQ(server_.requestCount(assetPath(301, "Staged")), 1);

  download->setDownloadType(TillDownload::kInstall);
  answer = run(manager, download);
  ASSERT_TRUE(answer.success) << answer.error->description;
  EXPECT_EQ(server_.requestCount(assetPath(301, "Staged")), 1) << "the staged package was used";
  EXPECT_EQ(readFile(root_.applications() / "Staged.app/resources/payload.bin"),
            randomBytes(200'000, 301));
  EXPECT_TRUE(filesUnderDownloads().empty());
}

TEST_F(DownloadManagerTest, AStagedPackageThatNoLongerMatchesIsFetchedAgain) {
  VendDownloadManager manager(root_.configuration());
  auto download = servedDownload(302, "Stale", "com.example.stale", "1.0", 100'000, Fault::kNone,
                                 TillDownload::kStageOnly);
  ASSERT_TRUE(run(manager, download).success);
  testing::writeFile(root_.downloads() / "302/0.pkg", randomBytes(packages_[302].size(), 77));

  download->setDownloadType(TillDownload::kInstall);
  const ReplyWaiter::Answer answer = run(manager, download);
  ASSERT_TRUE(answer.success) << answer.error->description;
  EXPECT_EQ(server_.requestCount(assetPath(302, "Stale")), 2);
  EXPECT_EQ(readFile(root_.applications() / "Stale.app/resources/payload.bin"),
            randomBytes(100'000, 302));
}

TEST_F(DownloadManagerTest, SkippingTheDownloadWorksOnlyWithWhatIsOnDisk) {
  VendDownloadManager manager(root_.configuration());
  for (std::int64_t type : {TillDownload::kStageOnly, TillDownload::kInstall}) {
    auto download =
        servedDownload(401, "Skip", "com.example.skip", "1.0", 50'000, Fault::kNone, type);
    download->setSkipAssetDownloadIfNotAlreadyOnDisk(true);
    const ReplyWaiter::Answer answer = run(manager, download);
    EXPECT_FALSE(answer.success);
    ASSERT_TRUE(answer.error);
    EXPECT_EQ(answer.error->code, VendDownloadError::kNotOnDisk) << answer.error->description;
    EXPECT_NE(answer.error->description.find("not on disk"), std::string::npos)
        << answer.error->description;
  }
  EXPECT_EQ(server_.totalRequests(), 0);
  EXPECT_FALSE(fs::exists(root_.applications() / "Skip.app"));

  // Once staged, the same setting installs from disk.
  auto stage = servedDownload(402, "Skip", "com.example.skip", "1.0", 50'000, Fault::kNone,
                              TillDownload::kStageOnly);
  ASSERT_TRUE(run(manager, stage).success);
  stage->setSkipAssetDownloadIfNotAlreadyOnDisk(true);
  stage->setDownloadType(TillDownload::kInstall);
  const ReplyWaiter::Answer answer = run(manager, stage);
  ASSERT_TRUE(answer.success) << answer.error->description;
  EXPECT_EQ(server_.totalRequests(), 1);
  EXPECT_TRUE(fs::exists(root_.applications() / "Skip.app/bin/run"));
}

class PausedDownloadTest : public DownloadManagerTest {
 protected:
  static constexpr std::size_t kPayload = 6u << 20u;
  static constexpr std::size_t kGate = 2'500'001;  // not on a chunk boundary

  void SetUp() override {
    // The manager says at level 2 when a paused transfer has stopped; a
    // resume before that point would only let the transfer go on.
    TillLogManager& log = TillLogManager::sharedManager();
    previousLevel_ = log.level();
    log.setLevel(std::max(previousLevel_, 2));
    sink_ = log.addSink([this](int, const std::string& line) {
      if (line.find("Paused download of 501") == std::string::npos) return;
      std::lock_guard lock(mutex_);
      ++parked_;
      parkedChanged_.notify_all();
    });
  }
  void TearDown() override {
    sink_.reset();
    TillLogManager::sharedManager().setLevel(previousLevel_);
  }

  // Starts a download that stops at the gate, pauses it there and waits
  // until its transfer has stopped; gives the size of its partial file.
  std::uint64_t startAndPause(VendDownloadManager& manager, ReplyWaiter& waiter,
                              std::int64_t type = TillDownload::kInstall) {
    server_.setGateBytes(kGate);
    download_ =
        servedDownload(501, "Paused", "com.example.paused", "1.0", kPayload, Fault::kGate, type);
    manager.performDownload(download_, waiter.callback());
    EXPECT_TRUE(server_.waitUntilGateReached(std::chrono::seconds(20)));
    EXPECT_TRUE(eventually([&] { return download_->progress() > 0; }));
    manager.pauseDownloadWithItemIdentifier(501);
    EXPECT_TRUE(download_->status().isPaused);
    std::unique_lock lock(mutex_);
    EXPECT_TRUE(
        parkedChanged_.wait_for(lock, std::chrono::seconds(20), [this] { return parked_ > 0; }));
    std::error_code code;
    const std::uint64_t partial = fs::file_size(root_.downloads() / "501/0.partial", code);
    EXPECT_FALSE(code);
    EXPECT_GT(partial, 0u);
    EXPECT_LE(partial, kGate);
    return partial;
  }

  std::shared_ptr<TillDownload> download_;

 private:
  int previousLevel_ = 0;
  std::shared_ptr<void> sink_;
  std::mutex mutex_;
  std::condition_variable parkedChanged_;
  int parked_ = 0;
};

TEST_F(PausedDownloadTest, ResumesWithARangeRequestAndInstalls) {
  std::optional<VendDownloadManager> manager(std::in_place, root_.configuration());
  ReplyWaiter waiter;
  const std::uint64_t partial = startAndPause(*manager, waiter);
  const auto listed = manager->downloadsWithTypeMask(TillDownload::kInstall);
  ASSERT_EQ(listed.size(), 1u);
  EXPECT_EQ(listed.front(), download_);
  EXPECT_TRUE(listed.front()->status().isPaused);
  EXPECT_TRUE(manager->downloadsWithTypeMask(TillDownload::kStageOnly).empty());

  server_.openGate();
  manager->resumeDownloadWithItemIdentifier(501);
  EXPECT_FALSE(download_->status().isPaused);
  std::optional<ReplyWaiter::Answer> answer = waiter.wait();
  ASSERT_TRUE(answer);
  ASSERT_TRUE(answer->success) << answer->error->description;
  EXPECT_EQ(server_.rangeHeaders(assetPath(501, "Paused")),
            (std::vector<std::string>{"", "bytes=" + std::to_string(partial) + "-"}));
  EXPECT_EQ(readFile(root_.applications() / "Paused.app/resources/payload.bin"),
            randomBytes(kPayload, 501));
  EXPECT_TRUE(filesUnderDownloads().empty());
  // The first answer was the success: the pause did not answer before it.
  // Once the manager's workers are joined no answer can still come.
  manager.reset();
  EXPECT_EQ(waiter.count(), 1u) << "a paused download has not replied";
}

TEST_F(PausedDownloadTest, AStoreThatIgnoresTheRangeMakesItStartOver) {
  VendDownloadManager manager(root_.configuration());
  ReplyWaiter waiter;
  startAndPause(manager, waiter, TillDownload::kStageOnly);
  EXPECT_EQ(manager.downloadsWithTypeMask(TillDownload::kStageOnly).size(), 1u);
  EXPECT_TRUE(manager.downloadsWithTypeMask(TillDownload::kInstall).empty());
  server_.setFault(assetPath(501, "Paused"), Fault::kIgnoreRange);
  server_.openGate();
  manager.resumeDownloadWithItemIdentifier(501);
  std::optional<ReplyWaiter::Answer> answer = waiter.wait();
  ASSERT_TRUE(answer);
  ASSERT_TRUE(answer->success) << answer->error->description;
  EXPECT_EQ(server_.requestCount(assetPath(501, "Paused")), 3)
      << "first part, refused resume, whole file";
  EXPECT_EQ(readFile(root_.downloads() / "501/0.pkg"), packages_[501]);
}

TEST_F(PausedDownloadTest, StoppingTheManagerCancelsAPausedDownloadAndKeepsItsPart) {
  ReplyWaiter waiter;
  std::uint64_t partial = 0;
  {
    VendDownloadManager manager(root_.configuration());
    partial = startAndPause(manager, waiter);
  }
  ASSERT_EQ(waiter.count(), 1u);
  const ReplyWaiter::Answer answer = *waiter.wait();
  EXPECT_FALSE(answer.success);
  ASSERT_TRUE(answer.error);
  EXPECT_TRUE(answer.error->isCancellation());
  EXPECT_EQ(fs::file_size(root_.downloads() / "501/0.partial"), partial);

  // A new manager goes on from the part on disk, after reading it back.
  server_.openGate();
  VendDownloadManager again(root_.configuration());
  auto download =
      downloadFor(501, "com.example.paused",
                  assetFor(server_.url(assetPath(501, "Paused")), packages_[501], kChunk));
  ReplyWaiter second;
  again.performDownload(download, second.callback());
  std::optional<ReplyWaiter::Answer> finished = second.wait();
  ASSERT_TRUE(finished);
  ASSERT_TRUE(finished->success) << finished->error->description;
  EXPECT_EQ(server_.rangeHeaders(assetPath(501, "Paused")).back(),
            "bytes=" + std::to_string(partial) + "-");
}

TEST_F(DownloadManagerTest, ManyItemsDownloadAtOnce) {
  constexpr int kItems = 12;
  VendDownloadManager manager(root_.configuration());
  std::vector<std::shared_ptr<TillDownload>> downloads;
  for (int i = 0; i < kItems; ++i) {
    downloads.push_back(servedDownload(600 + i, "Many" + std::to_string(i),
                                       "com.example.many" + std::to_string(i), "1.0",
                                       300'000 + 1000 * i));
  }
  std::vector<ReplyWaiter> waiters(kItems);
  for (int i = 0; i < kItems; ++i) manager.performDownload(downloads[i], waiters[i].callback());
  // The same item again while it is under way is refused.
  ReplyWaiter duplicate;
  manager.performDownload(downloads[kItems - 1], duplicate.callback());

  for (int i = 0; i < kItems; ++i) {
    std::optional<ReplyWaiter::Answer> answer = waiters[i].wait();
    ASSERT_TRUE(answer) << i;
    EXPECT_TRUE(answer->success) << i << ": " << (answer->error ? answer->error->description : "");
  }
  std::optional<ReplyWaiter::Answer> refused = duplicate.wait();
  ASSERT_TRUE(refused);
  EXPECT_FALSE(refused->success);
  EXPECT_EQ(refused->error->code, VendDownloadError::kAlreadyInProgress);
  for (int i = 0; i < kItems; ++i) {
    EXPECT_EQ(readFile(root_.applications() / ("Many" + std::to_string(i) + ".app") /
                       "resources/payload.bin"),
              randomBytes(300'000 + 1000 * i, 600 + i))
        << i;
    EXPECT_EQ(waiters[i].count(), 1u) << "exactly one reply";
  }
  EXPECT_TRUE(filesUnderDownloads().empty());
}

TEST_F(DownloadManagerTest, UnusableDownloadsAreRefusedOnAnotherThread) {
  VendDownloadManager manager(root_.configuration());
  auto download = servedDownload(701, "Bad", "com.example.bad", "1.0");
  auto assets = download->assets();
  auto hashes = assets[0].hashes();
  hashes.pop_back();
  assets[0].setHashes(hashes);
  download->setAssets(assets);

  std::thread::id replyThread;
  ReplyWaiter waiter;
  manager.performDownload(download,
                          [&, callback = waiter.callback()](bool success, OptionalError error) {
                            replyThread = std::this_thread::get_id();
                            callback(success, std::move(error));
                          });
  std::optional<ReplyWaiter::Answer> answer = waiter.wait();
  ASSERT_TRUE(answer);
  EXPECT_FALSE(answer->success);
  EXPECT_EQ(answer->error->code, VendDownloadError::kInvalidDownload);
  EXPECT_NE(answer->error->description.find("digests"), std::string::npos)
      << answer->error->description;
  EXPECT_NE(replyThread, std::this_thread::get_id());

  auto neither = servedDownload(702, "Bad", "com.example.bad", "1.0");
  neither->setDownloadType(4);
  ReplyWaiter second;
  manager.performDownload(neither, second.callback());
  EXPECT_EQ(second.wait()->error->code, VendDownloadError::kInvalidDownload);
  EXPECT_EQ(server_.totalRequests(), 0);
}

TEST_F(DownloadManagerTest, LocksNestAndKeepOtherEntriesOfTheFile) {
  // An entry that another process wrote stays.
  const std::string file =
      (root_.root() / "var/lib/larder-platform/locked-applications.plist").string();
  testing::writeFile(file,
                     PropertyListSerialization::writeXml(PlistArray{"com.example.elsewhere"}));
  VendDownloadManager manager(root_.configuration());
  manager.lockApplicationsForBundleID("com.example.a");
  manager.lockApplicationsForBundleID("com.example.a");
  manager.lockApplicationsForBundleID("com.example.b");
  EXPECT_EQ(VendApplicationLocks::persistedIdentifiers(),
            (std::vector<std::string>{"com.example.elsewhere", "com.example.a", "com.example.b"}));
  manager.unlockApplicationsWithBundleIdentifier("com.example.a");
  EXPECT_EQ(manager.applicationLocks().lockCount("com.example.a"), 1u);
  EXPECT_EQ(VendApplicationLocks::persistedIdentifiers().size(), 3u) << "still locked once";
  manager.unlockApplicationsWithBundleIdentifier("com.example.a");
  manager.unlockApplicationsWithBundleIdentifier("com.example.never");
  EXPECT_EQ(VendApplicationLocks::persistedIdentifiers(),
            (std::vector<std::string>{"com.example.elsewhere", "com.example.b"}));
  EXPECT_EQ(manager.applicationLocks().lockCount("com.example.a"), 0u);
}

class PreflightTest : public DownloadManagerTest {
 protected:
  struct Verdict {
    bool allowed = false;
    PlistValue object;
  };

  Verdict ask(const std::string& url, PlistValue info = {}) {
    std::promise<Verdict> promise;
    manager_.checkPreflight(9, url, std::move(info), [&](bool allowed, PlistValue object) {
      promise.set_value({allowed, std::move(object)});
    });
    return promise.get_future().get();
  }
  std::string servePreflight(const std::string& name, PlistDictionary answer) {
    return server_.add("/preflight/" + name, PropertyListSerialization::writeXml(answer));
  }

  VendDownloadManager manager_{root_.configuration()};
};

TEST_F(PreflightTest, ComparesTheMinimumWithTheGivenSystemVersion) {
  const std::string needs12 =
      servePreflight("12", {{"allowed", true}, {"minimumSystemVersion", "12.2"}});
  EXPECT_TRUE(ask(needs12, PlistDictionary{{"SystemVersion", "12.10"}}).allowed);
  EXPECT_TRUE(ask(needs12, PlistDictionary{{"ProductVersion", "12.2"}}).allowed);
  EXPECT_TRUE(ask(needs12, "13.0").allowed);
  const Verdict older = ask(needs12, PlistDictionary{{"SystemVersion", "12.1.9"}});
  EXPECT_FALSE(older.allowed);
  EXPECT_EQ(older.object["code"].int64Value(), VendDownloadError::kPreflightFailed);
  EXPECT_NE(older.object["description"].string()->find("12.2"), std::string::npos);

  const Verdict allowedWithoutMinimum = ask(servePreflight("any", {{"allowed", true}}));
  EXPECT_TRUE(allowedWithoutMinimum.allowed);
  EXPECT_TRUE(allowedWithoutMinimum.object.isNull());
  const Verdict forbidden =
      ask(servePreflight("no", {{"allowed", false}, {"minimumSystemVersion", "1"}}));
  EXPECT_FALSE(forbidden.allowed);
  EXPECT_EQ(forbidden.object["domain"], PlistValue(VendDownloadError::kDomain));
}

TEST_F(PreflightTest, WithoutVersionInfoTheMachinesMajorVersionCounts) {
  testing::writeFile(root_.root() / "etc/os-release", "NAME=\"Test\"\nVERSION_ID=\"12\"\n");
  EXPECT_TRUE(
      ask(servePreflight("a", {{"allowed", true}, {"minimumSystemVersion", "12.4"}})).allowed);
  EXPECT_TRUE(
      ask(servePreflight("b", {{"allowed", true}, {"minimumSystemVersion", "11"}})).allowed);
  EXPECT_FALSE(
      ask(servePreflight("c", {{"allowed", true}, {"minimumSystemVersion", "13.0"}})).allowed);
}

TEST_F(PreflightTest, FetchFailuresAnswerFalseWithTheError) {
  const Verdict refused =
      ask("http://127.0.0.1:" + std::to_string(PackageServer::refusingPort()) + "/preflight/1");
  EXPECT_FALSE(refused.allowed);
  EXPECT_EQ(refused.object["domain"], PlistValue(VendHTTPTransfer::kErrorDomain));
  EXPECT_NE(refused.object["description"].string()->find("Preflight of item 9"), std::string::npos);

  server_.add("/preflight/broken", "x", Fault::kStatus500);
  const Verdict broken = ask(server_.url("/preflight/broken"));
  EXPECT_FALSE(broken.allowed);
  EXPECT_NE(broken.object["description"].string()->find("HTTP 500"), std::string::npos);

  server_.add("/preflight/garbage", "not a property list");
  EXPECT_FALSE(ask(server_.url("/preflight/garbage")).allowed);
  EXPECT_FALSE(ask(servePreflight("silent", {{"minimumSystemVersion", "1"}})).allowed)
      << "no verdict";
  EXPECT_FALSE(ask("").allowed);
}

TEST_F(DownloadManagerTest, TheServiceOfAStoreClientReachesTheRuntimesManager) {
  auto runtime = std::make_shared<VendRuntime>(root_.configuration());
  VendDownloadService service(
      VendStoreClient::initWithStoreClientType(VendStoreClient::kStoreApplication), runtime);
  std::promise<std::pair<std::int64_t, OptionalError>> result;
  service.performDownload(servedDownload(801, "Serviced", "com.example.serviced", "1.0"), 0,
                          [&](std::int64_t value, OptionalError error) {
                            result.set_value({value, error});
                          });
  auto [value, error] = result.get_future().get();
  EXPECT_EQ(value, 1) << (error ? error->description : "");
  EXPECT_TRUE(fs::exists(root_.applications() / "Serviced.app/bundle.plist"));

  std::promise<std::int64_t> failed;
  auto bad = servedDownload(802, "Broken", "com.example.broken", "1.0", 10'000, Fault::kStatus500);
  service.performDownload(bad, 0,
                          [&](std::int64_t value, OptionalError) { failed.set_value(value); });
  EXPECT_EQ(failed.get_future().get(), 0);

  service.lockApplicationsForBundleID("com.example.serviced");
  EXPECT_EQ(VendApplicationLocks::persistedIdentifiers(),
            std::vector<std::string>{"com.example.serviced"});
  service.unlockApplicationsWithBundleIdentifier("com.example.serviced");
  EXPECT_TRUE(VendApplicationLocks::persistedIdentifiers().empty());

  std::promise<std::size_t> listed;
  service.downloadsWithTypeMask(3, [&](std::vector<std::shared_ptr<TillDownload>> downloads) {
    listed.set_value(downloads.size());
  });
  EXPECT_EQ(listed.get_future().get(), 0u);
}

}  // namespace
}  // namespace larder
