// The update queue: checks against the store, the cached file, joined
// callers, reconciliation with local marks, and the marks and removals
// that downloads and the update machinery make.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <thread>
#include <vector>

#include "UpdateQueueTestSupport.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "store-runtime/http/VendGzip.h"

namespace larder::testing {
namespace {

PlistDictionary parseBody(const std::string& body) {
  auto plist = PropertyListSerialization::read(body);
  return plist && plist->dictionary() ? *plist->dictionary() : PlistDictionary{};
}

std::vector<std::string> reportedWareIDs(const PlistDictionary& body) {
  std::vector<std::string> wareIDs;
  auto list = body.find("local-software");
  const PlistArray* entries = list == body.end() ? nullptr : list->second.array();
  if (!entries) return wareIDs;
  for (const PlistValue& entry : *entries) {
    if (const std::string* wareID = entry["ware-id"].string()) wareIDs.push_back(*wareID);
  }
  std::sort(wareIDs.begin(), wareIDs.end());
  return wareIDs;
}

struct FileStamp {
  std::string bytes;
  std::int64_t modifiedNanoseconds = 0;
};

FileStamp stampOf(const std::string& path) {
  struct stat status {};
  EXPECT_EQ(::stat(path.c_str(), &status), 0) << path;
  auto bytes = FileIO::read(path).value_or(std::vector<std::uint8_t>{});
  return {std::string(bytes.begin(), bytes.end()),
          status.st_mtim.tv_sec * 1000000000LL + status.st_mtim.tv_nsec};
}

TEST_F(UpdateQueueTest, ACheckReportsTheInstalledSoftwareAndTheAnswerSurvivesARestart) {
  store_.answer(PlistDictionary{
      {"items", PlistArray{storeItem(101, "com.example.atlas", "1.1"),
                           storeItem(102, "com.example.birch", "2.1")}},
      {"incompatible-items", PlistArray{storeItem(103, "com.example.cedar", "9.0")}}});
  auto queue = makeQueue();
  CheckResult result = check(*queue);
  ASSERT_TRUE(result.success) << (result.error ? result.error->descriptionText() : "");
  EXPECT_EQ(identifiersOf(result.available), (std::vector<std::uint64_t>{101, 102}));
  ASSERT_TRUE(result.incompatible);
  EXPECT_EQ(identifiersOf(*result.incompatible), (std::vector<std::uint64_t>{103}));

  // The body's installed list and headers are the bag's business, below.
  ASSERT_EQ(store_.requestCount(), 1U);
  EXPECT_FALSE(parseBody(store_.requests().front().body).contains("bundled-software"));

  auto restarted = makeQueue();
  EXPECT_EQ(identifiersOf(*restarted->availableUpdates()), (std::vector<std::uint64_t>{101, 102}));
  ASSERT_TRUE(restarted->incompatibleUpdates());
  EXPECT_EQ(identifiersOf(*restarted->incompatibleUpdates()), (std::vector<std::uint64_t>{103}));
  EXPECT_EQ(*restarted->availableUpdateWithItemIdentifier(102)->version(), "2.1");
  EXPECT_EQ(store_.requestCount(), 1U) << "a restart reads the cache, not the store";
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
    PlistDictionary bag;
    if (!c.compress.isNull())
      bag.emplace("available-software-updates-compress-request", c.compress);
    if (!c.skipList.isNull()) bag.emplace("da-do-not-update-list", c.skipList);
    store_.setBag(bag);
    useFreshRuntime();
    ASSERT_TRUE(check(*makeQueue()).success) << index;
    ASSERT_EQ(store_.requestCount(), index + 1);
    const UpdateStoreStub::Request request = store_.requests().back();
    std::string body = request.body;
    if (c.gzip) {
      EXPECT_EQ(request.contentEncoding, "gzip") << index;
      EXPECT_EQ(request.contentType, "application/x-orvane-plist") << index;
      // The server library inflates gzip bodies itself when it can; a body
      // that was not gzip would have been refused by it.
      if (body.starts_with("\x1f\x8b")) {
        auto plain = VendCopyGunzippedDataForData(
            std::span(reinterpret_cast<const std::uint8_t*>(body.data()), body.size()));
        ASSERT_TRUE(plain) << index;
        body.assign(plain->begin(), plain->end());
      }
    } else {
      EXPECT_EQ(request.contentEncoding, "") << index;
      EXPECT_EQ(request.contentType, "") << index;
    }
    EXPECT_EQ(reportedWareIDs(parseBody(body)), c.reported) << index;
  }
}

TEST_F(UpdateQueueTest, CallersDuringACheckJoinItAndShareItsAnswer) {
  store_.answer(PlistDictionary{{"items", PlistArray{storeItem(101, "com.example.atlas", "1.1")}}});
  store_.hold();
  auto queue = makeQueue();
  constexpr int kCallers = 10;
  std::vector<std::future<CheckResult>> results(kCallers);
  std::vector<std::thread> callers;
  for (auto& result : results) {
    callers.emplace_back([queue, &result] { result = startCheck(*queue); });
  }
  for (std::thread& caller : callers) caller.join();
  // A caller without a handler joins too and starts nothing.
  queue->checkForUpdatesWithCompletionHandler(nullptr);
  ASSERT_TRUE(eventually([&] { return store_.requestCount() == 1; }));
  store_.release();

  std::vector<LedgerUpdate*> firstRecords;
  for (auto& future : results) {
    ASSERT_EQ(future.wait_for(std::chrono::seconds(20)), std::future_status::ready);
    CheckResult result = future.get();
    EXPECT_TRUE(result.success);
    ASSERT_EQ(identifiersOf(result.available), (std::vector<std::uint64_t>{101}));
    firstRecords.push_back(result.available.front().get());
  }
  EXPECT_TRUE(std::all_of(firstRecords.begin(), firstRecords.end(), [&](LedgerUpdate* record) {
    return record == firstRecords.front();
  })) << "every caller gets the queue's own record";
  EXPECT_EQ(store_.requestCount(), 1U);

  // Once it has ended, the next call starts a new check.
  EXPECT_TRUE(check(*queue).success);
  EXPECT_EQ(store_.requestCount(), 2U);
}

TEST_F(UpdateQueueTest, MalformedItemsAreDroppedAndTheGoodOnesKept) {
  store_.answer(PlistDictionary{
      {"items", PlistArray{storeItem(101, "com.example.atlas", "1.1"), PlistValue("not an item"),
                           PlistDictionary{{"bundle-id", "com.example.nowareid"}},
                           PlistDictionary{{"ware-id", 104}, {"version", PlistArray{}}},
                           PlistDictionary{{"ware-id", 105}, {"version", 3}},
                           storeItem(102, "com.example.birch", "2.1")}}});
  auto queue = makeQueue();
  CheckResult result = check(*queue);
  ASSERT_TRUE(result.success);
  // An item with an odd field keeps its place, without that field or with
  // the field converted.
  EXPECT_EQ(identifiersOf(result.available), (std::vector<std::uint64_t>{101, 104, 105, 102}));
  ASSERT_EQ(result.available.size(), 4U);
  EXPECT_EQ(result.available[1]->version(), std::nullopt);
  EXPECT_EQ(result.available[2]->version(), "3");
  // No "incompatible-items": no list, and an empty one in the file.
  EXPECT_FALSE(result.incompatible);
  EXPECT_EQ(queue->incompatibleUpdates(), nullptr);
  const PlistDictionary cache = cacheContents();
  ASSERT_TRUE(PlistValue(cache)["incompatibleUpdates"].array());
  EXPECT_TRUE(PlistValue(cache)["incompatibleUpdates"].array()->empty());
  EXPECT_EQ(PlistValue(cache)["updates"].array()->size(), 4U);
}

TEST_F(UpdateQueueTest, AFailedCheckLeavesListsFileAndDelegateAlone) {
  auto delegate = std::make_shared<CountingUpdateQueueDelegate>();
  store_.answer(PlistDictionary{{"items", PlistArray{storeItem(101, "com.example.atlas", "1.1"),
                                                     storeItem(102, "com.example.birch", "2.1")}}});
  auto queue = makeQueue(delegate);
  ASSERT_TRUE(check(*queue).success);
  ASSERT_EQ(delegate->waitForCalls(1), 1U);
  const auto before = queue->availableUpdates();
  const FileStamp stamp = stampOf(cacheFile());

  const std::vector<std::pair<int, std::string>> failures = {
      {500, PropertyListSerialization::writeXml(
                PlistDictionary{{"failureType", "server-error"}, {"customerMessage", "Down"}})},
      {200, "<html>this is no property list</html>"},
      {200, PropertyListSerialization::writeXml(PlistDictionary{{"failureType", "busy"}})},
  };
  for (const auto& [status, body] : failures) {
    store_.answerRaw(body, status);
    CheckResult result = check(*queue);
    EXPECT_FALSE(result.success) << body;
    EXPECT_TRUE(result.error) << body;
    ASSERT_EQ(result.available.size(), 2U) << "the waiting callers get the cached lists";
    EXPECT_EQ(result.available[0].get(), (*before)[0].get());
    EXPECT_EQ(queue->availableUpdates(), before);
  }
  const FileStamp after = stampOf(cacheFile());
  EXPECT_EQ(after.bytes, stamp.bytes);
  EXPECT_EQ(after.modifiedNanoseconds, stamp.modifiedNanoseconds);
  settle();
  EXPECT_EQ(delegate->calls(), 1U);
}

TEST_F(UpdateQueueTest, AReturningUpdateKeepsItsPlaceAndMarksWhileTheStoreValuesWin) {
  auto delegate = std::make_shared<CountingUpdateQueueDelegate>();
  store_.answer(PlistDictionary{{"items", PlistArray{storeItem(101, "com.example.atlas", "1.1"),
                                                     storeItem(102, "com.example.birch", "2.1"),
                                                     storeItem(105, "com.example.gone", "5.0")}}});
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
  store_.answer(
      PlistDictionary{{"items", PlistArray{storeItem(106, "com.example.new", "1.0"), renewed,
                                           storeItem(101, "com.example.atlas", "1.2")}}});
  LogCapture log;
  CheckResult second = check(*queue);
  ASSERT_TRUE(second.success);
  EXPECT_EQ(identifiersOf(second.available), (std::vector<std::uint64_t>{101, 102, 106}));
  EXPECT_EQ(log.countContaining("Removing obsolete update <LedgerUpdate: itemIdentifier=105"), 1U)
      << log.dump();

  auto birch = queue->availableUpdateWithItemIdentifier(102);
  EXPECT_EQ(*birch->version(), "2.2");
  EXPECT_EQ(*birch->title(), "Birch Renewed");
  EXPECT_EQ(*PlistValue(birch->dictionary())["extra"].string(), "from the store");
  EXPECT_TRUE(birch->isStaged());
  EXPECT_TRUE(birch->hasBeenSeenByUser());
  EXPECT_EQ(birch->autoUpdateAbortCode(), 7);
  EXPECT_EQ(birch->firstAutoUpdateAttemptDate(), firstAttempt);
  EXPECT_TRUE(queue->availableUpdateWithItemIdentifier(101)->hasBeenSeenByUser());
  EXPECT_EQ(*queue->availableUpdateWithItemIdentifier(101)->version(), "1.2");
  EXPECT_FALSE(queue->availableUpdateWithItemIdentifier(106)->hasBeenSeenByUser());

  // The marks reach the file too.
  auto restarted = makeQueue();
  EXPECT_TRUE(restarted->availableUpdateWithItemIdentifier(102)->isStaged());
  EXPECT_TRUE(restarted->availableUpdateWithItemIdentifier(101)->hasBeenSeenByUser());
  // Two checks and the abort code.
  EXPECT_EQ(delegate->waitForCalls(3), 3U);
}

TEST_F(UpdateQueueTest, AnAnswerWithoutUpdatesEmptiesTheQueue) {
  store_.answer(PlistDictionary{{"items", PlistArray{storeItem(101, "com.example.atlas", "1.1")}}});
  auto delegate = std::make_shared<CountingUpdateQueueDelegate>();
  auto queue = makeQueue(delegate);
  ASSERT_TRUE(check(*queue).success);
  for (const PlistValue& answer :
       {PlistValue(PlistDictionary{}), PlistValue(PlistDictionary{{"items", PlistArray{}}}),
        PlistValue(PlistArray{storeItem(101, "com.example.atlas", "1.1")})}) {
    store_.answer(answer);
    CheckResult result = check(*queue);
    EXPECT_TRUE(result.success) << describePlistValue(answer);
    EXPECT_TRUE(result.available.empty());
    EXPECT_TRUE(PlistValue(cacheContents())["updates"].array()->empty());
    store_.answer(
        PlistDictionary{{"items", PlistArray{storeItem(101, "com.example.atlas", "1.1")}}});
    ASSERT_EQ(check(*queue).available.size(), 1U);
  }
  EXPECT_EQ(delegate->waitForCalls(7), 7U) << "every successful check tells the delegate";
}

TEST_F(UpdateQueueTest, AnUnreadableCacheGivesAnEmptyQueueUntilTheNextCheckRewritesIt) {
  const PlistData valid = PropertyListSerialization::writeBinary(
      PlistDictionary{{"updates", PlistArray{storeItem(101, "com.example.atlas", "1.1")}},
                      {"incompatibleUpdates", PlistArray{}}});
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
       PropertyListSerialization::writeXml(PlistDictionary{
           {"updates", PlistArray{storeItem(101, "com.example.atlas", "1.1"), "junk"}}}),
       true},
      {"a list that is no list",
       PropertyListSerialization::writeXml(PlistDictionary{{"updates", "everything"}}), true},
  };
  store_.answer(PlistDictionary{{"items", PlistArray{storeItem(102, "com.example.birch", "2.1")}}});
  for (const Case& c : cases) {
    writeText(cacheFile(), c.bytes);
    LogCapture log;
    auto queue = makeQueue();
    EXPECT_TRUE(queue->availableUpdates()->empty()) << c.name;
    EXPECT_EQ(log.countContaining("Exception loading updates from persisted store - "),
              c.logsException ? 1U : 0U)
        << c.name << "\n"
        << log.dump();
    ASSERT_TRUE(check(*queue).success) << c.name;
    EXPECT_EQ(identifiersOf(*makeQueue()->availableUpdates()), (std::vector<std::uint64_t>{102}))
        << c.name;
  }
}

class CachedUpdateQueueTest : public UpdateQueueTest {
 protected:
  static void writeCache(const PlistArray& updates) {
    writeBytes(cacheFile(), PropertyListSerialization::writeBinary(PlistDictionary{
                                {"updates", updates}, {"incompatibleUpdates", PlistArray{}}}));
  }
};

TEST_F(CachedUpdateQueueTest, LookupsAndMarksFollowTheListOrder) {
  writeCache(PlistArray{storeItem(101, "com.example.a", "1", "first"),
                        storeItem(102, "com.example.dup", "1", "earlier"),
                        storeItem(101, "com.example.a", "1", "second"),
                        storeItem(103, "com.example.dup", "1", "later")});
  auto delegate = std::make_shared<CountingUpdateQueueDelegate>();
  auto queue = makeQueue(delegate);
  EXPECT_EQ(*queue->availableUpdateWithItemIdentifier(101)->title(), "first");
  EXPECT_EQ(*queue->availableUpdateWithBundleIdentifier("com.example.dup")->title(), "later");
  EXPECT_EQ(queue->availableUpdateWithItemIdentifier(999), nullptr);
  EXPECT_EQ(queue->availableUpdateWithBundleIdentifier("com.example.none"), nullptr);

  EXPECT_FALSE(queue->hasStagedUpdates());
  queue->didStageUpdateForItemIdentifier(101);
  EXPECT_TRUE(queue->hasStagedUpdates());
  const auto list = queue->availableUpdates();
  EXPECT_TRUE((*list)[0]->isStaged());
  EXPECT_TRUE((*list)[2]->isStaged()) << "every record of that identifier is staged";
  EXPECT_FALSE((*list)[1]->isStaged());

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
  auto record = queue->availableUpdateWithItemIdentifier(103);
  EXPECT_EQ(record->autoUpdateAbortCode(), 2);
  EXPECT_EQ(record->firstAutoUpdateAttemptDate(), firstDate);

  queue->didRemoveApplicationWithIdentifier(101);
  EXPECT_EQ(identifiersOf(*queue->availableUpdates()), (std::vector<std::uint64_t>{102, 103}));
  EXPECT_EQ(identifiersOf(*makeQueue()->availableUpdates()), (std::vector<std::uint64_t>{102, 103}))
      << "the removal is saved";
  // Staging tells nobody; two abort codes and the removal do.
  settle();
  EXPECT_EQ(delegate->calls(), 3U);
  // A snapshot taken before stays as it was.
  EXPECT_EQ(list->size(), 4U);
}

TEST_F(UpdateQueueTest, AnUpdateBeingDownloadedReachesTheJournalAfterACheckDroppedIt) {
  store_.answer(PlistDictionary{{"items", PlistArray{storeItem(101, "com.example.atlas", "1.1"),
                                                     storeItem(102, "com.example.birch", "2.1")}}});
  auto delegate = std::make_shared<CountingUpdateQueueDelegate>();
  auto queue = makeQueue(delegate);
  ASSERT_TRUE(check(*queue).success);
  queue->willStartDownloadForUpdateWithIdentifier(101);
  queue->willStartDownloadForUpdateWithIdentifier(777);  // unknown: ignored
  store_.answer(PlistDictionary{{"items", PlistArray{storeItem(102, "com.example.birch", "2.1")}}});
  ASSERT_TRUE(check(*queue).success);
  ASSERT_EQ(queue->availableUpdateWithItemIdentifier(101), nullptr);

  LogCapture log;
  queue->didFinishDownloadForUpdateWithItemIdentifier(101, true);
  EXPECT_EQ(log.countContaining("Installed update <LedgerUpdate: itemIdentifier=101", 1), 1U)
      << log.dump();
  // Its record is let go once the download has ended.
  queue->didFinishDownloadForUpdateWithItemIdentifier(101, true);
  EXPECT_EQ(log.countContaining("Failed to find queued update for item identifier 101 - journal "
                                "may be incomplete",
                                1),
            1U);

  const std::size_t callsBefore = delegate->waitForCalls(2);
  queue->didFinishDownloadForUpdateWithItemIdentifier(102, false);
  EXPECT_EQ(queue->availableUpdates()->size(), 1U)
      << "a download that did not install changes nothing";
  queue->didFinishDownloadForUpdateWithItemIdentifier(102, true);
  EXPECT_TRUE(queue->availableUpdates()->empty());
  EXPECT_EQ(
      log.countContaining(
          "Removed obsolete update <LedgerUpdate: itemIdentifier=102 bundleID=com.example.birch"),
      1U);
  EXPECT_TRUE(PlistValue(cacheContents())["updates"].array()->empty());
  EXPECT_EQ(delegate->waitForCalls(callsBefore + 1), callsBefore + 1);
}

TEST_F(CachedUpdateQueueTest, ElevenCachedUpdatesGoToTheDebugFileAndTenToTheLog) {
  for (int count : {10, 11}) {
    std::filesystem::remove(stateFolder() + "/updates.plist");
    PlistArray updates;
    for (int i = 1; i <= count; ++i) {
      updates.emplace_back(
          storeItem(static_cast<std::uint64_t>(i), "com.example.app" + std::to_string(i), "1"));
    }
    writeCache(updates);
    LogCapture log;
    auto queue = makeQueue();
    EXPECT_EQ(queue->availableUpdates()->size(), static_cast<std::size_t>(count));
    const bool inline_ = log.countContaining("UpdateQueue: Updates - (") == 1;
    const bool sideFile = std::filesystem::exists(stateFolder() + "/updates.plist");
    EXPECT_EQ(inline_, count == 10) << count;
    EXPECT_EQ(sideFile, count == 11) << count;
  }
}

TEST_F(UpdateQueueTest, AHandlerMayCallBackIntoTheQueue) {
  store_.answer(PlistDictionary{{"items", PlistArray{storeItem(101, "com.example.atlas", "1.1")}}});
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

}  // namespace
}  // namespace larder::testing
