#include "Daemon/QRTCrashPoint.h"

#ifdef QRT_TEST_HOOKS

#include <signal.h>
#include <string.h>

#include <chrono>
#include <string>
#include <thread>

#include "platform/DeviceRoot.h"
#include "platform/Log.h"

namespace {

// Whether the host file names this point.
bool armed(const char* file, const char* name) {
  auto text = platform::readHostFile(platform::hostPath(file), 256);
  if (!text) return false;
  std::string wanted = *text;
  while (!wanted.empty() && (wanted.back() == '\n' || wanted.back() == ' ')) wanted.pop_back();
  return wanted == name;
}

}  // namespace

void QRTCrashPointReached(const char* name) {
  if (!armed("/run/quarterd.crashpoint", name)) return;
  QRTLog(platform::kLogError, "Crash point %s reached: killing the daemon", name);
  raise(SIGKILL);
}

void QRTPausePointReached(const char* name) {
  if (!armed("/run/quarterd.pausepoint", name)) return;
  QRTLog(platform::kLogError, "Pause point %s reached", name);
  std::this_thread::sleep_for(std::chrono::seconds(1));
}

#endif
