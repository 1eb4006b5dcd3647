#include "platform/ProcessLimits.h"

#include <malloc.h>
#include <sys/resource.h>

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

}  // namespace platform
