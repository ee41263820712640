// Operations, their queue, and the provider that reads the store's
// property list answers.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <stdexcept>
#include <thread>

#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/plist/PropertyListSerialization.h"
#include "store-runtime/records/TillDownload.h"
#include "store-runtime/services/VendOperation.h"
#include "store-runtime/services/VendOperationQueue.h"
#include "store-runtime/services/VendPropertyListProvider.h"

namespace larder {
namespace {

using namespace std::chrono_literals;

VendStoreClient testClient() {
  return VendStoreClient::initWithStoreClientType(0);
}

// An operation whose run is whatever the test says.
class ScriptedOperation : public VendOperation {
 public:
  explicit ScriptedOperation(std::function<void(ScriptedOperation&)> body)
      : VendOperation(testClient()), body_(std::move(body)) {}
  std::atomic<int> runs{0};
  std::atomic<std::thread::id> thread;

  using VendOperation::setError;
  using VendOperation::setSuccess;

 protected:
  void run() override {
    ++runs;
    thread = std::this_thread::get_id();
    body_(*this);
  }

 private:
  std::function<void(ScriptedOperation&)> body_;
};

class RecordingDelegate : public VendOperationDelegate {
 public:
  void operationFailedWithError(VendOperation&, const VendError& error) override {
    failures.push_back(error);
  }
  void operationFinished(VendOperation&) override { ++finished; }
  std::vector<VendError> failures;
  int finished = 0;
};

VendError errorWithCode(std::int64_t code) {
  return VendError{.code = code, .description = "failure " + std::to_string(code)};
}

// Whatever the run does, its outcome reaches the handler and the delegate
// once, and a second run gives the recorded outcome without running again.
// An exception is a failure, not a crash; whether it comes with an error is
// left open here.
TEST(VendOperation, OutcomeReachesHandlerAndDelegateOnceAndTheOperationNeverRunsTwice) {
  const struct {
    const char* name;
    std::function<void(ScriptedOperation&)> body;
    bool success;
    std::optional<std::int64_t> code;
  } cases[] = {
      {"success", [](ScriptedOperation& self) { self.setSuccess(true); }, true, std::nullopt},
      {"error without success", [](ScriptedOperation& self) { self.setError(errorWithCode(9)); },
       false, 9},
      {"exception after success",
       [](ScriptedOperation& self) {
         self.setSuccess(true);
         throw std::runtime_error("archive damaged");
       },
       false, std::nullopt},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    auto operation = std::make_shared<ScriptedOperation>(c.body);
    auto delegate = std::make_shared<RecordingDelegate>();
    operation->setDelegate(delegate);
    std::vector<bool> handled;
    operation->setCompletionHandler(
        [&](VendOperation&, bool success, const OptionalError&) { handled.push_back(success); });
    for (int run = 0; run < 2; ++run) {
      OptionalError error;
      EXPECT_EQ(operation->runSyncReturningError(&error), c.success);
      if (c.success) {
        EXPECT_FALSE(error);
      }
      if (c.code) {
        ASSERT_TRUE(error);
        EXPECT_EQ(error->code, *c.code);
      }
    }
    EXPECT_EQ(operation->runs, 1);
    EXPECT_EQ(handled, std::vector<bool>{c.success});
    EXPECT_EQ(delegate->finished, 1);
    if (c.success || c.code) {
      EXPECT_EQ(delegate->failures.size(), c.code ? 1u : 0u);
    }
  }
}

// An exception thrown after the operation declared success must still leave an error that
// names it, for callers and for the delegate.
TEST(VendOperation, AnExceptionAfterSuccessFailsWithAnError) {
  auto operation = std::make_shared<ScriptedOperation>([](ScriptedOperation& self) {
    self.setSuccess(true);
    throw std::runtime_error("archive damaged");
  });
  auto delegate = std::make_shared<RecordingDelegate>();
  operation->setDelegate(delegate);
  OptionalError handled;
  operation->setCompletionHandler(
      [&](VendOperation&, bool, const OptionalError& error) { handled = error; });
  OptionalError error;
  EXPECT_FALSE(operation->runSyncReturningError(&error));
  ASSERT_TRUE(error) << "a failure with no error";
  EXPECT_NE(error->description.find("archive damaged"), std::string::npos);
  EXPECT_TRUE(handled) << "the handler is told of a failure with no error";
  EXPECT_EQ(delegate->failures.size(), 1u);
}

TEST(VendOperation, SubOperationGivesItsOutcomeWithoutChangingTheOuterOne) {
  std::int64_t innerBagType = 0;
  auto inner = std::make_shared<ScriptedOperation>([&](ScriptedOperation& self) {
    innerBagType = self.requiredBagType();
    self.setError(errorWithCode(11));
  });
  bool innerResult = true;
  OptionalError innerError;
  std::thread::id outerThread;
  auto outer = std::make_shared<ScriptedOperation>([&](ScriptedOperation& self) {
    outerThread = std::this_thread::get_id();
    innerResult = self.runSubOperation(*inner, &innerError);
    self.setSuccess(true);
  });
  outer->setRequiredBagType(1);
  EXPECT_TRUE(outer->runSyncReturningError(nullptr));
  EXPECT_EQ(innerBagType, 1) << "the inner work reads the outer one's bag";
  EXPECT_FALSE(innerResult);
  ASSERT_TRUE(innerError);
  EXPECT_EQ(innerError->code, 11);
  EXPECT_EQ(inner->thread.load(), outerThread);
  EXPECT_TRUE(outer->success());
  EXPECT_FALSE(outer->error());
}

TEST(VendOperation, CancellingTheOuterOperationReachesItsSubOperation) {
  bool innerSawCancel = false;
  auto inner = std::make_shared<ScriptedOperation>(
      [&](ScriptedOperation& self) { innerSawCancel = self.isCancelled(); });
  auto outer = std::make_shared<ScriptedOperation>([&](ScriptedOperation& self) {
    self.cancel();
    self.runSubOperation(*inner, nullptr);
  });
  outer->runSyncReturningError(nullptr);
  EXPECT_TRUE(innerSawCancel);
  EXPECT_FALSE(inner->isCancelled());  // only while it ran inside the cancelled one
}

// Every operation waits for one it adds to the same queue, twenty levels
// deep, while other chains do the same: a queue with a fixed set of
// threads would deadlock here.
TEST(VendOperationQueue, OperationsWaitingForOperationsOnTheSameQueueDoNotDeadlock) {
  VendOperationQueue queue("nested");
  constexpr int kDepth = 20;
  constexpr int kChains = 6;
  std::atomic<int> completed{0};
  std::function<std::shared_ptr<ScriptedOperation>(int)> chain = [&](int depth) {
    return std::make_shared<ScriptedOperation>([&, depth](ScriptedOperation& self) {
      if (depth > 0) {
        DispatchSemaphore done;
        auto next = chain(depth - 1);
        next->setCompletionHandler(
            [&](VendOperation&, bool, const OptionalError&) { done.signal(); });
        queue.addOperation(next);
        ASSERT_TRUE(done.waitFor(10s)) << "nested operation never ran";
      }
      ++completed;
      self.setSuccess(true);
    });
  };
  for (int i = 0; i < kChains; ++i) queue.addOperation(chain(kDepth));
  queue.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(completed, kChains * (kDepth + 1));
}

TEST(VendOperationQueue, RunsOffTheCallersThreadOnThreadsThatLeaveWhenIdle) {
  VendOperationQueue queue("idle", 50ms);
  for (int i = 0; i < 4; ++i) {
    queue.addOperation(std::make_shared<ScriptedOperation>([](ScriptedOperation& self) {
      std::this_thread::sleep_for(20ms);
      self.setSuccess(true);
    }));
  }
  queue.waitUntilAllOperationsAreFinished();
  EXPECT_GE(queue.threadCount(), 1U);
  const auto deadline = std::chrono::steady_clock::now() + 5s;
  while (queue.threadCount() > 0 && std::chrono::steady_clock::now() < deadline)
    std::this_thread::sleep_for(10ms);
  EXPECT_EQ(queue.threadCount(), 0U);
  auto late =
      std::make_shared<ScriptedOperation>([](ScriptedOperation& self) { self.setSuccess(true); });
  queue.addOperation(late);
  queue.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(late->runs, 1);
  EXPECT_NE(late->thread.load(), std::this_thread::get_id());
  EXPECT_EQ(queue.operationCount(), 0U);
}

PlistData bytes(const std::string& text) {
  return {text.begin(), text.end()};
}

PlistData xml(const PlistValue& value) {
  return bytes(PropertyListSerialization::writeXml(value));
}

PlistDictionary downloadEntry(std::uint64_t item) {
  return PlistDictionary{
      {"metadata",
       PlistDictionary{
           {"itemIdentifier", item}, {"bundleIdentifier", "com.example.A"}, {"title", "A"}}},
      {"assets", PlistArray{PlistDictionary{{"type", 10},
                                            {"URL", "http://127.0.0.1:1/assets/1/A.tar"},
                                            {"fileSize", 4},
                                            {"numberOfBytesToHash", 4},
                                            {"hashes", PlistArray{std::string(64, 'a')}}}}}};
}

VendPropertyListProvider provider() {
  VendPropertyListProvider made(VendStoreClient::initWithStoreClientType(0));
  made.setShouldTriggerDownloads(false);
  return made;
}

TEST(VendPropertyListProvider, AnswersThatAreNotPropertyListsGiveAnErrorAndNoOutput) {
  for (const std::string& text :
       {std::string(), std::string("<html>busy</html>"), std::string("bplist00\xff\xff"),
        std::string("<plist><dict><key>a</key></plist>")}) {
    auto parser = provider();
    OptionalError error;
    EXPECT_FALSE(parser.parseData(bytes(text), &error)) << text;
    ASSERT_TRUE(error) << text;
    EXPECT_FALSE(error->description.empty());
    EXPECT_TRUE(parser.output().isNull());
  }
}

TEST(VendPropertyListProvider, TheProtocolSwitchDecidesWhetherAStoreFailureFailsTheParse) {
  const PlistData answer = xml(PlistDictionary{{"failureType", "item-unavailable"},
                                               {"customerMessage", "This item is gone."}});
  auto obeying = provider();
  OptionalError error;
  EXPECT_FALSE(obeying.parseData(answer, &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->description, "This item is gone.");
  EXPECT_EQ(*PlistValue(error->userInfo)["failureType"].string(), "item-unavailable");

  auto ignoring = provider();
  ignoring.setShouldProcessProtocol(false);
  error.reset();
  EXPECT_TRUE(ignoring.parseData(answer, &error));
  EXPECT_FALSE(error);
  EXPECT_EQ(*ignoring.output()["customerMessage"].string(), "This item is gone.");
}

TEST(VendPropertyListProvider, DownloadsAreTakenUpOnlyWhenAskedAndMalformedOnesAreSkipped) {
  const PlistData answer = xml(PlistDictionary{
      {"downloads", PlistArray{downloadEntry(11), PlistValue("junk"),
                               PlistDictionary{{"metadata", 3}}, downloadEntry(12)}}});
  auto taking = provider();
  ASSERT_TRUE(taking.parseData(answer, nullptr));
  ASSERT_EQ(taking.downloads().size(), 2U);
  EXPECT_EQ(taking.downloads()[0]->metadata().itemIdentifier(), 11U);
  EXPECT_EQ(taking.downloads()[1]->metadata().itemIdentifier(), 12U);

  auto leaving = provider();
  leaving.setShouldProcessDownloads(false);
  ASSERT_TRUE(leaving.parseData(answer, nullptr));
  EXPECT_TRUE(leaving.downloads().empty());
  EXPECT_EQ(leaving.output()["downloads"].array()->size(), 4U);  // the output is the whole answer

  // A provider configured from another takes its switches, and migrating
  // takes over its results.
  auto configured = provider();
  configured.configureFromProvider(leaving);
  EXPECT_FALSE(configured.shouldProcessDownloads());
  EXPECT_FALSE(configured.shouldTriggerDownloads());
  configured.migrateOutputFromSubProvider(taking);
  EXPECT_EQ(configured.downloads().size(), 2U);
  EXPECT_EQ(configured.output(), taking.output());
}

}  // namespace
}  // namespace larder
