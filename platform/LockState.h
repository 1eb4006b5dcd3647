// Device lock state from R/run/device/lockstate (0 unlocked, 1 locked, others
// transitional; missing is unlocked), and a watcher that calls back on the main
// queue when the file is written or replaced.
#pragma once

#include <functional>

namespace platform {

int deviceLockState();
// Starts watching; 0 on success, else an errno value.
int watchLockState(std::function<void()> onChange);

}  // namespace platform
