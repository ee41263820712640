#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "store-runtime/services/VendAccountService.h"
#include "store-runtime/services/VendServiceProxy.h"
#include "tests/integration/ServiceHarness.h"
#include "tests/integration/StoreCatalogueBuilder.h"
#include "tests/integration/StoreServerProcess.h"
#include "tests/unit/ScopedEnvironment.h"

namespace larder::testing {

// Every line the log writes while the capture lives, at every level.
class LogLines {
 public:
  LogLines() : savedLevel_(TillLogManager::sharedManager().level()) {
    TillLogManager::sharedManager().setLevel(3);
    sink_ = TillLogManager::sharedManager().addSink([this](int level, const std::string& line) {
      std::lock_guard lock(mutex_);
      lines_.emplace_back(level, line);
    });
  }
  ~LogLines() {
    sink_.reset();
    TillLogManager::sharedManager().setLevel(savedLevel_);
  }
  LogLines(const LogLines&) = delete;
  LogLines& operator=(const LogLines&) = delete;

  // The lines at `level` that contain `text` (from their start when `atStart`).
  [[nodiscard]] std::vector<std::string> at(int level, std::string_view text,
                                            bool atStart = true) const {
    std::lock_guard lock(mutex_);
    std::vector<std::string> found;
    for (const auto& [lineLevel, line] : lines_) {
      const auto where = line.find(text);
      if (lineLevel == level && where != std::string::npos && (!atStart || where == 0)) {
        found.push_back(line);
      }
    }
    return found;
  }

 private:
  int savedLevel_;
  std::shared_ptr<void> sink_;
  mutable std::mutex mutex_;
  std::vector<std::pair<int, std::string>> lines_;
};

// The store runtime in this process, shared, against larder-store on
// 127.0.0.1, with a private platform root.
class InProcessRuntimeTest : public ::testing::Test {
 protected:
  InProcessRuntimeTest() {
    environment_.set("LARDER_ROOT", platform_.root());
    environment_.set("XDG_CONFIG_HOME", platform_.home() + "/.config");
  }
  void TearDown() override { VendRuntime::setShared(nullptr); }

  // Starts the store with these faults and a runtime that talks to it.
  void startStore(const std::vector<std::string>& faults = {}, double timeout = 10) {
    store_ = std::make_unique<StoreServerProcess>(catalogue_.directory(), faults);
    useBag(store_->bagURL(), timeout);
  }

  void useBag(const std::string& bagURL, double timeout = 10) {
    VendRuntimeConfiguration configuration;
    configuration.bagURL = bagURL;
    configuration.stateDirectory = platform_.stateHome() + "/larder";
    configuration.downloadsDirectory = platform_.cacheHome() + "/com.orvane.larderd/Downloads";
    configuration.connectTimeout = std::chrono::seconds(2);
    configuration.requestTimeout = timeout;
    runtime_ = std::make_shared<VendRuntime>(configuration);
    VendRuntime::setShared(runtime_);
  }

  // Signs the account in through the account service of `proxy`; whether
  // it worked.
  static bool signInThrough(VendServiceProxy& proxy, const std::string& name,
                            const std::string& password) {
    bool signedIn = false;
    proxy.accountServiceSynchronousBlock([&](VendAccountService& service, DispatchSemaphore& done) {
      service.signIn(name, password, [&](bool success, std::uint64_t, const OptionalError&) {
        signedIn = success;
        done.signal();
      });
    });
    return signedIn;
  }

  [[nodiscard]] std::uint64_t requests(const std::string& route) const {
    return store_->requestCount(route);
  }

  TemporaryPlatform platform_;
  ScopedEnvironment environment_;
  StoreCatalogueBuilder catalogue_;
  std::unique_ptr<StoreServerProcess> store_;
  std::shared_ptr<VendRuntime> runtime_;
};

}  // namespace larder::testing
