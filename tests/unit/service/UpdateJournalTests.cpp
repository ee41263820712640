// The installed-updates journal: its file, the 30-day prune, the entries of
// app and OS updates, the confirmation of OS updates installed after a
// logout, changes from many threads, and a writer killed at random moments.
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <random>
#include <set>
#include <thread>

#include "ServiceTestSupport.h"
#include "platform/system/FileIO.h"
#include "update-queue/journal/UpdateJournal.h"

extern char** environ;

namespace larder::testing {
namespace {

constexpr double kDay = 86400;
// A fixed moment, so that ages at the edge of the limit are exact.
constexpr double kNow = 1'800'000'000;

PlistDate now() {
  return PlistDate{kNow};
}

PlistDictionary entryAged(double ageSeconds, std::string name) {
  return {{"title", std::move(name)}, {"installDate", PlistDate{kNow - ageSeconds}}};
}

std::vector<std::string> titles(const UpdateJournal::Entries& entries) {
  std::vector<std::string> names;
  for (const PlistDictionary& entry : entries) {
    // Looked up in the entry itself: a pointer into a temporary copy would
    // dangle once the copy goes.
    const auto found = entry.find("title");
    const std::string* title = found == entry.end() ? nullptr : found->second.string();
    names.push_back(title ? *title : "?");
  }
  return names;
}

SysupQuaymartUpdate osUpdate(const std::string& key, std::int64_t action,
                             std::vector<std::string> tags = {}) {
  return SysupQuaymartUpdate({.productKey = key,
                              .tags = std::move(tags),
                              .title = "Security " + key,
                              .versionString = "1." + std::to_string(action),
                              .longDescription = "Fixes for " + key,
                              .action = action});
}

class UpdateJournalTest : public ServiceTest {
 protected:
  // Below folders that do not exist yet.
  std::string path() const { return temporary() + "/data/larder/Quaymart/updatejournal.plist"; }

  void writeFile(const PlistValue& document) const {
    writeBytes(path(), PropertyListSerialization::writeBinary(document));
  }
  void writeEntries(const UpdateJournal::Entries& entries) const {
    writeFile(
        PlistDictionary{{"autoInstalledUpdates", PlistArray(entries.begin(), entries.end())}});
  }
  // The entries as the file holds them, unpruned.
  PlistArray fileEntries() const {
    Result<std::vector<std::uint8_t>> bytes = FileIO::read(path());
    if (!bytes) return {};
    const std::size_t head = std::min<std::size_t>(bytes->size(), 8);
    EXPECT_EQ(std::string(bytes->begin(), bytes->begin() + static_cast<std::ptrdiff_t>(head)),
              "bplist00");
    PlistValue document = PropertyListSerialization::read(*bytes).value_or(PlistValue());
    EXPECT_EQ(document.dictionary() ? document.dictionary()->size() : 0U, 1U);
    const PlistArray* entries = document["autoInstalledUpdates"].array();
    return entries ? *entries : PlistArray{};
  }

  void SetUp() override {
    ServiceTest::SetUp();
    journal_.emplace(path(), now);
  }

  std::optional<UpdateJournal> journal_;
};

TEST_F(UpdateJournalTest, TheWalkPrunesFromTheFrontAndStopsAtTheFirstRecentOrDatelessEntry) {
  struct Case {
    const char* what;
    UpdateJournal::Entries file;
    std::vector<std::string> kept;
  };
  const PlistDictionary dateless{{"title", "dateless"}};
  const Case cases[] = {
      {"30 days and one second goes", {entryAged(30 * kDay + 1, "old")}, {}},
      {"30 days exactly stays", {entryAged(30 * kDay, "edge")}, {"edge"}},
      {"29 days stays", {entryAged(29 * kDay, "recent")}, {"recent"}},
      {"a 40-day entry behind a 1-day entry stays",
       {entryAged(kDay, "new"), entryAged(40 * kDay, "behind")},
       {"new", "behind"}},
      {"the walk removes every stale entry up to the first recent one",
       {entryAged(50 * kDay, "a"), entryAged(31 * kDay, "b"), entryAged(2 * kDay, "c"),
        entryAged(45 * kDay, "d")},
       {"c", "d"}},
      {"an entry without a date stops the walk",
       {entryAged(40 * kDay, "a"), dateless, entryAged(40 * kDay, "b")},
       {"dateless", "b"}},
  };
  for (const Case& c : cases) {
    writeEntries(c.file);
    EXPECT_EQ(titles(journal_->installedUpdatesJournalIgnoringPendingUpdates(false)), c.kept)
        << c.what;
    EXPECT_EQ(fileEntries().size(), c.file.size()) << c.what << ": a read leaves the file alone";
  }
  // The next change writes the pruned list.
  writeEntries({entryAged(31 * kDay, "stale"), entryAged(kDay, "kept")});
  journal_->appendCriticalUpdates({entryAged(0, "added")});
  EXPECT_EQ(fileEntries().size(), 2U);
  EXPECT_EQ(titles(journal_->installedUpdatesJournal()),
            (std::vector<std::string>{"kept", "added"}));
}

TEST_F(UpdateJournalTest, OSUpdatesMakeEntriesExceptPartsOfABundleAndPendWithAction1Or2) {
  journal_->appendInstalledUpdates(
      {}, {osUpdate("A0", 0), osUpdate("A1", 1), osUpdate("A2", 2),
           osUpdate("B", 0, {"other:tag", "SysupBUNDLE:com.example.bundle"}), osUpdate("A3", 3)});

  const PlistArray file = fileEntries();
  ASSERT_EQ(file.size(), 4U) << "no entry for the part of a bundle";
  const std::string keys[] = {"A0", "A1", "A2", "A3"};
  const bool pending[] = {false, true, true, false};
  for (std::size_t i = 0; i < file.size(); ++i) {
    const PlistDictionary expected{
        {"title", "Security " + keys[i]},
        {"version", "1." + std::to_string(i)},
        {"release-notes", "Fixes for " + keys[i]},
        {"productKey", keys[i]},
        {"__isSoftwareUpdate", true},
        {"installDate", now()},
    };
    PlistDictionary withFlag = expected;
    if (pending[i]) withFlag["__postLogoutInstallPending"] = true;
    EXPECT_EQ(file[i], PlistValue(withFlag)) << keys[i];
  }
  std::vector<std::string> shown;
  for (const PlistDictionary& entry : journal_->installedUpdatesJournal()) {
    shown.push_back(*PlistValue(entry)["productKey"].string());
  }
  EXPECT_EQ(shown, (std::vector<std::string>{"A0", "A3"})) << "pending entries are not shown";
}

TEST_F(UpdateJournalTest, AnAppUpdateKeepsEveryKeyOfItsRecordAndAnEmptySlotIsLoggedAndSkipped) {
  LedgerUpdateRef update = LedgerUpdate::initWithDictionary(
      {{"ware-id", 901}, {"bundle-id", "com.example.Atlas"}, {"title", "Atlas"}, {"x-odd", 7}});
  ASSERT_NE(update, nullptr);
  update->setIsStaged(true);
  LogCapture log;
  journal_->appendInstalledUpdates({nullptr, update}, {osUpdate("A0", 0)});

  EXPECT_TRUE(log.hasOnce(
      "UpdateJournal: appendInstalledUpdatesToJournal: unknown update object (null)", 1));
  const UpdateJournal::Entries entries = journal_->installedUpdatesJournal();
  ASSERT_EQ(entries.size(), 2U) << "the other updates of the list are written";
  PlistDictionary expected = update->dictionary();
  expected["installDate"] = now();
  EXPECT_EQ(entries[0], expected);
  EXPECT_EQ(PlistValue(entries[1])["productKey"], PlistValue("A0"));
}

TEST_F(UpdateJournalTest, ConfirmingKeepsTheNewestPendingEntryOfAReportedProductAndDropsTheRest) {
  auto pending = [](const std::string& title, std::optional<std::string> key, double age) {
    PlistDictionary entry = entryAged(age, title);
    entry["__isSoftwareUpdate"] = true;
    entry["__postLogoutInstallPending"] = true;
    if (key) entry["productKey"] = *key;
    return entry;
  };
  writeEntries({pending("A earlier", "A", 5 * kDay), entryAged(4 * kDay, "app"),
                pending("unnamed", std::nullopt, 3 * kDay), pending("A later", "A", 2 * kDay),
                pending("C", "C", kDay), entryAged(0.5 * kDay, "app 2")});
  LogCapture log;
  journal_->confirmPendingUpdates({"A", "B"});

  const auto confirming = log.linesContaining(
      "UpdateJournal: Confirming pending updates in journal with "
      "installedProductKeys = ");
  ASSERT_EQ(confirming.size(), 1U) << log.dump();
  EXPECT_NE(confirming[0].text.find("\"B\""), std::string::npos) << confirming[0].text;
  EXPECT_EQ(log.countContaining("UpdateJournal: Removed pending post-logout update from journal: "),
            2U)
      << "the unnamed one and C, which the report did not name";
  EXPECT_EQ(log.linesContaining("Skipping pending post-logout update in journal since it's a "
                                "duplicate: ")
                .size(),
            1U);
  EXPECT_EQ(log.linesContaining("A earlier").size(), 1U) << "the earlier one is the duplicate";
  ASSERT_EQ(log.countContaining("UpdateJournal: Confirmed pending post-logout update in journal: "),
            1U);
  EXPECT_NE(log.linesContaining("Confirmed pending")[0].text.find("A later"), std::string::npos);

  const PlistArray file = fileEntries();
  ASSERT_EQ(titles(journal_->installedUpdatesJournalIgnoringPendingUpdates(false)),
            (std::vector<std::string>{"app", "app 2", "A later"}))
      << "confirmed entries go to the end";
  EXPECT_FALSE(file[2].dictionary()->contains("__postLogoutInstallPending"));
  EXPECT_EQ(file[2]["installDate"], PlistValue(PlistDate{kNow - 2 * kDay}))
      << "it keeps the date of the request";
  EXPECT_EQ(titles(journal_->installedUpdatesJournal()).size(), 3U) << "now shown";
}

TEST_F(UpdateJournalTest, AnAppendKeepsPendingEntriesForTheConfirmationAfterTheLogout) {
  journal_->appendInstalledUpdates({}, {osUpdate("LOGOUT", 1)});
  journal_->appendCriticalUpdates({entryAged(0, "silent")});
  journal_->appendInstalledUpdates({}, {osUpdate("NOW", 0)});
  EXPECT_EQ(fileEntries().size(), 3U);
  EXPECT_EQ(titles(journal_->installedUpdatesJournal()),
            (std::vector<std::string>{"silent", "Security NOW"}));
  journal_->confirmPendingUpdates({"LOGOUT"});
  EXPECT_EQ(titles(journal_->installedUpdatesJournal()),
            (std::vector<std::string>{"silent", "Security NOW", "Security LOGOUT"}));
}

TEST_F(UpdateJournalTest, AMissingFileIsEmptyAndTheFirstAppendMakesItsFolders) {
  ASSERT_FALSE(fs::exists(temporary() + "/data"));
  EXPECT_TRUE(journal_->installedUpdatesJournal().empty());
  EXPECT_FALSE(fs::exists(temporary() + "/data")) << "a read makes nothing";
  journal_->appendCriticalUpdates({entryAged(0, "first")});
  EXPECT_EQ(fileEntries().size(), 1U);

  // The process's journal lives below the user's data folder.
  EXPECT_EQ(UpdateJournal::sharedJournal().path(),
            temporary() + "/data/larder/Quaymart/updatejournal.plist");
  ::setenv("XDG_DATA_HOME", (temporary() + "/elsewhere").c_str(), 1);
  EXPECT_EQ(UpdateJournal::sharedJournal().path(),
            temporary() + "/elsewhere/larder/Quaymart/updatejournal.plist")
      << "looked up at each use";
}

// The version written here is kept in memory, and the file's identity
// decides whether it is still the file's: a replacement by another process
// (new inode) or a rewrite in place of another size is read again, while a
// file whose identity is unchanged is not parsed at all.
TEST_F(UpdateJournalTest, TheKeptVersionAnswersOnlyWhileTheFileIsTheOneWrittenHere) {
  journal_->appendCriticalUpdates({entryAged(kDay, "ours")});
  ASSERT_EQ(titles(journal_->installedUpdatesJournal()), std::vector<std::string>{"ours"});

  // Garbage of the same size in place, its modification time put back: the
  // identity is the one written here, so the kept entries answer.
  const std::optional<FileIdentity> written = FileIO::identity(path());
  ASSERT_TRUE(written);
  struct stat status {};
  ASSERT_EQ(::stat(path().c_str(), &status), 0);
  writeText(path(), std::string(written->size, 'x'));
  const timespec times[2] = {status.st_atim, status.st_mtim};
  ASSERT_EQ(::utimensat(AT_FDCWD, path().c_str(), times, 0), 0);
  ASSERT_EQ(FileIO::identity(path()), written);
  LogCapture log;
  EXPECT_EQ(titles(journal_->installedUpdatesJournal()), std::vector<std::string>{"ours"});
  EXPECT_EQ(log.countContaining("does not parse", 1), 0U) << "not parsed again";

  // Another process replaces the file with the same number of entries.
  const std::string replacement = path() + ".other";
  writeBytes(replacement, PropertyListSerialization::writeBinary(PlistDictionary{
                              {"autoInstalledUpdates", PlistArray{entryAged(kDay, "theirs")}}}));
  fs::rename(replacement, path());
  EXPECT_EQ(titles(journal_->installedUpdatesJournal()), std::vector<std::string>{"theirs"});
  journal_->appendCriticalUpdates({entryAged(0, "next")});
  EXPECT_EQ(titles(journal_->installedUpdatesJournal()),
            (std::vector<std::string>{"theirs", "next"}))
      << "a change starts from the file's version";

  // A rewrite in place that keeps the inode but not the size.
  writeEntries({entryAged(kDay, "rewritten in place"), entryAged(0, "by another writer")});
  EXPECT_EQ(titles(journal_->installedUpdatesJournal()),
            (std::vector<std::string>{"rewritten in place", "by another writer"}));
}

TEST_F(UpdateJournalTest, AFileThatDoesNotParseOrHasAnotherShapeCountsAsEmpty) {
  const PlistValue damaged[] = {
      PlistValue(PlistArray{entryAged(0, "in an array")}),
      PlistValue(PlistDictionary{{"autoInstalledUpdates", "not a list"}}),
      PlistValue(PlistDictionary{{"otherKey", PlistArray{entryAged(0, "other key")}}}),
  };
  for (const PlistValue& document : damaged) {
    writeFile(document);
    EXPECT_TRUE(journal_->installedUpdatesJournalIgnoringPendingUpdates(false).empty());
  }
  writeText(path(), "bplist00 but cut short");
  LogCapture log;
  EXPECT_TRUE(journal_->installedUpdatesJournal().empty());
  EXPECT_EQ(log.countContaining("does not parse and counts as empty", 1), 1U) << log.dump();
  journal_->appendCriticalUpdates({entryAged(0, "alone")});
  EXPECT_EQ(titles(journal_->installedUpdatesJournal()), std::vector<std::string>{"alone"})
      << "the next append replaces it with its own entries";
}

TEST_F(UpdateJournalTest, AppendsFromManyThreadsLoseNothing) {
  constexpr int kThreads = 6;
  constexpr int kAppendsEach = 20;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([this, t] {
      for (int i = 0; i < kAppendsEach; ++i) {
        const std::string name = std::to_string(t) + "/" + std::to_string(i);
        if (i % 2 == 0) {
          journal_->appendCriticalUpdates({entryAged(0, name)});
        } else {
          SysupQuaymartUpdate update = osUpdate(name, 0);
          journal_->appendInstalledUpdates({}, {update});
        }
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  const std::vector<std::string> names = titles(journal_->installedUpdatesJournal());
  const std::set<std::string> distinct(names.begin(), names.end());
  EXPECT_EQ(names.size(), std::size_t{kThreads * kAppendsEach});
  EXPECT_EQ(distinct.size(), names.size());
}

// A process that appends to the journal at `path` until it is killed,
// printing the number of entries after each append.
#ifndef LARDER_JOURNAL_APPENDER_PATH
#error "the kill test needs the appender program: define LARDER_JOURNAL_APPENDER_PATH"
#endif

class Appender {
 public:
  explicit Appender(const std::string& journalPath) {
    int pipeEnds[2];
    if (::pipe2(pipeEnds, O_CLOEXEC) != 0) throw std::runtime_error("pipe");
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, pipeEnds[1], STDOUT_FILENO);
    std::string program = LARDER_JOURNAL_APPENDER_PATH;
    std::string argument = journalPath;
    char* argv[] = {program.data(), argument.data(), nullptr};
    const int spawned = ::posix_spawn(&pid_, program.c_str(), &actions, nullptr, argv, environ);
    posix_spawn_file_actions_destroy(&actions);
    ::close(pipeEnds[1]);
    output_ = pipeEnds[0];
    if (spawned != 0) throw std::runtime_error("spawn " + program);
  }
  ~Appender() {
    if (pid_ > 0) kill();
    ::close(output_);
  }
  Appender(const Appender&) = delete;
  Appender& operator=(const Appender&) = delete;

  // Reads the count the appender printed after its first append.
  long firstCount() {
    std::string line;
    char c = 0;
    while (::read(output_, &c, 1) == 1 && c != '\n') line += c;
    return line.empty() ? -1 : std::stol(line);
  }
  // Kills it and gives the last count it printed (-1 for none).
  long kill() {
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
    pid_ = -1;
    std::string text;
    char buffer[4096];
    for (ssize_t n; (n = ::read(output_, buffer, sizeof buffer)) > 0;) text.append(buffer, n);
    const std::size_t end = text.rfind('\n');
    if (end == std::string::npos) return -1;
    const std::size_t start = text.rfind('\n', end - 1);
    const std::size_t from = start == std::string::npos ? 0 : start + 1;
    return std::stol(text.substr(from, end - from));
  }

 private:
  pid_t pid_ = -1;
  int output_ = -1;
};

TEST_F(UpdateJournalTest, AWriterKilledAtAnyMomentLeavesAFileThatParsesLosingAtMostItsLastChange) {
  std::minstd_rand random(20261126);
  UpdateJournal reader(path());
  std::size_t entries = 0;
  int roundsWithAppends = 0;
  for (int round = 0; round < 60; ++round) {
    Appender appender(path());
    long confirmed = -1;
    // Half the kills come at once, in the middle of the first read or
    // write; the others once the appender is under way.
    if (round % 2 == 1) {
      confirmed = appender.firstCount();
      ASSERT_GT(confirmed, 0) << "round " << round;
      std::this_thread::sleep_for(std::chrono::microseconds(random() % 20000));
    }
    confirmed = std::max(confirmed, appender.kill());
    if (confirmed > 0) ++roundsWithAppends;

    // The file parses, and holds every entry up to the last one the
    // appender saw written, in order, plus at most the one under way.
    const PlistArray file = fileEntries();
    const std::vector<std::string> names = titles(reader.installedUpdatesJournal());
    ASSERT_EQ(names.size(), file.size()) << "round " << round;
    for (std::size_t i = 0; i < names.size(); ++i) {
      ASSERT_EQ(names[i], std::to_string(i)) << "round " << round;
    }
    const auto counted = static_cast<long>(names.size());
    if (confirmed > 0) {
      EXPECT_GE(counted, confirmed) << "round " << round;
    }
    EXPECT_LE(counted, std::max(confirmed, static_cast<long>(entries)) + 1) << "round " << round;
    EXPECT_GE(names.size(), entries) << "round " << round << ": an earlier entry was lost";
    entries = names.size();
  }
  EXPECT_GE(roundsWithAppends, 30) << "kills while the appender was under way";
  EXPECT_GE(entries, static_cast<std::size_t>(roundsWithAppends))
      << "each of those rounds kept at least the append it reported";
  // A killed writer's temporary goes at the next write, so they never pile up.
  std::size_t temporaries = 0;
  for (const auto& item : fs::directory_iterator(fs::path(path()).parent_path())) {
    if (item.path().filename().string().starts_with("updatejournal.plist.tmp-")) ++temporaries;
  }
  EXPECT_LE(temporaries, 1U);
}

}  // namespace
}  // namespace larder::testing
