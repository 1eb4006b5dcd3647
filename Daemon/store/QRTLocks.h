// The identifier locks: a reader-writer lock per identifier string plus one
// lock over all identifiers, kept in the process-wide gQRTLocks. An
// all-identifiers writer excludes everyone; an all-identifiers reader excludes
// identifier writers only; different identifiers never exclude each other.
#pragma once

#include <atomic>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>
#include <vector>

// One identifier that is locked or awaited. Its waiters sleep on `released`
// with gQRTLocks.mutex; once a writer waits, new readers queue behind it.
struct QRTIdentifierLockRecord {
  std::condition_variable released;
  uint64_t referenceCount = 0;        // takers not yet unlocked, waiters included
  int32_t waitingWriters = 0;         // takers waiting to write
  std::atomic<int32_t> lockState{0};  // -1 written, n > 0 read by n, 0 free
};

struct QRTLocksState {
  std::mutex mutex;  // guards everything below
  std::condition_variable allWriterCondition;
  std::condition_variable allReaderCondition;
  std::condition_variable identifierWriterCondition;
  std::condition_variable identifierReaderCondition;
  std::unordered_map<std::string, std::unique_ptr<QRTIdentifierLockRecord>> identifierToLockMap;
  int32_t identifierReaderCount = 0;  // held or awaited for reading
  int32_t identifierWriterCount = 0;  // held or awaited for writing
  int32_t allReaderWriterState = 0;   // -1 written, n > 0 read by n, 0 free
  // Fairness for the all-identifiers writer: while one waits, lockers that
  // arrive (identifier lockers and all-identifiers readers) wait behind it.
  // The lockers that were waiting when a writer lets go are let in before
  // the next writer, so a stream of writers does not starve them either.
  int32_t allWritersWaiting = 0;
  int32_t lockersWaiting = 0;
  uint64_t allWriterReleases = 0;
  int32_t lockersToAdmit = 0;
};

// Never destroyed: request threads may still hold locks while the process exits.
extern QRTLocksState& gQRTLocks;

// Each lock call blocks until held and never fails; pair it with exactly one
// unlock. A list is taken in ascending and released in descending order, each
// distinct identifier once, and is let in as a whole. Once a writer waits,
// newly arriving readers wait behind it, except on a thread that already
// holds a lock (the writer may be waiting for that one).
void _lock_identifier(const std::string& identifier, bool writing);
void _lock_identifier(const std::vector<std::string>& identifiers, bool writing);
void unlock_identifier(const std::string& identifier);
void unlock_identifier(const std::vector<std::string>& identifiers);
void _lock_all_identifiers(bool writing);
void unlock_all_identifiers();
void take_one_lock(const std::string& identifier, bool writing);
void unlock_one_lock(const std::string& identifier);

// Scoped forms for the operations; nothing is taken when enabled is false
// (the useLocking: argument).
class QRTAllIdentifiersLock {
 public:
  QRTAllIdentifiersLock(bool writing, bool enabled = true);
  ~QRTAllIdentifiersLock();
  QRTAllIdentifiersLock(const QRTAllIdentifiersLock&) = delete;
  QRTAllIdentifiersLock& operator=(const QRTAllIdentifiersLock&) = delete;

 private:
  bool enabled_;
};

class QRTIdentifierLock {
 public:
  QRTIdentifierLock(std::string identifier, bool writing, bool enabled = true);
  ~QRTIdentifierLock();
  QRTIdentifierLock(const QRTIdentifierLock&) = delete;
  QRTIdentifierLock& operator=(const QRTIdentifierLock&) = delete;

 private:
  std::string identifier_;
  bool enabled_;
};

class QRTIdentifierListLock {
 public:
  QRTIdentifierListLock(std::vector<std::string> identifiers, bool writing, bool enabled = true);
  ~QRTIdentifierListLock();
  QRTIdentifierListLock(const QRTIdentifierListLock&) = delete;
  QRTIdentifierListLock& operator=(const QRTIdentifierListLock&) = delete;

 private:
  std::vector<std::string> taken_;  // sorted ascending, distinct; empty when disabled
};

// For tests and diagnostics: the bookkeeping as seen under the mutex.
struct QRTLocksSnapshot {
  int32_t identifierReaderCount;
  int32_t identifierWriterCount;
  int32_t allReaderWriterState;
  size_t mapSize;
};
QRTLocksSnapshot QRTLocksGetSnapshot();
