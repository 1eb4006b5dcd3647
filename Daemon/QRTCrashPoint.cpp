#include "Daemon/QRTCrashPoint.h"

#ifdef QRT_TEST_HOOKS

#include <signal.h>
#include <string.h>

#include <string>

#include "platform/DeviceRoot.h"
#include "platform/Log.h"

void QRTCrashPointReached(const char* name) {
  static const std::string armed = platform::hostPath("/run/quarterd.crashpoint");
  auto text = platform::readHostFile(armed, 256);
  if (!text) return;
  std::string wanted = *text;
  while (!wanted.empty() && (wanted.back() == '\n' || wanted.back() == ' ')) wanted.pop_back();
  if (wanted != name) return;
  QRTLog(platform::kLogError, "Crash point %s reached: killing the daemon", name);
  raise(SIGKILL);
}

#endif
