// Packages installed into place: a new bundle, a replaced bundle (with and
// without exchange), and the hostile packages that must leave nothing
// behind.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <string>
#include <vector>

#include "RuntimeTestSupport.h"
#include "store-runtime/download/VendDownloadError.h"
#include "store-runtime/download/VendPackageEntryPolicy.h"
#include "store-runtime/download/VendPackageInstaller.h"

namespace larder {
namespace {

namespace fs = std::filesystem;

using testing::bundlePackage;
using testing::installBundleDirectly;
using testing::PrivateRoot;
using testing::randomBytes;
using testing::readFile;
using testing::TarBuilder;
using testing::treeOf;
using testing::writeFile;

class PackageInstallerTest : public ::testing::Test {
 protected:
  std::string writePackage(const std::string& bytes, const std::string& name = "package.tar") {
    const fs::path path = root_.scratch() / name;
    writeFile(path, bytes);
    return path.string();
  }

  PrivateRoot root_;
};

TEST_F(PackageInstallerTest, InstallsANewBundleUnderApplications) {
  const std::string package =
      writePackage(bundlePackage("Thing", "com.example.thing", "1.0", 50'000, 4));
  const VendPackageInstaller::Result result =
      VendPackageInstaller().install(package, "com.example.thing");
  ASSERT_FALSE(result.error) << result.error->description;
  const fs::path bundle = root_.applications() / "Thing.app";
  EXPECT_EQ(fs::path(result.installedPath), fs::canonical(bundle));
  EXPECT_FALSE(result.replacedExisting);
  EXPECT_EQ(readFile(bundle / "resources/version.txt"), "1.0");
  EXPECT_EQ(readFile(bundle / "resources/payload.bin"), randomBytes(50'000, 4));
  struct stat info {};
  ASSERT_EQ(::stat((bundle / "bin/run").c_str(), &info), 0);
  EXPECT_NE(info.st_mode & S_IXUSR, 0u) << "the executable keeps its mode";
  // Nothing but the bundle: the staging folder has become it.
  EXPECT_EQ(treeOf(root_.applications()),
            (std::vector<std::string>{"Thing.app", "Thing.app/bin", "Thing.app/bin/run",
                                      "Thing.app/bundle.plist", "Thing.app/resources",
                                      "Thing.app/resources/payload.bin",
                                      "Thing.app/resources/version.txt"}));
}

class ReplacementTest : public PackageInstallerTest, public ::testing::WithParamInterface<bool> {};

TEST_P(ReplacementTest, ReplacesTheInstalledBundleWhereverItIs) {
  // Installed in a subfolder and under another name than the package's
  // folder: the installed bundle's place wins.
  const fs::path installed = root_.applications() / "Tools" / "Old Name.app";
  installBundleDirectly(installed, "com.example.thing", "1.0");
  const std::string package = writePackage(bundlePackage("Thing", "com.example.thing", "2.0"));

  VendPackageInstaller::Options options;
  options.useExchange = GetParam();
  const VendPackageInstaller::Result result =
      VendPackageInstaller(options).install(package, "com.example.thing");
  ASSERT_FALSE(result.error) << result.error->description;
  EXPECT_TRUE(result.replacedExisting);
  EXPECT_EQ(fs::path(result.installedPath), fs::canonical(installed));
  EXPECT_EQ(readFile(installed / "resources/version.txt"), "2.0");
  EXPECT_FALSE(fs::exists(installed / "resources/only-in-old.txt"))
      << "the old tree is gone, not merged";
  EXPECT_TRUE(fs::exists(installed / "bin/run"));
  EXPECT_FALSE(fs::exists(root_.applications() / "Thing.app"));
  // Neither the staging folder nor the old tree stays beside the bundle.
  EXPECT_EQ(treeOf(root_.applications() / "Tools").front(), "Old Name.app");
  for (const std::string& path : treeOf(root_.applications() / "Tools")) {
    EXPECT_EQ(path.rfind("Old Name.app", 0), 0u) << path;
  }
}

INSTANTIATE_TEST_SUITE_P(ExchangeAndRenameAside, ReplacementTest, ::testing::Bool());

struct HostilePackage {
  std::string name;
  TarBuilder archive;
  std::string expectedReason;
};

std::vector<HostilePackage> hostilePackages() {
  const std::string info = testing::bundleInfo("com.example.evil", "1");
  auto bundle = [&] {
    return TarBuilder().directory("Evil.app/").file("Evil.app/bundle.plist", info);
  };
  return {
      {"climbing path", bundle().file("../escaped.txt", "x"), "climbs out"},
      {"climbing inside the bundle", bundle().file("Evil.app/../../escaped.txt", "x"),
       "climbs out"},
      {"absolute path", bundle().file("/tmp/larder-escaped.txt", "x"), "absolute path"},
      {"symlink out of the bundle", bundle().symlink("Evil.app/etc", "../../../etc"),
       "points outside"},
      {"absolute symlink", bundle().symlink("Evil.app/passwd", "/etc/passwd"), "absolute path"},
      {"symlink then write through it",
       bundle().symlink("Evil.app/up", "..").file("Evil.app/up/escaped.txt", "x"),
       "points outside"},
      {"two top-level folders", bundle().directory("Other.app/").file("Other.app/x", "x"),
       "second top-level"},
      {"no app folder", TarBuilder().directory("Evil/").file("Evil/bundle.plist", info),
       "outside a top-level .app"},
      {"a file beside the bundle", bundle().file("README", "x"), "outside a top-level .app"},
      {"the bundle is a file", TarBuilder().file("Evil.app", "x"), "is not a folder"},
      {"named pipe", bundle().fifo("Evil.app/pipe"), "device, pipe or socket"},
      {"device", bundle().characterDevice("Evil.app/null"), "device, pipe or socket"},
      {"hard link to a system file", bundle().hardlink("Evil.app/shadow", "/etc/shadow"),
       "outside the bundle"},
      {"hard link into another folder", bundle().hardlink("Evil.app/x", "Other.app/x"),
       "second top-level"},
      {"empty archive", TarBuilder(), "no top-level .app"},
  };
}

TEST_F(PackageInstallerTest, HostilePackagesAreRefusedAndLeaveNothing) {
  for (const HostilePackage& hostile : hostilePackages()) {
    const std::string package = writePackage(hostile.archive.bytes());
    const VendPackageInstaller::Result result =
        VendPackageInstaller().install(package, "com.example.evil");
    ASSERT_TRUE(result.error) << hostile.name << " was installed";
    EXPECT_EQ(result.error->domain, VendDownloadError::kDomain) << hostile.name;
    EXPECT_EQ(result.error->code, VendDownloadError::kUnsafePackage) << hostile.name;
    EXPECT_NE(result.error->description.find(hostile.expectedReason), std::string::npos)
        << hostile.name << ": " << result.error->description;
    EXPECT_TRUE(treeOf(root_.applications()).empty()) << hostile.name;
  }
  EXPECT_FALSE(fs::exists(root_.root() / "escaped.txt"));
  EXPECT_FALSE(fs::exists(root_.scratch().parent_path() / "escaped.txt"));
  EXPECT_FALSE(fs::exists("/tmp/larder-escaped.txt"));
}

TEST_F(PackageInstallerTest, LinksThatStayInsideTheBundleAreKept) {
  const std::string info = testing::bundleInfo("com.example.links", "1");
  const std::string package =
      writePackage(TarBuilder()
                       .directory("./")
                       .directory("./Links.app/")
                       .file("./Links.app/bundle.plist", info)
                       .file("./Links.app/resources/data", "payload")
                       .symlink("./Links.app/bin/tool", "../resources/data")
                       .hardlink("./Links.app/resources/same", "./Links.app/resources/data")
                       .bytes());
  const VendPackageInstaller::Result result =
      VendPackageInstaller().install(package, "com.example.links");
  ASSERT_FALSE(result.error) << result.error->description;
  const fs::path bundle = root_.applications() / "Links.app";
  EXPECT_TRUE(fs::is_symlink(bundle / "bin/tool"));
  EXPECT_EQ(readFile(bundle / "bin/tool"), "payload");
  EXPECT_EQ(fs::hard_link_count(bundle / "resources/same"), 2u);
}

// A package that is not the installed bundle's, or cannot be installed,
// leaves the folder it would go to exactly as it was.
TEST_F(PackageInstallerTest, APackageThatCannotReplaceLeavesTheFolderAsItWas) {
  const struct {
    const char* name;
    const char* installedIdentifier;
    std::string package;
    VendDownloadError::Code code;
    const char* phrase;
  } cases[] = {
      {"another bundle's package", "com.example.thing",
       bundlePackage("Thing", "com.example.other", "9.0"), VendDownloadError::kUnsafePackage,
       "com.example.other"},
      {"hostile package", "com.example.thing",
       TarBuilder().directory("Thing.app/").file("Thing.app/../../x", "x").bytes(),
       VendDownloadError::kUnsafePackage, "climbs out"},
      {"damaged package", "com.example.thing", randomBytes(10'000, 2),
       VendDownloadError::kInstallFailed, ""},
      {"folder of another bundle", "com.example.someone-else",
       bundlePackage("Thing", "com.example.thing", "1.0"), VendDownloadError::kInstallFailed,
       "already exists"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    fs::remove_all(root_.applications());
    const fs::path installed = root_.applications() / "Thing.app";
    installBundleDirectly(installed, c.installedIdentifier, "3.0");
    const std::vector<std::string> before = treeOf(root_.applications());
    const VendPackageInstaller::Result result =
        VendPackageInstaller().install(writePackage(c.package), "com.example.thing");
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->code, c.code) << result.error->description;
    EXPECT_NE(result.error->description.find(c.phrase), std::string::npos)
        << result.error->description;
    EXPECT_EQ(treeOf(root_.applications()), before) << "no staging folder beside it";
    EXPECT_EQ(readFile(installed / "resources/version.txt"), "3.0");
  }
}

// Symbolic links judged one package at a time: chains, loops and links to
// links must never lead out of the bundle, while ordinary links inside it
// stay allowed.
TEST(VendPackageEntryPolicy, LinksMayNeverLeadOutOfTheBundle) {
  using Links = std::vector<std::pair<std::string, std::string>>;  // name, target
  // Eight folders deep, a link back up to the bundle folder; a second link
  // walks through it one level further, to the folder above the bundle; a
  // third reads a system file through the second.
  const std::string deep = "a/b/c/d/e/f/g/h";
  const std::string eightUp = "../../../../../../../../";
  const Links chainOut = {{"X.app/" + deep + "/up", eightUp},
                          {"X.app/out", deep + "/up/" + eightUp + ".."},
                          {"X.app/passwd", "out/etc/passwd"}};
  const struct {
    const char* name;
    Links links;
    bool allowed;
  } cases[] = {
      {"chain of links out of the bundle", chainOut, false},
      {"through a link to its folder and up",
       {{"X.app/a/up", ".."}, {"X.app/b", "a/up/../.."}},
       false},
      {"loop that climbs", {{"X.app/loop", "loop/.."}}, false},
      {"absolute target", {{"X.app/passwd", "/etc/passwd"}}, false},
      {"absolute target into the bundle's own name", {{"X.app/a", "/X.app/a"}}, false},
      {"more levels up than the link is deep", {{"X.app/bin/tool", "../../x"}}, false},
      {"link to a link inside",
       {{"X.app/bin/tool", "../lib/current/tool"}, {"X.app/lib/current", "v2"}},
       true},
      {"loop of two links inside", {{"X.app/a", "b"}, {"X.app/b", "a"}}, true},
      {"relative link to a sibling folder", {{"X.app/bin/tool", "../resources/./data"}}, true},
      {"deep link back to the bundle folder", {chainOut.front()}, true},
  };
  using Kind = VendPackageEntryPolicy::Kind;
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    VendPackageEntryPolicy policy;
    EXPECT_TRUE(policy.judge({"X.app/", Kind::kDirectory, "", false}).allowed);
    std::string refusal;
    for (const auto& [name, target] : c.links) {
      const auto decision = policy.judge({name, Kind::kSymlink, target, false});
      if (!decision.allowed) {
        refusal = decision.reason;
        break;
      }
    }
    EXPECT_EQ(refusal.empty(), c.allowed) << refusal;
    if (!c.allowed) {
      EXPECT_NE(refusal.find("the link \"X.app/"), std::string::npos) << refusal;
    }
  }
}

}  // namespace
}  // namespace larder
