// Crash points for the crash-safety tests: in a build with test hooks, a
// named point kills the daemon (SIGKILL) when R/run/quarterd.crashpoint
// holds that name. Other builds compile the points away.
#pragma once

#ifdef QRT_TEST_HOOKS
void QRTCrashPointReached(const char* name);
#define QRT_CRASH_POINT(name) QRTCrashPointReached(name)
#else
#define QRT_CRASH_POINT(name) ((void)0)
#endif
