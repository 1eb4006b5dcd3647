#include "platform/ByteBudget.h"

#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/Log.h"

namespace platform {

void ByteBudget::wakeWaiters() {
  uint64_t one = 1;
  if (::write(wakeFd_, &one, sizeof one) < 0 && errno != EAGAIN)
    QRTLog(kLogError, "Cannot wake the %s: %s", "budget waiters", strerror(errno));
}

}  // namespace platform
