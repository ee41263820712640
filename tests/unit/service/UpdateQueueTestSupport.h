// The update queue against a store on loopback: a map of installed
// software, a runtime pointed at the stub store, and checks that wait for
// their handler.
#pragma once

#include <chrono>
#include <condition_variable>
#include <future>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>

#include "ServiceTestSupport.h"
#include "UpdateStoreStub.h"
#include "platform/system/FileIO.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "update-queue/UpdateQueue.h"

namespace larder::testing {

// Counts the delegate's calls, from whatever thread they come.
class CountingUpdateQueueDelegate final : public UpdateQueueDelegate {
 public:
  void availableUpdatesDidChange() override {
    {
      std::lock_guard lock(mutex_);
      ++calls_;
    }
    called_.notify_all();
  }
  // Waits a while for the count to reach `expected`; the count then.
  std::size_t waitForCalls(std::size_t expected) {
    std::unique_lock lock(mutex_);
    called_.wait_for(lock, std::chrono::seconds(10), [&] { return calls_ >= expected; });
    return calls_;
  }
  std::size_t calls() {
    std::lock_guard lock(mutex_);
    return calls_;
  }

 private:
  std::mutex mutex_;
  std::condition_variable called_;
  std::size_t calls_ = 0;
};

struct CheckResult {
  bool success = false;
  UpdateQueue::UpdateList available;
  std::optional<UpdateQueue::UpdateList> incompatible;
  OptionalError error;
};

inline PlistDictionary storeItem(std::uint64_t wareID, const std::string& bundleID,
                                 const std::string& version, const std::string& title = "Title") {
  return PlistDictionary{{"ware-id", wareID},
                         {"bundle-id", bundleID},
                         {"title", title},
                         {"version", version},
                         {"action-params", "itemId=" + std::to_string(wareID)},
                         {"release-date", PlistDate{1700000000}}};
}

inline std::vector<std::uint64_t> identifiersOf(const UpdateQueue::UpdateList& updates) {
  std::vector<std::uint64_t> identifiers;
  for (const LedgerUpdateRef& update : updates)
    identifiers.push_back(update->itemIdentifierValue());
  return identifiers;
}

class UpdateQueueTest : public ServiceTest {
 protected:
  void SetUp() override {
    ServiceTest::SetUp();
    makeStoreBundle(rootApplications(), "Atlas", "com.example.atlas", "1.0", 101);
    makeStoreBundle(rootApplications(), "Birch", "com.example.birch", "2.0", 102);
    map_ = std::make_unique<SoftwareMap>(options(storePath(), true));
    map_->waitUntilIdle();
    previousRuntime_ = VendRuntime::shared();
    useFreshRuntime();
  }

  void TearDown() override {
    VendRuntime::setShared(previousRuntime_);
    map_.reset();
    ServiceTest::TearDown();
  }

  // The bag is fetched once per runtime: a test that changes it starts a
  // new runtime.
  void useFreshRuntime() {
    VendRuntime::setShared(store_.runtime(temporary() + "/runtime" + std::to_string(++runtimes_)));
  }

  std::shared_ptr<UpdateQueue> makeQueue(std::shared_ptr<UpdateQueueDelegate> delegate = nullptr) {
    return std::make_shared<UpdateQueue>(VendStoreClient::initWithStoreClientType(0),
                                         std::move(delegate), *map_);
  }

  static std::future<CheckResult> startCheck(UpdateQueue& queue) {
    auto result = std::make_shared<std::promise<CheckResult>>();
    std::future<CheckResult> future = result->get_future();
    queue.checkForUpdatesWithCompletionHandler(
        [result](bool success, const UpdateQueue::UpdateList& available,
                 const std::optional<UpdateQueue::UpdateList>& incompatible,
                 const OptionalError& error) {
          result->set_value({success, available, incompatible, error});
        });
    return future;
  }

  static CheckResult check(UpdateQueue& queue) {
    std::future<CheckResult> future = startCheck(queue);
    if (future.wait_for(std::chrono::seconds(20)) != std::future_status::ready) {
      ADD_FAILURE() << "the check never ended";
      return {};
    }
    return future.get();
  }

  // Every change queued so far has been made and every delegate call it
  // queued has been delivered: a count of calls taken after this is final.
  static void settle() {
    UpdateQueue::finishPendingWritesOfAllQueues();
    DispatchQueue::globalQueue().barrierSync([] {});
  }

  static std::string cacheFile() { return UpdateQueue::cachePath().value_or(""); }

  static PlistDictionary cacheContents() {
    auto bytes = FileIO::read(cacheFile());
    if (!bytes) return {};
    auto plist = PropertyListSerialization::read(*bytes);
    return plist && plist->dictionary() ? *plist->dictionary() : PlistDictionary{};
  }

  UpdateStoreStub store_;
  std::unique_ptr<SoftwareMap> map_;

 private:
  std::shared_ptr<VendRuntime> previousRuntime_;
  int runtimes_ = 0;
};

}  // namespace larder::testing
