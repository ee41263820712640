// Shared scaffolding of the service tests: a private platform tree per
// test, bundles written to disk, captured log lines and a recording
// observer.
#pragma once

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "platform/log/TillLogManager.h"
#include "platform/plist/KeyedArchive.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/value/PlistValue.h"
#include "software-map/SoftwareMap.h"
#include "software-map/VendSoftwareMapObserver.h"
#include "store-runtime/records/LedgerSoftwareProduct.h"
#include "tests/unit/ScopedEnvironment.h"

namespace larder::testing {

namespace fs = std::filesystem;

// Polls `condition` for up to ten seconds; whether it came true.
template <typename Condition>
bool eventually(Condition condition) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return true;
}

// Every line the log writes while the capture lives.
class LogCapture {
 public:
  struct Line {
    int level;
    std::string text;
  };

  LogCapture() {
    handle_ = TillLogManager::sharedManager().addSink([this](int level, const std::string& line) {
      std::lock_guard lock(mutex_);
      lines_.push_back({level, line});
    });
  }
  void clear() {
    std::lock_guard lock(mutex_);
    lines_.clear();
  }
  // Lines equal to / holding `text`, at `level` (any level when 0).
  [[nodiscard]] std::size_t countExactly(std::string_view text, int level = 0) const {
    return linesWhere([&](const Line& l) { return l.text == text; }, level).size();
  }
  [[nodiscard]] std::size_t countContaining(std::string_view fragment, int level = 0) const {
    return linesContaining(fragment, level).size();
  }
  [[nodiscard]] std::vector<Line> linesContaining(std::string_view fragment, int level = 0) const {
    return linesWhere([&](const Line& l) { return l.text.find(fragment) != l.text.npos; }, level);
  }
  // Exactly one line equal to `text`; on failure the message shows the log.
  [[nodiscard]] ::testing::AssertionResult hasOnce(std::string_view text, int level = 0) const {
    const std::size_t count = countExactly(text, level);
    if (count == 1) return ::testing::AssertionSuccess();
    return ::testing::AssertionFailure() << count << " lines \"" << text << "\" in:\n" << dump();
  }
  [[nodiscard]] std::string dump() const {
    std::string text;
    for (const Line& line : linesWhere([](const Line&) { return true; }, 0))
      text += "[" + std::to_string(line.level) + "] " + line.text + "\n";
    return text;
  }

 private:
  template <typename Predicate>
  std::vector<Line> linesWhere(Predicate predicate, int level) const {
    std::lock_guard lock(mutex_);
    std::vector<Line> found;
    for (const Line& line : lines_) {
      if (predicate(line) && (level == 0 || line.level == level)) found.push_back(line);
    }
    return found;
  }

  mutable std::mutex mutex_;
  std::vector<Line> lines_;
  std::shared_ptr<void> handle_;
};

// Collects observer calls from whatever thread delivers them.
class RecordingObserver final : public VendSoftwareMapObserver {
 public:
  struct Call {
    LedgerSoftwareProductRef product;
    std::int64_t state;
    LedgerSoftwareProductFields fieldsAtCall;
  };

  void softwareProductUpdatedState(const LedgerSoftwareProductRef& product,
                                   std::int64_t state) override {
    LedgerSoftwareProductFields fields =
        product ? product->snapshot() : LedgerSoftwareProductFields{};
    std::lock_guard lock(mutex_);
    calls_.push_back({product, state, std::move(fields)});
  }

  [[nodiscard]] std::vector<Call> calls() const {
    std::lock_guard lock(mutex_);
    return calls_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<Call> calls_;
};

// The fields a purchase record is written with; absent ones are left out.
struct Purchase {
  std::optional<std::string> bundleIdentifier;
  std::optional<std::string> bundleVersion;
  PlistValue wareID;
  PlistValue installerVersionID;
  std::optional<std::string> account;
  std::optional<double> purchaseDate;  // whole seconds since 1970

  [[nodiscard]] PlistDictionary toDictionary() const {
    PlistDictionary dictionary;
    if (bundleIdentifier) dictionary.emplace("bundleIdentifier", *bundleIdentifier);
    if (bundleVersion) dictionary.emplace("bundleVersion", *bundleVersion);
    if (!wareID.isNull()) dictionary.emplace("wareID", wareID);
    if (!installerVersionID.isNull()) dictionary.emplace("installerVersionID", installerVersionID);
    if (account) dictionary.emplace("opaqueAccountIDString", *account);
    if (purchaseDate) dictionary.emplace("purchaseDate", PlistDate{*purchaseDate});
    return dictionary;
  }
};

// Plain writes: the fixtures need no crash safety.
inline void writeText(const std::string& path, std::string_view text) {
  fs::create_directories(fs::path(path).parent_path());
  std::ofstream file(path, std::ios::binary | std::ios::trunc);
  file.write(text.data(), static_cast<std::streamsize>(text.size()));
  file.close();
  ASSERT_TRUE(file) << "cannot write " << path;
}

inline void writeBytes(const std::string& path, const PlistData& bytes) {
  writeText(path, std::string_view(reinterpret_cast<const char*>(bytes.data()), bytes.size()));
}

inline void writePlist(const std::string& path, const PlistValue& value) {
  writeText(path, PropertyListSerialization::writeXml(value));
}

// A test's own platform tree, home, caches and state folder below a fresh
// temporary folder. The variables are put back as they were afterwards.
class ServiceTest : public ::testing::Test {
 protected:
  static constexpr const char* kVariables[] = {
      "LARDER_ROOT",     "HOME",          "XDG_CACHE_HOME",         "XDG_STATE_HOME",
      "XDG_CONFIG_HOME", "XDG_DATA_HOME", "__OSINSTALL_ENVIRONMENT"};

  void SetUp() override {
    for (const char* name : kVariables) environment_.save(name);
    ::unsetenv("__OSINSTALL_ENVIRONMENT");
    std::string pattern = (fs::temp_directory_path() / "larder-service-XXXXXX").string();
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    temporary_ = pattern;
    useLayout("root", "home");
    savedLevel_ = TillLogManager::sharedManager().level();
    TillLogManager::sharedManager().setLevel(3);
  }

  void TearDown() override {
    TillLogManager::sharedManager().setLevel(savedLevel_);
    std::error_code code;
    fs::remove_all(temporary_, code);
    environment_.restore();
  }

  // Points the variables at folders `rootName` and `homeName` of the
  // temporary folder; caches and state stay where they are.
  void useLayout(const std::string& rootName, const std::string& homeName) {
    root_ = temporary_ + "/" + rootName;
    home_ = temporary_ + "/" + homeName;
    fs::create_directories(root_ + "/Applications");
    fs::create_directories(home_ + "/Applications");
    fs::create_directories(temporary_ + "/cache");
    fs::create_directories(temporary_ + "/state");
    ::setenv("LARDER_ROOT", root_.c_str(), 1);
    ::setenv("HOME", home_.c_str(), 1);
    ::setenv("XDG_CACHE_HOME", (temporary_ + "/cache").c_str(), 1);
    ::setenv("XDG_STATE_HOME", (temporary_ + "/state").c_str(), 1);
    ::setenv("XDG_CONFIG_HOME", (temporary_ + "/config").c_str(), 1);
    ::setenv("XDG_DATA_HOME", (temporary_ + "/data").c_str(), 1);
  }

  [[nodiscard]] std::string rootApplications() const { return root_ + "/Applications"; }
  [[nodiscard]] std::string homeApplications() const { return home_ + "/Applications"; }
  [[nodiscard]] std::string volumeApplications(const std::string& volume) const {
    return root_ + "/Volumes/" + volume + "/Applications";
  }
  [[nodiscard]] std::string stateFolder() const { return temporary_ + "/state/larder"; }
  [[nodiscard]] std::string storePath(const std::string& name = "SoftwareMap") const {
    return temporary_ + "/stores/" + name;
  }
  [[nodiscard]] const std::string& temporary() const { return temporary_; }

  // Writes "<folder>/<name>.app" with its information property list and,
  // when given, its purchase record; returns the bundle's path.
  static std::string makeBundle(const std::string& folder, const std::string& name,
                                const std::string& identifier, const std::string& shortVersion,
                                const std::optional<Purchase>& purchase,
                                const std::string& bundleVersion = "100") {
    std::string path = folder + "/" + name + ".app";
    fs::create_directories(path);
    writePlist(path + "/bundle.plist",
               PlistDictionary{{"HostBundleIdentifier", identifier},
                               {"HostBundleShortVersionString", shortVersion},
                               {"HostBundleVersion", bundleVersion},
                               {"HostBundleIconFile", "AppIcon"}});
    if (purchase) writePlist(path + "/purchase.plist", purchase->toDictionary());
    return path;
  }

  // A store bundle whose purchase record agrees with its information list.
  static std::string makeStoreBundle(const std::string& folder, const std::string& name,
                                     const std::string& identifier, const std::string& version,
                                     std::int64_t wareID, std::int64_t installerVersionID = 1) {
    Purchase purchase{identifier,         version,
                      PlistValue(wareID), PlistValue(installerVersionID),
                      "account-" + name,  1600000000.0};
    return makeBundle(folder, name, identifier, version, purchase);
  }

  static SoftwareMap::Options options(const std::string& store, bool discover) {
    SoftwareMap::Options result;
    result.persistedStorePath = store;
    result.discoverApplications = discover;
    // These tests look at the scan and the update notices alone.
    result.liveQueries = false;
    result.periodicReload = false;
    return result;
  }

  // A record as discovery keeps it for an installed bundle; fields not
  // given stay absent.
  static LedgerSoftwareProductFields storedRecord(
      const std::string& path, std::optional<std::string> identifier = std::nullopt,
      std::optional<std::string> version = std::nullopt,
      std::optional<std::uint64_t> item = std::nullopt,
      std::optional<std::int64_t> versionIdentifier = std::nullopt) {
    return {.bundlePath = path,
            .bundleIdentifier = std::move(identifier),
            .bundleVersion = std::move(version),
            .itemIdentifier = item,
            .versionIdentifier = versionIdentifier,
            .installed = true,
            .source = LedgerSoftwareProduct::kSourceRegistryOrPurchaseRecord};
  }

  // A map that holds exactly `records`, from its persisted store, and
  // never looks at the application folders.
  std::unique_ptr<SoftwareMap> mapWithRecords(
      const std::vector<LedgerSoftwareProductFields>& records) {
    std::string path = storePath("records");
    writeBytes(path, archivedStore(records));
    auto map = std::make_unique<SoftwareMap>(options(path, false));
    map->waitUntilIdle();
    EXPECT_EQ(map->allProducts().size(), records.size());
    return map;
  }

  // An archived store holding `records` keyed by their paths.
  static PlistData archivedStore(const std::vector<LedgerSoftwareProductFields>& records) {
    PlistDictionary byPath;
    for (const LedgerSoftwareProductFields& fields : records) {
      byPath.emplace(fields.bundlePath, LedgerSoftwareProduct(fields).encodeWithCoder());
    }
    return KeyedArchive::archivedData(
        KeyedArchive::dictionary({{"appsByPath", KeyedArchive::dictionary(std::move(byPath))}}));
  }

 private:
  std::string temporary_;
  std::string root_;
  std::string home_;
  int savedLevel_ = 2;
  ScopedEnvironment environment_;
};

inline std::vector<std::string> pathsOf(const SoftwareMap::ProductList& products) {
  std::vector<std::string> paths;
  for (const auto& product : products) paths.push_back(product->bundlePath());
  std::sort(paths.begin(), paths.end());
  return paths;
}

}  // namespace larder::testing
