#include "platform/dispatch/DispatchQueue.h"
#include "platform/dispatch/QueueConfined.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <fstream>
#include <map>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/dispatch/DispatchSemaphore.h"

namespace larder {
namespace {

using namespace std::chrono_literals;
using Kind = DispatchQueue::Kind;
using Clock = std::chrono::steady_clock;
using ::testing::HasSubstr;

// Waits that must succeed get this long, so that a fault fails the test instead of hanging it.
constexpr auto kGenerous = 5s;

std::shared_ptr<DispatchQueue> makeQueue(Kind kind, std::string label = "test") {
  return DispatchQueue::create(std::move(label), kind);
}

// A meeting point for `parties` threads; a thread that waits in vain gets false back instead of
// blocking forever, so that a queue that fails to overlap its items fails the test.
class Rendezvous {
 public:
  explicit Rendezvous(int parties) : missing_(parties) {}

  bool arriveAndWaitFor(Clock::duration timeout) {
    std::unique_lock lock(mutex_);
    if (--missing_ == 0) {
      allArrived_.notify_all();
      return true;
    }
    return allArrived_.wait_for(lock, timeout, [this] { return missing_ <= 0; });
  }

 private:
  std::mutex mutex_;
  std::condition_variable allArrived_;
  int missing_;
};

// Runs `work` on its own thread and tells whether it returned within `timeout`. When it did not,
// the thread is left behind: the test has failed and must not hang as well.
bool completesWithin(Clock::duration timeout, std::function<void()> work) {
  auto finished = std::make_shared<DispatchSemaphore>();
  std::thread runner([finished, work = std::move(work)] {
    work();
    finished->signal();
  });
  if (finished->waitFor(timeout)) {
    runner.join();
    return true;
  }
  runner.detach();
  return false;
}

bool eventually(const std::function<bool()>& condition, Clock::duration timeout = kGenerous) {
  const auto giveUpAt = Clock::now() + timeout;
  while (!condition()) {
    if (Clock::now() > giveUpAt) return false;
    std::this_thread::sleep_for(1ms);
  }
  return true;
}

// The kernel's id of the calling thread, which names it in /proc.
pid_t threadId() {
  return static_cast<pid_t>(::syscall(SYS_gettid));
}

// Waits until thread `tid` of this process sleeps in a wait, or has ended. A thread that must
// block somewhere has then got as far as it can: checks that something did not happen before
// that point need no pause of a guessed length.
bool eventuallyAsleep(pid_t tid) {
  return eventually([tid] {
    std::ifstream stat("/proc/self/task/" + std::to_string(tid) + "/stat");
    std::string text;
    if (!std::getline(stat, text)) return true;
    const std::size_t nameEnd = text.rfind(')');
    return nameEnd != std::string::npos && text.compare(nameEnd + 2, 1, "S") == 0;
  });
}

// A thread that tells who it is before it runs `work`, so that the test can wait for it to block.
class Caller {
 public:
  explicit Caller(std::function<void()> work)
      : thread_([this, work = std::move(work)] {
          id_ = threadId();
          known_.signal();
          work();
        }) {}
  ~Caller() { join(); }
  Caller(const Caller&) = delete;
  Caller& operator=(const Caller&) = delete;

  [[nodiscard]] bool blocked() {
    known_.wait();
    known_.signal();
    return eventuallyAsleep(id_);
  }
  void join() {
    if (thread_.joinable()) thread_.join();
  }

 private:
  std::atomic<pid_t> id_{0};
  DispatchSemaphore known_;
  std::thread thread_;
};

// An item that holds its queue until released.
struct Hold {
  DispatchSemaphore started;
  DispatchSemaphore release;
  std::function<void()> item() {
    return [this] {
      started.signal();
      release.wait();
    };
  }
};

std::string kindName(const ::testing::TestParamInfo<Kind>& info) {
  return info.param == Kind::Serial ? "Serial" : "Concurrent";
}

// Half the producers mix in sync items, which keep their place as well; the other half queue
// only asynchronous items, so that some of those follow each other directly.
TEST(SerialQueue, ItemsFromSeveralThreadsRunOneAtATimeInSubmissionOrder) {
  constexpr int kProducers = 4;
  constexpr int kItemsEach = 300;
  auto queue = makeQueue(Kind::Serial);
  // Deliberately unsynchronised: the queue alone must keep its items apart.
  std::vector<std::pair<int, int>> ran;
  std::atomic<int> inside{0};
  std::atomic<bool> overlapped{false};

  std::vector<std::thread> producers;
  for (int producer = 0; producer < kProducers; ++producer) {
    producers.emplace_back([&, producer] {
      for (int sequence = 0; sequence < kItemsEach; ++sequence) {
        auto item = [&, producer, sequence] {
          if (inside.fetch_add(1) != 0) overlapped = true;
          ran.emplace_back(producer, sequence);
          inside.fetch_sub(1);
        };
        if (producer % 2 == 1 && sequence % 2 == 0) {
          queue->sync(item);
        } else {
          queue->async(item);
        }
      }
    });
  }
  for (auto& producer : producers) producer.join();
  queue->sync([] {});

  EXPECT_FALSE(overlapped);
  ASSERT_EQ(ran.size(), std::size_t{kProducers * kItemsEach});
  std::vector<int> nextExpected(kProducers, 0);
  for (const auto& [producer, sequence] : ran) {
    ASSERT_EQ(sequence, nextExpected[producer]) << "producer " << producer;
    ++nextExpected[producer];
  }
}

TEST(SerialQueue, SyncWaitsWhileAnEarlierItemIsStillRunning) {
  auto queue = makeQueue(Kind::Serial);
  DispatchSemaphore firstStarted;
  DispatchSemaphore releaseFirst;
  bool firstFinished = false;
  queue->async([&] {
    firstStarted.signal();
    releaseFirst.wait();
    firstFinished = true;
  });
  ASSERT_TRUE(firstStarted.waitFor(kGenerous));

  bool sawFirstFinished = false;
  Caller caller([&] { queue->sync([&] { sawFirstFinished = firstFinished; }); });
  // A sync that does not wait has run its block by the time its caller sleeps or ends.
  ASSERT_TRUE(caller.blocked());
  releaseFirst.signal();
  caller.join();
  EXPECT_TRUE(sawFirstFinished);
}

TEST(SerialQueue, ItemsQueuedDuringASyncBlockWaitForItToReturn) {
  auto queue = makeQueue(Kind::Serial);
  bool blockReturned = false;  // unsynchronised on purpose: the queue orders the accesses
  bool laterItemSawTheReturn = false;
  DispatchSemaphore laterItemDone;
  queue->sync([&] {
    queue->async([&] {
      laterItemSawTheReturn = blockReturned;
      laterItemDone.signal();
    });
    // Workers start as items are let in: one let in too early already shows in the count.
    EXPECT_EQ(queue->workerThreadCount(), 0u) << "item queued during a sync block let in";
    blockReturned = true;
  });
  ASSERT_TRUE(laterItemDone.waitFor(kGenerous));
  EXPECT_TRUE(laterItemSawTheReturn);
}

TEST(SerialQueue, BarrierItemsKeepTheSameSingleOrder) {
  auto queue = makeQueue(Kind::Serial);
  std::vector<int> order;
  queue->async([&] { order.push_back(1); });
  queue->barrierAsync([&] { order.push_back(2); });
  queue->sync([&] { order.push_back(3); });
  queue->async([&] { order.push_back(4); });
  queue->barrierSync([&] { order.push_back(5); });
  EXPECT_EQ(order, (std::vector<int>{1, 2, 3, 4, 5}));
}

// A sync reader meets another sync reader, or an asynchronous item, inside the queue at once.
TEST(ConcurrentQueue, SyncReadersOverlapOtherReaders) {
  for (const bool otherIsAsync : {false, true}) {
    SCOPED_TRACE(otherIsAsync ? "async item" : "sync reader");
    auto queue = makeQueue(Kind::Concurrent);
    Rendezvous both(2);
    std::atomic<int> met{0};
    auto meet = [&] { met += both.arriveAndWaitFor(2s) ? 1 : 0; };
    DispatchSemaphore otherDone;
    std::thread otherThread;
    if (otherIsAsync) {
      queue->async([&] {
        meet();
        otherDone.signal();
      });
    } else {
      otherThread = std::thread([&] {
        queue->sync(meet);
        otherDone.signal();
      });
    }
    queue->sync(meet);
    ASSERT_TRUE(otherDone.waitFor(kGenerous));
    if (otherThread.joinable()) otherThread.join();
    EXPECT_EQ(met, 2);
  }
}

TEST(ConcurrentQueue, AsyncItemsRunInParallelUpToTheWorkerLimit) {
  auto queue = DispatchQueue::create("wide", Kind::Concurrent, {.concurrentWorkers = 3});
  DispatchSemaphore started;
  DispatchSemaphore release;
  Rendezvous allThree(3);
  std::atomic<int> met{0};
  for (int i = 0; i < 3; ++i) {
    queue->async([&] {
      met += allThree.arriveAndWaitFor(2s) ? 1 : 0;
      started.signal();
      release.wait();
    });
  }
  std::atomic<bool> fourthStarted{false};
  DispatchSemaphore fourthDone;
  queue->async([&] {
    fourthStarted = true;
    fourthDone.signal();
  });
  for (int i = 0; i < 3; ++i) ASSERT_TRUE(started.waitFor(kGenerous));
  EXPECT_EQ(met, 3);
  // Workers start as items are let in, so a fourth worker would already be counted.
  EXPECT_EQ(queue->workerThreadCount(), 3u) << "more workers than the queue's limit";
  EXPECT_FALSE(fourthStarted) << "more items ran at once than the queue's worker limit";
  for (int i = 0; i < 3; ++i) release.signal();
  EXPECT_TRUE(fourthDone.waitFor(kGenerous));
  // The workers may still be returning from `release`: let them finish before it goes away.
  queue->barrierSync([] {});
}

TEST(ConcurrentQueue, BarrierWaitsForEveryReaderQueuedBeforeIt) {
  auto queue = makeQueue(Kind::Concurrent);
  DispatchSemaphore readerInside;
  DispatchSemaphore releaseSyncReaders;
  DispatchSemaphore releaseAsyncReader;
  std::atomic<int> readersFinished{0};
  auto holdingReader = [&](DispatchSemaphore& release) {
    return [&] {
      readerInside.signal();
      release.wait();
      readersFinished.fetch_add(1);
    };
  };
  std::thread syncReaderA([&] { queue->sync(holdingReader(releaseSyncReaders)); });
  std::thread syncReaderB([&] { queue->sync(holdingReader(releaseSyncReaders)); });
  std::atomic<pid_t> worker{0};
  queue->async([&, reader = holdingReader(releaseAsyncReader)] {
    worker = threadId();
    reader();
  });
  for (int i = 0; i < 3; ++i) ASSERT_TRUE(readerInside.waitFor(kGenerous));

  std::atomic<int> finishedWhenBarrierRan{-1};
  DispatchSemaphore barrierRan;
  queue->barrierAsync([&] {
    finishedWhenBarrierRan = readersFinished.load();
    barrierRan.signal();
  });
  std::atomic<int> finishedWhenSyncBarrierRan{-1};
  Caller syncBarrier(
      [&] { queue->barrierSync([&] { finishedWhenSyncBarrierRan = readersFinished.load(); }); });

  // Workers start as items are let in: a barrier let in too early would need a second one.
  ASSERT_TRUE(syncBarrier.blocked());
  EXPECT_EQ(queue->workerThreadCount(), 1u) << "barrier started while readers were inside";
  releaseAsyncReader.signal();
  // The worker sleeps again once it has run all it may.
  ASSERT_TRUE(eventually([&] { return readersFinished == 1; }));
  ASSERT_TRUE(eventuallyAsleep(worker));
  EXPECT_FALSE(barrierRan.waitFor(0ms)) << "barrier started while sync readers were inside";
  // Nothing but the sync readers leaving can let the barriers in now.
  releaseSyncReaders.signal();
  releaseSyncReaders.signal();
  EXPECT_TRUE(barrierRan.waitFor(kGenerous));
  syncReaderA.join();
  syncReaderB.join();
  syncBarrier.join();
  EXPECT_EQ(finishedWhenBarrierRan, 3);
  EXPECT_EQ(finishedWhenSyncBarrierRan, 3);
}

TEST(ConcurrentQueue, ItemsQueuedAfterABarrierWaitForItAndSeeItsEffect) {
  auto queue = makeQueue(Kind::Concurrent);
  DispatchSemaphore earlyReaderInside;
  DispatchSemaphore releaseEarlyReader;
  std::thread earlyReader([&] {
    queue->sync([&] {
      earlyReaderInside.signal();
      releaseEarlyReader.wait();
    });
  });
  ASSERT_TRUE(earlyReaderInside.waitFor(kGenerous));

  int value = 0;  // unsynchronised on purpose: the queue orders the accesses
  queue->barrierAsync([&] { value = 42; });

  int seenBySyncReader = -1;
  Caller lateSyncReader([&] { queue->sync([&] { seenBySyncReader = value; }); });
  int seenByAsyncReader = -1;
  DispatchSemaphore asyncReaderDone;
  queue->async([&] {
    seenByAsyncReader = value;
    asyncReaderDone.signal();
  });

  // A reader passing the barrier would have read by the time the other sleeps, and the
  // asynchronous one would have had a worker started for it.
  ASSERT_TRUE(lateSyncReader.blocked());
  EXPECT_EQ(queue->workerThreadCount(), 0u) << "reader passed a pending barrier";
  releaseEarlyReader.signal();
  earlyReader.join();
  lateSyncReader.join();
  ASSERT_TRUE(asyncReaderDone.waitFor(kGenerous));
  EXPECT_EQ(seenBySyncReader, 42);
  EXPECT_EQ(seenByAsyncReader, 42);
}

TEST(ConcurrentQueue, BarrierIsNotStarvedByAnEndlessRelayOfReaders) {
  auto queue = makeQueue(Kind::Concurrent);
  std::atomic<int> inside{0};
  std::atomic<int> entries{0};
  std::atomic<bool> stopReaders{false};
  // Each reader leaves only while the other one is inside, so that a queue which lets readers
  // pass a pending barrier never has a moment without a reader. A fair queue holds the next
  // reader back; the one inside then gives up waiting and leaves.
  auto relayReader = [&] {
    while (!stopReaders) {
      queue->sync([&] {
        inside.fetch_add(1);
        entries.fetch_add(1);
        const auto giveUpAt = Clock::now() + 100ms;
        for (;;) {
          int bothInside = 2;
          if (inside.compare_exchange_weak(bothInside, 1)) return;
          if (Clock::now() > giveUpAt) {
            inside.fetch_sub(1);
            return;
          }
          std::this_thread::yield();
        }
      });
    }
  };
  std::thread readerA(relayReader);
  std::thread readerB(relayReader);
  ASSERT_TRUE(eventually([&] { return entries >= 20; }));

  DispatchSemaphore barrierRan;
  queue->barrierAsync([&] { barrierRan.signal(); });
  const bool barrierGotIn = barrierRan.waitFor(2s);
  const bool syncBarrierGotIn = completesWithin(2s, [&] { queue->barrierSync([] {}); });
  stopReaders = true;
  readerA.join();
  readerB.join();
  EXPECT_TRUE(barrierGotIn);
  EXPECT_TRUE(syncBarrierGotIn);
}

TEST(ConcurrentQueue, ReadersAndBarriersUnderLoadNeverOverlap) {
  auto queue = makeQueue(Kind::Concurrent);
  // Unsynchronised on purpose; barriers move one unit between two keys in two steps, so a reader
  // overlapping a barrier may see a total that is off by one (and the thread sanitizer sees the
  // race).
  std::map<int, int> table{{0, 100}, {1, 100}, {2, 100}, {3, 100}};
  constexpr int kTotal = 400;
  std::atomic<int> readersInside{0};
  std::atomic<bool> barrierInside{false};
  std::atomic<int> violations{0};
  std::atomic<int> barriersRun{0};

  auto read = [&] {
    readersInside.fetch_add(1);
    if (barrierInside) violations.fetch_add(1);
    int sum = 0;
    for (const auto& [key, amount] : table) sum += amount;
    if (sum != kTotal) violations.fetch_add(1);
    readersInside.fetch_sub(1);
  };
  auto write = [&](int step) {
    barrierInside = true;
    if (readersInside != 0) violations.fetch_add(1);
    table[step % 4] -= 1;
    std::this_thread::yield();  // widens the window in which an overlapping reader would look
    table[(step + 1) % 4] += 1;
    barrierInside = false;
    barriersRun.fetch_add(1);
  };

  std::atomic<bool> writerDone{false};
  std::vector<std::thread> threads;
  for (int t = 0; t < 3; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < 300 || !writerDone; ++i) queue->sync(read);
    });
  }
  threads.emplace_back([&] {
    for (int i = 0; i < 150; ++i) {
      if (i % 3 == 0) {
        queue->barrierSync([&] { write(i); });
      } else if (i % 3 == 1) {
        queue->barrierAsync([&, i] { write(i); });
      } else {
        queue->async(read);
      }
    }
    writerDone = true;
  });
  for (auto& thread : threads) thread.join();
  queue->barrierSync([] {});
  EXPECT_EQ(violations, 0);
  EXPECT_EQ(barriersRun, 100);
}

TEST(ConcurrentQueue, ReaderHeldBackByABarrierIsNotHeldBackByTheWorkerLimit) {
  auto queue = DispatchQueue::create("narrow", Kind::Concurrent, {.concurrentWorkers = 1});
  Hold barrier;
  queue->barrierAsync(barrier.item());
  ASSERT_TRUE(barrier.started.waitFor(kGenerous));
  Hold async;
  queue->async(async.item());
  queue->async([] {});  // waits for the only worker
  DispatchSemaphore readerDone;
  Caller reader([&] {
    queue->sync([] {});
    readerDone.signal();
  });
  ASSERT_TRUE(reader.blocked());  // queued up behind the barrier
  barrier.release.signal();
  ASSERT_TRUE(async.started.waitFor(kGenerous));
  EXPECT_TRUE(readerDone.waitFor(kGenerous)) << "reader waited for a worker it does not need";
  async.release.signal();
  reader.join();
  queue->barrierSync([] {});  // the worker may still be returning from `releaseAsync`
}

class EveryQueueKind : public ::testing::TestWithParam<Kind> {};

INSTANTIATE_TEST_SUITE_P(DispatchQueue, EveryQueueKind,
                         ::testing::Values(Kind::Serial, Kind::Concurrent), kindName);

TEST_P(EveryQueueKind, SyncFromATaskOfAnotherQueueWorks) {
  auto outer = makeQueue(Kind::Serial, "outer");
  auto queue = makeQueue(GetParam(), "inner");
  auto innermost = makeQueue(Kind::Serial, "innermost");
  int value = 0;
  std::atomic<bool> bothCurrent{false};
  std::atomic<bool> allThreeCurrent{false};
  DispatchSemaphore done;
  outer->async([&] {
    queue->sync([&] {
      value = 1;
      bothCurrent = outer->isCurrent() && queue->isCurrent();
      innermost->sync([&] {
        allThreeCurrent = outer->isCurrent() && queue->isCurrent() && innermost->isCurrent();
      });
    });
    queue->barrierSync([&] { value += 1; });
    done.signal();
  });
  ASSERT_TRUE(done.waitFor(kGenerous));
  EXPECT_TRUE(bothCurrent);
  EXPECT_TRUE(allThreeCurrent);
  int seen = 0;
  queue->sync([&] { seen = value; });
  EXPECT_EQ(seen, 2);
}

TEST_P(EveryQueueKind, PendingItemsRunAfterTheLastReferenceIsDropped) {
  auto queue = makeQueue(GetParam());
  Hold first;
  queue->barrierAsync(first.item());
  constexpr int kItems = 60;
  std::atomic<int> ran{0};
  DispatchSemaphore allRan;
  auto countRun = [&] {
    if (ran.fetch_add(1) + 1 == kItems) allRan.signal();
  };
  for (int i = 0; i < kItems; ++i) {
    if (i % 20 == 10) {
      queue->barrierAsync(countRun);
    } else {
      queue->async(countRun);
    }
  }
  ASSERT_TRUE(first.started.waitFor(kGenerous));
  queue.reset();
  first.release.signal();
  EXPECT_TRUE(allRan.waitFor(kGenerous));
  EXPECT_EQ(ran, kItems);
}

TEST_P(EveryQueueKind, LastReferenceDroppedInsideItsOwnTask) {
  auto queue = makeQueue(GetParam());
  std::weak_ptr<DispatchQueue> weak = queue;
  // A barrier, so that on a concurrent queue too the next item waits for the handle to go.
  Hold blocker;
  queue->barrierAsync(blocker.item());
  DispatchSemaphore released;
  std::atomic<bool> expiredInside{false};
  queue->async([&released, &expiredInside, &weak, self = queue]() mutable {
    self.reset();
    expiredInside = weak.expired();
    released.signal();
  });
  ASSERT_TRUE(blocker.started.waitFor(kGenerous));
  queue.reset();
  blocker.release.signal();
  ASSERT_TRUE(released.waitFor(kGenerous));
  EXPECT_TRUE(expiredInside);
}

TEST_P(EveryQueueKind, LastReferenceReleasedWithAFinishedTaskCapture) {
  // The queue's last handle goes when the worker lets go of the finished item's captures.
  struct HandleHolder {
    HandleHolder(std::shared_ptr<DispatchQueue> handle, DispatchSemaphore& onRelease)
        : queue(std::move(handle)), released(&onRelease) {}
    HandleHolder(const HandleHolder&) = delete;
    HandleHolder& operator=(const HandleHolder&) = delete;
    std::shared_ptr<DispatchQueue> queue;
    DispatchSemaphore* released;
    ~HandleHolder() {
      queue.reset();
      released->signal();
    }
  };
  DispatchSemaphore released;
  auto queue = makeQueue(GetParam());
  std::weak_ptr<DispatchQueue> weak = queue;
  DispatchSemaphore ran;
  auto holder = std::make_shared<HandleHolder>(queue, released);
  queue->async([holder, &ran] { ran.signal(); });
  holder.reset();
  queue.reset();
  ASSERT_TRUE(ran.waitFor(kGenerous));
  ASSERT_TRUE(released.waitFor(kGenerous));
  EXPECT_TRUE(weak.expired());
}

TEST_P(EveryQueueKind, WorkersStartOnDemandAndExitWhenIdle) {
  auto queue =
      DispatchQueue::create("idle", GetParam(), {.concurrentWorkers = 2, .idleTimeout = 30ms});
  queue->sync([] {});
  queue->barrierSync([] {});
  EXPECT_EQ(queue->workerThreadCount(), 0u) << "synchronous work must not start workers";

  DispatchSemaphore ran;
  queue->async([&] { ran.signal(); });
  ASSERT_TRUE(ran.waitFor(kGenerous));
  EXPECT_GE(queue->workerThreadCount(), 1u);
  EXPECT_TRUE(eventually([&] { return queue->workerThreadCount() == 0; }));

  queue->async([&] { ran.signal(); });
  EXPECT_TRUE(ran.waitFor(kGenerous)) << "no worker came back for new work";
}

TEST_P(EveryQueueKind, IdleTimeoutWithoutLimitKeepsTheWorker) {
  auto queue = DispatchQueue::create("keeper", GetParam(),
                                     {.idleTimeout = std::chrono::milliseconds::max()});
  // A queue with a short timeout losing its worker shows an idle worker has had its chance to go.
  auto yardstick = DispatchQueue::create("yardstick", GetParam(), {.idleTimeout = 1ms});
  DispatchSemaphore ran;
  queue->async([&] { ran.signal(); });
  ASSERT_TRUE(ran.waitFor(kGenerous));
  yardstick->async([&] { ran.signal(); });
  ASSERT_TRUE(ran.waitFor(kGenerous));
  ASSERT_TRUE(eventually([&] { return yardstick->workerThreadCount() == 0; }));
  EXPECT_EQ(queue->workerThreadCount(), 1u);
  queue->async([&] { ran.signal(); });
  EXPECT_TRUE(ran.waitFor(kGenerous));
}

TEST_P(EveryQueueKind, AsyncItemThatThrowsIsReportedAndTheQueueGoesOn) {
  auto queue = makeQueue(GetParam(), "throwing-queue");
  DispatchSemaphore after;
  ::testing::internal::CaptureStderr();
  queue->async([] { throw std::runtime_error("boom from an async item"); });
  queue->barrierAsync([] { throw 7; });
  queue->barrierAsync([&] { after.signal(); });
  const bool wentOn = after.waitFor(kGenerous);
  const std::string errors = ::testing::internal::GetCapturedStderr();
  ASSERT_TRUE(wentOn);
  EXPECT_THAT(errors, HasSubstr("throwing-queue"));
  EXPECT_THAT(errors, HasSubstr("boom from an async item"));
  EXPECT_EQ(std::count(errors.begin(), errors.end(), '\n'), 2) << errors;
  int value = 0;
  queue->sync([&] { value = 1; });
  EXPECT_EQ(value, 1);
}

TEST_P(EveryQueueKind, SyncItemThatThrowsPropagatesAndReleasesTheQueueAlsoAfterWaiting) {
  auto queue = makeQueue(GetParam());
  EXPECT_THROW(queue->sync([] { throw std::runtime_error("reader"); }), std::runtime_error);
  EXPECT_FALSE(queue->isCurrent());
  EXPECT_TRUE(completesWithin(kGenerous, [&] { queue->barrierSync([] {}); }));
  EXPECT_THROW(queue->barrierSync([] { throw std::logic_error("writer"); }), std::logic_error);
  EXPECT_TRUE(completesWithin(kGenerous, [&] { queue->sync([] {}); }));
  DispatchSemaphore ran;
  queue->async([&] { ran.signal(); });
  EXPECT_TRUE(ran.waitFor(kGenerous));

  // Also when the block waited its turn behind a barrier.
  Hold barrier;
  queue->barrierAsync(barrier.item());
  ASSERT_TRUE(barrier.started.waitFor(kGenerous));
  std::atomic<bool> threw{false};
  Caller reader([&] {
    try {
      queue->sync([] { throw std::runtime_error("queued reader"); });
    } catch (const std::runtime_error&) {
      threw = true;
    }
  });
  ASSERT_TRUE(reader.blocked());
  barrier.release.signal();
  reader.join();
  EXPECT_TRUE(threw);
  EXPECT_TRUE(completesWithin(kGenerous, [&] { queue->barrierSync([] {}); }));
}

TEST_P(EveryQueueKind, IsCurrentOnlyWhileRunningATaskOfThatQueueAndSyncRunsOnTheCaller) {
  auto queue = makeQueue(GetParam());
  auto other = makeQueue(GetParam());
  const auto caller = std::this_thread::get_id();
  std::mutex mutex;
  std::string seen;  // each item as "name", "+" when the queue is current, "@" on the caller
  const auto note = [&](const char* name) {
    return [&, name] {
      std::lock_guard lock(mutex);
      seen += std::string(" ") + name + (queue->isCurrent() ? "+" : "") +
              (other->isCurrent() ? " other+" : "") +
              (std::this_thread::get_id() == caller ? "@" : "");
    };
  };
  EXPECT_FALSE(queue->isCurrent());
  queue->async([] {});
  queue->sync(note("sync"));
  queue->barrierSync(note("barrierSync"));
  DispatchSemaphore done;
  queue->async(note("async"));
  queue->barrierAsync([&, last = note("barrierAsync")] {
    last();
    done.signal();
  });
  ASSERT_TRUE(done.waitFor(kGenerous));
  std::lock_guard lock(mutex);
  EXPECT_EQ(seen, " sync+@ barrierSync+@ async+ barrierAsync+");
  EXPECT_FALSE(queue->isCurrent());
}

TEST_P(EveryQueueKind, EmptyWorkIsRejected) {
  auto queue = makeQueue(GetParam());
  EXPECT_THROW(queue->async(nullptr), std::invalid_argument);
  EXPECT_THROW(queue->sync(nullptr), std::invalid_argument);
  EXPECT_THROW(queue->barrierAsync(nullptr), std::invalid_argument);
  EXPECT_THROW(queue->barrierSync(nullptr), std::invalid_argument);
}

class EveryQueueKindDeathTest : public EveryQueueKind {};

INSTANTIATE_TEST_SUITE_P(DispatchQueue, EveryQueueKindDeathTest,
                         ::testing::Values(Kind::Serial, Kind::Concurrent), kindName);

TEST_P(EveryQueueKindDeathTest, ConfinedStateTouchedOffItsQueueAbortsInDebugBuilds) {
  auto queue = makeQueue(GetParam(), "confined");
  QueueConfined<std::vector<int>> numbers(queue, 1, 7);
  queue->sync([&] { numbers->push_back(8); });
  queue->sync([&] { EXPECT_EQ(*numbers, (std::vector<int>{7, 8})); });
#ifdef NDEBUG
  GTEST_SKIP() << "the check is compiled into debug builds only";
#else
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(numbers->clear(), "'confined' used outside it");
  // Another queue's task is outside it too.
  auto other = makeQueue(GetParam(), "other");
  EXPECT_DEATH(other->sync([&] { numbers->clear(); }), "'confined' used outside it");
#endif
}

TEST_P(EveryQueueKindDeathTest, SyncOnTheQueueOfTheRunningTaskAbortsInDebugBuilds) {
#ifdef NDEBUG
  GTEST_SKIP() << "the check is compiled into debug builds only";
#else
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  const char* const message = "'self-deadlock'.*already running on it";
  EXPECT_DEATH(
      {
        auto queue = makeQueue(GetParam(), "self-deadlock");
        queue->sync([&] { queue->sync([] {}); });
      },
      message);
  EXPECT_DEATH(
      {
        auto queue = makeQueue(GetParam(), "self-deadlock");
        queue->async([&] { queue->barrierSync([] {}); });
        DispatchSemaphore never;
        never.wait();
      },
      message);
#endif
}

TEST(DispatchSemaphore, EachSignalOrInitialCountReleasesExactlyOneWaitAndOtherwiseTimesOut) {
  DispatchSemaphore semaphore(1);
  semaphore.signal();
  semaphore.signal();
  EXPECT_TRUE(semaphore.waitFor(0ms));
  semaphore.wait();
  EXPECT_TRUE(semaphore.waitFor(0ms));
  const auto before = Clock::now();
  EXPECT_FALSE(semaphore.waitFor(20ms));
  EXPECT_GE(Clock::now() - before, 20ms);
}

// The signal comes once the waiter sleeps, so that it is the wake-up that ends the wait, with
// a timeout and with the longest one, which means none.
TEST(DispatchSemaphore, SignalFromAnotherThreadWakesASleepingWaiter) {
  DispatchSemaphore semaphore;
  const pid_t waiter = threadId();
  for (const Clock::duration timeout : {Clock::duration(kGenerous), Clock::duration::max()}) {
    std::atomic<bool> signalled{false};
    std::thread signaller([&] {
      EXPECT_TRUE(eventuallyAsleep(waiter));
      signalled = true;
      semaphore.signal();
    });
    EXPECT_TRUE(semaphore.waitFor(timeout));
    EXPECT_TRUE(signalled);
    signaller.join();
  }
  semaphore.signal();
  EXPECT_TRUE(semaphore.waitFor(Clock::duration::max()));
}

TEST(DispatchSemaphore, WaiterMayDestroyItRightAfterWaking) {
  // The usual in-line completion pattern: the semaphore lives on the waiter's stack.
  auto queue = makeQueue(Kind::Concurrent);
  for (int i = 0; i < 200; ++i) {
    auto semaphore = std::make_unique<DispatchSemaphore>();
    queue->async([raw = semaphore.get()] { raw->signal(); });
    semaphore->wait();
  }
  queue->barrierSync([] {});
}

}  // namespace
}  // namespace larder
