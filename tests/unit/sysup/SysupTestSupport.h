// A temporary platform root with a system update state file, and a way to
// wait for what handlers report.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <functional>
#include <string>
#include <vector>

#include "platform/system/Mutex.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/sysup/SysupQuaymartUpdateController.h"
#include "tests/unit/ScopedEnvironment.h"
#include "tests/unit/TemporaryFolder.h"

namespace larder::testing {

inline PlistDictionary catalogEntry(const std::string& productKey, PlistDictionary extra = {}) {
  extra["productKey"] = productKey;
  extra["title"] = "Update " + productKey;
  return extra;
}

inline PlistArray keys(std::initializer_list<const char*> names) {
  PlistArray array;
  for (const char* name : names) array.emplace_back(name);
  return array;
}

inline std::vector<std::string> productKeysOf(
    const SysupQuaymartUpdateController::UpdateList& updates) {
  std::vector<std::string> result;
  for (const SysupQuaymartUpdate& update : updates) result.push_back(update.productKey());
  return result;
}

class SysupTest : public ::testing::Test {
 protected:
  void SetUp() override { environment_.set("LARDER_ROOT", folder_ / "root"); }

  static SysupQuaymartUpdateController& controller() {
    return SysupQuaymartUpdateController::sharedUpdateController();
  }
  static PlatformStateFile stateFile() {
    return PlatformStateFile::named(SysupQuaymartUpdateController::kStateFileName);
  }
  static void merge(const PlistDictionary& values) {
    ASSERT_TRUE(stateFile().updateDictionary([&values](PlistDictionary& state) {
      for (const auto& [key, value] : values) state[key] = value;
    }));
  }
  static PlistValue stored(std::string_view key) {
    return PlistValue(stateFile().readDictionary())[key];
  }
  static std::vector<SysupQuaymartUpdate> updatesNamed(std::initializer_list<const char*> names) {
    std::vector<SysupQuaymartUpdate> updates;
    for (const char* name : names) {
      updates.emplace_back(SysupQuaymartUpdateFields{.productKey = name});
    }
    return updates;
  }

  TemporaryFolder folder_;
  ScopedEnvironment environment_;
};

// Collects values from other threads; a test waits until enough arrived.
template <typename Value>
class Collector {
 public:
  void add(Value value) {
    MutexLock lock(mutex_);
    values_.push_back(std::move(value));
    condition_.notify_all();
  }
  // The values once `arrived` holds for them; fails the test after 10 seconds.
  template <typename Predicate>
  std::vector<Value> waitUntil(Predicate arrived) {
    MutexLock lock(mutex_);
    const bool done = condition_.wait_for(lock, std::chrono::seconds(10),
                                          [&]() REQUIRES(mutex_) { return arrived(values_); });
    EXPECT_TRUE(done) << "gave up after " << values_.size() << " values";
    return values_;
  }
  std::vector<Value> waitFor(std::size_t count) {
    return waitUntil([count](const std::vector<Value>& values) { return values.size() >= count; });
  }

 private:
  Mutex mutex_;
  ConditionVariable condition_;
  std::vector<Value> values_ GUARDED_BY(mutex_);
};

}  // namespace larder::testing
