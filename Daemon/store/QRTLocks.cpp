#include "Daemon/store/QRTLocks.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <functional>

#include "platform/Log.h"

QRTLocksState& gQRTLocks = *new QRTLocksState;

namespace {

[[noreturn]] void lockAssertionFailed(const char* expression, const char* function, int line) {
  std::string text = QRTFormat("Assertion failed: (%s), function %s, file Daemon/QRTLocks, line %d.",
                               expression, function, line);
  QRTLogAs(platform::kLogError, function, "%s", text.c_str());
  fprintf(stderr, "%s\n", text.c_str());
  fflush(stderr);
  abort();
}

// A broken invariant means a lock was paired wrongly: stop rather than go on
// with bookkeeping that no longer matches the locks.
#define QRTLocksAssert(expression)                                            \
  do {                                                                        \
    if (!(expression)) lockAssertionFailed(#expression, __func__, __LINE__);  \
  } while (0)

// Debug lines must not turn a lock or unlock into a throwing call.
#define QRTLocksDebug(...)                        \
  do {                                            \
    try {                                         \
      QRTLog(platform::kLogDebug, __VA_ARGS__);   \
    } catch (...) {                               \
    }                                             \
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

// Takes an ascending list; if one step throws, what was already taken is
// released again so no lock outlives the failed call.
void takeSortedList(const std::vector<std::string>& sorted, bool writing) {
  size_t taken = 0;
  try {
    for (; taken < sorted.size(); ++taken) take_one_lock(sorted[taken], writing);
  } catch (...) {
    while (taken > 0) unlock_one_lock(sorted[--taken]);
    throw;
  }
}

// Under the mutex: waits until this kind of identifier lock may be counted,
// then returns the identifier's record with this taker counted in it.
QRTIdentifierLockRecord& enterIdentifier(std::unique_lock<std::mutex>& hold, const std::string& identifier,
                                         bool writing) {
  QRTLocksState& locks = gQRTLocks;
  if (writing) {
    locks.identifierWriterCondition.wait(hold, [&] { return locks.allReaderWriterState == 0; });
  } else {
    locks.identifierReaderCondition.wait(hold, [&] { return locks.allReaderWriterState != -1; });
  }
  // The record is made before anything is counted, so a failed allocation
  // leaves the bookkeeping as it was.
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

// Under the mutex: the bookkeeping of giving up a write or a read.
void releaseWrite(QRTIdentifierLockRecord& record) {
  QRTLocksState& locks = gQRTLocks;
  int32_t previousState = -1;
  record.lockState.compare_exchange_strong(previousState, 0);
  QRTLocksAssert(previousState == -1);
  QRTLocksAssert(locks.allReaderWriterState == 0);
  QRTLocksAssert(locks.identifierWriterCount > 0);
  --locks.identifierWriterCount;
  if (locks.identifierWriterCount == 0 && locks.identifierReaderCount == 0) locks.allWriterCondition.notify_one();
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
    locks.allWriterCondition.notify_one();
  }
}

}  // namespace

void take_one_lock(const std::string& identifier, bool writing) {
  QRTIdentifierLockRecord* record;
  {
    std::unique_lock<std::mutex> hold(gQRTLocks.mutex);
    record = &enterIdentifier(hold, identifier, writing);
  }
  // Counted in the record, it cannot be freed while this thread waits on it.
  QRTLocksDebug("Waiting to lock %@ for %s", identifier, modeName(writing));
  if (writing) {
    record->rwlock.lock();
    int32_t previousState = 0;
    record->lockState.compare_exchange_strong(previousState, -1);
    QRTLocksAssert(previousState == 0);
  } else {
    record->rwlock.lock_shared();
    int32_t readersNow = record->lockState.fetch_add(1) + 1;
    QRTLocksAssert(readersNow > 0);
  }
  QRTLocksDebug("Got lock on identifier %@", identifier);
}

void unlock_one_lock(const std::string& identifier) {
  QRTLocksState& locks = gQRTLocks;
  std::lock_guard<std::mutex> hold(locks.mutex);
  auto found = locks.identifierToLockMap.find(identifier);
  QRTLocksAssert(found != locks.identifierToLockMap.end());
  QRTIdentifierLockRecord& record = *found->second;
  QRTLocksAssert(record.lockState.load() != 0);
  // The holder's own mode: no writer can hold the record while we read it.
  bool writing = record.lockState.load() == -1;
  if (writing) {
    releaseWrite(record);
  } else {
    releaseRead(record);
  }
  --record.referenceCount;
  if (writing) {
    record.rwlock.unlock();
  } else {
    record.rwlock.unlock_shared();
  }
  QRTLocksDebug("Unlocked identifier %@", identifier);
  if (record.referenceCount == 0) {
    QRTLocksDebug("Destroying lock for identifier %@", identifier);
    QRTLocksAssert(record.lockState.load() == 0);
    locks.identifierToLockMap.erase(found);
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
  std::unique_lock<std::mutex> hold(locks.mutex);
  if (writing) {
    locks.allWriterCondition.wait(hold, [&] {
      return locks.identifierReaderCount == 0 && locks.identifierWriterCount == 0 &&
             locks.allReaderWriterState == 0;
    });
    locks.allReaderWriterState = -1;
  } else {
    locks.allReaderCondition.wait(hold, [&] {
      return locks.identifierWriterCount == 0 && locks.allReaderWriterState != -1;
    });
    ++locks.allReaderWriterState;
  }
  QRTLocksDebug("Locked all identifiers for %s", modeName(writing));
}

void unlock_all_identifiers() {
  QRTLocksState& locks = gQRTLocks;
  {
    std::lock_guard<std::mutex> hold(locks.mutex);
    QRTLocksAssert(locks.allReaderWriterState == -1 || locks.allReaderWriterState > 0);
    if (locks.allReaderWriterState == -1) {
      locks.allReaderWriterState = 0;
      locks.allWriterCondition.notify_one();
      locks.allReaderCondition.notify_all();
      locks.identifierWriterCondition.notify_all();
      locks.identifierReaderCondition.notify_all();
    } else if (--locks.allReaderWriterState == 0) {
      locks.identifierWriterCondition.notify_all();
      if (locks.identifierReaderCount == 0 && locks.identifierWriterCount == 0) {
        locks.allWriterCondition.notify_one();
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
