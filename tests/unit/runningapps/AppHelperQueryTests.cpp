#include <gtest/gtest.h>

#include "running-apps/AppHelper.h"
#include "running-apps/PlugInHost.h"
#include "tests/unit/runningapps/AppTestSupport.h"

namespace larder {
namespace {

using testing::AppTestRoot;
using testing::eventually;

class AppHelperQueryTest : public ::testing::Test {
 protected:
  AppTestRoot apps_;
};

TEST_F(AppHelperQueryTest, ARunningAppIsFoundWithItsNameAndNotAfterItQuit) {
  pid_t pid = apps_.launch(apps_.makeBundle("Foo", "test.query.foo", AppTestRoot::Program::kSleeps,
                                            {{"HostBundleDisplayName", "Foo Deluxe"}}));
  std::optional<std::string> name;
  std::optional<PlugInHostApps> hosts;
  EXPECT_TRUE(AppHelper::isAppRunningWithBundleID("test.query.foo", &name, &hosts));
  EXPECT_EQ(name, "Foo Deluxe");
  EXPECT_FALSE(hosts);
  EXPECT_FALSE(AppHelper::isAppRunningWithBundleID("", &name, nullptr));

  ASSERT_EQ(::kill(pid, SIGKILL), 0);
  ASSERT_TRUE(eventually([&] { return testing::processIsGone(pid); }));
  name.reset();
  EXPECT_FALSE(AppHelper::isAppRunningWithBundleID("test.query.foo", &name, &hosts));
  EXPECT_FALSE(name);
  // The probe of the plug-ins leaves no hold behind.
  EXPECT_TRUE(PlugInHost::holds().empty());
}

struct PlugInCase {
  const char* name;
  bool hostIsContainer;
  bool fileBrowserExtension;
  bool expectHosts;
};

class AppHelperPlugInTest : public AppHelperQueryTest,
                            public ::testing::WithParamInterface<PlugInCase> {};

TEST_P(AppHelperPlugInTest, ABusyPlugInCountsAsRunning) {
  const PlugInCase& plugInCase = GetParam();
  std::string container = apps_.makeBundle("Container", "test.query.container");
  PlistDictionary plugInInfo;
  if (plugInCase.fileBrowserExtension) {
    plugInInfo["HostExtension"] =
        PlistDictionary{{"HostExtensionPointIdentifier", "com.orvane.FilewalkerSync"}};
  }
  std::string plugIn = apps_.makeBundle("Ext", "test.query.container.ext",
                                        AppTestRoot::Program::kSleeps, plugInInfo, container);
  std::string host = apps_.makeBundle("Host", "test.query.host", AppTestRoot::Program::kSleeps,
                                      {{"HostBundleName", "Host Viewer"}});
  PlistDictionary busy{
      {"containingIdentifier", "test.query.container"},
      {"containingPath", container},
      {"plugInIdentifier", "test.query.container.ext"},
      {"plugInPath", plugIn},
      {"hostIdentifier", plugInCase.hostIsContainer ? "test.query.container" : "test.query.host"},
      {"hostPath", plugInCase.hostIsContainer ? container : host},
      {"service-pid", 4242}};
  ASSERT_TRUE(PlugInHost::addBusyPlugIn(busy));
  // A busy plug-in of another application does not count.
  ASSERT_TRUE(PlugInHost::addBusyPlugIn({{"containingIdentifier", "test.query.other"},
                                         {"containingPath", apps_.applications() + "/Other.app"},
                                         {"service-pid", 4343}}));

  std::optional<std::string> name;
  std::optional<PlugInHostApps> hosts;
  EXPECT_TRUE(AppHelper::isAppRunningWithBundleID("test.query.container", &name, &hosts));
  EXPECT_FALSE(name);
  ASSERT_EQ(hosts.has_value(), plugInCase.expectHosts);
  if (plugInCase.expectHosts) {
    ASSERT_EQ(hosts->size(), 1u);
    EXPECT_EQ(hosts->begin()->first, "Host Viewer");
    EXPECT_EQ(*PlistValue(hosts->begin()->second)["containingPath"].string(), container);
  }

  // Running as well: the name comes from the process, the hosts still from
  // the plug-in.
  apps_.launch(container);
  hosts.reset();
  EXPECT_TRUE(AppHelper::isAppRunningWithBundleID("test.query.container", &name, &hosts));
  EXPECT_EQ(name, "Container");
  EXPECT_EQ(hosts.has_value(), plugInCase.expectHosts);
}

INSTANTIATE_TEST_SUITE_P(Hosts, AppHelperPlugInTest,
                         ::testing::Values(PlugInCase{"InAnotherApp", false, false, true},
                                           PlugInCase{"ContainerIsHost", true, false, false},
                                           PlugInCase{"FileBrowserExtension", false, true, false}),
                         [](const auto& info) { return std::string(info.param.name); });

struct WhiteListCase {
  const char* name;
  std::optional<std::string> identifier;
  std::optional<std::string> bundleURL;
  bool hasLaunchDate;
  bool whiteListed;
};

class AppHelperWhiteListTest : public ::testing::TestWithParam<WhiteListCase> {};

TEST_P(AppHelperWhiteListTest, WhiteListedApps) {
  const WhiteListCase& whiteListCase = GetParam();
  RunningApplication::Description description;
  description.pid = ::getpid();
  description.bundleIdentifier = whiteListCase.identifier;
  description.bundleURL = whiteListCase.bundleURL;
  if (whiteListCase.hasLaunchDate) description.launchDate = PlistDate{1.7e9};
  auto application = RunningApplication::make(description);
  EXPECT_EQ(AppHelper::isRunningAppImmortalWhiteListed(*application), whiteListCase.whiteListed);
}

INSTANTIATE_TEST_SUITE_P(
    Cases, AppHelperWhiteListTest,
    ::testing::Values(
        WhiteListCase{"Ordinary", "test.query.foo", "/Applications/Foo.app", true, false},
        WhiteListCase{"NoLaunchDate", "test.query.foo", "/Applications/Foo.app", false, true},
        WhiteListCase{"NoIdentifier", std::nullopt, "/Applications/Foo.app", true, true},
        WhiteListCase{"SystemFolder", "test.query.foo", "/System/Foo.app", true, true},
        WhiteListCase{"WhiteListedIdentifier", "com.orvane.statusbarserver",
                      "/Applications/Bar.app", true, true}),
    [](const auto& info) { return std::string(info.param.name); });

TEST_F(AppHelperQueryTest, ImmortalStopsAtTheFirstNoisyInstance) {
  pid_t first = apps_.launch(apps_.makeBundle("First", "test.query.editor"));
  pid_t second = apps_.launch(apps_.makeBundle("Second", "test.query.editor"));
  std::optional<std::string> reason = "stale";
  std::optional<std::string> name = "stale";
  EXPECT_FALSE(AppHelper::isAppImmortalWithBundleID("test.query.editor", &reason, &name));
  EXPECT_FALSE(reason);
  EXPECT_FALSE(name);

  ASSERT_TRUE(RunningApplicationFacts::setQuittingLosesData("test.query.editor", "A render runs"));
  EXPECT_TRUE(AppHelper::isAppImmortalWithBundleID("test.query.editor", &reason, &name));
  EXPECT_EQ(reason, "A render runs");
  // The scan goes in pid order.
  EXPECT_EQ(name, first < second ? "First" : "Second");
  EXPECT_FALSE(AppHelper::isAppImmortalWithBundleID("", &reason, &name));
}

TEST_F(AppHelperQueryTest, ForemostComesFromTheDesktopState) {
  apps_.launch(apps_.makeBundle("Foo", "test.query.foo"));
  std::optional<std::string> name;
  EXPECT_FALSE(AppHelper::isAppForemostWithBundleID("test.query.foo", &name));
  ASSERT_TRUE(RunningApplicationFacts::setForemost("test.query.foo"));
  EXPECT_TRUE(AppHelper::isAppForemostWithBundleID("test.query.foo", &name));
  EXPECT_EQ(name, "Foo");
  EXPECT_FALSE(AppHelper::isAppForemostWithBundleID("test.query.other", &name));
}

TEST_F(AppHelperQueryTest, RelaunchByIdentifierStartsTheApp) {
  std::string bundle = apps_.makeBundle("Foo", "test.query.foo");
  AppHelper::relaunchAppWithBundleID("test.query.foo");
  EXPECT_TRUE(eventually([&] {
    auto found = RunningApplication::runningApplicationsWithBundleIdentifier("test.query.foo");
    return !found.empty() && AppTestRoot::runsSleepOf(found.front()->pid(), bundle);
  }));
}

}  // namespace
}  // namespace larder
