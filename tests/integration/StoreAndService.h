#pragma once

#include <gtest/gtest.h>

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "tests/integration/LarderctlProcess.h"
#include "tests/integration/ServiceHarness.h"
#include "tests/integration/StoreCatalogueBuilder.h"
#include "tests/integration/StoreServerProcess.h"

namespace larder::testing {

// larder-store with a catalogue, larderd on a private bus pointed at it,
// and larderctl or clients on the bus, used the way a person at a terminal
// and the store application use them.
class StoreAndServiceTest : public ::testing::Test {
 protected:
  static constexpr char kShopper[] = "shopper@example.org";
  static constexpr char kPassword[] = "open sesame";

  // The shopper's account and Atlas (item 901, 3.1) in the catalogue.
  void SetUp() override {
    catalogue_.addAccount({.accountID = 8123, .orvaneID = kShopper, .password = kPassword});
    catalogue_.addItem(
        {.wareID = 901, .bundleID = "com.example.Atlas", .title = "Atlas", .version = "3.1"});
  }
  [[nodiscard]] std::string applications() const { return platform_.root() + "/Applications"; }

  // Starts the store of the catalogue with `faults`, then the service.
  void start(const std::vector<std::string>& faults = {}) {
    store_ = std::make_unique<StoreServerProcess>(catalogue_.directory(), faults);
    startService(store_->bagURL());
  }

  // (Re)starts the service against `storeURL` and waits for its first look
  // at the disk.
  void startService(const std::string& storeURL, std::vector<std::string> arguments = {}) {
    service_.reset();
    service_ = std::make_unique<ServiceProcess>(
        platform_, bus_, std::move(arguments),
        std::map<std::string, std::string>{{"LARDER_STORE_URL", storeURL},
                                           {"LARDER_STORE_TIMEOUT", "5"}});
    ASSERT_TRUE(service_->waitUntilServing()) << service_->log();
    ASSERT_TRUE(service_->waitForLog("MetadataQuery initial load took", std::chrono::seconds(20)))
        << service_->log();
  }

  // A client that has presented itself as the store application.
  std::unique_ptr<ServiceClient> client() {
    auto made = connectClient(bus_);
    made->presentStoreClient(0);
    return made;
  }

  LarderctlRun run(const std::vector<std::string>& arguments,
                   const std::map<std::string, std::string>& environment = {}) {
    auto merged = platform_.environment(bus_);
    for (const auto& [name, value] : environment) merged[name] = value;
    return runLarderctl(platform_.directory() + "/larderctl-" + std::to_string(++runs_), arguments,
                        merged);
  }

  // Sends the software update agent's report (`info`, or a scan's when
  // empty) and waits until the run it starts has ended.
  void backgroundRun(const std::string& info = {}) {
    const std::size_t before = service_->logLines("autoupdate.operation_run").size();
    std::vector<std::string> arguments{"background-scan"};
    if (!info.empty()) arguments.insert(arguments.end(), {"--info", info});
    const LarderctlRun report = run(arguments);
    ASSERT_EQ(report.status, 0) << report.errors;
    ASSERT_TRUE(
        eventually([&] { return service_->logLines("autoupdate.operation_run").size() > before; },
                   std::chrono::seconds(60)))
        << service_->log();
  }

  StoreCatalogueBuilder catalogue_;
  std::unique_ptr<StoreServerProcess> store_;
  TemporaryPlatform platform_;
  PrivateBus bus_;
  std::unique_ptr<ServiceProcess> service_;
  int runs_ = 0;
};

}  // namespace larder::testing
