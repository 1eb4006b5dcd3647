#include "Daemon/QRTDaemon.h"

#include <limits.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>

#include <cerrno>
#include <cstdio>
#include <string>

#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/requests/QRTRequestDispatcher.h"
#include "platform/DeviceProperties.h"
#include "platform/DeviceRoot.h"
#include "platform/FirstBoot.h"
#include "platform/LockState.h"
#include "platform/Log.h"
#include "platform/RequestSocket.h"

using platform::kLogDebug;
using platform::kLogError;
using platform::kLogNotice;

uint32_t gQRTLogFileCount = 1;

platform::Queue& QRTDeathRowQueue() {
  static std::shared_ptr<platform::Queue> queue =
      platform::makeSerialQueue("com.norvane.quarterd.deathrow", platform::QueuePriority::Background);
  return *queue;
}

platform::Queue& QRTLockStateQueue() {
  static std::shared_ptr<platform::Queue> queue = platform::makeSerialQueue("com.norvane.quarterd.lockstate");
  return *queue;
}

namespace {

// Starts at "unknown" so that the first call suspends only for a lock.
int gLastAppliedLockState = 3;
std::unique_ptr<platform::RequestListener> gListener;

struct Options {
  std::string root = "/";
  bool logStderr = false;
  int logLevel = platform::kLogNotice;
};

void usage() { fprintf(stderr, "usage: quarterd [--root DIR] [--log-stderr] [--log-level N]\n"); }

bool parseOptions(int argc, char** argv, Options* options) {
  for (int i = 1; i < argc; ++i) {
    std::string arg = argv[i];
    if (arg == "--root" && i + 1 < argc) {
      options->root = argv[++i];
    } else if (arg == "--log-stderr") {
      options->logStderr = true;
    } else if (arg == "--log-level" && i + 1 < argc) {
      char* end = nullptr;
      long level = strtol(argv[++i], &end, 10);
      if (!end || *end || level < 0 || level > 7) return false;
      options->logLevel = static_cast<int>(level);
    } else {
      return false;
    }
  }
  return true;
}

// The device root must exist; it is resolved once so every host path is stable.
bool setUpDeviceRoot(const std::string& root) {
  char resolved[PATH_MAX];
  if (root.empty() || root[0] != '/' || !realpath(root.c_str(), resolved)) {
    fprintf(stderr, "quarterd: bad device root %s: %s\n", root.c_str(), strerror(errno ? errno : EINVAL));
    return false;
  }
  platform::setDeviceRoot(resolved);
  for (const char* dir : {"/run", "/etc"}) mkdir(platform::hostPath(dir).c_str(), 0755);
  return true;
}

void openLog(const Options& options) {
  std::string logPath = QRTGlobalConfiguration::sharedInstance().logDirectory().path() + "/quarterd.log";
  platform::logSetStderr(options.logStderr);
  if (!platform::logOpen(logPath, "com.norvane.quarterd", options.logLevel)) {
    platform::syslogWrite(LOG_ERR, QRTFormat("Failed to set up rotating logs at path %s", logPath.c_str()));
  }
  uint64_t sizeLimit = 102400;
  gQRTLogFileCount = 1;
  if (platform::deviceIsInternalBuild()) {
    gQRTLogFileCount = 4;
    sizeLimit = 262144;
  }
  platform::logSetRotation(gQRTLogFileCount, sizeLimit);
}

void startListener() {
  auto listenerQueue = platform::makeConcurrentQueue("com.norvane.quarterd.listener");
  gListener = platform::RequestListener::create(platform::hostPath("/run/com.norvane.quarterd"), listenerQueue,
                                                QRTProcessRelayEvent);
  if (!gListener) {
    QRTLog(kLogError, "unable to start relay service!");
    return;
  }
  gListener->resume();
}

}  // namespace

void run_async_with_transaction(platform::Queue& queue, platform::Work work) {
  platform::transactionBegin();
  queue.async([work = std::move(work)] {
    work();
    platform::transactionEnd();
  });
}

void lock_state_notification_callback() {
  int state = platform::deviceLockState();
  QRTLog(kLogDebug, "LockState=%d", state);
  if (state == 1) {
    if (gLastAppliedLockState != 1) QRTLockStateQueue().suspend();
    gLastAppliedLockState = 1;
  } else if (state == 0) {
    if (gLastAppliedLockState == 1) QRTLockStateQueue().resume();
    gLastAppliedLockState = 0;
  }
}

void set_first_boot_work_completed() {
  if (!platform::createFirstBootMarker()) {
    QRTLog(kLogError, "Failed to create semaphore %s: %s", platform::firstBootMarkerPath().c_str(), strerror(errno));
  }
}

// The kernel upcall server joins with the sandbox integration; until then
// there is no upcall service to check in.
bool QRTKernServerStart() { return true; }

int QRTDaemonMain(int argc, char** argv) {
  Options options;
  if (!parseOptions(argc, argv, &options)) {
    usage();
    return 2;
  }
  // Before any thread exists, so that every thread inherits the blocked SIGTERM.
  platform::installTerminationHandler([] {
    if (gListener) gListener->stopAccepting();
  });
  if (!setUpDeviceRoot(options.root)) return 2;

  platform::transactionBegin();
  openLog(options);
  QRTLog(kLogDebug, "quarterd built at %s %s started", __DATE__, __TIME__);

  // Queue creation cannot fail here short of running out of memory, which
  // ends the process anyway; they are made now so that start-up work finds them.
  QRTDeathRowQueue();
  QRTLockStateQueue();

  QRTClientConnection& internal = QRTClientConnection::sharedClientConnection();
  const bool firstBoot = !platform::firstBootMarkerExists();
  if (firstBoot) {
    QRTLog(kLogNotice, "quarterd performing first boot initialization");
    internal.rebootQuarterSetup();
  }
  internal.quarterSetup();

  if (!QRTKernServerStart()) {
    QRTLog(kLogError, "Failed to initialize kernel upcall interface. THIS IS BAD! Exiting.");
    return -1;
  }
  if (int status = platform::watchLockState([] { lock_state_notification_callback(); })) {
    QRTLog(kLogError, "Failed to register for %s: %d", "com.norvane.device.lockstate", status);
  }
  lock_state_notification_callback();

  if (firstBoot) {
    internal.rebootQuarterCleanup();
    QRTLog(kLogNotice, "quarterd first boot cleanup complete");
    set_first_boot_work_completed();
  }
  internal.quarterCleanup();
  platform::transactionEnd();

  startListener();
  return platform::runMainLoop();
}
