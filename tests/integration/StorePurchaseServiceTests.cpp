// Purchases through the running service, the way a person at a terminal
// makes them: larder-store, larderd on a private bus, larderctl.
#include <gtest/gtest.h>

#include <filesystem>
#include <memory>

#include "tests/integration/LarderctlProcess.h"
#include "tests/integration/ServiceHarness.h"
#include "tests/integration/StoreCatalogueBuilder.h"
#include "tests/integration/StoreServerProcess.h"

namespace larder::testing {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

constexpr char kAccountName[] = "shopper@example.org";
constexpr char kPassword[] = "open sesame";

class StorePurchaseServiceTest : public ::testing::Test {
 protected:
  void SetUp() override {
    catalogue_.addAccount({.accountID = 8123, .orvaneID = kAccountName, .password = kPassword});
    catalogue_.addItem(
        {.wareID = 901, .bundleID = "com.example.Atlas", .title = "Atlas", .version = "3.1"});
    store_ = std::make_unique<StoreServerProcess>(catalogue_.directory(), storeFaults());
    fs::create_directories(platform_.root() + "/Applications");
    service_ = std::make_unique<ServiceProcess>(
        platform_, bus_, std::vector<std::string>{},
        std::map<std::string, std::string>{{"LARDER_STORE_URL", store_->bagURL()},
                                           {"LARDER_STORE_TIMEOUT", "5"}});
    ASSERT_TRUE(service_->waitUntilServing()) << service_->log();
  }

  [[nodiscard]] virtual std::vector<std::string> storeFaults() const { return {}; }

  // Runs larderctl to its end; its exit status.
  int run(const std::vector<std::string>& arguments, std::string* output = nullptr,
          std::string* errors = nullptr) {
    LarderctlRun ran =
        runLarderctl(platform_, bus_, arguments, "larderctl-" + std::to_string(++runs_), 60s);
    if (output) *output = std::move(ran.output);
    if (errors) *errors = std::move(ran.errors);
    return ran.status;
  }

  [[nodiscard]] std::string bundlePath() const {
    return platform_.root() + "/Applications/Atlas.app";
  }

  StoreCatalogueBuilder catalogue_;
  std::unique_ptr<StoreServerProcess> store_;
  TemporaryPlatform platform_;
  PrivateBus bus_;
  std::unique_ptr<ServiceProcess> service_;
  int runs_ = 0;
};

TEST_F(StorePurchaseServiceTest, SignedInPurchaseInstallsTheBundleAndTheMapSeesIt) {
  std::string output;
  std::string errors;
  ASSERT_EQ(run({"signin", kAccountName, "--password", kPassword}, &output, &errors), 0)
      << errors << service_->log();
  EXPECT_NE(output.find("account 8123"), std::string::npos) << output;
  ASSERT_EQ(run({"account"}, &output), 0);
  EXPECT_NE(output.find(kAccountName), std::string::npos);

  ASSERT_EQ(run({"purchase", "901"}, &output, &errors), 0) << errors << service_->log();
  EXPECT_NE(output.find("com.example.Atlas"), std::string::npos) << output;
  // larderctl follows the install to its end.
  EXPECT_NE(output.find("installed Atlas at " + bundlePath()), std::string::npos) << output;
  ASSERT_TRUE(fs::exists(bundlePath() + "/purchase.plist")) << service_->log();
  EXPECT_TRUE(eventually(
      [&] {
        return run({"product", "--bundle-id", "com.example.Atlas"}, &output) == 0;
      },
      20s))
      << service_->log();
  EXPECT_NE(output.find("3.1"), std::string::npos) << output;
}

TEST_F(StorePurchaseServiceTest, ADialogAgentSignsTheAccountInWhenAPurchaseNeedsIt) {
  Larderctl agent(platform_, bus_,
                  {"agent", "--answer", "ok", "--account", kAccountName, "--password", kPassword},
                  "agent");
  ASSERT_TRUE(agent.waitForError("registered")) << agent.errors();
  std::string errors;
  ASSERT_EQ(run({"purchase", "901"}, nullptr, &errors), 0) << errors << service_->log();
  std::string output;
  ASSERT_EQ(run({"--json", "account"}, &output), 0);
  EXPECT_NE(output.find("8123"), std::string::npos) << output;
  EXPECT_TRUE(eventually([&] { return fs::exists(bundlePath() + "/bundle.plist"); }, 20s));
}

TEST_F(StorePurchaseServiceTest, WithoutAgentOrAccountThePurchaseFailsAsCancelled) {
  std::string errors;
  EXPECT_EQ(run({"purchase", "901"}, nullptr, &errors), 1);
  EXPECT_NE(errors.find("code -128"), std::string::npos) << errors;
  EXPECT_EQ(store_->requestCount("buy-product"), 0U);
  EXPECT_FALSE(fs::exists(bundlePath()));
  EXPECT_EQ(run({"signin", kAccountName, "--password", "wrong"}, nullptr, &errors), 1);
  EXPECT_NE(errors.find("code 401"), std::string::npos) << errors;
}

// Every package the store sends fails its digests.
class CorruptStorePurchaseServiceTest : public StorePurchaseServiceTest {
 protected:
  [[nodiscard]] std::vector<std::string> storeFaults() const override { return {"assets=corrupt"}; }
};

TEST_F(CorruptStorePurchaseServiceTest, LarderctlSaysWhenThePurchasedDownloadIsNotInstalled) {
  ASSERT_EQ(run({"signin", kAccountName, "--password", kPassword}), 0) << service_->log();
  std::string output;
  std::string errors;
  EXPECT_EQ(run({"purchase", "901"}, &output, &errors), 1) << output << errors;
  EXPECT_NE(errors.find("the download of Atlas (901) ended without an installed application"),
            std::string::npos)
      << errors;
  EXPECT_EQ(output.find("installed Atlas"), std::string::npos) << output;
  EXPECT_FALSE(fs::exists(bundlePath()));
  // Without waiting, larderctl returns once the store has answered.
  EXPECT_EQ(run({"purchase", "901", "--no-wait"}, &output, &errors), 0) << errors;
  EXPECT_NE(output.find("downloading 901"), std::string::npos) << output;
}

}  // namespace
}  // namespace larder::testing
