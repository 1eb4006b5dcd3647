#include "Daemon/store/QRTLocks.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <functional>

#include "platform/Log.h"

QRTLocksState& gQRTLocks = *new QRTLocksState;

namespace {

[[noreturn]] void lockAssertionFailed(const char* expression, const char* function, int line) {
  std::string text =
      QRTFormat("Assertion failed: (%s), function %s, file Daemon/QRTLocks, line %d.", expression, function, line);
  QRTLogAs(platform::kLogError, function, "%s", text.c_str());
  fprintf(stderr, "%s\n", text.c_str());
  fflush(stderr);
  abort();
}

// A broken invariant means a lock was paired wrongly: stop rather than go on
// with bookkeeping that no longer matches the locks.
#define QRTLocksAssert(expression)                                           \
  do {                                                                       \
    if (!(expression)) lockAssertionFailed(#expression, __func__, __LINE__); \
  } while (0)

// Debug lines must not turn a lock or unlock into a throwing call.
#define QRTLocksDebug(...)                      \
  do {                                          \
    try {                                       \
      QRTLog(platform::kLogDebug, __VA_ARGS__); \
    } catch (...) {}                            \
  } while (0)

const char* modeName(bool writing) { return writing ? "writing" : "reading"; }

// The distinct identifiers of a list in the order they are taken (ascending)
// or released (descending).
std::vector<std::string> distinctSorted(std::vector<std::string> sorted, bool ascending) {
  if (ascending) {
    std::sort(sorted.begin(), sorted.end());
  } else {
    std::sort(sorted.begin(), sorted.end(), std::greater<>());
  }
  sorted.erase(std::unique(sorted.begin(), sorted.end()), sorted.end());
  return sorted;
}

// Locks this thread holds. A thread that already holds one is never held
// back for a waiting writer, which would be waiting for it in turn.
thread_local int tLocksHeld = 0;

// Under the mutex: waits until a locker of this kind may be counted. Besides
// what `allowed` says, a waiting all-identifiers writer keeps newcomers out,
// unless they already waited through a writer's release.
template <typename Allowed>
void waitToEnter(std::unique_lock<std::mutex>& hold, std::condition_variable& condition, Allowed allowed) {
  QRTLocksState& locks = gQRTLocks;
  if (tLocksHeld > 0) return condition.wait(hold, allowed);
  if (allowed() && locks.allWritersWaiting == 0) return;
  const uint64_t releases = locks.allWriterReleases;
  ++locks.lockersWaiting;
  condition.wait(hold,
                 [&] { return allowed() && (locks.allWritersWaiting == 0 || locks.allWriterReleases != releases); });
  --locks.lockersWaiting;
  if (locks.allWriterReleases != releases && locks.lockersToAdmit > 0 && --locks.lockersToAdmit == 0) {
    locks.allWriterCondition.notify_all();
  }
}

void waitToEnterIdentifiers(std::unique_lock<std::mutex>& hold, bool writing) {
  QRTLocksState& locks = gQRTLocks;
  if (writing) {
    waitToEnter(hold, locks.identifierWriterCondition, [&] { return locks.allReaderWriterState == 0; });
  } else {
    waitToEnter(hold, locks.identifierReaderCondition, [&] { return locks.allReaderWriterState != -1; });
  }
}

// Under the mutex: the identifier's record with this taker counted in it.
// The record is made before anything is counted, so a failed allocation
// leaves the bookkeeping as it was.
QRTIdentifierLockRecord& countIn(const std::string& identifier, bool writing) {
  QRTLocksState& locks = gQRTLocks;
  auto found = locks.identifierToLockMap.find(identifier);
  if (found == locks.identifierToLockMap.end()) {
    found = locks.identifierToLockMap.emplace(identifier, std::make_unique<QRTIdentifierLockRecord>()).first;
  }
  QRTIdentifierLockRecord& record = *found->second;
  ++record.referenceCount;
  if (writing) {
    ++locks.identifierWriterCount;
  } else {
    ++locks.identifierReaderCount;
  }
  return record;
}

// Under the mutex (released while waiting): takes the record. Once a writer
// waits for it, new readers wait behind the writer.
void acquireRecord(std::unique_lock<std::mutex>& hold, QRTIdentifierLockRecord& record, bool writing) {
  if (writing) {
    ++record.waitingWriters;
    record.released.wait(hold, [&] { return record.lockState.load() == 0; });
    --record.waitingWriters;
    int32_t previousState = 0;
    record.lockState.compare_exchange_strong(previousState, -1);
    QRTLocksAssert(previousState == 0);
  } else {
    const bool holdsOthers = tLocksHeld > 0;
    record.released.wait(hold,
                         [&] { return record.lockState.load() != -1 && (record.waitingWriters == 0 || holdsOthers); });
    int32_t readersNow = record.lockState.fetch_add(1) + 1;
    QRTLocksAssert(readersNow > 0);
  }
}

// Under the mutex: the bookkeeping of giving up a write or a read.
void releaseWrite(QRTIdentifierLockRecord& record) {
  QRTLocksState& locks = gQRTLocks;
  int32_t previousState = -1;
  record.lockState.compare_exchange_strong(previousState, 0);
  QRTLocksAssert(previousState == -1);
  QRTLocksAssert(locks.allReaderWriterState == 0);
  QRTLocksAssert(locks.identifierWriterCount > 0);
  --locks.identifierWriterCount;
  if (locks.identifierWriterCount == 0 && locks.identifierReaderCount == 0) locks.allWriterCondition.notify_all();
  if (locks.identifierWriterCount == 0) locks.allReaderCondition.notify_all();
}

void releaseRead(QRTIdentifierLockRecord& record) {
  QRTLocksState& locks = gQRTLocks;
  int32_t readersLeft = record.lockState.fetch_sub(1) - 1;
  QRTLocksAssert(readersLeft >= 0);
  QRTLocksAssert(locks.allReaderWriterState >= 0);
  QRTLocksAssert(locks.identifierReaderCount > 0);
  --locks.identifierReaderCount;
  if (locks.allReaderWriterState == 0 && locks.identifierReaderCount == 0 && locks.identifierWriterCount == 0) {
    locks.allWriterCondition.notify_all();
  }
}

// Takes a list sorted ascending, without duplicates: let in once as a whole
// (so a writer that starts waiting half-way cannot hold back the rest), then
// each record in order.
void takeSortedList(const std::vector<std::string>& sorted, bool writing) {
  if (sorted.empty()) return;
  for (const std::string& identifier : sorted)
    QRTLocksDebug("Waiting to lock %@ for %s", identifier, modeName(writing));
  {
    std::unique_lock<std::mutex> hold(gQRTLocks.mutex);
    waitToEnterIdentifiers(hold, writing);
    std::vector<QRTIdentifierLockRecord*> records;
    records.reserve(sorted.size());
    try {
      for (const std::string& identifier : sorted) records.push_back(&countIn(identifier, writing));
    } catch (...) {
      // Nothing of a failed call stays counted.
      QRTLocksState& locks = gQRTLocks;
      for (size_t i = 0; i < records.size(); ++i) {
        --(writing ? locks.identifierWriterCount : locks.identifierReaderCount);
        if (--records[i]->referenceCount == 0) locks.identifierToLockMap.erase(sorted[i]);
      }
      locks.allWriterCondition.notify_all();
      locks.allReaderCondition.notify_all();
      throw;
    }
    // Counted in its record, none can be freed while this thread waits on it.
    for (QRTIdentifierLockRecord* record : records) {
      acquireRecord(hold, *record, writing);
      ++tLocksHeld;
    }
  }
  for (const std::string& identifier : sorted) QRTLocksDebug("Got lock on identifier %@", identifier);
}

}  // namespace

void take_one_lock(const std::string& identifier, bool writing) { takeSortedList({identifier}, writing); }

void unlock_one_lock(const std::string& identifier) {
  QRTLocksState& locks = gQRTLocks;
  std::lock_guard<std::mutex> hold(locks.mutex);
  auto found = locks.identifierToLockMap.find(identifier);
  QRTLocksAssert(found != locks.identifierToLockMap.end());
  QRTIdentifierLockRecord& record = *found->second;
  QRTLocksAssert(record.lockState.load() != 0);
  // The holder's own mode: no writer can hold the record while we read it.
  if (record.lockState.load() == -1) {
    releaseWrite(record);
  } else {
    releaseRead(record);
  }
  --record.referenceCount;
  --tLocksHeld;
  QRTLocksDebug("Unlocked identifier %@", identifier);
  if (record.referenceCount == 0) {
    // Every waiter is counted, so none sleeps on the record.
    QRTLocksDebug("Destroying lock for identifier %@", identifier);
    QRTLocksAssert(record.lockState.load() == 0);
    locks.identifierToLockMap.erase(found);
  } else {
    record.released.notify_all();
  }
}

void _lock_identifier(const std::string& identifier, bool writing) { take_one_lock(identifier, writing); }

void _lock_identifier(const std::vector<std::string>& identifiers, bool writing) {
  takeSortedList(distinctSorted(identifiers, true), writing);
}

void unlock_identifier(const std::string& identifier) { unlock_one_lock(identifier); }

void unlock_identifier(const std::vector<std::string>& identifiers) {
  for (const std::string& identifier : distinctSorted(identifiers, false)) unlock_one_lock(identifier);
}

void _lock_all_identifiers(bool writing) {
  QRTLocksState& locks = gQRTLocks;
  QRTLocksDebug("Waiting to lock all identifiers for %s", modeName(writing));
  {
    std::unique_lock<std::mutex> hold(locks.mutex);
    if (writing) {
      ++locks.allWritersWaiting;
      locks.allWriterCondition.wait(hold, [&] {
        return locks.identifierReaderCount == 0 && locks.identifierWriterCount == 0 &&
               locks.allReaderWriterState == 0 && locks.lockersToAdmit == 0;
      });
      --locks.allWritersWaiting;
      locks.allReaderWriterState = -1;
    } else {
      waitToEnter(hold, locks.allReaderCondition,
                  [&] { return locks.identifierWriterCount == 0 && locks.allReaderWriterState != -1; });
      ++locks.allReaderWriterState;
    }
    ++tLocksHeld;
  }
  QRTLocksDebug("Locked all identifiers for %s", modeName(writing));
}

void unlock_all_identifiers() {
  QRTLocksState& locks = gQRTLocks;
  {
    std::lock_guard<std::mutex> hold(locks.mutex);
    QRTLocksAssert(locks.allReaderWriterState == -1 || locks.allReaderWriterState > 0);
    --tLocksHeld;
    if (locks.allReaderWriterState == -1) {
      locks.allReaderWriterState = 0;
      // Whoever waited through this writer goes before the next one.
      ++locks.allWriterReleases;
      locks.lockersToAdmit = locks.lockersWaiting;
      locks.allWriterCondition.notify_all();
      locks.allReaderCondition.notify_all();
      locks.identifierWriterCondition.notify_all();
      locks.identifierReaderCondition.notify_all();
    } else if (--locks.allReaderWriterState == 0) {
      locks.identifierWriterCondition.notify_all();
      if (locks.identifierReaderCount == 0 && locks.identifierWriterCount == 0) {
        locks.allWriterCondition.notify_all();
      }
    }
  }
  QRTLocksDebug("Unlocked all identifiers");
}

QRTLocksSnapshot QRTLocksGetSnapshot() {
  QRTLocksState& locks = gQRTLocks;
  std::lock_guard<std::mutex> hold(locks.mutex);
  return {locks.identifierReaderCount, locks.identifierWriterCount, locks.allReaderWriterState,
          locks.identifierToLockMap.size()};
}

QRTAllIdentifiersLock::QRTAllIdentifiersLock(bool writing, bool enabled) : enabled_(enabled) {
  if (enabled_) _lock_all_identifiers(writing);
}

QRTAllIdentifiersLock::~QRTAllIdentifiersLock() {
  if (enabled_) unlock_all_identifiers();
}

QRTIdentifierLock::QRTIdentifierLock(std::string identifier, bool writing, bool enabled)
    : identifier_(std::move(identifier)), enabled_(enabled) {
  if (enabled_) take_one_lock(identifier_, writing);
}

QRTIdentifierLock::~QRTIdentifierLock() {
  if (enabled_) unlock_one_lock(identifier_);
}

// The sorted list is kept so that the release needs no allocation.
QRTIdentifierListLock::QRTIdentifierListLock(std::vector<std::string> identifiers, bool writing, bool enabled) {
  if (!enabled) return;
  taken_ = distinctSorted(std::move(identifiers), true);
  takeSortedList(taken_, writing);
}

QRTIdentifierListLock::~QRTIdentifierListLock() {
  for (auto identifier = taken_.rbegin(); identifier != taken_.rend(); ++identifier) unlock_one_lock(*identifier);
}
