#include <unistd.h>

#include <array>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <mutex>
#include <random>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "Daemon/QRTLocks.h"
#include "platform/Log.h"

using namespace std::chrono_literals;

namespace {

// An unopened log sends every line, debug included, to syslog; the tests want
// the daemon's default level, with the lines going nowhere.
void quietLog() { platform::logOpen("/dev/null", "locks_test", platform::kLogNotice); }

class QuietLog : public ::testing::Environment {
 public:
  void SetUp() override { quietLog(); }
};

const auto* const gQuietLog = ::testing::AddGlobalTestEnvironment(new QuietLog);

// A thread that takes a lock, reports it, holds it until released, then lets
// it go. The long bounds only turn a hang into a failure.
class Holder {
 public:
  Holder(std::function<void()> lock, std::function<void()> unlock)
      : thread_([this, lock = std::move(lock), unlock = std::move(unlock)] {
          lock();
          {
            std::lock_guard hold(mutex_);
            acquired_ = true;
          }
          changed_.notify_all();
          std::unique_lock hold(mutex_);
          changed_.wait(hold, [&] { return released_; });
          unlock();
        }) {}
  ~Holder() {
    release();
    if (!waitAcquired()) {
      // The thread is stuck in the lock call; joining it would hang the run.
      fprintf(stderr, "A lock waiter never got its lock\n");
      abort();
    }
    thread_.join();
  }
  bool acquired() {
    std::lock_guard hold(mutex_);
    return acquired_;
  }
  bool waitAcquired() {
    std::unique_lock hold(mutex_);
    return changed_.wait_for(hold, 10s, [&] { return acquired_; });
  }
  void release() {
    {
      std::lock_guard hold(mutex_);
      released_ = true;
    }
    changed_.notify_all();
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  bool acquired_ = false;
  bool released_ = false;
  std::thread thread_;  // last: starts once the fields above exist
};

using HolderPtr = std::unique_ptr<Holder>;

HolderPtr holdIdentifier(const std::string& identifier, bool writing) {
  return std::make_unique<Holder>([=] { _lock_identifier(identifier, writing); },
                                  [=] { unlock_identifier(identifier); });
}

HolderPtr holdList(const std::vector<std::string>& identifiers, bool writing) {
  return std::make_unique<Holder>([=] { _lock_identifier(identifiers, writing); },
                                  [=] { unlock_identifier(identifiers); });
}

HolderPtr holdAll(bool writing) {
  return std::make_unique<Holder>([=] { _lock_all_identifiers(writing); }, [] { unlock_all_identifiers(); });
}

// Gives a waiter that wrongly gets through the chance to do so.
void settle() { std::this_thread::sleep_for(50ms); }

bool eventually(const std::function<bool(const QRTLocksSnapshot&)>& condition) {
  for (int i = 0; i < 10000; ++i) {
    if (condition(QRTLocksGetSnapshot())) return true;
    std::this_thread::sleep_for(1ms);
  }
  return false;
}

// Runs the bodies on threads of their own and joins them; a deadlock stops
// the run with a message instead of hanging it.
void runConcurrently(const std::vector<std::function<void()>>& bodies) {
  std::atomic<size_t> finished{0};
  std::vector<std::thread> threads;
  for (const auto& body : bodies) {
    threads.emplace_back([&] {
      body();
      ++finished;
    });
  }
  for (int i = 0; i < 12000 && finished < bodies.size(); ++i) std::this_thread::sleep_for(10ms);
  if (finished < bodies.size()) {
    fprintf(stderr, "Lock users deadlocked\n");
    abort();
  }
  for (auto& thread : threads) thread.join();
}

void expectIdle() {
  QRTLocksSnapshot s = QRTLocksGetSnapshot();
  EXPECT_EQ(s.identifierReaderCount, 0);
  EXPECT_EQ(s.identifierWriterCount, 0);
  EXPECT_EQ(s.allReaderWriterState, 0);
  EXPECT_EQ(s.mapSize, 0u);
}

class IdentifierLockTest : public ::testing::Test {
 protected:
  void TearDown() override { expectIdle(); }
};

TEST_F(IdentifierLockTest, ReadersShareWritersExcludeAndIdentifiersAreIndependent) {
  auto reader1 = holdIdentifier("a", false);
  auto reader2 = holdIdentifier("a", false);
  ASSERT_TRUE(reader1->waitAcquired());
  ASSERT_TRUE(reader2->waitAcquired());

  auto writer = holdIdentifier("a", true);
  // An awaited writer is already counted and shares the record.
  ASSERT_TRUE(eventually([](auto& s) { return s.identifierWriterCount == 1; }));
  auto other = holdIdentifier("b", true);
  ASSERT_TRUE(other->waitAcquired());
  settle();
  EXPECT_FALSE(writer->acquired());
  QRTLocksSnapshot s = QRTLocksGetSnapshot();
  EXPECT_EQ(s.identifierReaderCount, 2);
  EXPECT_EQ(s.identifierWriterCount, 2);
  EXPECT_EQ(s.mapSize, 2u);

  reader1.reset();
  settle();
  EXPECT_FALSE(writer->acquired());
  reader2.reset();
  ASSERT_TRUE(writer->waitAcquired());

  auto lateReader = holdIdentifier("a", false);
  settle();
  EXPECT_FALSE(lateReader->acquired());
  writer.reset();
  EXPECT_TRUE(lateReader->waitAcquired());
}

TEST_F(IdentifierLockTest, RecordLivesUntilTheLastUnlockAndIsMadeAgain) {
  auto first = holdIdentifier("a", false);
  auto second = holdIdentifier("a", false);
  ASSERT_TRUE(first->waitAcquired());
  ASSERT_TRUE(second->waitAcquired());
  EXPECT_EQ(QRTLocksGetSnapshot().mapSize, 1u);
  first.reset();
  EXPECT_EQ(QRTLocksGetSnapshot().mapSize, 1u);
  second.reset();
  EXPECT_EQ(QRTLocksGetSnapshot().mapSize, 0u);

  _lock_identifier("a", true);
  EXPECT_EQ(QRTLocksGetSnapshot().mapSize, 1u);
  unlock_identifier("a");
}

TEST_F(IdentifierLockTest, DuplicatesInAListAreLockedAndUnlockedOnce) {
  // Taking "x" twice for writing on one thread would never return.
  const std::vector<std::string> list = {"x", "y", "x", "y", "x"};
  _lock_identifier(list, true);
  QRTLocksSnapshot s = QRTLocksGetSnapshot();
  EXPECT_EQ(s.identifierWriterCount, 2);
  EXPECT_EQ(s.mapSize, 2u);
  unlock_identifier(list);
  expectIdle();

  {
    QRTIdentifierListLock scoped(list, false);
    s = QRTLocksGetSnapshot();
    EXPECT_EQ(s.identifierReaderCount, 2);
    EXPECT_EQ(s.mapSize, 2u);
  }
}

TEST_F(IdentifierLockTest, OppositeOrderListsDoNotDeadlock) {
  int counter = 0;  // plain: the sanitizer sees any overlap of the holders
  auto worker = [&](std::vector<std::string> list, bool scoped) {
    for (int i = 0; i < 1000; ++i) {
      if (scoped) {
        QRTIdentifierListLock hold(list, true);
        ++counter;
      } else {
        _lock_identifier(list, true);
        ++counter;
        unlock_identifier(list);
      }
    }
  };
  runConcurrently({[&] { worker({"a", "b"}, false); }, [&] { worker({"b", "a"}, true); }});
  EXPECT_EQ(counter, 2000);
}

TEST_F(IdentifierLockTest, AllReaderAdmitsIdentifierReadersButNotWriters) {
  _lock_all_identifiers(false);
  auto reader = holdIdentifier("a", false);
  auto list = holdList({"b", "c"}, false);
  auto secondAll = holdAll(false);
  EXPECT_TRUE(reader->waitAcquired());
  EXPECT_TRUE(list->waitAcquired());
  EXPECT_TRUE(secondAll->waitAcquired());
  EXPECT_EQ(QRTLocksGetSnapshot().allReaderWriterState, 2);

  auto writer = holdIdentifier("d", true);
  settle();
  EXPECT_FALSE(writer->acquired());
  // A writer held back by the all-identifiers lock is not yet counted.
  EXPECT_EQ(QRTLocksGetSnapshot().identifierWriterCount, 0);
  secondAll.reset();
  settle();
  EXPECT_FALSE(writer->acquired());
  unlock_all_identifiers();
  EXPECT_TRUE(writer->waitAcquired());
}

TEST_F(IdentifierLockTest, AllReaderWaitsForHeldAndAwaitedIdentifierWriters) {
  auto reader = holdIdentifier("a", false);
  ASSERT_TRUE(reader->waitAcquired());
  auto writer = holdIdentifier("a", true);
  ASSERT_TRUE(eventually([](auto& s) { return s.identifierWriterCount == 1; }));

  auto all = holdAll(false);
  settle();
  EXPECT_FALSE(all->acquired());
  reader.reset();
  ASSERT_TRUE(writer->waitAcquired());
  settle();
  EXPECT_FALSE(all->acquired());
  writer.reset();
  EXPECT_TRUE(all->waitAcquired());
}

TEST_F(IdentifierLockTest, AllWriterBlocksIdentifierLocksAndWakesThemAll) {
  _lock_all_identifiers(true);
  std::vector<HolderPtr> waiters;
  waiters.push_back(holdIdentifier("a", false));
  waiters.push_back(holdIdentifier("a", false));
  waiters.push_back(holdIdentifier("b", true));
  waiters.push_back(holdList({"d", "c"}, true));
  settle();
  for (auto& waiter : waiters) EXPECT_FALSE(waiter->acquired());
  QRTLocksSnapshot s = QRTLocksGetSnapshot();
  EXPECT_EQ(s.allReaderWriterState, -1);
  EXPECT_EQ(s.identifierReaderCount, 0);
  EXPECT_EQ(s.identifierWriterCount, 0);
  EXPECT_EQ(s.mapSize, 0u);

  unlock_all_identifiers();
  // They hold together, so every one of them was woken.
  for (auto& waiter : waiters) EXPECT_TRUE(waiter->waitAcquired());
}

TEST_F(IdentifierLockTest, AllWriterBlocksOtherAllLocks) {
  _lock_all_identifiers(true);
  auto reader1 = holdAll(false);
  auto reader2 = holdAll(false);
  settle();
  EXPECT_FALSE(reader1->acquired());
  EXPECT_FALSE(reader2->acquired());
  unlock_all_identifiers();
  EXPECT_TRUE(reader1->waitAcquired());
  EXPECT_TRUE(reader2->waitAcquired());

  auto writer = holdAll(true);
  settle();
  EXPECT_FALSE(writer->acquired());
  reader1.reset();
  settle();
  EXPECT_FALSE(writer->acquired());
  reader2.reset();
  ASSERT_TRUE(writer->waitAcquired());

  auto secondWriter = holdAll(true);
  settle();
  EXPECT_FALSE(secondWriter->acquired());
  writer.reset();
  EXPECT_TRUE(secondWriter->waitAcquired());
}

TEST_F(IdentifierLockTest, AllWriterWaitsOutAwaitedIdentifierLocksWithoutPriority) {
  auto writer = holdIdentifier("a", true);
  ASSERT_TRUE(writer->waitAcquired());
  auto awaited = holdIdentifier("a", false);
  ASSERT_TRUE(eventually([](auto& s) { return s.identifierReaderCount == 1; }));

  auto all = holdAll(true);
  settle();
  EXPECT_FALSE(all->acquired());
  // A newcomer is admitted although the all-identifiers writer waits.
  auto newcomer = holdIdentifier("b", false);
  EXPECT_TRUE(newcomer->waitAcquired());

  writer.reset();
  ASSERT_TRUE(awaited->waitAcquired());
  newcomer.reset();
  settle();
  EXPECT_FALSE(all->acquired());
  awaited.reset();
  EXPECT_TRUE(all->waitAcquired());
}

TEST_F(IdentifierLockTest, ScopedLocksTakeOnlyWhenEnabled) {
  {
    QRTAllIdentifiersLock all(true, false);
    QRTIdentifierLock one("a", true, false);
    QRTIdentifierListLock list({"b", "c"}, true, false);
    expectIdle();
  }
  {
    QRTAllIdentifiersLock all(false);
    QRTIdentifierLock one("a", false);
    QRTIdentifierListLock list({"c", "b", "c"}, false);
    QRTLocksSnapshot s = QRTLocksGetSnapshot();
    EXPECT_EQ(s.allReaderWriterState, 1);
    EXPECT_EQ(s.identifierReaderCount, 3);
    EXPECT_EQ(s.mapSize, 3u);
  }
  {
    QRTIdentifierLock one("a", true);
    EXPECT_EQ(QRTLocksGetSnapshot().identifierWriterCount, 1);
  }
}

TEST_F(IdentifierLockTest, DebugLinesTellEachStep) {
  auto path = std::filesystem::temp_directory_path() / ("locks_test-" + std::to_string(getpid()) + ".log");
  ASSERT_TRUE(platform::logOpen(path, "locks_test", platform::kLogDebug));
  _lock_all_identifiers(false);
  unlock_all_identifiers();
  _lock_identifier("com.example.logged", true);
  unlock_identifier("com.example.logged");
  quietLog();

  std::stringstream text;
  text << std::ifstream(path).rdbuf();
  std::filesystem::remove(path);
  for (const char* line : {"_lock_all_identifiers: Waiting to lock all identifiers for reading",
                           "_lock_all_identifiers: Locked all identifiers for reading",
                           "unlock_all_identifiers: Unlocked all identifiers",
                           "take_one_lock: Waiting to lock com.example.logged for writing",
                           "take_one_lock: Got lock on identifier com.example.logged",
                           "unlock_one_lock: Unlocked identifier com.example.logged",
                           "unlock_one_lock: Destroying lock for identifier com.example.logged"}) {
    EXPECT_NE(text.str().find(line), std::string::npos) << line;
  }
}

using IdentifierLockDeathTest = IdentifierLockTest;

TEST_F(IdentifierLockDeathTest, UnpairedUnlocksStopTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(unlock_identifier("never-locked"),
               "identifierToLockMap.end\\(\\).*Daemon/QRTLocks");
  EXPECT_DEATH(unlock_all_identifiers(), "allReaderWriterState == -1.*Daemon/QRTLocks");
}

// Mixed traffic on few identifiers. Each holder announces itself in shared
// counters and then checks for anyone it must exclude (both sides of a
// conflict announce before checking, so at least one of them sees it); the
// plain values are also checked by ThreadSanitizer.
class LockStressTest : public ::testing::Test {
 protected:
  static constexpr int kIdentifiers = 16;
  static constexpr int kThreads = 8;
  static constexpr int kOperations = 10000;

  std::array<std::atomic<int>, kIdentifiers> readers_{};
  std::array<std::atomic<int>, kIdentifiers> writers_{};
  std::atomic<int> identifierHolders_{0};
  std::atomic<int> identifierWriters_{0};
  std::atomic<int> allReaders_{0};
  std::atomic<int> allWriters_{0};
  std::atomic<int> violations_{0};
  std::array<uint64_t, kIdentifiers> values_{};  // written only under a write lock
  std::array<std::atomic<uint64_t>, kIdentifiers> writesDone_{};

  static std::string name(int index) { return "com.example.stress." + std::to_string(index); }

  void check(bool ok) {
    if (!ok) ++violations_;
  }

  void holdIdentifiers(const std::set<int>& indexes, bool writing) {
    for (int i : indexes) {
      ++identifierHolders_;
      if (writing) {
        ++identifierWriters_;
        check(++writers_[i] == 1);
        check(readers_[i] == 0);
      } else {
        ++readers_[i];
        check(writers_[i] == 0);
      }
    }
    check(allWriters_ == 0);
    if (writing) check(allReaders_ == 0);
    for (int i : indexes) {
      if (writing) {
        ++values_[i];
        ++writesDone_[i];
      } else {
        check(values_[i] != UINT64_MAX);
      }
    }
    for (int i : indexes) {
      if (writing) {
        --writers_[i];
        --identifierWriters_;
      } else {
        --readers_[i];
      }
      --identifierHolders_;
    }
  }

  void holdAllIdentifiers(bool writing) {
    if (writing) {
      check(++allWriters_ == 1);
      check(allReaders_ == 0 && identifierHolders_ == 0);
      for (int i = 0; i < kIdentifiers; ++i) {
        ++values_[i];
        ++writesDone_[i];
      }
      --allWriters_;
    } else {
      ++allReaders_;
      check(allWriters_ == 0 && identifierWriters_ == 0);
      uint64_t sum = 0;
      for (uint64_t value : values_) sum += value;
      check(sum != UINT64_MAX);
      --allReaders_;
    }
  }

  void run(unsigned seed) {
    std::mt19937 random(seed);
    for (int op = 0; op < kOperations; ++op) {
      unsigned kind = random() % 20;
      bool writing = random() % 2 == 0;
      if (kind < 3) {  // all identifiers
        QRTAllIdentifiersLock hold(writing);
        holdAllIdentifiers(writing);
      } else if (kind < 11) {  // one identifier
        int index = static_cast<int>(random() % kIdentifiers);
        QRTIdentifierLock hold(name(index), writing);
        holdIdentifiers({index}, writing);
      } else {  // a list, in random order and with repeats
        std::vector<std::string> names;
        std::set<int> indexes;
        for (unsigned n = 1 + random() % 4; n > 0; --n) {
          int index = static_cast<int>(random() % kIdentifiers);
          names.push_back(name(index));
          indexes.insert(index);
        }
        if (kind % 2) {
          QRTIdentifierListLock hold(names, writing);
          holdIdentifiers(indexes, writing);
        } else {
          _lock_identifier(names, writing);
          holdIdentifiers(indexes, writing);
          unlock_identifier(names);
        }
      }
    }
  }
};

TEST_F(LockStressTest, MixedOperationsKeepMutualExclusion) {
  std::vector<std::function<void()>> bodies;
  for (unsigned t = 0; t < kThreads; ++t) bodies.push_back([this, t] { run(1000 + t); });
  runConcurrently(bodies);

  EXPECT_EQ(violations_, 0);
  for (int i = 0; i < kIdentifiers; ++i) EXPECT_EQ(values_[i], writesDone_[i]) << name(i);
  expectIdle();
}

}  // namespace
