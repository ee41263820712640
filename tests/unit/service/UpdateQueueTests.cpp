// The update queue against a store on loopback that serves a URL bag and
// the update route: checks, the cached file, reconciliation with local
// marks, and the marks and removals that downloads make; and the parser of
// the store's answer.
#include <httplib.h>
#include <sys/stat.h>

#include <algorithm>
#include <condition_variable>
#include <future>
#include <thread>
#include <vector>

#include "ServiceTestSupport.h"
#include "platform/system/FileIO.h"
#include "store-runtime/http/VendGzip.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "update-queue/SoftwareUpdatesProvider.h"
#include "update-queue/UpdateQueue.h"
#include "update-queue/journal/UpdateJournal.h"

namespace larder::testing {
namespace {

// Tests choose the bag's settings and the answer, and see every request.
class UpdateStoreStub {
 public:
  struct Request {
    std::string body, contentEncoding, contentType;
  };

  UpdateStoreStub() {
    server_.Get("/bag.plist", [this](const httplib::Request&, httplib::Response& response) {
      std::lock_guard lock(mutex_);
      PlistDictionary bag = bag_;
      bag.insert_or_assign("available-software-updates-extended", baseURL() + "/updates");
      response.set_content(PropertyListSerialization::writeXml(bag), "application/x-plist");
    });
    server_.Post("/updates", [this](const httplib::Request& request, httplib::Response& response) {
      std::lock_guard lock(mutex_);
      requests_.push_back({request.body, request.get_header_value("Content-Encoding"),
                           request.get_header_value("Content-Type")});
      response.status = status_;
      response.set_content(body_, "application/x-plist");
    });
    port_ = server_.bind_to_any_port("127.0.0.1");
    thread_ = std::thread([this] { server_.listen_after_bind(); });
    while (!server_.is_running()) std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  ~UpdateStoreStub() {
    server_.stop();
    thread_.join();
  }

  [[nodiscard]] std::string baseURL() const { return "http://127.0.0.1:" + std::to_string(port_); }
  void setBag(PlistDictionary bag) {
    std::lock_guard lock(mutex_);
    bag_ = std::move(bag);
  }
  void answerRaw(std::string body, int status = 200) {
    std::lock_guard lock(mutex_);
    body_ = std::move(body);
    status_ = status;
  }
  void answer(const PlistValue& plist) { answerRaw(PropertyListSerialization::writeXml(plist)); }
  void answerItems(const PlistArray& items) { answer(PlistDictionary{{"items", items}}); }
  [[nodiscard]] std::vector<Request> requests() const {
    std::lock_guard lock(mutex_);
    return requests_;
  }

 private:
  httplib::Server server_;
  int port_ = 0;
  std::thread thread_;
  mutable std::mutex mutex_;
  PlistDictionary bag_;
  int status_ = 200;
  std::string body_ = PropertyListSerialization::writeXml(PlistDictionary{});
  std::vector<Request> requests_;
};

class CountingDelegate final : public UpdateQueueDelegate {
 public:
  void availableUpdatesDidChange() override {
    std::lock_guard lock(mutex_);
    ++calls_;
  }
  std::size_t calls() {
    std::lock_guard lock(mutex_);
    return calls_;
  }

 private:
  std::mutex mutex_;
  std::size_t calls_ = 0;
};

struct CheckResult {
  bool success = false;
  UpdateQueue::UpdateList available;
  std::optional<UpdateQueue::UpdateList> incompatible;
  OptionalError error;
};

PlistDictionary storeItem(std::uint64_t wareID, const std::string& bundleID,
                          const std::string& version, const std::string& title = "Title") {
  return PlistDictionary{{"ware-id", wareID},
                         {"bundle-id", bundleID},
                         {"title", title},
                         {"version", version},
                         {"action-params", "itemId=" + std::to_string(wareID)},
                         {"release-date", PlistDate{1700000000}}};
}
PlistDictionary atlas(const std::string& version = "1.1") {
  return storeItem(101, "com.example.atlas", version);
}
PlistDictionary birch(const std::string& version = "2.1") {
  return storeItem(102, "com.example.birch", version);
}

std::vector<std::uint64_t> identifiersOf(const UpdateQueue::UpdateList& updates) {
  std::vector<std::uint64_t> identifiers;
  for (const LedgerUpdateRef& update : updates)
    identifiers.push_back(update->itemIdentifierValue());
  return identifiers;
}

class UpdateQueueTest : public ServiceTest {
 protected:
  void SetUp() override {
    ServiceTest::SetUp();
    makeStoreBundle(rootApplications(), "Atlas", "com.example.atlas", "1.0", 101);
    makeStoreBundle(rootApplications(), "Birch", "com.example.birch", "2.0", 102);
    map_ = std::make_unique<SoftwareMap>(options(storePath(), true));
    map_->waitUntilIdle();
    previousRuntime_ = VendRuntime::shared();
    useFreshRuntime();
  }
  void TearDown() override {
    VendRuntime::setShared(previousRuntime_);
    map_.reset();
    ServiceTest::TearDown();
  }

  // The bag is fetched once per runtime: a test that changes it starts a
  // new runtime.
  void useFreshRuntime() {
    VendRuntimeConfiguration configuration;
    configuration.bagURL = store_.baseURL() + "/bag.plist";
    const std::string folder = temporary() + "/runtime" + std::to_string(++runtimes_);
    configuration.stateDirectory = folder + "/state";
    configuration.downloadsDirectory = folder + "/downloads";
    configuration.requestTimeout = 5;
    VendRuntime::setShared(std::make_shared<VendRuntime>(configuration));
  }

  std::shared_ptr<UpdateQueue> makeQueue(std::shared_ptr<UpdateQueueDelegate> delegate = nullptr) {
    return std::make_shared<UpdateQueue>(VendStoreClient::initWithStoreClientType(0),
                                         std::move(delegate), *map_);
  }

  static CheckResult check(UpdateQueue& queue) {
    auto result = std::make_shared<std::promise<CheckResult>>();
    std::future<CheckResult> future = result->get_future();
    queue.checkForUpdatesWithCompletionHandler(
        [result](bool success, const UpdateQueue::UpdateList& available,
                 const std::optional<UpdateQueue::UpdateList>& incompatible,
                 const OptionalError& error) {
          result->set_value({success, available, incompatible, error});
        });
    if (future.wait_for(std::chrono::seconds(20)) == std::future_status::ready) return future.get();
    ADD_FAILURE() << "the check never ended";
    return {};
  }

  // Every change queued so far has been made and every delegate call it
  // queued has been delivered: a count of calls taken after this is final.
  static void settle(UpdateQueue& queue) {
    queue.finishPendingWrites();
    DispatchQueue::globalQueue().barrierSync([] {});
  }

  static std::string cacheFile() { return UpdateQueue::cachePath().value_or(""); }
  static PlistValue cacheContents() {
    auto bytes = FileIO::read(cacheFile());
    return bytes ? PropertyListSerialization::read(*bytes).value_or(PlistValue()) : PlistValue();
  }
  static void writeCache(const PlistArray& updates) {
    writeBytes(cacheFile(), PropertyListSerialization::writeBinary(PlistDictionary{
                                {"updates", updates}, {"incompatibleUpdates", PlistArray{}}}));
  }

  UpdateStoreStub store_;
  std::unique_ptr<SoftwareMap> map_;

 private:
  std::shared_ptr<VendRuntime> previousRuntime_;
  int runtimes_ = 0;
};

std::vector<std::string> reportedWareIDs(const std::string& body) {
  std::vector<std::string> wareIDs;
  const PlistValue plist = PropertyListSerialization::read(body).value_or(PlistValue());
  if (const PlistArray* entries = plist["local-software"].array()) {
    for (const PlistValue& entry : *entries) wareIDs.push_back(*entry["ware-id"].string());
  }
  std::sort(wareIDs.begin(), wareIDs.end());
  return wareIDs;
}

TEST_F(UpdateQueueTest, TheBagDecidesCompressionAndWhichSoftwareIsLeftOut) {
  struct Case {
    PlistValue compress;
    PlistValue skipList;
    bool gzip;
    std::vector<std::string> reported;
  };
  const std::vector<Case> cases = {
      {PlistValue(true), PlistArray{"com.example.birch"}, true, {"101"}},
      {PlistValue(1), PlistArray{"101"}, true, {"102"}},
      // Only a number switches compression on; only an array skips.
      {PlistValue("1"), PlistValue("com.example.birch"), false, {"101", "102"}},
      {PlistValue(false), PlistDictionary{{"com.example.birch", true}}, false, {"101", "102"}},
      {PlistValue(), PlistValue(), false, {"101", "102"}},
  };
  for (std::size_t index = 0; index < cases.size(); ++index) {
    const Case& c = cases[index];
    SCOPED_TRACE(index);
    PlistDictionary bag;
    if (!c.compress.isNull())
      bag.emplace("available-software-updates-compress-request", c.compress);
    if (!c.skipList.isNull()) bag.emplace("da-do-not-update-list", c.skipList);
    store_.setBag(bag);
    useFreshRuntime();
    ASSERT_TRUE(check(*makeQueue()).success);
    ASSERT_EQ(store_.requests().size(), index + 1);
    const UpdateStoreStub::Request request = store_.requests().back();
    std::string body = request.body;
    EXPECT_EQ(request.contentEncoding, c.gzip ? "gzip" : "");
    EXPECT_EQ(request.contentType, c.gzip ? "application/x-orvane-plist" : "");
    // The server library inflates gzip bodies itself when it can; a body
    // that was not gzip would have been refused by it.
    if (c.gzip && body.starts_with("\x1f\x8b")) {
      auto plain = VendCopyGunzippedDataForData(
          std::span(reinterpret_cast<const std::uint8_t*>(body.data()), body.size()));
      ASSERT_TRUE(plain);
      body.assign(plain->begin(), plain->end());
    }
    EXPECT_EQ(reportedWareIDs(body), c.reported);
    EXPECT_EQ(body.find("bundled-software"), std::string::npos);
  }
}

TEST_F(UpdateQueueTest, ItemsWithOddFieldsKeepTheirPlaceAndNoIncompatibleListIsAnEmptyOne) {
  store_.answerItems({atlas(), PlistDictionary{{"ware-id", 104}, {"version", PlistArray{}}},
                      PlistDictionary{{"ware-id", 105}, {"version", 3}}});
  auto queue = makeQueue();
  CheckResult result = check(*queue);
  ASSERT_TRUE(result.success);
  ASSERT_EQ(identifiersOf(result.available), (std::vector<std::uint64_t>{101, 104, 105}));
  EXPECT_EQ(result.available[1]->version(), std::nullopt);
  EXPECT_EQ(result.available[2]->version(), "3");
  EXPECT_FALSE(result.incompatible);
  EXPECT_EQ(queue->incompatibleUpdates(), nullptr);
  EXPECT_EQ(cacheContents()["incompatibleUpdates"], PlistValue(PlistArray{}));
}

TEST_F(UpdateQueueTest, AFailedCheckLeavesListsFileAndDelegateAlone) {
  auto delegate = std::make_shared<CountingDelegate>();
  store_.answerItems({atlas(), birch()});
  auto queue = makeQueue(delegate);
  ASSERT_TRUE(check(*queue).success);
  const auto before = queue->availableUpdates();
  struct stat was {};
  ASSERT_EQ(::stat(cacheFile().c_str(), &was), 0);
  const PlistValue cached = cacheContents();

  for (const auto& [status, body] : std::vector<std::pair<int, std::string>>{
           {500, PropertyListSerialization::writeXml(PlistDictionary{
                     {"failureType", "server-error"}, {"customerMessage", "Down"}})},
           {200, "<html>this is no property list</html>"},
           {200, PropertyListSerialization::writeXml(PlistDictionary{{"failureType", "busy"}})}}) {
    store_.answerRaw(body, status);
    CheckResult result = check(*queue);
    EXPECT_FALSE(result.success) << body;
    EXPECT_TRUE(result.error) << body;
    ASSERT_EQ(result.available.size(), 2U) << "the waiting callers get the cached lists";
    EXPECT_EQ(result.available[0].get(), (*before)[0].get());
    EXPECT_EQ(queue->availableUpdates(), before);
  }
  struct stat after {};
  ASSERT_EQ(::stat(cacheFile().c_str(), &after), 0);
  EXPECT_EQ(after.st_mtim.tv_nsec, was.st_mtim.tv_nsec);
  EXPECT_EQ(cacheContents(), cached);
  settle(*queue);
  EXPECT_EQ(delegate->calls(), 1U);
}

TEST_F(UpdateQueueTest, AReturningUpdateKeepsItsPlaceAndMarksWhileTheStoreValuesWin) {
  auto delegate = std::make_shared<CountingDelegate>();
  store_.answerItems({atlas(), birch(), storeItem(105, "com.example.gone", "5.0")});
  auto queue = makeQueue(delegate);
  CheckResult first = check(*queue);
  ASSERT_TRUE(first.success);
  queue->setUserHasSeenAllUpdates(first.available, {});
  queue->didStageUpdateForItemIdentifier(102);
  queue->setAutoUpdateAbortCode(7, 102);
  const auto firstAttempt =
      queue->availableUpdateWithItemIdentifier(102)->firstAutoUpdateAttemptDate();
  ASSERT_TRUE(firstAttempt);

  PlistDictionary renewed = storeItem(102, "com.example.birch", "2.2", "Birch Renewed");
  renewed.emplace("extra", "from the store");
  store_.answerItems({storeItem(106, "com.example.new", "1.0"), renewed, atlas("1.2")});
  LogCapture log;
  CheckResult second = check(*queue);
  ASSERT_TRUE(second.success);
  EXPECT_EQ(identifiersOf(second.available), (std::vector<std::uint64_t>{101, 102, 106}));
  EXPECT_EQ(log.countContaining("Removing obsolete update <LedgerUpdate: itemIdentifier=105"), 1U)
      << log.dump();

  auto birchRecord = queue->availableUpdateWithItemIdentifier(102);
  EXPECT_EQ(PlistValue(birchRecord->dictionary())["extra"], PlistValue("from the store"));
  EXPECT_EQ(*birchRecord->title(), "Birch Renewed");
  EXPECT_EQ(birchRecord->autoUpdateAbortCode(), 7);
  EXPECT_EQ(birchRecord->firstAutoUpdateAttemptDate(), firstAttempt);
  EXPECT_EQ(*queue->availableUpdateWithItemIdentifier(101)->version(), "1.2");
  EXPECT_FALSE(queue->availableUpdateWithItemIdentifier(106)->hasBeenSeenByUser());
  // The marks kept reach the file too.
  auto restarted = makeQueue();
  EXPECT_TRUE(restarted->availableUpdateWithItemIdentifier(102)->isStaged());
  EXPECT_TRUE(restarted->availableUpdateWithItemIdentifier(101)->hasBeenSeenByUser());
  settle(*queue);
  EXPECT_EQ(delegate->calls(), 3U) << "two checks and the abort code";
}

TEST_F(UpdateQueueTest, AnAnswerWithoutUpdatesEmptiesTheQueue) {
  auto delegate = std::make_shared<CountingDelegate>();
  auto queue = makeQueue(delegate);
  for (const PlistValue& answer :
       {PlistValue(PlistDictionary{}), PlistValue(PlistDictionary{{"items", PlistArray{}}}),
        PlistValue(PlistArray{atlas()})}) {
    store_.answerItems({atlas()});
    ASSERT_EQ(check(*queue).available.size(), 1U);
    store_.answer(answer);
    CheckResult result = check(*queue);
    EXPECT_TRUE(result.success) << describePlistValue(answer);
    EXPECT_TRUE(result.available.empty());
    EXPECT_EQ(cacheContents()["updates"], PlistValue(PlistArray{}));
  }
  settle(*queue);
  EXPECT_EQ(delegate->calls(), 6U) << "every successful check tells the delegate";
}

TEST_F(UpdateQueueTest, AnUnreadableCacheGivesAnEmptyQueueUntilTheNextCheckRewritesIt) {
  const PlistData valid = PropertyListSerialization::writeBinary(
      PlistDictionary{{"updates", PlistArray{atlas()}}, {"incompatibleUpdates", PlistArray{}}});
  struct Case {
    std::string name;
    std::string bytes;
    bool logsException;
  };
  const std::vector<Case> cases = {
      {"truncated", std::string(valid.begin(), valid.begin() + valid.size() / 2), false},
      {"empty", "", false},
      {"another type", PropertyListSerialization::writeXml(PlistArray{"updates"}), false},
      {"a bad element",
       PropertyListSerialization::writeXml(PlistDictionary{{"updates", PlistArray{atlas(), 1}}}),
       true},
      {"a list that is no list",
       PropertyListSerialization::writeXml(PlistDictionary{{"updates", "everything"}}), true},
  };
  store_.answerItems({birch()});
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    writeText(cacheFile(), c.bytes);
    LogCapture log;
    auto queue = makeQueue();
    EXPECT_TRUE(queue->availableUpdates()->empty());
    EXPECT_EQ(log.countContaining("Exception loading updates from persisted store - "),
              c.logsException ? 1U : 0U)
        << log.dump();
    ASSERT_TRUE(check(*queue).success);
    EXPECT_EQ(identifiersOf(*makeQueue()->availableUpdates()), (std::vector<std::uint64_t>{102}));
  }
}

TEST_F(UpdateQueueTest, LookupsAndMarksFollowTheListOrder) {
  writeCache({storeItem(101, "com.example.a", "1", "first"),
              storeItem(102, "com.example.dup", "1", "earlier"),
              storeItem(101, "com.example.a", "1", "second"),
              storeItem(103, "com.example.dup", "1", "later")});
  auto delegate = std::make_shared<CountingDelegate>();
  auto queue = makeQueue(delegate);
  EXPECT_EQ(*queue->availableUpdateWithItemIdentifier(101)->title(), "first");
  EXPECT_EQ(*queue->availableUpdateWithBundleIdentifier("com.example.dup")->title(), "later");
  EXPECT_EQ(queue->availableUpdateWithItemIdentifier(999), nullptr);
  EXPECT_EQ(queue->availableUpdateWithBundleIdentifier("com.example.none"), nullptr);

  EXPECT_FALSE(queue->hasStagedUpdates());
  queue->didStageUpdateForItemIdentifier(101);
  EXPECT_TRUE(queue->hasStagedUpdates());
  const auto list = queue->availableUpdates();
  std::vector<bool> staged;
  for (const LedgerUpdateRef& update : *list) staged.push_back(update->isStaged());
  EXPECT_EQ(staged, (std::vector<bool>{true, false, true, false}));

  queue->setAutoUpdateAbortCode(1, 103);
  const auto firstDate =
      queue->availableUpdateWithItemIdentifier(103)->firstAutoUpdateAttemptDate();
  ASSERT_TRUE(firstDate);
  // A second attempt stamped with the clock must be able to differ from
  // the first, or keeping the first date would be indistinguishable.
  ASSERT_TRUE(eventually([&] {
    return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch())
               .count() > firstDate->secondsSince1970;
  }));
  queue->setAutoUpdateAbortCode(2, 103);
  EXPECT_EQ(queue->availableUpdateWithItemIdentifier(103)->autoUpdateAbortCode(), 2);
  EXPECT_EQ(queue->availableUpdateWithItemIdentifier(103)->firstAutoUpdateAttemptDate(), firstDate);

  queue->didRemoveApplicationWithIdentifier(101);
  EXPECT_EQ(identifiersOf(*queue->availableUpdates()), (std::vector<std::uint64_t>{102, 103}));
  EXPECT_EQ(identifiersOf(*makeQueue()->availableUpdates()), (std::vector<std::uint64_t>{102, 103}))
      << "the removal is saved";
  settle(*queue);
  EXPECT_EQ(delegate->calls(), 3U) << "staging tells nobody; two abort codes and the removal do";
  EXPECT_EQ(list->size(), 4U) << "a snapshot taken before stays as it was";
}

TEST_F(UpdateQueueTest, AnUpdateBeingDownloadedReachesTheJournalAfterACheckDroppedIt) {
  store_.answerItems({atlas(), birch()});
  auto delegate = std::make_shared<CountingDelegate>();
  auto queue = makeQueue(delegate);
  ASSERT_TRUE(check(*queue).success);
  queue->willStartDownloadForUpdateWithIdentifier(101);
  queue->willStartDownloadForUpdateWithIdentifier(777);  // unknown: ignored
  store_.answerItems({birch()});
  ASSERT_TRUE(check(*queue).success);
  ASSERT_EQ(queue->availableUpdateWithItemIdentifier(101), nullptr);

  LogCapture log;
  queue->didFinishDownloadForUpdateWithItemIdentifier(101, true);
  // Its record is let go once the download has ended.
  queue->didFinishDownloadForUpdateWithItemIdentifier(101, true);
  // The record the download started with is what the journal keeps.
  const UpdateJournal::Entries journal = UpdateJournal::sharedJournal().installedUpdatesJournal();
  ASSERT_EQ(journal.size(), 1U);
  EXPECT_EQ(PlistValue(journal[0])["ware-id"].int64Value(), 101);
  EXPECT_TRUE(PlistValue(journal[0])["installDate"].isDate());
  EXPECT_EQ(log.countContaining("Failed to find queued update for item identifier 101 - journal "
                                "may be incomplete",
                                1),
            1U);
  queue->didFinishDownloadForUpdateWithItemIdentifier(102, false);
  EXPECT_EQ(queue->availableUpdates()->size(), 1U)
      << "a download that did not install changes nothing";
  queue->didFinishDownloadForUpdateWithItemIdentifier(102, true);
  EXPECT_TRUE(queue->availableUpdates()->empty());
  EXPECT_EQ(UpdateJournal::sharedJournal().installedUpdatesJournal().size(), 2U)
      << "only the download that installed is journaled";
  EXPECT_EQ(log.countContaining("Removed obsolete update <LedgerUpdate: itemIdentifier=102 "
                                "bundleID=com.example.birch"),
            1U)
      << log.dump();
  EXPECT_EQ(cacheContents()["updates"], PlistValue(PlistArray{}));
  settle(*queue);
  EXPECT_EQ(delegate->calls(), 3U);
}

TEST_F(UpdateQueueTest, ElevenCachedUpdatesGoToTheDebugFileAndTenToTheLog) {
  for (int count : {10, 11}) {
    std::filesystem::remove(stateFolder() + "/updates.plist");
    PlistArray updates;
    for (int i = 1; i <= count; ++i) {
      updates.emplace_back(
          storeItem(static_cast<std::uint64_t>(i), "com.example.app" + std::to_string(i), "1"));
    }
    writeCache(updates);
    LogCapture log;
    EXPECT_EQ(makeQueue()->availableUpdates()->size(), static_cast<std::size_t>(count));
    EXPECT_EQ(log.countContaining("UpdateQueue: Updates - ("), count == 10 ? 1U : 0U) << count;
    EXPECT_EQ(std::filesystem::exists(stateFolder() + "/updates.plist"), count == 11) << count;
  }
}

TEST_F(UpdateQueueTest, AHandlerMayCallBackIntoTheQueue) {
  store_.answerItems({atlas()});
  auto queue = makeQueue();
  std::promise<bool> seen;
  queue->checkForUpdatesWithCompletionHandler(
      [&seen, queue](bool, const UpdateQueue::UpdateList& available,
                     const std::optional<UpdateQueue::UpdateList>&, const OptionalError&) {
        queue->setUserHasSeenAllUpdates(available, {});
        seen.set_value(queue->availableUpdateWithItemIdentifier(101)->hasBeenSeenByUser());
      });
  auto future = seen.get_future();
  ASSERT_EQ(future.wait_for(std::chrono::seconds(20)), std::future_status::ready);
  EXPECT_TRUE(future.get());
}

// MARK: the store's answer

struct Parsed {
  bool ok = false;
  OptionalError error;
  std::shared_ptr<SoftwareUpdatesProvider> provider;
};

Parsed parse(const std::string& bytes) {
  Parsed parsed{.provider = SoftwareUpdatesProvider::providerWithStoreClient(
                    VendStoreClient::initWithStoreClientType(0))};
  parsed.ok = parsed.provider->parseData(PlistData(bytes.begin(), bytes.end()), &parsed.error);
  return parsed;
}

TEST(SoftwareUpdatesProvider, EachListIsPresentOnlyWhenTheAnswerHeldItAsAnArray) {
  Parsed emptyItems = parse(PropertyListSerialization::writeXml(
      PlistDictionary{{"items", PlistArray{}}, {"other", "left to the property-list layer"}}));
  ASSERT_TRUE(emptyItems.ok);
  ASSERT_TRUE(emptyItems.provider->availableUpdates());
  EXPECT_FALSE(emptyItems.provider->incompatibleUpdates());
  EXPECT_EQ(emptyItems.provider->output(),
            PlistValue(PlistDictionary{{"availableUpdates", PlistArray{}}}));

  Parsed both = parse(PropertyListSerialization::writeXml(PlistDictionary{
      {"items", PlistArray{storeItem(1, "a", "1"), "junk", storeItem(2, "b", "1")}},
      {"incompatible-items", PlistArray{PlistDictionary{}, storeItem(3, "c", "1")}}}));
  ASSERT_TRUE(both.ok);
  EXPECT_EQ(identifiersOf(*both.provider->availableUpdates()), (std::vector<std::uint64_t>{1, 2}));
  EXPECT_EQ(identifiersOf(*both.provider->incompatibleUpdates()), (std::vector<std::uint64_t>{3}));
  EXPECT_EQ(both.provider->output()["availableUpdates"],
            PlistValue(PlistArray{storeItem(1, "a", "1"), storeItem(2, "b", "1")}));

  for (const PlistValue& answer :
       {PlistValue(PlistDictionary{}), PlistValue(PlistDictionary{{"items", "all of them"}}),
        PlistValue(PlistArray{storeItem(1, "a", "1")}), PlistValue("text")}) {
    Parsed parsed = parse(PropertyListSerialization::writeXml(answer));
    EXPECT_TRUE(parsed.ok) << describePlistValue(answer);
    EXPECT_FALSE(parsed.provider->availableUpdates()) << describePlistValue(answer);
    EXPECT_FALSE(parsed.provider->incompatibleUpdates());
    EXPECT_EQ(parsed.provider->output(), PlistValue(PlistDictionary{}));
  }
}

TEST(SoftwareUpdatesProvider, AnAnswerThatIsNoPropertyListOrAFailureSetsNothing) {
  for (const std::string& bytes : {std::string("<html>maintenance</html>"), std::string(),
                                   PropertyListSerialization::writeXml(PlistDictionary{
                                       {"failureType", "busy"}, {"items", PlistArray{atlas()}}})}) {
    Parsed parsed = parse(bytes);
    EXPECT_FALSE(parsed.ok) << bytes;
    EXPECT_TRUE(parsed.error) << bytes;
    EXPECT_FALSE(parsed.provider->availableUpdates());
    EXPECT_TRUE(parsed.provider->output().isNull());
  }
}

}  // namespace
}  // namespace larder::testing
