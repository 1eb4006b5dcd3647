#include <sched.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstring>
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
  void arrive() { ++count_; }
  bool waitFor(int count) {
    for (int i = 0; i < 30000 && count_ < count; ++i) std::this_thread::sleep_for(1ms);
    return count_ >= count;
  }
  int count() const { return count_; }

 private:
  std::atomic<int> count_{0};
};

// Gives a queue that wrongly runs suspended work the chance to do so.
void letWrongWorkRun() { std::this_thread::sleep_for(20ms); }

TEST(SerialQueue, RunsItemsOneAtATimeInOrderPerProducer) {
  auto queue = makeSerialQueue("test.serial");
  constexpr int kProducers = 4, kItems = 400;
  std::vector<std::pair<int, int>> seen;  // touched only by the queue's worker
  std::atomic<int> running{0};
  std::atomic<bool> overlapped{false};
  std::vector<std::thread> producers;
  for (int p = 0; p < kProducers; ++p) {
    producers.emplace_back([&, p] {
      for (int i = 0; i < kItems; ++i)
        queue->async([&, p, i] {
          if (running.fetch_add(1) != 0) overlapped = true;
          seen.emplace_back(p, i);
          running.fetch_sub(1);
        });
    });
  }
  for (auto& t : producers) t.join();
  queue->sync([] {});
  ASSERT_EQ(seen.size(), size_t{kProducers * kItems});
  EXPECT_FALSE(overlapped);
  std::vector<int> next(kProducers, 0);
  for (auto [p, i] : seen) EXPECT_EQ(i, next[p]++) << "producer " << p;
}

TEST(SerialQueue, SyncRunsOnTheWorkerInlineFromItsOwnWorkAndSurvivesThrowingWork) {
  auto queue = makeSerialQueue("test.sync");
  queue->async([] { throw std::runtime_error("boom"); });
  std::thread::id worker, inner;
  queue->sync([&] {
    worker = std::this_thread::get_id();
    queue->sync([&] { inner = std::this_thread::get_id(); });
  });
  EXPECT_NE(worker, std::this_thread::get_id());
  EXPECT_EQ(inner, worker);
}

TEST(SerialQueue, LowerPrioritiesReachTheWorker) {
  // The idle queue's worker (and the threads it starts) yield the processor and the disk.
  int policy = -1;
  long ioClass = -1;
  makeSerialQueue("test.idle", QueuePriority::Idle)->sync([&] {
    std::thread([&] {
      policy = sched_getscheduler(0);
      ioClass = syscall(SYS_ioprio_get, 1, 0) >> 13;  // this thread; the class is above bit 13
    }).join();
  });
  EXPECT_EQ(policy, SCHED_IDLE);
  EXPECT_EQ(ioClass, 3) << "the idle I/O class";

  auto niceOf = [](Queue& queue) {
    int nice = 0;
    queue.sync([&] { nice = getpriority(PRIO_PROCESS, static_cast<id_t>(gettid())); });
    return nice;
  };
  int base = niceOf(*makeSerialQueue("test.normal"));
  if (base >= 19) GTEST_SKIP() << "already at the lowest priority";
  EXPECT_GT(niceOf(*makeSerialQueue("test.background", QueuePriority::Background)), base);
}

TEST(SerialQueue, DestroyingDropsSuspendedWorkAndMayHappenOnItsOwnWorker) {
  auto token = std::make_shared<int>(0);
  auto suspended = makeSerialQueue("test.destroy.suspended");
  suspended->suspend();
  suspended->async([token] { ADD_FAILURE() << "suspended work ran"; });
  suspended.reset();
  EXPECT_EQ(token.use_count(), 1) << "dropped work must be destroyed";

  // The last reference goes away inside the queue's own work (held through
  // one more pointer so that copies of the work cannot keep it).
  Gate start, released;
  auto queue = makeSerialQueue("test.self");
  auto last = std::make_shared<std::shared_ptr<Queue>>(queue);
  queue->async([&start, &released, last] {
    start.waitFor(1);
    last->reset();
    released.arrive();
  });
  queue.reset();
  start.arrive();
  EXPECT_TRUE(released.waitFor(1));
}

TEST(Queues, ConcurrentOneGrowsAndBothKeepSuspendedWorkAndFinishPendingWork) {
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

  // Both kinds: suspending keeps items and nests; destroying runs or waits for pending work.
  for (bool serial : {true, false}) {
    Gate ran;
    auto queue = serial ? makeSerialQueue("test.suspend") : makeConcurrentQueue("test.suspend");
    queue->resume();  // unbalanced: ignored
    queue->suspend();
    queue->suspend();
    for (int i = 0; i < 3; ++i) queue->async([&] { ran.arrive(); });
    letWrongWorkRun();
    queue->resume();
    letWrongWorkRun();
    EXPECT_EQ(ran.count(), 0) << "one resume must not undo two suspends";
    queue->resume();
    EXPECT_TRUE(ran.waitFor(3));

    std::atomic<int> done{0};
    for (int i = 0; i < 50; ++i)
      queue->async([&] {
        std::this_thread::sleep_for(100us);
        ++done;
      });
    queue.reset();
    EXPECT_EQ(done, 50);
  }
}

TEST(MainQueue, RunsOnlyInsideRunMainLoopAndTransactionWaitsEndAtZero) {
  std::atomic<bool> ran{false};
  std::thread::id runner;
  mainQueue().async([&] {
    ran = true;
    runner = std::this_thread::get_id();
  });
  letWrongWorkRun();
  EXPECT_FALSE(ran) << "nothing serves the main queue before runMainLoop";
  std::thread stopper([] {
    mainQueue().sync([] {});  // served by the main loop, after the item before it
    stopMainLoop();
  });
  EXPECT_EQ(runMainLoop(), 0);
  stopper.join();
  EXPECT_TRUE(ran);
  EXPECT_EQ(runner, std::this_thread::get_id());

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

TEST(QueueTerminationDeathTest, WaitsForTransactionsThenExitsZero) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(holdTransactionThroughSigterm(), ::testing::ExitedWithCode(0),
              "stopped accepting(.|\n)*transaction ended");
}

}  // namespace
