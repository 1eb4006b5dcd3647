// Test hooks for the crash-safety tests, compiled only into builds with test
// hooks (other builds compile the points away):
// - a crash point kills the daemon (SIGKILL) when R/run/quarterd.crashpoint
//   holds its name;
// - a pause point stops the calling thread for a second when
//   R/run/quarterd.pausepoint holds its name, so that a test can act while
//   an operation is half-way.
#pragma once

#ifdef QRT_TEST_HOOKS
void QRTCrashPointReached(const char* name);
void QRTPausePointReached(const char* name);
#define QRT_CRASH_POINT(name) QRTCrashPointReached(name)
#define QRT_PAUSE_POINT(name) QRTPausePointReached(name)
#else
#define QRT_CRASH_POINT(name) ((void)0)
#define QRT_PAUSE_POINT(name) ((void)0)
#endif
