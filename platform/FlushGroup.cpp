#include "platform/FlushGroup.h"

#include <sys/stat.h>

#include <cerrno>
#include <condition_variable>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <utility>

#include "platform/FileIO.h"

namespace platform {

namespace {

// One directory's flushes, numbered in the order they start; at most one
// runs at a time.
struct Group {
  std::mutex lock;
  std::condition_variable finished;
  uint64_t started = 0;
  uint64_t done = 0;
  bool running = false;
  uint64_t failedFlush = 0;  // the number of the last flush that failed
  int failure = 0;
  int users = 0;  // callers inside flush; guarded by the registry lock
};

using Key = std::pair<dev_t, ino_t>;

std::mutex& registryLock() {
  static std::mutex* lock = new std::mutex;
  return *lock;
}

std::map<Key, Group*>& registry() {
  static auto* groups = new std::map<Key, Group*>;
  return *groups;
}

Group* enter(const Key& key) {
  std::lock_guard<std::mutex> hold(registryLock());
  Group*& group = registry()[key];
  if (!group) group = new Group;
  ++group->users;
  return group;
}

void leave(const Key& key, Group* group) {
  std::lock_guard<std::mutex> hold(registryLock());
  if (--group->users > 0) return;
  registry().erase(key);
  delete group;
}

int flushIn(Group& group, int fd) {
  std::unique_lock<std::mutex> hold(group.lock);
  // The running flush may have begun before the caller's change: only one
  // that starts from now on covers it.
  const uint64_t needed = group.started + 1;
  while (group.done < needed) {
    if (group.running) {
      group.finished.wait(hold);
      continue;
    }
    group.running = true;
    const uint64_t number = ++group.started;
    hold.unlock();
    const int err = syncDirectory(fd);
    hold.lock();
    group.running = false;
    group.done = number;
    if (err) {
      group.failedFlush = number;
      group.failure = err;
    }
    group.finished.notify_all();
  }
  return group.failedFlush >= needed ? group.failure : 0;
}

}  // namespace

int flushDirectoryShared(int fd) {
  struct stat st;
  if (fstat(fd, &st) != 0) return errno;
  const Key key{st.st_dev, st.st_ino};
  Group* group = enter(key);
  const int err = flushIn(*group, fd);
  leave(key, group);
  return err;
}

}  // namespace platform
