#include "platform/metadata/MetadataQuery.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <cstdlib>
#include <deque>
#include <filesystem>
#include <fstream>
#include <functional>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "platform/dispatch/DispatchQueue.h"
#include "platform/metadata/MetadataAttributes.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"

namespace larder {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::UnorderedElementsAre;
using ItemRef = std::shared_ptr<const MetadataItem>;

constexpr const char* kStoreQuery =
    "kHostItemQuaymartHasPurchaseRecord == 1 || "
    "kHostItemHostBundleIdentifier=='com.orvane.SetupHerald*'";

constexpr const char* kLegacyQuery =
    "kHostItemContentType=com.orvane.application-bundle && "
    "kHostItemQuaymartHasPurchaseRecord!=1 && kHostItemQuaymartIsDeveloperSigned!=1 && "
    "(kHostItemHostBundleIdentifier='com.orvane.Snapbox' || "
    "kHostItemHostBundleIdentifier='com.orvane.ReelcutApp')";

// Far above the query's own delays (50 ms quiet, 150 ms longest), so that a slow sanitizer
// build still passes; a passing test returns as soon as its event has come.
constexpr auto kEventTimeout = 1500ms;

std::vector<std::string> valueAttributes() {
  return {"kHostItemQuaymartWareID",       "kHostItemQuaymartInstallerVersionID",
          "kHostItemHostBundleIdentifier", "kHostItemVersion",
          "_kHostItemQuaymartRefID",       "kHostItemQuaymartPurchaseDate"};
}

struct RecordedItem {
  ItemRef item;
  PlistDictionary attributes;  // as delivered with the event
  [[nodiscard]] std::string path() const {
    auto found = attributes.find(MetadataAttributes::kPath);
    return found == attributes.end() || !found->second.string() ? "" : *found->second.string();
  }
};

struct RecordedUpdate {
  std::vector<RecordedItem> added;
  std::vector<RecordedItem> changed;
  std::vector<RecordedItem> removed;
};

std::vector<RecordedItem> recorded(const std::vector<ItemRef>& items) {
  std::vector<RecordedItem> result;
  for (const ItemRef& item : items) result.push_back({item, *item->attributes()});
  return result;
}

std::vector<std::string> pathsOf(const std::vector<RecordedItem>& items) {
  std::vector<std::string> paths;
  for (const RecordedItem& item : items) paths.push_back(item.path());
  return paths;
}

// Listens to one query on a serial queue of its own and lets the test wait for what comes.
class QueryRecorder {
 public:
  explicit QueryRecorder(const std::shared_ptr<MetadataQuery>& query)
      : queue_(DispatchQueue::create("MetadataQueryTests", DispatchQueue::Kind::Serial)) {
    query->setQueue(queue_);
    query->setHandlers({
        [this](MetadataQuery& q) { onFinished(q); },
        [this](MetadataQuery& q, const MetadataQueryUpdate& update) { onUpdate(q, update); },
        [this](MetadataQuery& q) { onPortInvalid(q); },
    });
  }

  // Waits for what is queued for the handlers to run.
  void drain() {
    queue_->sync([] {});
  }

  bool waitForFinished() {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, kEventTimeout, [this] { return finished_; });
  }

  std::optional<RecordedUpdate> nextUpdate(std::chrono::milliseconds limit = kEventTimeout) {
    std::unique_lock lock(mutex_);
    if (!changed_.wait_for(lock, limit, [this] { return !updates_.empty(); })) return std::nullopt;
    RecordedUpdate update = std::move(updates_.front());
    updates_.pop_front();
    return update;
  }

  // Updates merged in order until `done` holds for the one just come (or none comes).
  RecordedUpdate updatesUntil(const std::function<bool(const RecordedUpdate&)>& done) {
    RecordedUpdate merged;
    while (std::optional<RecordedUpdate> update = nextUpdate()) {
      append(merged.added, update->added);
      append(merged.changed, update->changed);
      append(merged.removed, update->removed);
      if (done(*update)) break;
    }
    return merged;
  }

  // Updates until one has an added, changed or removed item at `path`.
  RecordedUpdate updatesUntilPath(const std::string& path) {
    return updatesUntil([&](const RecordedUpdate& update) {
      auto mentions = [&](const std::vector<RecordedItem>& items) {
        return std::any_of(items.begin(), items.end(),
                           [&](const RecordedItem& item) { return item.path() == path; });
      };
      return mentions(update.added) || mentions(update.changed) || mentions(update.removed);
    });
  }

  RecordedUpdate updatesUntilAnAddition() {
    return updatesUntil([](const RecordedUpdate& update) { return !update.added.empty(); });
  }

  // Nothing more has been told so far; call it once the query has shown,
  // by a later event, that it has taken up what came before.
  bool nothingPending() {
    drain();
    return !nextUpdate(0ms).has_value();
  }

  bool waitForPortInvalid() {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, kEventTimeout, [this] { return portInvalidCount_ > 0; });
  }

  std::vector<std::string> initialPaths() {
    std::lock_guard lock(mutex_);
    return initialPaths_;
  }

  int portInvalidCount() {
    std::lock_guard lock(mutex_);
    return portInvalidCount_;
  }

  bool handlersRanOnTheQueue() {
    std::lock_guard lock(mutex_);
    return allOnQueue_;
  }

 private:
  static void append(std::vector<RecordedItem>& to, const std::vector<RecordedItem>& from) {
    to.insert(to.end(), from.begin(), from.end());
  }

  void onFinished(MetadataQuery& query) {
    std::vector<std::string> paths;
    for (std::size_t index = 0; index < query.resultCount(); ++index) {
      paths.push_back(query.resultAtIndex(index)->path());
    }
    std::sort(paths.begin(), paths.end());
    std::lock_guard lock(mutex_);
    allOnQueue_ = allOnQueue_ && queue_->isCurrent();
    initialPaths_ = std::move(paths);
    finished_ = true;
    changed_.notify_all();
  }

  void onUpdate(MetadataQuery& /*query*/, const MetadataQueryUpdate& update) {
    RecordedUpdate entry{recorded(update.added), recorded(update.changed),
                         recorded(update.removed)};
    std::lock_guard lock(mutex_);
    allOnQueue_ = allOnQueue_ && queue_->isCurrent();
    updates_.push_back(std::move(entry));
    changed_.notify_all();
  }

  void onPortInvalid(MetadataQuery& /*query*/) {
    std::lock_guard lock(mutex_);
    allOnQueue_ = allOnQueue_ && queue_->isCurrent();
    ++portInvalidCount_;
    changed_.notify_all();
  }

  std::shared_ptr<DispatchQueue> queue_;
  std::mutex mutex_;
  std::condition_variable changed_;
  bool finished_ = false;
  bool allOnQueue_ = true;
  int portInvalidCount_ = 0;
  std::vector<std::string> initialPaths_;
  std::deque<RecordedUpdate> updates_;
};

struct BundleContents {
  std::string identifier;
  std::string version = "1.0";
  std::optional<std::int64_t> wareID;  // with a value: a purchase record is written
  std::int64_t installerVersionID = 1;
  bool developerSigned = false;
};

class MetadataQueryTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (fs::temp_directory_path() / "larder-metadata-query-XXXXXX").string();
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    base_ = pattern;
    root_ = base_ + "/root";
    home_ = base_ + "/home";
    staging_ = base_ + "/staging";
    for (const std::string& folder : {root_ + "/Applications", home_ + "/Applications", staging_}) {
      fs::create_directories(folder);
    }
    ::setenv("LARDER_ROOT", root_.c_str(), 1);
    ::setenv("HOME", home_.c_str(), 1);
  }

  void TearDown() override {
    for (auto& [query, recorder] : queries_) {
      query->stop();
      recorder->drain();
    }
    queries_.clear();
    std::error_code ignored;
    fs::remove_all(base_, ignored);
  }

  struct Started {
    std::shared_ptr<MetadataQuery> query;
    QueryRecorder* recorder;
  };

  Started startQuery(const char* text = kStoreQuery,
                     MetadataQuery::Options options = fastOptions()) {
    auto query = MetadataQuery::create(text, valueAttributes(), std::move(options));
    auto recorder = std::make_unique<QueryRecorder>(query);
    QueryRecorder* raw = recorder.get();
    queries_.emplace_back(query, std::move(recorder));
    EXPECT_TRUE(query->start()) << query->startError();
    EXPECT_TRUE(raw->waitForFinished());
    return {query, raw};
  }

  static MetadataQuery::Options fastOptions() {
    MetadataQuery::Options options;
    options.settleLimit = 300ms;
    return options;
  }

  static void writePlist(const std::string& path, const PlistDictionary& dictionary) {
    ASSERT_TRUE(FileIO::writeAtomically(path, PropertyListSerialization::writeXml(dictionary)));
  }

  static PlistDictionary purchaseFor(const BundleContents& contents) {
    return {{"bundleIdentifier", contents.identifier},
            {"bundleVersion", contents.version},
            {"wareID", *contents.wareID},
            {"installerVersionID", contents.installerVersionID},
            {"opaqueAccountIDString", "account-7"},
            {"purchaseDate", PlistDate{1700000000}}};
  }

  // Writes a bundle in place, files as a copy would leave them.
  static void writeBundle(const std::string& path, const BundleContents& contents) {
    fs::create_directories(path + "/resources");
    PlistDictionary info{{"HostBundleIdentifier", contents.identifier},
                         {"HostBundleShortVersionString", contents.version}};
    if (contents.developerSigned) info["HostBundleDeveloperSigned"] = true;
    writePlist(path + "/bundle.plist", info);
    if (contents.wareID) writePlist(path + "/purchase.plist", purchaseFor(contents));
  }

  // Prepares the bundle outside the scope and renames it in: it lands in one step.
  void landBundle(const std::string& path, const BundleContents& contents) {
    const std::string prepared = staging_ + "/" + fs::path(path).filename().string();
    writeBundle(prepared, contents);
    fs::create_directories(fs::path(path).parent_path());
    fs::rename(prepared, path);
  }

  std::string applications(const std::string& name) const {
    return root_ + "/Applications/" + name;
  }

  // Lands a bundle of its own and waits for it to be told. Events are taken
  // up in order, so by then whatever the test did before has been seen, and
  // the marker must be all that was told since.
  void expectOnlyAMarkerNext(QueryRecorder& recorder) {
    const std::string marker = applications("Marker" + std::to_string(++markers_) + ".app");
    landBundle(marker, storeApp("com.example.Marker", 900000 + markers_));
    const RecordedUpdate merged = recorder.updatesUntilPath(marker);
    EXPECT_EQ(pathsOf(merged.added), std::vector<std::string>{marker});
    EXPECT_THAT(pathsOf(merged.changed), IsEmpty());
    EXPECT_THAT(pathsOf(merged.removed), IsEmpty());
  }

  static BundleContents storeApp(std::string identifier, std::int64_t wareID = 401000001) {
    return {std::move(identifier), "1.0", wareID};
  }

  std::string base_;
  std::string root_;
  std::string home_;
  std::string staging_;
  int markers_ = 0;
  std::vector<std::pair<std::shared_ptr<MetadataQuery>, std::unique_ptr<QueryRecorder>>> queries_;
};

TEST_F(MetadataQueryTest, GathersStoreSoftwareInEveryApplicationFolder) {
  writeBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  writeBundle(applications("Utilities/Tool.app"), storeApp("com.example.Tool", 401000002));
  writeBundle(home_ + "/Applications/Mine.app", storeApp("com.example.Mine", 401000003));
  writeBundle(root_ + "/Volumes/Disk/Applications/Far.app", storeApp("com.example.Far", 4010004));
  writeBundle(applications("Setup SetupHerald.app"), {"com.orvane.SetupHerald", "12.0"});
  writeBundle(applications("Plain.app"), {"com.example.Plain"});
  writeBundle(applications("Utilities/Deeper/Hidden.app"), storeApp("com.example.Hidden", 5));
  writeBundle(applications("NotABundle"), storeApp("com.example.NotABundle", 6));

  auto [query, recorder] = startQuery();
  EXPECT_THAT(recorder->initialPaths(),
              ElementsAre(home_ + "/Applications/Mine.app", applications("Notes.app"),
                          applications("Setup SetupHerald.app"), applications("Utilities/Tool.app"),
                          root_ + "/Volumes/Disk/Applications/Far.app"));
  EXPECT_FALSE(query->isGathering());
  EXPECT_TRUE(recorder->handlersRanOnTheQueue());
}

TEST_F(MetadataQueryTest, ResultsGiveTheValueAttributes) {
  BundleContents notes = storeApp("com.example.Notes", 401000009);
  notes.version = "2.5";
  notes.installerVersionID = 33;
  writeBundle(applications("Notes.app"), notes);
  auto [query, recorder] = startQuery();
  ASSERT_EQ(query->resultCount(), 1u);
  ItemRef item = query->resultAtIndex(0);
  ASSERT_NE(item, nullptr);
  EXPECT_EQ(query->indexOfResult(item.get()), 0u);
  EXPECT_EQ(query->valueOfAttribute("kHostItemQuaymartWareID", 0), PlistValue(401000009.0));
  EXPECT_EQ(query->valueOfAttribute("kHostItemQuaymartInstallerVersionID", 0), PlistValue(33));
  EXPECT_EQ(query->valueOfAttribute("kHostItemHostBundleIdentifier", 0),
            PlistValue("com.example.Notes"));
  EXPECT_EQ(query->valueOfAttribute("kHostItemVersion", 0), PlistValue("2.5"));
  EXPECT_EQ(query->valueOfAttribute("_kHostItemQuaymartRefID", 0), PlistValue("account-7"));
  EXPECT_EQ(query->valueOfAttribute("kHostItemQuaymartPurchaseDate", 0),
            PlistValue(PlistDate{1700000000}));
  EXPECT_EQ(MetadataQuery::attributeOfItem(*item, "kHostItemPath"),
            PlistValue(applications("Notes.app")));
  EXPECT_TRUE(query->valueOfAttribute("kHostItemVersion", 1).isNull());
  EXPECT_EQ(query->resultAtIndex(1), nullptr);
  MetadataItem* stranger = nullptr;
  EXPECT_EQ(query->indexOfResult(stranger), std::nullopt);
}

TEST_F(MetadataQueryTest, BundleLandingIsOneAddedWithItsAttributes) {
  auto [query, recorder] = startQuery();
  EXPECT_EQ(query->resultCount(), 0u);
  const auto landed = std::chrono::steady_clock::now();
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  std::optional<RecordedUpdate> update = recorder->nextUpdate();
  const auto latency = std::chrono::steady_clock::now() - landed;
  ASSERT_TRUE(update.has_value());
  ASSERT_EQ(update->added.size(), 1u);
  EXPECT_THAT(update->changed, IsEmpty());
  EXPECT_THAT(update->removed, IsEmpty());
  EXPECT_EQ(update->added[0].path(), applications("Notes.app"));
  EXPECT_EQ(update->added[0].attributes.at("kHostItemHostBundleIdentifier"),
            PlistValue("com.example.Notes"));
  EXPECT_EQ(query->resultCount(), 1u);
  EXPECT_LT(latency, kEventTimeout);
  expectOnlyAMarkerNext(*recorder);
}

TEST_F(MetadataQueryTest, BundleCopiedFileByFileIsOneAddedWithFinalAttributes) {
  MetadataQuery::Options patient = fastOptions();
  patient.settleLimit = kEventTimeout;
  auto [query, recorder] = startQuery(kStoreQuery, patient);
  const std::string path = applications("Notes.app");
  const BundleContents contents = storeApp("com.example.Notes");
  // The purchase record first and the information list a while later, as a slow copy might:
  // the half-copied bundle is held back while another one lands.
  fs::create_directories(path);
  writePlist(path + "/purchase.plist", purchaseFor(contents));
  expectOnlyAMarkerNext(*recorder);
  writePlist(path + "/bundle.plist", {{"HostBundleIdentifier", contents.identifier},
                                      {"HostBundleShortVersionString", contents.version}});
  std::optional<RecordedUpdate> update = recorder->nextUpdate();
  ASSERT_TRUE(update.has_value());
  ASSERT_EQ(update->added.size(), 1u);
  EXPECT_EQ(update->added[0].attributes.at("kHostItemHostBundleIdentifier"),
            PlistValue("com.example.Notes"));
  EXPECT_EQ(update->added[0].attributes.at("kHostItemVersion"), PlistValue("1.0"));
  expectOnlyAMarkerNext(*recorder);
}

TEST_F(MetadataQueryTest, BundleThatNeverGetsItsInformationListArrivesAfterTheLimit) {
  auto [query, recorder] = startQuery();
  const std::string path = applications("Broken.app");
  fs::create_directories(path);
  writePlist(path + "/purchase.plist", purchaseFor(storeApp("com.example.Broken")));
  std::optional<RecordedUpdate> update = recorder->nextUpdate();
  ASSERT_TRUE(update.has_value());
  ASSERT_EQ(update->added.size(), 1u);
  EXPECT_EQ(update->added[0].attributes.count("kHostItemHostBundleIdentifier"), 0u);
  EXPECT_EQ(update->added[0].attributes.at("kHostItemQuaymartHasPurchaseRecord"), PlistValue(1));
}

TEST_F(MetadataQueryTest, EditingThePurchaseRecordIsAChange) {
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  auto [query, recorder] = startQuery();
  ASSERT_EQ(query->resultCount(), 1u);
  const ItemRef item = query->resultAtIndex(0);

  BundleContents updated = storeApp("com.example.Notes");
  updated.installerVersionID = 2;
  writePlist(applications("Notes.app/purchase.plist"), purchaseFor(updated));
  std::optional<RecordedUpdate> update = recorder->nextUpdate();
  ASSERT_TRUE(update.has_value());
  ASSERT_EQ(update->changed.size(), 1u);
  EXPECT_EQ(update->changed[0].item, item);
  EXPECT_EQ(update->changed[0].attributes.at("kHostItemQuaymartInstallerVersionID"), PlistValue(2));
  EXPECT_THAT(update->added, IsEmpty());
  EXPECT_THAT(update->removed, IsEmpty());
  EXPECT_EQ(query->valueOfAttribute("kHostItemQuaymartInstallerVersionID", 0), PlistValue(2));

  // Rewritten in place rather than replaced.
  updated.installerVersionID = 3;
  std::ofstream(applications("Notes.app/purchase.plist"), std::ios::trunc)
      << PropertyListSerialization::writeXml(purchaseFor(updated));
  update = recorder->nextUpdate();
  ASSERT_TRUE(update.has_value());
  ASSERT_EQ(update->changed.size(), 1u);
  EXPECT_EQ(update->changed[0].attributes.at("kHostItemQuaymartInstallerVersionID"), PlistValue(3));
}

TEST_F(MetadataQueryTest, EditingTheInformationListIsAChange) {
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  auto [query, recorder] = startQuery();
  writePlist(applications("Notes.app/bundle.plist"),
             {{"HostBundleIdentifier", "com.example.Notes"}, {"HostBundleVersion", "9"}});
  std::optional<RecordedUpdate> update = recorder->nextUpdate();
  ASSERT_TRUE(update.has_value());
  ASSERT_EQ(update->changed.size(), 1u);
  EXPECT_EQ(update->changed[0].attributes.at("kHostItemVersion"), PlistValue("9"));
}

TEST_F(MetadataQueryTest, UnrelatedFilesInsideABundleAreNoChange) {
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  auto [query, recorder] = startQuery();
  std::ofstream(applications("Notes.app/resources/icon.png")) << "picture";
  fs::create_directories(applications("Notes.app/bin"));
  // Rewriting the record with the same contents changes no attribute either.
  writePlist(applications("Notes.app/purchase.plist"), purchaseFor(storeApp("com.example.Notes")));
  expectOnlyAMarkerNext(*recorder);
}

TEST_F(MetadataQueryTest, DeletingABundleRemovesItsItem) {
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  landBundle(applications("Other.app"), storeApp("com.example.Other", 7));
  auto [query, recorder] = startQuery();
  ASSERT_EQ(query->resultCount(), 2u);
  const ItemRef notes = query->resultAtIndex(0)->path() == applications("Notes.app")
                            ? query->resultAtIndex(0)
                            : query->resultAtIndex(1);
  fs::remove_all(applications("Notes.app"));
  std::optional<RecordedUpdate> update = recorder->nextUpdate();
  ASSERT_TRUE(update.has_value());
  ASSERT_EQ(update->removed.size(), 1u);
  EXPECT_EQ(update->removed[0].item, notes);
  EXPECT_EQ(update->removed[0].path(), applications("Notes.app"));
  EXPECT_EQ(query->resultCount(), 1u);
  EXPECT_EQ(query->indexOfResult(notes.get()), std::nullopt);
  EXPECT_EQ(query->resultAtIndex(0)->path(), applications("Other.app"));
  EXPECT_EQ(query->indexOfResult(query->resultAtIndex(0).get()), 0u);
}

TEST_F(MetadataQueryTest, MovingABundleBetweenFoldersKeepsTheItem) {
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  auto [query, recorder] = startQuery();
  const ItemRef item = query->resultAtIndex(0);
  const std::string moved = home_ + "/Applications/Notes.app";
  fs::rename(applications("Notes.app"), moved);
  std::optional<RecordedUpdate> update = recorder->nextUpdate();
  ASSERT_TRUE(update.has_value());
  EXPECT_THAT(update->added, IsEmpty());
  EXPECT_THAT(update->removed, IsEmpty());
  ASSERT_EQ(update->changed.size(), 1u);
  EXPECT_EQ(update->changed[0].item, item);
  EXPECT_EQ(update->changed[0].path(), moved);
  EXPECT_EQ(item->path(), moved);
  EXPECT_EQ(query->resultCount(), 1u);

  // Renamed in place, and moved into a subfolder: still the same item.
  const std::string renamed = home_ + "/Applications/Jotter.app";
  fs::rename(moved, renamed);
  update = recorder->nextUpdate();
  ASSERT_TRUE(update.has_value());
  ASSERT_EQ(update->changed.size(), 1u);
  EXPECT_EQ(update->changed[0].item, item);
  EXPECT_EQ(update->changed[0].path(), renamed);

  // The folder is new: the query learns of it and of the bundle in one go.
  fs::create_directories(applications("Office"));
  fs::rename(renamed, applications("Office/Jotter.app"));
  update = recorder->nextUpdate();
  ASSERT_TRUE(update.has_value());
  ASSERT_EQ(update->changed.size(), 1u);
  EXPECT_EQ(update->changed[0].item, item);
  EXPECT_EQ(update->changed[0].path(), applications("Office/Jotter.app"));
}

TEST_F(MetadataQueryTest, MovingABundleOutOfTheScopeRemovesIt) {
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  auto [query, recorder] = startQuery();
  fs::rename(applications("Notes.app"), staging_ + "/Notes.app");
  std::optional<RecordedUpdate> update = recorder->nextUpdate();
  ASSERT_TRUE(update.has_value());
  EXPECT_EQ(update->removed.size(), 1u);
  EXPECT_EQ(query->resultCount(), 0u);
}

TEST_F(MetadataQueryTest, ReplacingABundleIsARemovalAndAnAddition) {
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  auto [query, recorder] = startQuery();
  const ItemRef old = query->resultAtIndex(0);
  BundleContents newer = storeApp("com.example.Notes");
  newer.version = "2.0";
  writeBundle(staging_ + "/Notes.app", newer);
  fs::rename(applications("Notes.app"), staging_ + "/Old.app");
  fs::rename(staging_ + "/Notes.app", applications("Notes.app"));
  const RecordedUpdate merged = recorder->updatesUntilAnAddition();
  EXPECT_THAT(merged.changed, IsEmpty());
  ASSERT_EQ(merged.removed.size(), 1u);
  EXPECT_EQ(merged.removed[0].item, old);
  ASSERT_EQ(merged.added.size(), 1u);
  EXPECT_NE(merged.added[0].item, old);
  EXPECT_EQ(merged.added[0].attributes.at("kHostItemVersion"), PlistValue("2.0"));
  // Settled, the replacement is told as a change of the new item too.
  std::optional<RecordedUpdate> settled = recorder->nextUpdate();
  ASSERT_TRUE(settled.has_value());
  EXPECT_THAT(settled->added, IsEmpty());
  EXPECT_THAT(settled->removed, IsEmpty());
  ASSERT_EQ(settled->changed.size(), 1u);
  EXPECT_EQ(settled->changed[0].item, merged.added[0].item);
  EXPECT_EQ(settled->changed[0].attributes.at("kHostItemVersion"), PlistValue("2.0"));
}

// Deleted and made again at once, the new folder often gets the inode of the old one: it must
// still be a new item, at the same path or at another.
TEST_F(MetadataQueryTest, BundleDeletedAndMadeAgainIsANewItem) {
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  auto [query, recorder] = startQuery();
  for (const char* name : {"Notes.app", "Jotter.app"}) {
    const ItemRef old = query->resultAtIndex(0);
    ASSERT_NE(old, nullptr);
    fs::remove_all(old->path());
    BundleContents again = storeApp("com.example.Notes");
    again.version = name;
    writeBundle(applications(name), again);
    const RecordedUpdate merged = recorder->updatesUntilAnAddition();
    EXPECT_THAT(merged.changed, IsEmpty()) << name;
    ASSERT_EQ(merged.removed.size(), 1u) << name;
    EXPECT_EQ(merged.removed[0].item, old) << name;
    ASSERT_EQ(merged.added.size(), 1u) << name;
    EXPECT_NE(merged.added[0].item, old) << name;
    EXPECT_EQ(merged.added[0].path(), applications(name));
    EXPECT_EQ(merged.added[0].attributes.at("kHostItemVersion"), PlistValue(name));
    ASSERT_EQ(query->resultCount(), 1u);
    if (name == std::string("Notes.app")) {
      // At the same path it is a replacement, which is also told as a change once settled.
      std::optional<RecordedUpdate> settled = recorder->nextUpdate();
      ASSERT_TRUE(settled.has_value());
      ASSERT_EQ(settled->changed.size(), 1u);
      EXPECT_EQ(settled->changed[0].item, merged.added[0].item);
    }
  }
}

TEST_F(MetadataQueryTest, PurchaseRecordComingAndGoingAddsAndRemoves) {
  writeBundle(applications("Plain.app"), {"com.example.Plain"});
  auto [query, recorder] = startQuery();
  EXPECT_EQ(query->resultCount(), 0u);
  writePlist(applications("Plain.app/purchase.plist"), purchaseFor(storeApp("com.example.Plain")));
  std::optional<RecordedUpdate> update = recorder->nextUpdate();
  ASSERT_TRUE(update.has_value());
  ASSERT_EQ(update->added.size(), 1u);
  const ItemRef item = update->added[0].item;

  fs::remove(applications("Plain.app/purchase.plist"));
  update = recorder->nextUpdate();
  ASSERT_TRUE(update.has_value());
  ASSERT_EQ(update->removed.size(), 1u);
  EXPECT_EQ(update->removed[0].item, item);
  EXPECT_EQ(query->resultCount(), 0u);
}

TEST_F(MetadataQueryTest, LegacyQueryFollowsItsOwnBundles) {
  writeBundle(applications("Snapbox.app"), {"com.orvane.Snapbox", "9.1"});
  BundleContents signedReelcut{"com.orvane.ReelcutApp", "9.0"};
  signedReelcut.developerSigned = true;
  writeBundle(applications("Reelcut.app"), signedReelcut);
  writeBundle(applications("Other.app"), {"com.orvane.Darkbench", "3.0"});
  auto [query, recorder] = startQuery(kLegacyQuery);
  EXPECT_THAT(recorder->initialPaths(), ElementsAre(applications("Snapbox.app")));

  // Bought from the store later: no longer legacy software.
  writePlist(applications("Snapbox.app/purchase.plist"),
             purchaseFor(storeApp("com.orvane.Snapbox")));
  std::optional<RecordedUpdate> update = recorder->nextUpdate();
  ASSERT_TRUE(update.has_value());
  EXPECT_EQ(pathsOf(update->removed), std::vector<std::string>{applications("Snapbox.app")});
}

TEST_F(MetadataQueryTest, DamagedBundlesAreSurvived) {
  const std::string garbage = applications("Garbage.app");
  fs::create_directories(garbage);
  std::ofstream(garbage + "/bundle.plist") << "\x01\x02 not a plist";
  std::ofstream(garbage + "/purchase.plist") << "";
  const std::string piped = applications("Piped.app");
  fs::create_directories(piped);
  ASSERT_EQ(::mkfifo((piped + "/purchase.plist").c_str(), 0644), 0);
  ASSERT_EQ(::mkfifo((piped + "/bundle.plist").c_str(), 0644), 0);
  const std::string listed = applications("Listed.app");
  writeBundle(listed, {"com.example.Listed"});
  std::ofstream(listed + "/purchase.plist", std::ios::trunc)
      << PropertyListSerialization::writeXml(PlistValue(PlistArray{1, 2}));
  const std::string headless = applications("Headless.app");
  fs::create_directories(headless);
  writePlist(headless + "/purchase.plist", purchaseFor(storeApp("com.example.Headless")));
  std::ofstream(applications("File.app")) << "a file, not a folder";
  landBundle(applications("Good.app"), storeApp("com.example.Good"));

  auto [query, recorder] = startQuery();
  EXPECT_THAT(recorder->initialPaths(), ElementsAre(applications("Good.app"), headless));

  // Damage arriving later is survived too, and the query goes on.
  std::ofstream(applications("Good.app/purchase.plist"), std::ios::trunc) << "<plist><dict>";
  std::optional<RecordedUpdate> update = recorder->nextUpdate();
  ASSERT_TRUE(update.has_value());
  EXPECT_EQ(pathsOf(update->removed), std::vector<std::string>{applications("Good.app")});
  landBundle(applications("Later.app"), storeApp("com.example.Later"));
  update = recorder->nextUpdate();
  ASSERT_TRUE(update.has_value());
  EXPECT_EQ(pathsOf(update->added), std::vector<std::string>{applications("Later.app")});
}

TEST_F(MetadataQueryTest, SymbolicLinkLoopsAreSurvived) {
  landBundle(applications("Good.app"), storeApp("com.example.Good"));
  fs::create_symlink("Loop.app", applications("Loop.app"));
  fs::create_symlink("Pong.app", applications("Ping.app"));
  fs::create_symlink("Ping.app", applications("Pong.app"));
  fs::create_symlink(".", applications("Again"));
  fs::create_symlink("Circle", applications("Circle"));
  landBundle(staging_ + "/Elsewhere/Linked.app", storeApp("com.example.Linked", 9));
  fs::create_symlink(staging_ + "/Elsewhere/Linked.app", applications("Linked.app"));

  auto [query, recorder] = startQuery();
  // The folder linked to itself lists Good.app a second time: one bundle, at its first path.
  EXPECT_THAT(recorder->initialPaths(),
              ElementsAre(applications("Good.app"), applications("Linked.app")));

  fs::create_symlink("Loop2.app", applications("Loop2.app"));
  landBundle(applications("After.app"), storeApp("com.example.After", 10));
  RecordedUpdate merged = recorder->updatesUntilPath(applications("After.app"));
  EXPECT_EQ(pathsOf(merged.added), std::vector<std::string>{applications("After.app")});
}

TEST_F(MetadataQueryTest, BundleVanishingDuringTheGatheringIsLeftOut) {
  landBundle(applications("Going.app"), storeApp("com.example.Going"));
  landBundle(applications("Staying.app"), storeApp("com.example.Staying", 2));
  MetadataQuery::Options options = fastOptions();
  options.beforeReadingBundle = [this](const std::string& path) {
    if (path == applications("Going.app")) fs::remove_all(path);
  };
  auto [query, recorder] = startQuery(kStoreQuery, options);
  EXPECT_THAT(recorder->initialPaths(), ElementsAre(applications("Staying.app")));
  expectOnlyAMarkerNext(*recorder);  // never reported, so never removed
}

TEST_F(MetadataQueryTest, FolderVanishingDuringAnUpdateIsSurvived) {
  MetadataQuery::Options options = fastOptions();
  auto armed = std::make_shared<std::atomic<bool>>(false);
  const std::string games = applications("Games");
  options.beforeReadingBundle = [games, armed](const std::string& path) {
    if (path.starts_with(games + "/") && armed->exchange(false)) fs::remove_all(games);
  };
  auto [query, recorder] = startQuery(kStoreQuery, options);
  *armed = true;
  fs::create_directories(staging_ + "/Games");
  writeBundle(staging_ + "/Games/Chess.app", storeApp("com.example.Chess"));
  writeBundle(staging_ + "/Games/Go.app", storeApp("com.example.Go", 2));
  fs::rename(staging_ + "/Games", applications("Games"));
  // The whole folder went while its first bundle was being read: nothing stays.
  expectOnlyAMarkerNext(*recorder);
  EXPECT_EQ(query->resultCount(), 1u);
}

TEST_F(MetadataQueryTest, NewVolumesAndFoldersAreWatched) {
  auto [query, recorder] = startQuery();
  // The volumes folder itself appears, with a volume in it.
  writeBundle(staging_ + "/Volumes/Disk/Applications/Far.app", storeApp("com.example.Far"));
  fs::rename(staging_ + "/Volumes", root_ + "/Volumes");
  RecordedUpdate merged = recorder->updatesUntilPath(root_ + "/Volumes/Disk/Applications/Far.app");
  EXPECT_EQ(pathsOf(merged.added),
            std::vector<std::string>{root_ + "/Volumes/Disk/Applications/Far.app"});

  // A second volume, then an application folder made on an empty volume.
  writeBundle(staging_ + "/Two/Applications/Near.app", storeApp("com.example.Near", 2));
  fs::rename(staging_ + "/Two", root_ + "/Volumes/Two");
  merged = recorder->updatesUntilPath(root_ + "/Volumes/Two/Applications/Near.app");
  EXPECT_EQ(pathsOf(merged.added),
            std::vector<std::string>{root_ + "/Volumes/Two/Applications/Near.app"});

  // Each step is seen before the next is taken.
  fs::create_directories(root_ + "/Volumes/Three");
  expectOnlyAMarkerNext(*recorder);
  fs::create_directories(root_ + "/Volumes/Three/Applications");
  expectOnlyAMarkerNext(*recorder);
  landBundle(root_ + "/Volumes/Three/Applications/Mid.app", storeApp("com.example.Mid", 3));
  merged = recorder->updatesUntilPath(root_ + "/Volumes/Three/Applications/Mid.app");
  EXPECT_EQ(pathsOf(merged.added),
            std::vector<std::string>{root_ + "/Volumes/Three/Applications/Mid.app"});

  // A volume going takes its bundles with it.
  fs::rename(root_ + "/Volumes/Two", staging_ + "/Two");
  merged = recorder->updatesUntilPath(root_ + "/Volumes/Two/Applications/Near.app");
  EXPECT_EQ(pathsOf(merged.removed),
            std::vector<std::string>{root_ + "/Volumes/Two/Applications/Near.app"});
  EXPECT_EQ(query->resultCount(), 4u) << "Far, Mid and the two markers";
}

TEST_F(MetadataQueryTest, HomeApplicationsFolderAppearingLater) {
  fs::remove(home_ + "/Applications");
  auto [query, recorder] = startQuery();
  writeBundle(staging_ + "/Applications/Mine.app", storeApp("com.example.Mine"));
  fs::rename(staging_ + "/Applications", home_ + "/Applications");
  RecordedUpdate merged = recorder->updatesUntilPath(home_ + "/Applications/Mine.app");
  EXPECT_EQ(pathsOf(merged.added), std::vector<std::string>{home_ + "/Applications/Mine.app"});
}

TEST_F(MetadataQueryTest, BurstOfWritesIsCoalesced) {
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  auto [query, recorder] = startQuery();
  BundleContents contents = storeApp("com.example.Notes");
  const std::string record = applications("Notes.app/purchase.plist");
  const auto start = std::chrono::steady_clock::now();
  for (int round = 2; round <= 30; ++round) {
    contents.installerVersionID = round;
    std::ofstream(record + ".new") << PropertyListSerialization::writeXml(purchaseFor(contents));
    fs::rename(record + ".new", record);
  }
  const auto writing = std::chrono::steady_clock::now() - start;
  std::vector<RecordedUpdate> updates;
  const auto isLast = [](const RecordedUpdate& update) {
    return !update.changed.empty() && update.changed.back().attributes.at(
                                          "kHostItemQuaymartInstallerVersionID") == PlistValue(30);
  };
  while (std::optional<RecordedUpdate> update = recorder->nextUpdate()) {
    updates.push_back(std::move(*update));
    if (isLast(updates.back())) break;
  }
  ASSERT_FALSE(updates.empty());
  // At most one update per longest delay (150 ms) while the writes went on, and one after.
  EXPECT_LE(updates.size(), static_cast<std::size_t>(writing / 150ms) + 2u) << updates.size();
  ASSERT_EQ(updates.back().changed.size(), 1u);
  EXPECT_EQ(updates.back().changed[0].attributes.at("kHostItemQuaymartInstallerVersionID"),
            PlistValue(30));
}

TEST_F(MetadataQueryTest, OverflowInvalidatesTheQueryAndARestartRecovers) {
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  auto [query, recorder] = startQuery();
  query->simulateQueueOverflowForTesting();
  ASSERT_TRUE(recorder->waitForPortInvalid());
  EXPECT_EQ(recorder->portInvalidCount(), 1);

  // What happens now goes unseen by the old query, while the owner's new query finds it in
  // its gathering and then follows the disk again; once that one has told of a later bundle,
  // the old one has had its chance to tell of either.
  landBundle(applications("Missed.app"), storeApp("com.example.Missed", 2));
  auto [again, againRecorder] = startQuery();
  EXPECT_THAT(againRecorder->initialPaths(),
              ElementsAre(applications("Missed.app"), applications("Notes.app")));
  landBundle(applications("Later.app"), storeApp("com.example.Later", 3));
  std::optional<RecordedUpdate> update = againRecorder->nextUpdate();
  ASSERT_TRUE(update.has_value());
  EXPECT_EQ(pathsOf(update->added), std::vector<std::string>{applications("Later.app")});
  EXPECT_TRUE(recorder->nothingPending());
  EXPECT_EQ(query->resultCount(), 1u);
}

TEST_F(MetadataQueryTest, MalformedQueryDoesNotStart) {
  for (const char* text : {"", "kHostItemVersion ==", "(a == 1", "a == 'x", "a & b", "!!"}) {
    auto query = MetadataQuery::create(text, valueAttributes());
    EXPECT_FALSE(query->start()) << text;
    EXPECT_FALSE(query->startError().empty()) << text;
    EXPECT_FALSE(query->isStarted());
  }
}

TEST_F(MetadataQueryTest, StartsOnlyOnce) {
  auto [query, recorder] = startQuery();
  EXPECT_FALSE(query->start());
  query->stop();
  EXPECT_FALSE(query->start());
}

TEST_F(MetadataQueryTest, StopEndsTheEvents) {
  auto [query, recorder] = startQuery();
  auto [witness, witnessRecorder] = startQuery();
  query->stop();
  query->stop();
  EXPECT_TRUE(query->isStopped());
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  // The query still running tells of it: the stopped one has had its chance.
  const RecordedUpdate seen = witnessRecorder->updatesUntilPath(applications("Notes.app"));
  EXPECT_EQ(pathsOf(seen.added), std::vector<std::string>{applications("Notes.app")});
  EXPECT_TRUE(recorder->nothingPending());
}

TEST_F(MetadataQueryTest, ReleasingAStartedQueryEndsIt) {
  std::weak_ptr<MetadataQuery> weak;
  auto queue = DispatchQueue::create("released", DispatchQueue::Kind::Serial);
  {
    auto query = MetadataQuery::create(kStoreQuery, valueAttributes(), fastOptions());
    query->setQueue(queue);
    ASSERT_TRUE(query->start());
    weak = query;
  }
  // A delivery in progress may hold the last reference for a moment.
  queue->sync([] {});
  EXPECT_TRUE(weak.expired());
}

TEST_F(MetadataQueryTest, TwoQueriesKeepTheirOwnItems) {
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  auto [first, firstRecorder] = startQuery();
  auto [second, secondRecorder] = startQuery();
  ASSERT_EQ(first->resultCount(), 1u);
  ASSERT_EQ(second->resultCount(), 1u);
  EXPECT_NE(first->resultAtIndex(0), second->resultAtIndex(0));
  fs::remove_all(applications("Notes.app"));
  EXPECT_TRUE(firstRecorder->nextUpdate().has_value());
  EXPECT_TRUE(secondRecorder->nextUpdate().has_value());
}

}  // namespace
}  // namespace larder
