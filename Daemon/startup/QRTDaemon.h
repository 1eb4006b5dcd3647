// Process start-up and the lock-state handling. The process-wide queues
// live below every subsystem, in Daemon/QRTProcessWide.h.
#pragma once

// Suspends the lock-state queue when the device locks, resumes it on unlock.
void lock_state_notification_callback();

// Creates the first-boot marker.
void set_first_boot_work_completed();

// Starts the kernel upcall server; false when it cannot. It accepts once
// resumed, when start-up work is over.
bool QRTKernServerStart();
void QRTKernServerResume();

// The daemon: parses the command line, starts up in order and serves until
// SIGTERM. Returns the process exit status when start-up fails.
int QRTDaemonMain(int argc, char** argv);
