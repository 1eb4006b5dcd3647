#include <array>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <future>
#include <memory>
#include <random>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "Daemon/store/QRTLocks.h"
#include "platform/Log.h"

using namespace std::chrono_literals;

namespace {

// An unopened log sends every line, debug included, to syslog; the tests want
// the daemon's default level, with the lines going nowhere.
class QuietLog : public ::testing::Environment {
 public:
  void SetUp() override { platform::logOpen("/dev/null", "locks_test", platform::kLogNotice); }
};

const auto* const gQuietLog = ::testing::AddGlobalTestEnvironment(new QuietLog);

// Polls for up to 10 s: the bound only turns a hang into a failure.
bool eventually(const std::function<bool()>& condition) {
  for (int i = 0; i < 10000 && !condition(); ++i) std::this_thread::sleep_for(1ms);
  return condition();
}

// A thread that takes a lock and holds it until destroyed.
class Holder {
 public:
  Holder(std::function<void()> lock, std::function<void()> unlock)
      : thread_([this, lock = std::move(lock), unlock = std::move(unlock), release = release_.get_future()] {
          lock();
          acquired_ = true;
          release.wait();
          unlock();
        }) {}
  ~Holder() {
    release_.set_value();
    if (!waitAcquired()) {
      // The thread is stuck in the lock call; joining it would hang the run.
      fprintf(stderr, "A lock waiter never got its lock\n");
      abort();
    }
    thread_.join();
  }
  bool acquired() const { return acquired_; }
  bool waitAcquired() const {
    return eventually([this] { return acquired_.load(); });
  }

 private:
  std::promise<void> release_;
  std::atomic<bool> acquired_{false};
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

// Identifier readers, identifier writers, all-identifiers state, records.
using Counts = std::array<int64_t, 4>;
Counts counts() {
  QRTLocksSnapshot s = QRTLocksGetSnapshot();
  return {s.identifierReaderCount, s.identifierWriterCount, s.allReaderWriterState, static_cast<int64_t>(s.mapSize)};
}

// Gives a waiter that wrongly gets through the chance to do so first.
bool blocked(const HolderPtr& holder) {
  std::this_thread::sleep_for(50ms);
  return !holder->acquired();
}

// Runs the bodies on threads of their own and joins them; a deadlock stops
// the run with a message instead of hanging it.
void runConcurrently(const std::vector<std::function<void()>>& bodies) {
  std::vector<std::future<void>> done;
  for (const auto& body : bodies) done.push_back(std::async(std::launch::async, body));
  for (auto& f : done) {
    if (f.wait_for(120s) != std::future_status::ready) {
      fprintf(stderr, "Lock users deadlocked\n");
      abort();
    }
  }
}

void expectIdle() { EXPECT_EQ(counts(), (Counts{0, 0, 0, 0})); }

class IdentifierLockTest : public ::testing::Test {
 protected:
  void TearDown() override { expectIdle(); }
};

TEST_F(IdentifierLockTest, ReadersShareWritersExcludeAndIdentifiersAreIndependent) {
  auto reader1 = holdIdentifier("a", false);
  auto reader2 = holdIdentifier("a", false);
  ASSERT_TRUE(reader1->waitAcquired() && reader2->waitAcquired());

  auto writer = holdIdentifier("a", true);
  // An awaited writer is already counted and shares the record.
  ASSERT_TRUE(eventually([] { return QRTLocksGetSnapshot().identifierWriterCount == 1; }));
  auto other = holdIdentifier("b", true);
  ASSERT_TRUE(other->waitAcquired());
  EXPECT_TRUE(blocked(writer));
  EXPECT_EQ(counts(), (Counts{2, 2, 0, 2}));

  reader1.reset();
  EXPECT_TRUE(blocked(writer));
  EXPECT_EQ(counts(), (Counts{1, 2, 0, 2})) << "the record lives until the last unlock";
  reader2.reset();
  ASSERT_TRUE(writer->waitAcquired());
  auto lateReader = holdIdentifier("a", false);
  EXPECT_TRUE(blocked(lateReader));
  writer.reset();
  EXPECT_TRUE(lateReader->waitAcquired());
}

TEST_F(IdentifierLockTest, AllReaderAdmitsIdentifierReadersButNotWriters) {
  // It waits for held and awaited identifier writers...
  auto reader = holdIdentifier("a", false);
  ASSERT_TRUE(reader->waitAcquired());
  auto writer = holdIdentifier("a", true);
  ASSERT_TRUE(eventually([] { return QRTLocksGetSnapshot().identifierWriterCount == 1; }));
  auto all = holdAll(false);
  EXPECT_TRUE(blocked(all));
  reader.reset();
  ASSERT_TRUE(writer->waitAcquired());
  EXPECT_TRUE(blocked(all));
  writer.reset();
  ASSERT_TRUE(all->waitAcquired());

  // ...then lets readers of every kind in and holds writers back.
  reader = holdIdentifier("a", false);
  auto list = holdList({"b", "c"}, false);
  auto secondAll = holdAll(false);
  EXPECT_TRUE(reader->waitAcquired() && list->waitAcquired() && secondAll->waitAcquired());
  writer = holdIdentifier("d", true);
  EXPECT_TRUE(blocked(writer));
  // A writer held back by the all-identifiers lock is not yet counted.
  EXPECT_EQ(counts(), (Counts{3, 0, 2, 3}));
  secondAll.reset();
  EXPECT_TRUE(blocked(writer));
  all.reset();
  EXPECT_TRUE(writer->waitAcquired());
}

TEST_F(IdentifierLockTest, AllWriterBlocksEveryoneAndWakesThemAll) {
  _lock_all_identifiers(true);
  HolderPtr waiters[] = {holdIdentifier("a", false), holdIdentifier("a", false), holdIdentifier("b", true),
                         holdList({"d", "c"}, true)};
  for (auto& waiter : waiters) EXPECT_TRUE(blocked(waiter));
  EXPECT_EQ(counts(), (Counts{0, 0, -1, 0}));
  unlock_all_identifiers();
  // They hold together, so every one of them was woken.
  for (auto& waiter : waiters) EXPECT_TRUE(waiter->waitAcquired());
  for (auto& waiter : waiters) waiter.reset();

  _lock_all_identifiers(true);
  HolderPtr readers[] = {holdAll(false), holdAll(false)};
  for (auto& reader : readers) EXPECT_TRUE(blocked(reader));
  unlock_all_identifiers();
  for (auto& reader : readers) EXPECT_TRUE(reader->waitAcquired());
  // A second all-writer waits for the all-readers, a third for the second.
  auto writer = holdAll(true);
  EXPECT_TRUE(blocked(writer));
  for (auto& reader : readers) reader.reset();
  ASSERT_TRUE(writer->waitAcquired());
  auto secondWriter = holdAll(true);
  EXPECT_TRUE(blocked(secondWriter));
  writer.reset();
  EXPECT_TRUE(secondWriter->waitAcquired());
}

// A name repeated in a list is taken once (the stress test repeats them in written lists).
TEST_F(IdentifierLockTest, ScopedLocksTakeOnlyWhenEnabled) {
  {
    QRTAllIdentifiersLock all(true, false);
    QRTIdentifierLock one("a", true, false);
    QRTIdentifierListLock list({"b", "c"}, true, false);
    expectIdle();
  }
  QRTAllIdentifiersLock all(false);
  QRTIdentifierLock one("a", false);
  QRTIdentifierListLock list({"c", "b", "c"}, false);
  EXPECT_EQ(counts(), (Counts{3, 0, 1, 3}));
}

// Readers keep arriving, always overlapping; a writer that waits gets in
// before they stop (with readers first it would wait for the last of them).
TEST_F(IdentifierLockTest, WaitingWriterIsNotStarvedByArrivingReaders) {
  const std::pair<std::function<void()>, std::function<void()>> writers[] = {
      {[] { _lock_identifier("a", true); }, [] { unlock_identifier("a"); }},
      {[] { _lock_all_identifiers(true); }, [] { unlock_all_identifiers(); }},
  };
  for (const auto& [lock, unlock] : writers) {
    std::atomic<bool> writerDone{false}, inWhileReadersRan{false};
    std::atomic<int> readersDone{0}, readersIn{0};
    auto reader = [&](int index) {
      for (int i = 0; i < 3000 && !writerDone; ++i) {
        // Every reader holds "a" throughout, so that it is never free for long.
        QRTIdentifierListLock hold({"a", "b" + std::to_string(index)}, false);
        readersIn += i == 0;
        std::this_thread::sleep_for(200us);
      }
      ++readersDone;
    };
    std::vector<std::function<void()>> bodies;
    for (int r = 0; r < 4; ++r) bodies.push_back([&, r] { reader(r); });
    bodies.push_back([&] {
      while (readersIn < 4) std::this_thread::yield();
      lock();
      inWhileReadersRan = readersDone == 0;
      unlock();
      writerDone = true;
    });
    runConcurrently(bodies);
    EXPECT_TRUE(inWhileReadersRan);
  }
}

// The writer waits for a lock this thread holds; a further lock of the
// thread must not wait behind the writer, or neither would ever go on.
TEST_F(IdentifierLockTest, HolderTakesMoreLocksPastAWaitingWriter) {
  std::promise<void> holding, go, nested;
  std::thread holder([&] {
    _lock_identifier("a", false);
    holding.set_value();
    go.get_future().wait();
    _lock_identifier("b", false);
    _lock_all_identifiers(false);
    nested.set_value();
    unlock_all_identifiers();
    unlock_identifier("b");
    unlock_identifier("a");
  });
  holding.get_future().wait();
  auto writer = holdAll(true);
  EXPECT_TRUE(blocked(writer));
  go.set_value();
  if (nested.get_future().wait_for(10s) != std::future_status::ready) {
    fprintf(stderr, "A lock holder waited behind the writer waiting for it\n");
    abort();
  }
  holder.join();
  EXPECT_TRUE(writer->waitAcquired());
}

using IdentifierLockDeathTest = IdentifierLockTest;

TEST_F(IdentifierLockDeathTest, UnpairedUnlocksStopTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(unlock_identifier("never-locked"), "identifierToLockMap.end\\(\\).*Daemon/QRTLocks");
  EXPECT_DEATH(unlock_all_identifiers(), "allReaderWriterState == -1.*Daemon/QRTLocks");
}

// Mixed traffic on few identifiers. Each holder announces itself and then
// checks for anyone it must exclude: of two conflicting holders at least one
// sees the other. The plain values are also checked by ThreadSanitizer. Lists
// come in random order, so locking them as given would deadlock the run.
class LockStressTest : public ::testing::Test {
 protected:
  static constexpr int kIdentifiers = 16, kThreads = 8, kOperations = 10000;

  std::array<std::atomic<int>, kIdentifiers> readers_{}, writers_{};
  std::atomic<int> allReaders_{0}, allWriters_{0}, violations_{0};
  std::array<uint64_t, kIdentifiers> values_{};  // written only under a write lock
  std::array<std::atomic<uint64_t>, kIdentifiers> writesDone_{};

  static std::string name(int index) { return "com.example.stress." + std::to_string(index); }

  void check(bool ok) { violations_ += !ok; }

  void use(int i, bool writing) {
    if (!writing) return check(values_[i] != UINT64_MAX);
    ++values_[i];
    ++writesDone_[i];
  }

  int identifierHolders(bool writersOnly) {
    int n = 0;
    for (int i = 0; i < kIdentifiers; ++i) n += writers_[i] + (writersOnly ? 0 : readers_[i].load());
    return n;
  }

  void holdIdentifiers(const std::set<int>& indexes, bool writing) {
    for (int i : indexes) ++(writing ? writers_ : readers_)[i];
    check(allWriters_ == 0 && (!writing || allReaders_ == 0));
    for (int i : indexes) {
      check(writers_[i] == (writing ? 1 : 0) && (!writing || readers_[i] == 0));
      use(i, writing);
    }
    for (int i : indexes) --(writing ? writers_ : readers_)[i];
  }

  void holdAllIdentifiers(bool writing) {
    ++(writing ? allWriters_ : allReaders_);
    check(writing ? allWriters_ == 1 && allReaders_ == 0 && identifierHolders(false) == 0
                  : allWriters_ == 0 && identifierHolders(true) == 0);
    for (int i = 0; i < kIdentifiers; ++i) use(i, writing);
    --(writing ? allWriters_ : allReaders_);
  }

  void run(unsigned seed) {
    std::mt19937 random(seed);
    for (int op = 0; op < kOperations; ++op) {
      const unsigned kind = random() % 20;
      const bool writing = random() % 2 == 0;
      if (kind < 3) {
        QRTAllIdentifiersLock hold(writing);
        holdAllIdentifiers(writing);
      } else if (kind < 11) {
        const int index = static_cast<int>(random() % kIdentifiers);
        QRTIdentifierLock hold(name(index), writing);
        holdIdentifiers({index}, writing);
      } else {  // a list, in random order and with repeats
        std::vector<std::string> names;
        std::set<int> indexes;
        for (unsigned n = 1 + random() % 4; n > 0; --n) {
          const int index = static_cast<int>(random() % kIdentifiers);
          names.push_back(name(index));
          indexes.insert(index);
        }
        QRTIdentifierListLock hold(names, writing);
        holdIdentifiers(indexes, writing);
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
