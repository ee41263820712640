#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <stdexcept>
#include <thread>

#include "platform/dispatch/DispatchSemaphore.h"
#include "store-runtime/services/VendOperation.h"
#include "store-runtime/services/VendOperationQueue.h"

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
  VendError error;
  error.code = code;
  error.description = "failure " + std::to_string(code);
  return error;
}

TEST(VendOperation, OutcomeReachesHandlerAndDelegateOnceAndTheOperationNeverRunsTwice) {
  auto operation =
      std::make_shared<ScriptedOperation>([](ScriptedOperation& self) { self.setSuccess(true); });
  auto delegate = std::make_shared<RecordingDelegate>();
  operation->setDelegate(delegate);
  int handlerCalls = 0;
  operation->setCompletionHandler([&](VendOperation&, bool success, const OptionalError& error) {
    ++handlerCalls;
    EXPECT_TRUE(success);
    EXPECT_FALSE(error);
  });
  OptionalError error;
  EXPECT_TRUE(operation->runSyncReturningError(&error));
  EXPECT_FALSE(error);
  EXPECT_TRUE(operation->runSyncReturningError(&error));  // the recorded outcome, no second run
  EXPECT_EQ(operation->runs, 1);
  EXPECT_EQ(handlerCalls, 1);
  EXPECT_EQ(delegate->finished, 1);
  EXPECT_TRUE(delegate->failures.empty());
}

TEST(VendOperation, RunWithoutSuccessFailsAndAnExceptionIsAFailureNotACrash) {
  auto silent = std::make_shared<ScriptedOperation>(
      [](ScriptedOperation& self) { self.setError(errorWithCode(9)); });
  auto delegate = std::make_shared<RecordingDelegate>();
  silent->setDelegate(delegate);
  OptionalError error;
  EXPECT_FALSE(silent->runSyncReturningError(&error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, 9);
  ASSERT_EQ(delegate->failures.size(), 1U);
  EXPECT_EQ(delegate->finished, 1);

  auto throwing = std::make_shared<ScriptedOperation>([](ScriptedOperation& self) {
    self.setSuccess(true);
    throw std::runtime_error("archive damaged");
  });
  bool handled = false;
  throwing->setCompletionHandler([&](VendOperation&, bool success, const OptionalError&) {
    handled = true;
    EXPECT_FALSE(success);
  });
  EXPECT_FALSE(throwing->runSyncReturningError(nullptr));
  EXPECT_TRUE(handled);
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

TEST(VendOperationQueue, OperationsRunOffTheCallersThread) {
  VendOperationQueue queue("test");
  auto operation =
      std::make_shared<ScriptedOperation>([](ScriptedOperation& self) { self.setSuccess(true); });
  queue.addOperation(operation);
  queue.waitUntilAllOperationsAreFinished();
  EXPECT_EQ(operation->runs, 1);
  EXPECT_NE(operation->thread.load(), std::this_thread::get_id());
  EXPECT_EQ(queue.operationCount(), 0U);
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

TEST(VendOperationQueue, IdleThreadsLeaveAndAreReplacedOnDemand) {
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
}

}  // namespace
}  // namespace larder
