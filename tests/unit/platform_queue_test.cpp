#include <signal.h>
#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <mutex>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "platform/Queue.h"

using namespace platform;
using namespace std::chrono_literals;

namespace {

// A counter threads can wait on; the long timeout only turns a hang into a
// failure.
class Gate {
 public:
  void arrive() {
    std::lock_guard lock(mutex_);
    ++count_;
    changed_.notify_all();
  }
  bool waitFor(int count) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, 30s, [&] { return count_ >= count; });
  }
  int count() {
    std::lock_guard lock(mutex_);
    return count_;
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  int count_ = 0;
};

// Gives a queue that wrongly runs suspended work the chance to do so.
void letWrongWorkRun() { std::this_thread::sleep_for(20ms); }

int niceOfWorker(Queue& queue) {
  int nice = 0;
  queue.sync([&] {
    nice = getpriority(PRIO_PROCESS, static_cast<id_t>(gettid()));
  });
  return nice;
}

TEST(SerialQueue, RunsItemsOneAtATimeInOrderPerProducer) {
  auto queue = makeSerialQueue("test.serial");
  constexpr int kProducers = 4, kItems = 400;
  std::vector<std::pair<int, int>> seen;  // touched only by the queue's worker
  std::atomic<int> running{0};
  std::atomic<bool> overlapped{false};
  std::vector<std::thread> producers;
  for (int p = 0; p < kProducers; ++p) {
    producers.emplace_back([&, p] {
      for (int i = 0; i < kItems; ++i) {
        queue->async([&, p, i] {
          if (running.fetch_add(1) != 0) overlapped = true;
          seen.emplace_back(p, i);
          running.fetch_sub(1);
        });
      }
    });
  }
  for (auto& t : producers) t.join();
  queue->sync([] {});
  ASSERT_EQ(seen.size(), size_t{kProducers * kItems});
  EXPECT_FALSE(overlapped);
  std::vector<int> next(kProducers, 0);
  for (auto [p, i] : seen) EXPECT_EQ(i, next[p]++) << "producer " << p;
}

TEST(SerialQueue, SuspendKeepsItemsAndNests) {
  auto queue = makeSerialQueue("test.suspend");
  queue->resume();  // unbalanced: ignored
  std::atomic<int> ran{0};
  queue->suspend();
  queue->suspend();
  for (int i = 0; i < 3; ++i) queue->async([&] { ++ran; });
  letWrongWorkRun();
  EXPECT_EQ(ran, 0);
  queue->resume();
  letWrongWorkRun();
  EXPECT_EQ(ran, 0) << "one resume must not undo two suspends";
  queue->resume();
  queue->sync([] {});
  EXPECT_EQ(ran, 3);
}

TEST(SerialQueue, SyncRunsOnTheWorkerAndInlineFromItsOwnWork) {
  auto queue = makeSerialQueue("test.sync");
  std::thread::id worker, inner;
  queue->sync([&] {
    worker = std::this_thread::get_id();
    queue->sync([&] { inner = std::this_thread::get_id(); });
  });
  EXPECT_NE(worker, std::this_thread::get_id());
  EXPECT_EQ(inner, worker);
}

TEST(SerialQueue, WorkThatThrowsDoesNotStopTheQueue) {
  auto queue = makeSerialQueue("test.throw");
  queue->async([] { throw std::runtime_error("boom"); });
  bool ran = false;
  queue->sync([&] { ran = true; });
  EXPECT_TRUE(ran);
}

TEST(SerialQueue, BackgroundPriorityRaisesTheWorkersNiceValue) {
  auto normal = makeSerialQueue("test.normal");
  auto background = makeSerialQueue("test.background", QueuePriority::Background);
  int base = niceOfWorker(*normal);
  if (base >= 19) GTEST_SKIP() << "already at the lowest priority";
  EXPECT_GT(niceOfWorker(*background), base);
}

TEST(SerialQueue, DestroyingRunsPendingWorkUnlessSuspended) {
  std::atomic<int> ran{0};
  auto queue = makeSerialQueue("test.destroy");
  for (int i = 0; i < 100; ++i) queue->async([&] { ++ran; });
  queue.reset();
  EXPECT_EQ(ran, 100);

  auto token = std::make_shared<int>(0);
  auto suspended = makeSerialQueue("test.destroy.suspended");
  suspended->suspend();
  suspended->async([token, &ran] { ++ran; });
  suspended.reset();
  EXPECT_EQ(ran, 100);
  EXPECT_EQ(token.use_count(), 1) << "dropped work must be destroyed";
}

TEST(SerialQueue, ReleasedFromItsOwnWork) {
  struct Holder {
    Holder(std::shared_ptr<Queue> q, Gate& g) : queue(std::move(q)), released(&g) {}
    std::shared_ptr<Queue> queue;
    Gate* released;
    ~Holder() {
      queue.reset();  // the last reference: destroys the queue on its own worker
      released->arrive();
    }
  };
  Gate start, released;
  auto queue = makeSerialQueue("test.self");
  auto holder = std::make_shared<Holder>(queue, released);
  queue->async([holder, &start] { start.waitFor(1); });
  holder.reset();
  queue.reset();
  start.arrive();
  EXPECT_TRUE(released.waitFor(1));
}

TEST(ConcurrentQueue, GrowsWhileItemsBlock) {
  auto queue = makeConcurrentQueue("test.concurrent");
  constexpr int kItems = 8;
  Gate inside, finished;
  std::atomic<int> sawAll{0};
  for (int i = 0; i < kItems; ++i) {
    queue->async([&] {
      inside.arrive();
      if (inside.waitFor(kItems)) ++sawAll;  // only if all eight run at once
      finished.arrive();
    });
  }
  ASSERT_TRUE(finished.waitFor(kItems));
  EXPECT_EQ(sawAll, kItems);
  int ranAfter = 0;
  queue->sync([&] { ranAfter = 1; });
  EXPECT_EQ(ranAfter, 1);
}

TEST(ConcurrentQueue, SuspendKeepsItemsUntilResumed) {
  auto queue = makeConcurrentQueue("test.concurrent.suspend");
  Gate ran;
  queue->suspend();
  for (int i = 0; i < 5; ++i) queue->async([&] { ran.arrive(); });
  letWrongWorkRun();
  EXPECT_EQ(ran.count(), 0);
  queue->resume();
  queue->resume();  // unbalanced: ignored
  EXPECT_TRUE(ran.waitFor(5));
}

TEST(ConcurrentQueue, DestroyingWaitsForRunningWork) {
  std::atomic<int> ran{0};
  auto queue = makeConcurrentQueue("test.concurrent.destroy");
  for (int i = 0; i < 20; ++i) queue->async([&] {
      std::this_thread::sleep_for(1ms);
      ++ran;
    });
  queue.reset();
  EXPECT_EQ(ran, 20);
}

TEST(MainQueue, RunsOnlyInsideRunMainLoop) {
  std::atomic<bool> ran{false};
  std::thread::id runner;
  Gate firstItem;
  mainQueue().async([&] {
    ran = true;
    runner = std::this_thread::get_id();
    firstItem.arrive();
  });
  letWrongWorkRun();
  EXPECT_FALSE(ran) << "nothing serves the main queue before runMainLoop";
  std::thread stopper([&] {
    int answer = 0;
    mainQueue().sync([&] { answer = 42; });  // served by the main loop
    EXPECT_EQ(answer, 42);
    firstItem.waitFor(1);
    stopMainLoop();
  });
  EXPECT_EQ(runMainLoop(), 0);
  stopper.join();
  EXPECT_TRUE(ran);
  EXPECT_EQ(runner, std::this_thread::get_id());
}

TEST(Transactions, WaitEndsWhenTheCountFallsToZero) {
  ASSERT_EQ(transactionCount(), 0);
  transactionBegin();
  transactionBegin();
  EXPECT_EQ(transactionCount(), 2);
  EXPECT_FALSE(waitForTransactions(1ms));
  std::thread ender([] {
    transactionEnd();
    transactionEnd();
  });
  EXPECT_TRUE(waitForTransactions(30s));
  ender.join();
  transactionEnd();  // unbalanced: ignored
  EXPECT_EQ(transactionCount(), 0);
  EXPECT_TRUE(waitForTransactions(0ms));
}

void say(const char* text) { (void)!write(STDERR_FILENO, text, strlen(text)); }

// Runs in the death-test child: holds a transaction past SIGTERM; the handler
// must stop accepting first, wait for the transaction, then exit 0.
void holdTransactionThroughSigterm() {
  auto stopped = std::make_shared<Gate>();
  installTerminationHandler([stopped] {
    say("stopped accepting\n");
    stopped->arrive();
  });
  transactionBegin();
  std::thread([stopped] {
    if (!stopped->waitFor(1)) return;
    std::this_thread::sleep_for(500ms);
    say("transaction ended\n");
    transactionEnd();
  }).detach();
  kill(getpid(), SIGTERM);
  std::this_thread::sleep_for(60s);
  _exit(3);
}

TEST(TerminationHandlerDeathTest, WaitsForTransactionsThenExitsZero) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(holdTransactionThroughSigterm(), ::testing::ExitedWithCode(0),
              "stopped accepting(.|\n)*transaction ended");
}

}  // namespace
