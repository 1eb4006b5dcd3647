#include "platform/ProcessLimits.h"

#include <malloc.h>
#include <sched.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>

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

int makeThisThreadIdle() {
  int error = 0;
  sched_param param{};
  if (sched_setscheduler(0, SCHED_IDLE, &param) != 0) error = errno;
  // Who 0 is the calling thread.
  if (syscall(SYS_ioprio_set, kIoprioWhoProcess, 0, kIoprioClassIdle << kIoprioClassShift) != 0 && error == 0)
    error = errno;
  return error;
}

}  // namespace platform
