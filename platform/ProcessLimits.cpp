#include "platform/ProcessLimits.h"

#include <malloc.h>
#include <sched.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <mutex>
#include <set>

namespace platform {

DescriptorLimit raiseDescriptorLimit() {
  DescriptorLimit result;
  rlimit limit{};
  if (getrlimit(RLIMIT_NOFILE, &limit) != 0) {
    result.error = errno;
    result.readFailed = true;
    return result;
  }
  result.hardLimit = limit.rlim_max;
  if (limit.rlim_cur == limit.rlim_max) return result;
  limit.rlim_cur = limit.rlim_max;
  if (setrlimit(RLIMIT_NOFILE, &limit) != 0) result.error = errno;
  return result;
}

bool returnLargeAllocationsToSystem(size_t bytes) { return mallopt(M_MMAP_THRESHOLD, static_cast<int>(bytes)) == 1; }

namespace {
// From the kernel's ioprio interface, which the C library does not wrap.
constexpr int kIoprioWhoProcess = 1;
constexpr int kIoprioClassShift = 13;
constexpr int kIoprioClassIdle = 3;
}  // namespace

std::mutex gIdleLock;
std::set<pid_t> gIdleThreads;  // under gIdleLock
bool gIdleEnded = false;       // under gIdleLock

int makeThisThreadIdle() {
  std::lock_guard<std::mutex> hold(gIdleLock);
  if (gIdleEnded) return 0;
  gIdleThreads.insert(gettid());
  int error = 0;
  sched_param param{};
  if (sched_setscheduler(0, SCHED_IDLE, &param) != 0) error = errno;
  // Who 0 is the calling thread.
  if (syscall(SYS_ioprio_set, kIoprioWhoProcess, 0, kIoprioClassIdle << kIoprioClassShift) != 0 && error == 0)
    error = errno;
  return error;
}

void forgetThisIdleThread() {
  std::lock_guard<std::mutex> hold(gIdleLock);
  gIdleThreads.erase(gettid());
}

void endIdlePriority() {
  std::lock_guard<std::mutex> hold(gIdleLock);
  gIdleEnded = true;
  sched_param param{};
  for (pid_t tid : gIdleThreads) {
    sched_setscheduler(tid, SCHED_OTHER, &param);
    syscall(SYS_ioprio_set, kIoprioWhoProcess, tid, 0);  // class none: follows the processor's
  }
  gIdleThreads.clear();
}

}  // namespace platform
