#include "store-runtime/host/PreferenceStore.h"

#include <gtest/gtest.h>

#include <thread>
#include <vector>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "store-runtime/core/DaemonDefaults.h"
#include "tests/unit/ScopedEnvironment.h"
#include "tests/unit/TemporaryFolder.h"

namespace larder {
namespace {

using testing::ScopedEnvironment;
using testing::TemporaryFolder;
using Scope = PreferenceScope;

constexpr std::string_view kDomain = kSoftwareUpdateDefaultsID;

class PreferenceStoreTest : public ::testing::Test {
 protected:
  void SetUp() override {
    environment_.set("LARDER_ROOT", folder_ / "root");
    environment_.set("XDG_CONFIG_HOME", folder_ / "config");
  }

  std::string userFile() const { return folder_ / "config/larder/com.orvane.SoftwareUpdate.plist"; }
  std::string systemFile() const {
    return folder_ / "root/etc/larder/com.orvane.SoftwareUpdate.plist";
  }
  static void write(const std::string& path, const PlistDictionary& values) {
    ASSERT_TRUE(FileIO::writeAtomically(path, PropertyListSerialization::writeXml(values)));
  }

  TemporaryFolder folder_;
  ScopedEnvironment environment_;
};

TEST_F(PreferenceStoreTest, ScopesReadTheirFilesAndAppFallsBackToTheMachine) {
  ASSERT_EQ(PreferenceStore::pathFor(kDomain, Scope::User), userFile());
  ASSERT_EQ(PreferenceStore::pathFor(kDomain, Scope::App), userFile());
  ASSERT_EQ(PreferenceStore::pathFor(kDomain, Scope::System), systemFile());
  write(userFile(), {{"Both", "user"}, {"UserOnly", std::int64_t{1}}});
  write(systemFile(), {{"Both", "system"}, {"SystemOnly", true}});
  struct Case {
    const char* key;
    Scope scope;
    PlistValue expected;
  } const cases[] = {
      {"Both", Scope::App, "user"},      {"Both", Scope::User, "user"},
      {"Both", Scope::System, "system"}, {"SystemOnly", Scope::App, true},
      {"SystemOnly", Scope::User, {}},   {"UserOnly", Scope::System, {}},
      {"Missing", Scope::App, {}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(std::string(c.key) + " in scope " + std::to_string(static_cast<int>(c.scope)));
    EXPECT_EQ(PreferenceStore::valueForKey(c.key, kDomain, c.scope), c.expected);
  }
  EXPECT_EQ(PlistValue(PreferenceStore::valuesForDomain(kDomain)),
            PlistValue(PlistDictionary{
                {"Both", "user"}, {"UserOnly", std::int64_t{1}}, {"SystemOnly", true}}));

  // Nothing is cached: a change by hand counts from the next read.
  write(userFile(), {{"Both", "changed"}});
  EXPECT_EQ(PreferenceStore::valueForKey("Both", kDomain), PlistValue("changed"));
  EXPECT_EQ(PreferenceStore::valueForKey("UserOnly", kDomain), PlistValue());
}

TEST_F(PreferenceStoreTest, TypedReadsAnswerOnlyForTheirType) {
  write(userFile(), {{"Flag", true},
                     {"Count", std::int64_t{3}},
                     {"Interval", 2.5},
                     {"FlagAsText", "true"},
                     {"When", PlistDate{1700000000}}});
  EXPECT_EQ(PreferenceStore::booleanForKey("Flag", kDomain), true);
  EXPECT_EQ(PreferenceStore::booleanForKey("FlagAsText", kDomain), std::nullopt);
  EXPECT_EQ(PreferenceStore::booleanForKey("Count", kDomain), std::nullopt);
  EXPECT_EQ(PreferenceStore::numberForKey("Count", kDomain), 3.0);
  EXPECT_EQ(PreferenceStore::numberForKey("Interval", kDomain), 2.5);
  EXPECT_EQ(PreferenceStore::numberForKey("Flag", kDomain), std::nullopt);
  EXPECT_EQ(PreferenceStore::stringForKey("FlagAsText", kDomain), "true");
  EXPECT_EQ(PreferenceStore::dateForKey("When", kDomain), PlistDate{1700000000});
  EXPECT_EQ(PreferenceStore::dateForKey("Count", kDomain), std::nullopt);
}

TEST_F(PreferenceStoreTest, WritesKeepOtherKeysAndScopesApart) {
  write(userFile(), {{"Kept", "yes"}});
  ASSERT_TRUE(PreferenceStore::setValue("Added", std::int64_t{7}, kDomain));
  ASSERT_TRUE(PreferenceStore::setValue("Machine", true, kDomain, Scope::System));
  EXPECT_EQ(PreferenceStore::valueForKey("Kept", kDomain, Scope::User), PlistValue("yes"));
  EXPECT_EQ(PreferenceStore::valueForKey("Added", kDomain, Scope::User), PlistValue(7));
  EXPECT_EQ(PreferenceStore::valueForKey("Machine", kDomain, Scope::User), PlistValue());
  EXPECT_EQ(PreferenceStore::valueForKey("Machine", kDomain, Scope::System), PlistValue(true));

  ASSERT_TRUE(PreferenceStore::removeValue("Added", kDomain));
  ASSERT_TRUE(PreferenceStore::setValue("Kept", PlistValue(), kDomain)) << "null removes";
  EXPECT_EQ(PlistValue(PreferenceStore::valuesForDomain(kDomain, Scope::User)),
            PlistValue(PlistDictionary{}));
}

TEST_F(PreferenceStoreTest, ConcurrentWritersOfOneDomainLoseNothing) {
  constexpr int kWriters = 8;
  constexpr int kKeysEach = 10;
  std::vector<std::thread> writers;
  for (int writer = 0; writer < kWriters; ++writer) {
    writers.emplace_back([writer] {
      for (int key = 0; key < kKeysEach; ++key) {
        const std::string name = "K" + std::to_string(writer) + "-" + std::to_string(key);
        EXPECT_TRUE(PreferenceStore::setValue(name, std::int64_t{key}, kDomain));
      }
    });
  }
  for (std::thread& writer : writers) writer.join();
  EXPECT_EQ(PreferenceStore::valuesForDomain(kDomain).size(),
            static_cast<std::size_t>(kWriters * kKeysEach));
}

TEST_F(PreferenceStoreTest, DamagedFilesAndBadDomainsAreRefusedNotFollowed) {
  ASSERT_TRUE(FileIO::writeAtomically(userFile(), std::string_view("<plist><dict><key>")));
  EXPECT_TRUE(PreferenceStore::valueForKey("Anything", kDomain).isNull());
  ASSERT_TRUE(PreferenceStore::setValue("Fresh", true, kDomain)) << "a damaged file is replaced";
  EXPECT_EQ(PreferenceStore::booleanForKey("Fresh", kDomain), true);

  for (std::string_view domain : std::initializer_list<std::string_view>{
           "", ".hidden", "../escape", "a/b", std::string_view("a\0b", 3)}) {
    SCOPED_TRACE(std::string(domain));
    const Result<void> written = PreferenceStore::setValue("Key", true, domain);
    ASSERT_FALSE(written);
    EXPECT_EQ(written.error().domain, PreferenceStore::kErrorDomain);
    EXPECT_TRUE(PreferenceStore::valueForKey("Key", domain).isNull());
  }
  EXPECT_FALSE(std::filesystem::exists(folder_ / "config/escape.plist"));
}

}  // namespace
}  // namespace larder
