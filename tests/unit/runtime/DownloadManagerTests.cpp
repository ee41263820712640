// The download layer end to end against a package server on 127.0.0.1:
// installs, replacements, every way a transfer fails, staging, pausing,
// many downloads at once, application locks and preflight checks.
#include <gtest/gtest.h>

#include <future>
#include <string>
#include <thread>
#include <vector>

#include "RuntimeTestSupport.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/download/VendApplicationLocks.h"
#include "store-runtime/download/VendDownloadError.h"
#include "store-runtime/download/VendDownloadManager.h"
#include "store-runtime/http/VendHTTPTransfer.h"
#include "store-runtime/services/VendDownloadService.h"

namespace larder {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using testing::assetFor;
using testing::bundlePackage;
using testing::downloadFor;
using testing::installBundleDirectly;
using testing::randomBytes;
using testing::readFile;
using testing::ReplyWaiter;
using testing::StoreServer;
using testing::treeOf;
using Fault = StoreServer::Fault;

constexpr std::size_t kChunk = 16 * 1024;

// Runs `onLine` for every log line of level 2 or below that holds `phrase`,
// for the lifetime of the watch: the manager and the installer say at
// level 2 when a step the tests wait for has happened.
class LogWatch {
 public:
  LogWatch(std::string phrase, std::function<void()> onLine)
      : previousLevel_(TillLogManager::sharedManager().level()) {
    TillLogManager::sharedManager().setLevel(std::max(previousLevel_, 2));
    sink_ = TillLogManager::sharedManager().addSink(
        [phrase = std::move(phrase), onLine = std::move(onLine)](int, const std::string& line) {
          if (line.find(phrase) != std::string::npos) onLine();
        });
  }
  ~LogWatch() {
    sink_.reset();
    TillLogManager::sharedManager().setLevel(previousLevel_);
  }

 private:
  int previousLevel_;
  std::shared_ptr<void> sink_;
};

class DownloadManagerTest : public ::testing::Test {
 protected:
  // Serves a package for `name` and gives a download of it.
  std::shared_ptr<TillDownload> servedDownload(std::uint64_t item, const std::string& name,
                                               const std::string& identifier,
                                               std::size_t payload = 200'000,
                                               Fault fault = Fault::kNone,
                                               std::int64_t type = TillDownload::kInstall) {
    const std::string bytes =
        bundlePackage(name, identifier, "2.0", payload, static_cast<unsigned>(item));
    packages_[item] = bytes;
    const std::string url = server_.add(assetPath(item, name), bytes, fault);
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
  static void expectFailure(const ReplyWaiter::Answer& answer, std::int64_t code,
                            std::string_view phrase) {
    EXPECT_FALSE(answer.success);
    ASSERT_TRUE(answer.error);
    EXPECT_EQ(answer.error->domain, VendDownloadError::kDomain);
    EXPECT_EQ(answer.error->code, code) << answer.error->description;
    EXPECT_NE(answer.error->description.find(phrase), std::string::npos)
        << answer.error->description;
  }
  std::string payloadOf(const std::string& name) const {
    return readFile(root_.applications() / (name + ".app") / "resources/payload.bin");
  }

  // Files left in the downloads folder (folders themselves do not count).
  std::vector<std::string> filesUnderDownloads() const {
    std::vector<std::string> files;
    for (const std::string& path : treeOf(root_.downloads())) {
      if (!fs::is_directory(root_.downloads() / path)) files.push_back(path);
    }
    return files;
  }

  testing::PrivateRoot root_;
  StoreServer server_;
  std::map<std::uint64_t, std::string> packages_;
};

TEST_F(DownloadManagerTest, ManyItemsInstallAtOnceEachWithOneReplyAndNothingLeft) {
  constexpr int kItems = 12;
  VendDownloadManager manager(root_.configuration());
  std::vector<std::shared_ptr<TillDownload>> downloads;
  std::vector<ReplyWaiter> waiters(kItems);
  for (int i = 0; i < kItems; ++i) {
    downloads.push_back(servedDownload(600 + i, "Many" + std::to_string(i),
                                       "com.example.many" + std::to_string(i), 300'000 + 1000 * i));
    manager.performDownload(downloads[i], waiters[i].callback());
  }
  // The same item again while it is under way is refused.
  ReplyWaiter duplicate;
  manager.performDownload(downloads[kItems - 1], duplicate.callback());

  for (int i = 0; i < kItems; ++i) {
    SCOPED_TRACE(i);
    std::optional<ReplyWaiter::Answer> answer = waiters[i].wait();
    ASSERT_TRUE(answer);
    EXPECT_TRUE(answer->success) << (answer->error ? answer->error->description : "");
  }
  std::optional<ReplyWaiter::Answer> refused = duplicate.wait();
  ASSERT_TRUE(refused);
  expectFailure(*refused, VendDownloadError::kAlreadyInProgress, "");
  for (int i = 0; i < kItems; ++i) {
    SCOPED_TRACE(i);
    EXPECT_EQ(payloadOf("Many" + std::to_string(i)), randomBytes(300'000 + 1000 * i, 600 + i));
    EXPECT_EQ(waiters[i].count(), 1u) << "exactly one reply";
    EXPECT_EQ(downloads[i]->progress(), 1.0);
    EXPECT_FALSE(downloads[i]->status().isFailed);
    EXPECT_EQ(server_.requestCount(assetPath(600 + i, "Many" + std::to_string(i))), 1u);
    EXPECT_FALSE(fs::exists(root_.downloads() / std::to_string(600 + i)))
        << "the item's folder goes with its package";
  }
  EXPECT_TRUE(filesUnderDownloads().empty());
  EXPECT_TRUE(manager.downloadsWithTypeMask(3).empty());
}

TEST_F(DownloadManagerTest, ReplacesAnInstalledBundleWhileItsApplicationsAreLocked) {
  installBundleDirectly(root_.applications() / "Thing.app", "com.example.thing", "1.0");
  VendDownloadManager manager(root_.configuration());
  // The installer's line comes while the bundle is being put in place;
  // what the lock file says then is what a launch would see.
  std::mutex mutex;
  std::vector<std::string> lockedDuringInstall;
  ReplyWaiter::Answer answer;
  {
    LogWatch watch("Installed", [&] {
      std::lock_guard lock(mutex);
      lockedDuringInstall = VendApplicationLocks::persistedIdentifiers();
    });
    answer = run(manager, servedDownload(102, "Thing", "com.example.thing"));
  }
  ASSERT_TRUE(answer.success) << answer.error->description;
  EXPECT_EQ(readFile(root_.applications() / "Thing.app/resources/version.txt"), "2.0");
  EXPECT_EQ(lockedDuringInstall, std::vector<std::string>{"com.example.thing"});
  EXPECT_TRUE(VendApplicationLocks::persistedIdentifiers().empty());
}

TEST_F(DownloadManagerTest, EveryFailedTransferSaysWhyAndLeavesNothing) {
  const struct {
    const char* name;
    Fault fault;
    bool refusedPort;
    VendDownloadError::Code code;
    const char* phrase;
  } cases[] = {
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
  for (const auto& failure : cases) {
    SCOPED_TRACE(failure.name);
    // Half of them would replace an installed bundle, half install anew.
    const bool replacing = ++item % 2 == 0;
    auto download =
        servedDownload(item, replacing ? "Kept" : "New" + std::to_string(item),
                       replacing ? "com.example.kept" : "com.example.new", 300'000, failure.fault);
    if (failure.refusedPort) {
      auto assets = download->assets();
      assets[0].setURLRequest(VendURLRequest(
          "http://127.0.0.1:" + std::to_string(StoreServer::refusingPort()) + "/assets/x.tar"));
      download->setAssets(assets);
    }
    const auto started = std::chrono::steady_clock::now();
    expectFailure(run(manager, download), failure.code, failure.phrase);
    EXPECT_LT(std::chrono::steady_clock::now() - started, 10s);
    EXPECT_TRUE(download->status().isFailed);
    EXPECT_EQ(treeOf(root_.applications()), applicationsBefore);
    EXPECT_TRUE(filesUnderDownloads().empty());
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
  auto download = servedDownload(250, "Big", "com.example.big", 48u << 20u, Fault::kCorrupt);
  const std::uint64_t size = packages_[250].size();
  const std::uint64_t badChunk = size / 2 / kChunk;
  expectFailure(run(manager, download), VendDownloadError::kDigestMismatch,
                "chunk " + std::to_string(badChunk) + " ");
  const auto received =
      static_cast<std::uint64_t>(download->progress() * static_cast<double>(size));
  EXPECT_LT(received, (badChunk + 1) * kChunk + kBufferedAllowance);
  EXPECT_LT(received, size);
}

// A staged package is installed without a second request, unless it no
// longer matches its manifest, when it is fetched again.
TEST_F(DownloadManagerTest, StagesThenInstallsFromTheStagedPackageWhileItMatches) {
  VendDownloadManager manager(root_.configuration());
  for (const bool damaged : {false, true}) {
    SCOPED_TRACE(damaged ? "damaged" : "intact");
    const std::uint64_t item = damaged ? 302 : 301;
    const std::string name = "Staged" + std::to_string(item);
    auto download = servedDownload(item, name, "com.example." + name, 100'000, Fault::kNone,
                                   TillDownload::kStageOnly);
    ReplyWaiter::Answer answer = run(manager, download);
    ASSERT_TRUE(answer.success) << answer.error->description;
    const std::string staged = std::to_string(item) + "/0.pkg";
    EXPECT_EQ(filesUnderDownloads(), std::vector<std::string>{staged});
    EXPECT_EQ(readFile(root_.downloads() / staged), packages_[item]);
    EXPECT_FALSE(fs::exists(root_.applications() / (name + ".app"))) << "staging installs nothing";
    if (damaged)
      testing::writeFile(root_.downloads() / staged, randomBytes(packages_[item].size(), 77));

    download->setDownloadType(TillDownload::kInstall);
    answer = run(manager, download);
    ASSERT_TRUE(answer.success) << answer.error->description;
    EXPECT_EQ(server_.requestCount(assetPath(item, name)), damaged ? 2u : 1u);
    EXPECT_EQ(payloadOf(name), randomBytes(100'000, item));
    EXPECT_TRUE(filesUnderDownloads().empty());
  }
}

TEST_F(DownloadManagerTest, SkippingTheDownloadWorksOnlyWithWhatIsOnDisk) {
  VendDownloadManager manager(root_.configuration());
  for (std::int64_t type : {TillDownload::kStageOnly, TillDownload::kInstall}) {
    auto download = servedDownload(401, "Skip", "com.example.skip", 50'000, Fault::kNone, type);
    download->setSkipAssetDownloadIfNotAlreadyOnDisk(true);
    expectFailure(run(manager, download), VendDownloadError::kNotOnDisk, "not on disk");
  }
  EXPECT_EQ(server_.totalRequests(), 0u);
  EXPECT_FALSE(fs::exists(root_.applications() / "Skip.app"));

  // Once staged, the same setting installs from disk.
  auto stage = servedDownload(402, "Skip", "com.example.skip", 50'000, Fault::kNone,
                              TillDownload::kStageOnly);
  ASSERT_TRUE(run(manager, stage).success);
  stage->setSkipAssetDownloadIfNotAlreadyOnDisk(true);
  stage->setDownloadType(TillDownload::kInstall);
  const ReplyWaiter::Answer answer = run(manager, stage);
  ASSERT_TRUE(answer.success) << answer.error->description;
  EXPECT_EQ(server_.totalRequests(), 1u);
  EXPECT_TRUE(fs::exists(root_.applications() / "Skip.app/bin/run"));
}

class PausedDownloadTest : public DownloadManagerTest {
 protected:
  static constexpr std::size_t kPayload = 6u << 20u;
  static constexpr std::size_t kGate = 2'500'001;  // not on a chunk boundary

  // Starts a download that stops at the gate, pauses it there and waits
  // until its transfer has stopped (a resume before that point would only
  // let the transfer go on); gives the size of its partial file.
  std::uint64_t startAndPause(VendDownloadManager& manager, ReplyWaiter& waiter,
                              std::int64_t type = TillDownload::kInstall) {
    std::promise<void> parked;
    std::once_flag once;
    LogWatch watch("Paused download of 501",
                   [&] { std::call_once(once, [&] { parked.set_value(); }); });
    server_.setGateBytes(kGate);
    download_ = servedDownload(501, "Paused", "com.example.paused", kPayload, Fault::kGate, type);
    manager.performDownload(download_, waiter.callback());
    EXPECT_TRUE(server_.waitUntilGateReached(20s));
    const auto deadline = std::chrono::steady_clock::now() + 20s;
    while (download_->progress() == 0 && std::chrono::steady_clock::now() < deadline)
      std::this_thread::sleep_for(10ms);
    manager.pauseDownloadWithItemIdentifier(501);
    EXPECT_TRUE(download_->status().isPaused);
    EXPECT_EQ(parked.get_future().wait_for(20s), std::future_status::ready);
    std::error_code code;
    const std::uint64_t partial = fs::file_size(root_.downloads() / "501/0.partial", code);
    EXPECT_FALSE(code);
    EXPECT_GT(partial, 0u);
    EXPECT_LE(partial, kGate);
    return partial;
  }

  std::shared_ptr<TillDownload> download_;
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
  EXPECT_EQ(payloadOf("Paused"), randomBytes(kPayload, 501));
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
  EXPECT_EQ(server_.requestCount(assetPath(501, "Paused")), 3u)
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
  const std::string url = server_.url(assetPath(501, "Paused"));
  const ReplyWaiter::Answer finished =
      run(again, downloadFor(501, "com.example.paused", assetFor(url, packages_[501], kChunk)));
  ASSERT_TRUE(finished.success) << finished.error->description;
  EXPECT_EQ(server_.rangeHeaders(assetPath(501, "Paused")).back(),
            "bytes=" + std::to_string(partial) + "-");
}

TEST_F(DownloadManagerTest, UnusableDownloadsAreRefusedOnAnotherThread) {
  VendDownloadManager manager(root_.configuration());
  auto download = servedDownload(701, "Bad", "com.example.bad");
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
  expectFailure(*answer, VendDownloadError::kInvalidDownload, "digests");
  EXPECT_NE(replyThread, std::this_thread::get_id());

  // Neither an install nor a staging.
  auto neither = servedDownload(702, "Bad", "com.example.bad");
  neither->setDownloadType(4);
  expectFailure(run(manager, neither), VendDownloadError::kInvalidDownload, "");
  EXPECT_EQ(server_.totalRequests(), 0u);
}

TEST_F(DownloadManagerTest, LocksNestAndKeepOtherEntriesOfTheFile) {
  // An entry that another process wrote stays.
  testing::writeFile(root_.root() / "var/lib/larder-platform/locked-applications.plist",
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

TEST_F(DownloadManagerTest, PreflightComparesTheMinimumAndAnswersFalseOnEveryFailure) {
  // The machine's own major version counts when no version is given.
  testing::writeFile(root_.root() / "etc/os-release", "NAME=\"Test\"\nVERSION_ID=\"12\"\n");
  const auto verdict = [](std::optional<bool> allowed, const char* minimum) {
    PlistDictionary answer;
    if (allowed) answer["allowed"] = *allowed;
    if (minimum) answer["minimumSystemVersion"] = minimum;
    return PropertyListSerialization::writeXml(answer);
  };
  const PlistValue none;
  const struct {
    const char* name;
    std::string body;
    int status;
    PlistValue info;
    bool allowed;
    std::string domain, phrase;  // of the error given with a refusal
  } cases[] = {
      {"later minor", verdict(true, "12.2"), 200, PlistDictionary{{"SystemVersion", "12.10"}},
       true},
      {"same version", verdict(true, "12.2"), 200, PlistDictionary{{"ProductVersion", "12.2"}},
       true},
      {"version as text", verdict(true, "12.2"), 200, "13.0", true},
      {"older", verdict(true, "12.2"), 200, PlistDictionary{{"SystemVersion", "12.1.9"}}, false,
       std::string(VendDownloadError::kDomain), "12.2"},
      {"no minimum", verdict(true, nullptr), 200, none, true},
      {"forbidden", verdict(false, "1"), 200, none, false, std::string(VendDownloadError::kDomain)},
      {"machine's major meets a minor", verdict(true, "12.4"), 200, none, true},
      {"machine's major above", verdict(true, "11"), 200, none, true},
      {"machine's major below", verdict(true, "13.0"), 200, none, false},
      {"no verdict", verdict(std::nullopt, "1"), 200, none, false},
      {"not a property list", "not a property list", 200, none, false},
      {"server error", "x", 500, none, false, "", "HTTP 500"},
  };
  VendDownloadManager manager(root_.configuration());
  const auto ask = [&](const std::string& url, const PlistValue& info) {
    std::promise<std::pair<bool, PlistValue>> promise;
    manager.checkPreflight(9, url, info, [&](bool allowed, PlistValue object) {
      promise.set_value({allowed, std::move(object)});
    });
    return promise.get_future().get();
  };
  int index = 0;
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    const std::string path = "/preflight/" + std::to_string(++index);
    const auto [allowed, error] = ask(server_.add(path, c.body, Fault::kNone, c.status), c.info);
    EXPECT_EQ(allowed, c.allowed);
    if (allowed) {
      EXPECT_TRUE(error.isNull());
    }
    if (!c.domain.empty()) {
      EXPECT_EQ(error["domain"], PlistValue(c.domain));
    }
    if (c.domain == VendDownloadError::kDomain && !c.phrase.empty()) {
      EXPECT_EQ(error["code"].int64Value(), VendDownloadError::kPreflightFailed);
    }
    if (!c.phrase.empty()) {
      EXPECT_NE(error["description"].string()->find(c.phrase), std::string::npos);
    }
  }
  const auto [refused, error] =
      ask("http://127.0.0.1:" + std::to_string(StoreServer::refusingPort()) + "/preflight/1", none);
  EXPECT_FALSE(refused);
  EXPECT_EQ(error["domain"], PlistValue(VendHTTPTransfer::kErrorDomain));
  EXPECT_NE(error["description"].string()->find("Preflight of item 9"), std::string::npos);
  EXPECT_FALSE(ask("", none).first);
}

// Downloads through the service are the service's store tests' business;
// the locks and the list must reach the runtime's manager too.
TEST_F(DownloadManagerTest, TheServiceOfAStoreClientReachesTheRuntimesManager) {
  auto runtime = std::make_shared<VendRuntime>(root_.configuration());
  VendDownloadService service(
      VendStoreClient::initWithStoreClientType(VendStoreClient::kStoreApplication), runtime);
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
