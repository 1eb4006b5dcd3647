// Process start-up, the process-wide queues and the lock-state handling.
#pragma once

#include <memory>

#include "platform/Queue.h"

// Serial, background priority: destruction of death-row items. Made on first use.
platform::Queue& QRTDeathRowQueue();
// Serial, suspended while the device is locked: protection changes.
platform::Queue& QRTLockStateQueue();
// The log file count (1, or 4 on an internal build).
extern uint32_t gQRTLogFileCount;

// Runs work on queue inside a keep-alive transaction.
void run_async_with_transaction(platform::Queue& queue, platform::Work work);

// Suspends the lock-state queue when the device locks, resumes it on unlock.
void lock_state_notification_callback();

// Creates the first-boot marker.
void set_first_boot_work_completed();

// Starts the kernel upcall server; false when it cannot.
bool QRTKernServerStart();

// The daemon: parses the command line, starts up in order and serves until
// SIGTERM. Returns the process exit status when start-up fails.
int QRTDaemonMain(int argc, char** argv);
