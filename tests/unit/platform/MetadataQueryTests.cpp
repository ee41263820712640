#include "platform/metadata/MetadataQuery.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <filesystem>
#include <fstream>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "platform/dispatch/DispatchQueue.h"
#include "platform/metadata/MetadataAttributes.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "tests/unit/platform/TemporaryFolderTest.h"

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

// What an update told, as one line: "+path" for each item added, "~path" for each changed and
// "-path" for each removed.
std::string told(const RecordedUpdate& update) {
  std::string text;
  for (const auto& [sign, items] : {std::pair{'+', &update.added}, std::pair{'~', &update.changed},
                                    std::pair{'-', &update.removed}}) {
    for (const RecordedItem& item : *items)
      text += (text.empty() ? "" : " ") + (sign + item.path());
  }
  return text;
}

// Listens to one query on a serial queue of its own and lets the test wait for what comes.
class QueryRecorder {
 public:
  explicit QueryRecorder(const std::shared_ptr<MetadataQuery>& query)
      : queue_(DispatchQueue::create("MetadataQueryTests", DispatchQueue::Kind::Serial)) {
    query->setQueue(queue_);
    query->setHandlers({
        [this](MetadataQuery& q) {
          std::vector<std::string> paths;
          for (std::size_t index = 0; index < q.resultCount(); ++index) {
            paths.push_back(q.resultAtIndex(index)->path());
          }
          std::sort(paths.begin(), paths.end());
          record([&] {
            initialPaths_ = std::move(paths);
            finished_ = true;
          });
        },
        [this](MetadataQuery&, const MetadataQueryUpdate& update) {
          RecordedUpdate entry{recorded(update.added), recorded(update.changed),
                               recorded(update.removed)};
          record([&] { updates_.push_back(std::move(entry)); });
        },
        [this](MetadataQuery&) { record([&] { ++portInvalidCount_; }); },
    });
  }

  // Waits for what is queued for the handlers to run.
  void drain() {
    queue_->sync([] {});
  }

  bool waitForFinished() {
    return waitFor([this] { return finished_; });
  }
  bool waitForPortInvalid() {
    return waitFor([this] { return portInvalidCount_ > 0; });
  }

  // The next update, or an empty one (and a failure) when none comes.
  RecordedUpdate next() {
    std::optional<RecordedUpdate> update = nextUpdate();
    if (!update) ADD_FAILURE() << "no update came";
    return update.value_or(RecordedUpdate{});
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

  // Nothing more has been told so far; call it once the query has shown,
  // by a later event, that it has taken up what came before.
  bool nothingPending() {
    drain();
    return !nextUpdate(0ms).has_value();
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

  // Takes a change in under the lock, noting whether the handler ran on the queue.
  template <typename Change>
  void record(Change change) {
    std::lock_guard lock(mutex_);
    allOnQueue_ = allOnQueue_ && queue_->isCurrent();
    change();
    changed_.notify_all();
  }

  template <typename Condition>
  bool waitFor(Condition condition) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, kEventTimeout, condition);
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

class MetadataQueryTest : public TemporaryFolderTest {
 protected:
  void SetUp() override {
    TemporaryFolderTest::SetUp();
    makeRootAndHome();
    staging_ = base_ + "/staging";
    for (const std::string& folder : {root_ + "/Applications", home_ + "/Applications", staging_}) {
      fs::create_directories(folder);
    }
  }

  void TearDown() override {
    for (auto& [query, recorder] : queries_) {
      query->stop();
      recorder->drain();
    }
    queries_.clear();
    TemporaryFolderTest::TearDown();
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
    EXPECT_EQ(told(recorder.updatesUntilPath(marker)), "+" + marker);
  }

  static BundleContents version(BundleContents contents, std::string text) {
    contents.version = std::move(text);
    return contents;
  }

  static BundleContents storeApp(std::string identifier, std::int64_t wareID = 401000001) {
    return {std::move(identifier), "1.0", wareID};
  }

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
  BundleContents notes = version(storeApp("com.example.Notes", 401000009), "2.5");
  notes.installerVersionID = 33;
  writeBundle(applications("Notes.app"), notes);
  auto [query, recorder] = startQuery();
  ASSERT_EQ(query->resultCount(), 1u);
  ItemRef item = query->resultAtIndex(0);
  ASSERT_NE(item, nullptr);
  EXPECT_EQ(query->indexOfResult(item.get()), 0u);
  PlistArray values;
  for (const std::string& name : valueAttributes()) {
    values.push_back(query->valueOfAttribute(name, 0));
  }
  EXPECT_EQ(PlistValue(values), PlistValue(PlistArray{401000009.0, 33, "com.example.Notes", "2.5",
                                                      "account-7", PlistDate{1700000000}}));
  EXPECT_EQ(MetadataQuery::attributeOfItem(*item, "kHostItemPath"),
            PlistValue(applications("Notes.app")));
  EXPECT_TRUE(query->valueOfAttribute("kHostItemVersion", 1).isNull());
  EXPECT_EQ(query->resultAtIndex(1), nullptr);
  MetadataItem* stranger = nullptr;
  EXPECT_EQ(query->indexOfResult(stranger), std::nullopt);
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
  const RecordedUpdate update = recorder->next();
  ASSERT_EQ(told(update), "+" + path);
  EXPECT_EQ(update.added[0].attributes.at("kHostItemHostBundleIdentifier"),
            PlistValue("com.example.Notes"));
  EXPECT_EQ(update.added[0].attributes.at("kHostItemVersion"), PlistValue("1.0"));
  expectOnlyAMarkerNext(*recorder);
}

TEST_F(MetadataQueryTest, BundleThatNeverGetsItsInformationListArrivesAfterTheLimit) {
  auto [query, recorder] = startQuery();
  const std::string path = applications("Broken.app");
  fs::create_directories(path);
  writePlist(path + "/purchase.plist", purchaseFor(storeApp("com.example.Broken")));
  const RecordedUpdate update = recorder->next();
  ASSERT_EQ(told(update), "+" + path);
  EXPECT_EQ(update.added[0].attributes.count("kHostItemHostBundleIdentifier"), 0u);
  EXPECT_EQ(update.added[0].attributes.at("kHostItemQuaymartHasPurchaseRecord"), PlistValue(1));
}

// Each edit of a property list the attributes come from is one change of the same item. (Replacing
// the purchase record is checked end to end by the service tests.)
TEST_F(MetadataQueryTest, EditingEitherPropertyListIsAChangeAndOtherFilesAreNone) {
  const std::string notes = applications("Notes.app");
  landBundle(notes, storeApp("com.example.Notes"));
  auto [query, recorder] = startQuery();
  ASSERT_EQ(query->resultCount(), 1u);
  const ItemRef item = query->resultAtIndex(0);
  BundleContents updated = storeApp("com.example.Notes");
  struct Edit {
    const char* name;
    std::function<void()> make;
    const char* attribute;
    PlistValue value;
  };
  const std::vector<Edit> edits{
      {"purchase record rewritten in place",
       [&] {
         updated.installerVersionID = 3;
         std::ofstream(notes + "/purchase.plist", std::ios::trunc)
             << PropertyListSerialization::writeXml(purchaseFor(updated));
       },
       "kHostItemQuaymartInstallerVersionID", 3},
      {"information list replaced",
       [&] {
         writePlist(notes + "/bundle.plist",
                    {{"HostBundleIdentifier", "com.example.Notes"}, {"HostBundleVersion", "9"}});
       },
       "kHostItemVersion", "9"},
  };
  for (const Edit& edit : edits) {
    SCOPED_TRACE(edit.name);
    edit.make();
    const RecordedUpdate update = recorder->next();
    ASSERT_EQ(told(update), "~" + notes);
    EXPECT_EQ(update.changed[0].item, item);
    EXPECT_EQ(update.changed[0].attributes.at(edit.attribute), edit.value);
    EXPECT_EQ(query->valueOfAttribute(edit.attribute, 0), edit.value);
  }
  std::ofstream(applications("Notes.app/resources/icon.png")) << "picture";
  fs::create_directories(applications("Notes.app/bin"));
  // Rewriting the record with the same contents changes no attribute either.
  writePlist(notes + "/purchase.plist", purchaseFor(updated));
  expectOnlyAMarkerNext(*recorder);
}

TEST_F(MetadataQueryTest, DeletingABundleOrMovingItOutOfTheScopeRemovesItsItem) {
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  landBundle(applications("Other.app"), storeApp("com.example.Other", 7));
  auto [query, recorder] = startQuery();
  ASSERT_EQ(query->resultCount(), 2u);
  const ItemRef notes = query->resultAtIndex(0)->path() == applications("Notes.app")
                            ? query->resultAtIndex(0)
                            : query->resultAtIndex(1);
  fs::remove_all(applications("Notes.app"));
  const RecordedUpdate update = recorder->next();
  ASSERT_EQ(told(update), "-" + applications("Notes.app"));
  EXPECT_EQ(update.removed[0].item, notes);
  EXPECT_EQ(query->resultCount(), 1u);
  EXPECT_EQ(query->indexOfResult(notes.get()), std::nullopt);
  EXPECT_EQ(query->resultAtIndex(0)->path(), applications("Other.app"));
  EXPECT_EQ(query->indexOfResult(query->resultAtIndex(0).get()), 0u);

  fs::rename(applications("Other.app"), staging_ + "/Other.app");
  EXPECT_EQ(told(recorder->next()), "-" + applications("Other.app"));
  EXPECT_EQ(query->resultCount(), 0u);
}

// Moved to another folder, renamed in place, and moved into a folder the query has not seen
// yet (it learns of the folder and the bundle in one go): still the same item.
TEST_F(MetadataQueryTest, MovingABundleWithinTheScopeKeepsTheItem) {
  std::string path = applications("Notes.app");
  landBundle(path, storeApp("com.example.Notes"));
  auto [query, recorder] = startQuery();
  const ItemRef item = query->resultAtIndex(0);
  for (const auto& [to, inNewFolder] : {std::pair{home_ + "/Applications/Notes.app", false},
                                        std::pair{home_ + "/Applications/Jotter.app", false},
                                        std::pair{applications("Office/Jotter.app"), true}}) {
    if (inNewFolder) fs::create_directories(fs::path(to).parent_path());
    fs::rename(path, to);
    path = to;
    const RecordedUpdate update = recorder->next();
    ASSERT_EQ(told(update), "~" + path);
    EXPECT_EQ(update.changed[0].item, item);
    EXPECT_EQ(item->path(), path);
    EXPECT_EQ(query->resultCount(), 1u);
  }
}

// A bundle replaced by another one at its path, or deleted and made again (the new folder often
// gets the old one's inode) at its path or at another, is a removal and an addition of a new
// item. At the same path the successor is also told as changed once it has settled.
TEST_F(MetadataQueryTest, ReplacedBundleIsANewItem) {
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  auto [query, recorder] = startQuery();
  const auto replaced = [&](const std::string& path) {
    writeBundle(staging_ + "/Notes.app", version(storeApp("com.example.Notes"), "replaced"));
    fs::rename(path, staging_ + "/Old.app");
    fs::rename(staging_ + "/Notes.app", path);
    return path;
  };
  const auto madeAgainAt = [&](const std::string& name) {
    return [&, name](const std::string& path) {
      fs::remove_all(path);
      writeBundle(applications(name), version(storeApp("com.example.Notes"), name));
      return applications(name);
    };
  };
  const std::vector<std::pair<std::string, std::function<std::string(const std::string&)>>> ways{
      {"replaced", replaced},
      {"Notes.app", madeAgainAt("Notes.app")},
      {"Jotter.app", madeAgainAt("Jotter.app")}};
  for (const auto& [label, replace] : ways) {
    SCOPED_TRACE(label);
    const ItemRef old = query->resultAtIndex(0);
    ASSERT_NE(old, nullptr);
    const std::string oldPath = old->path();
    const std::string path = replace(oldPath);
    const RecordedUpdate merged =
        recorder->updatesUntil([](const RecordedUpdate& update) { return !update.added.empty(); });
    EXPECT_THAT(merged.changed, IsEmpty());
    ASSERT_EQ(merged.removed.size(), 1u);
    EXPECT_EQ(merged.removed[0].item, old);
    ASSERT_EQ(merged.added.size(), 1u);
    EXPECT_NE(merged.added[0].item, old);
    EXPECT_EQ(merged.added[0].path(), path);
    EXPECT_EQ(merged.added[0].attributes.at("kHostItemVersion"), PlistValue(label));
    ASSERT_EQ(query->resultCount(), 1u);
    if (path == oldPath) {
      const RecordedUpdate settled = recorder->next();
      ASSERT_EQ(told(settled), "~" + path);
      EXPECT_EQ(settled.changed[0].item, merged.added[0].item);
      EXPECT_EQ(settled.changed[0].attributes.at("kHostItemVersion"), PlistValue(label));
    }
  }
}

TEST_F(MetadataQueryTest, PurchaseRecordComingAndGoingAddsAndRemoves) {
  writeBundle(applications("Plain.app"), {"com.example.Plain"});
  auto [query, recorder] = startQuery();
  EXPECT_EQ(query->resultCount(), 0u);
  writePlist(applications("Plain.app/purchase.plist"), purchaseFor(storeApp("com.example.Plain")));
  const RecordedUpdate added = recorder->next();
  ASSERT_EQ(told(added), "+" + applications("Plain.app"));
  fs::remove(applications("Plain.app/purchase.plist"));
  const RecordedUpdate removed = recorder->next();
  ASSERT_EQ(told(removed), "-" + applications("Plain.app"));
  EXPECT_EQ(removed.removed[0].item, added.added[0].item);
  EXPECT_EQ(query->resultCount(), 0u);
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
  EXPECT_EQ(told(recorder->next()), "-" + applications("Good.app"));
  landBundle(applications("Later.app"), storeApp("com.example.Later"));
  EXPECT_EQ(told(recorder->next()), "+" + applications("Later.app"));
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
  EXPECT_EQ(told(recorder->updatesUntilPath(applications("After.app"))),
            "+" + applications("After.app"));
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
  writeBundle(staging_ + "/Games/Chess.app", storeApp("com.example.Chess"));
  writeBundle(staging_ + "/Games/Go.app", storeApp("com.example.Go", 2));
  fs::rename(staging_ + "/Games", applications("Games"));
  // The whole folder went while its first bundle was being read: nothing stays.
  expectOnlyAMarkerNext(*recorder);
  EXPECT_EQ(query->resultCount(), 1u);
}

// Each step is seen before the next is taken.
TEST_F(MetadataQueryTest, NewVolumesAndFoldersAreWatched) {
  fs::remove(home_ + "/Applications");
  auto [query, recorder] = startQuery();
  const auto expectToldOf = [&](const std::string& path, const std::string& expected) {
    EXPECT_EQ(told(recorder->updatesUntilPath(path)), expected);
  };
  // The home folder's application folder appears later.
  writeBundle(staging_ + "/Applications/Mine.app", storeApp("com.example.Mine", 4));
  fs::rename(staging_ + "/Applications", home_ + "/Applications");
  expectToldOf(home_ + "/Applications/Mine.app", "+" + home_ + "/Applications/Mine.app");
  // The volumes folder itself appears, with a volume in it.
  const std::string far = root_ + "/Volumes/Disk/Applications/Far.app";
  writeBundle(staging_ + "/Volumes/Disk/Applications/Far.app", storeApp("com.example.Far"));
  fs::rename(staging_ + "/Volumes", root_ + "/Volumes");
  expectToldOf(far, "+" + far);
  // A second volume, then an application folder made on an empty volume.
  const std::string near = root_ + "/Volumes/Two/Applications/Near.app";
  writeBundle(staging_ + "/Two/Applications/Near.app", storeApp("com.example.Near", 2));
  fs::rename(staging_ + "/Two", root_ + "/Volumes/Two");
  expectToldOf(near, "+" + near);
  fs::create_directories(root_ + "/Volumes/Three");
  expectOnlyAMarkerNext(*recorder);
  fs::create_directories(root_ + "/Volumes/Three/Applications");
  expectOnlyAMarkerNext(*recorder);
  const std::string mid = root_ + "/Volumes/Three/Applications/Mid.app";
  landBundle(mid, storeApp("com.example.Mid", 3));
  expectToldOf(mid, "+" + mid);
  // A volume going takes its bundles with it.
  fs::rename(root_ + "/Volumes/Two", staging_ + "/Two");
  expectToldOf(near, "-" + near);
  EXPECT_EQ(query->resultCount(), 5u) << "Mine, Far, Mid and the two markers";
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
  EXPECT_EQ(told(againRecorder->next()), "+" + applications("Later.app"));
  EXPECT_TRUE(recorder->nothingPending());
  EXPECT_EQ(query->resultCount(), 1u);
}

TEST_F(MetadataQueryTest, MalformedQueryDoesNotStartAndAQueryStartsOnlyOnce) {
  for (const char* text : {"", "kHostItemVersion ==", "(a == 1", "a == 'x", "a & b", "!!"}) {
    auto query = MetadataQuery::create(text, valueAttributes());
    EXPECT_FALSE(query->start()) << text;
    EXPECT_FALSE(query->startError().empty()) << text;
    EXPECT_FALSE(query->isStarted());
  }
  auto [query, recorder] = startQuery();
  EXPECT_FALSE(query->start());
  query->stop();
  EXPECT_FALSE(query->start());
}

// Two queries keep their own items and both tell of what happens, until one is stopped.
TEST_F(MetadataQueryTest, QueriesKeepTheirOwnItemsAndStopEndsTheEvents) {
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  auto [query, recorder] = startQuery();
  auto [witness, witnessRecorder] = startQuery();
  ASSERT_EQ(query->resultCount(), 1u);
  ASSERT_EQ(witness->resultCount(), 1u);
  EXPECT_NE(query->resultAtIndex(0), witness->resultAtIndex(0));
  fs::remove_all(applications("Notes.app"));
  EXPECT_EQ(told(recorder->next()), "-" + applications("Notes.app"));
  EXPECT_EQ(told(witnessRecorder->next()), "-" + applications("Notes.app"));

  query->stop();
  query->stop();
  EXPECT_TRUE(query->isStopped());
  landBundle(applications("Notes.app"), storeApp("com.example.Notes"));
  // The query still running tells of it: the stopped one has had its chance.
  EXPECT_EQ(told(witnessRecorder->updatesUntilPath(applications("Notes.app"))),
            "+" + applications("Notes.app"));
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

}  // namespace
}  // namespace larder
