#include "Daemon/startup/QRTDaemon.h"

#include <limits.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>

#include <getopt.h>

#include <cerrno>
#include <cstdio>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Daemon/QRTMetrics.h"
#include "Daemon/QRTProcessWide.h"
#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/requests/QRTOperationsCommands.h"
#include "Daemon/requests/QRTRequestDispatcher.h"
#include "Daemon/sandbox/QRTKernServer.h"
#include "platform/DeviceProperties.h"
#include "platform/DeviceRoot.h"
#include "platform/FirstBoot.h"
#include "platform/HostProfile.h"
#include "platform/InstanceLock.h"
#include "platform/LockState.h"
#include "platform/Log.h"
#include "platform/ProcessLimits.h"
#include "platform/RequestSocket.h"
#include "platform/SafePath.h"
#include "platform/ServiceManager.h"
#include "platform/UpcallSocket.h"

using platform::kLogDebug;
using platform::kLogError;
using platform::kLogNotice;

namespace {

// Starts at "unknown" so that the first call suspends only for a lock.
int gLastAppliedLockState = 3;

// The listener is made by the main thread and stopped by the SIGTERM thread.
std::mutex gListenerLock;
std::unique_ptr<platform::RequestListener> gListener;
// Kept for the life of the process and never destroyed, not even by exit:
// its threads may still be running then.
platform::UpcallListener* gUpcallListener = nullptr;
bool gTerminating = false;

struct Options {
  std::optional<std::string> root;  // nothing: the host profile
  bool logStderr = false;
  bool logJournal = false;
  bool logFile = false;
  int logLevel = platform::kLogNotice;
  bool help = false;
  bool version = false;
};

const char kUsage[] = R"(usage: quarterd [--root DIR] [--log-stderr] [--log-level N] [--log-journal | --log-file]

Owns the containers of every program of a device and serves requests for them.
Without --root it serves this machine: the store in /var/lib/quarterd, the
sockets in /run/quarterd, the configuration in /etc/quarterd/quarterd.conf.

Options:
  --root DIR       serve the device tree under DIR, an existing absolute directory
  --log-stderr     also write every log line to standard error
  --log-level N    the log's starting level, 0 to 7 (default 5; 7 adds debug lines)
  --log-journal    log to the systemd journal (the default without --root)
  --log-file       log to the rotated file under the daemon's home (the default with --root)
  -h, --help       print this text and exit
  -V, --version    print the version and exit
)";

void usage(FILE* to) { fputs(kUsage, to); }

bool parseOptions(int argc, char** argv, Options* options) {
  enum { kRoot = 1000, kLogStderr, kLogLevel, kLogJournal, kLogFile };
  static const option kLong[] = {
      {"root", required_argument, nullptr, kRoot},
      {"log-stderr", no_argument, nullptr, kLogStderr},
      {"log-level", required_argument, nullptr, kLogLevel},
      {"log-journal", no_argument, nullptr, kLogJournal},
      {"log-file", no_argument, nullptr, kLogFile},
      {"help", no_argument, nullptr, 'h'},
      {"version", no_argument, nullptr, 'V'},
      {nullptr, 0, nullptr, 0},
  };
  opterr = 0;
  for (int c; (c = getopt_long(argc, argv, "+hV", kLong, nullptr)) != -1;) {
    switch (c) {
      case kRoot: options->root = optarg; break;
      case kLogStderr: options->logStderr = true; break;
      case kLogJournal: options->logJournal = true; break;
      case kLogFile: options->logFile = true; break;
      case kLogLevel: {
        char* end = nullptr;
        errno = 0;
        long level = strtol(optarg, &end, 10);
        if (errno || !*optarg || *end || level < 0 || level > 7) {
          fprintf(stderr, "quarterd: --log-level takes 0 to 7, not '%s'\n", optarg);
          return false;
        }
        options->logLevel = static_cast<int>(level);
        break;
      }
      case 'h': options->help = true; break;
      case 'V': options->version = true; break;
      default:
        fprintf(stderr, "quarterd: %s: %s\n", optopt ? "bad or incomplete option" : "unknown option", argv[optind - 1]);
        return false;
    }
  }
  if (optind < argc) {
    fprintf(stderr, "quarterd: unexpected argument %s\n", argv[optind]);
    return false;
  }
  if (options->logJournal && options->logFile) {
    fprintf(stderr, "quarterd: --log-journal and --log-file exclude each other\n");
    return false;
  }
  if (!options->logJournal && !options->logFile) options->logJournal = !options->root;
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
  for (const char* dir : {"/run", "/etc"}) {
    std::string path = platform::hostPath(dir);
    platform::UniqueFd made;
    if (int err = platform::safeMakeDirectory(path, 0755, false, platform::kAnyOwner, &made))
      fprintf(stderr, "quarterd: cannot create %s: %s\n", path.c_str(), strerror(err));
  }
  return true;
}

// The host profile's directories, in case systemd-tmpfiles has not run.
// Returns the configuration's complaints, to be logged once the log is open.
std::vector<platform::HostProfileLine> setUpHostProfile() {
  platform::enableHostProfile();
  platform::setDeviceRoot("/");
  std::vector<platform::HostProfileLine> lines = platform::loadHostProfile();
  for (const char* dir : {"/run/quarterd", "/var/lib/quarterd"}) {
    platform::UniqueFd made;
    if (int err = platform::safeMakeDirectory(dir, 0755, true, platform::kAnyOwner, &made))
      lines.push_back({kLogError, QRTFormat("Cannot create %s: %s", dir, strerror(err))});
  }
  return lines;
}

// Every connection costs a descriptor: take all the system lets us have.
void raiseDescriptorLimit() {
  const platform::DescriptorLimit limit = platform::raiseDescriptorLimit();
  if (limit.readFailed) {
    QRTLog(kLogError, "getrlimit(RLIMIT_NOFILE) failed: %s", strerror(limit.error));
  } else if (limit.error) {
    QRTLog(kLogError, "Cannot raise RLIMIT_NOFILE to %llu: %s", static_cast<unsigned long long>(limit.hardLimit),
           strerror(limit.error));
  }
}

// One daemon per device root: a second one would run start-up work and
// replace the socket under the first.
bool takeInstanceLock() {
  const std::string path = platform::hostPath("/run/quarterd.lock");
  if (platform::acquireInstanceLock(path) >= 0) return true;
  const int error = errno;
  const std::string why = error == EWOULDBLOCK ? "another quarterd serves this device root" : strerror(error);
  QRTLog(kLogError, "Cannot lock %s: %s. Exiting.", path.c_str(), why.c_str());
  fprintf(stderr, "quarterd: cannot lock %s: %s\n", path.c_str(), why.c_str());
  return false;
}

void openLog(const Options& options) {
  platform::logSetStderr(options.logStderr);
  if (options.logJournal) {
    platform::logToJournal();
    platform::logSetLevel(options.logLevel);
    return;
  }
  std::string logPath = QRTGlobalConfiguration::sharedInstance().logDirectory().path() + "/quarterd.log";
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

bool startListener() {
  std::lock_guard<std::mutex> hold(gListenerLock);
  if (gTerminating) return true;  // SIGTERM came during start-up: the exit is under way
  auto listenerQueue = platform::makeConcurrentQueue("com.norvane.quarterd.listener");
  gListener = platform::RequestListener::create(platform::hostPath("/run/com.norvane.quarterd"), listenerQueue,
                                                QRTProcessRelayEvent);
  if (!gListener) {
    QRTLog(kLogError, "unable to start relay service!");
    QRTLog(kLogError, "Request socket: %s", strerror(errno));
    return false;
  }
  gListener->resume();
  return true;
}

void stopListener() {
  platform::serviceNotifyStopping("Stopping: finishing running requests");
  platform::endIdlePriority();  // a death-row pass under way finishes at normal priority
  std::lock_guard<std::mutex> hold(gListenerLock);
  gTerminating = true;
  if (gListener) gListener->stopAccepting();
  if (gUpcallListener) gUpcallListener->stopAccepting();
}

}  // namespace

void lock_state_notification_callback() {
  int state = platform::deviceLockState();
  QRTLog(kLogDebug, "LockState=%d", state);
  if (state == 1) {
    if (gLastAppliedLockState != 1) QRTLockStateQueue()->suspend();
    gLastAppliedLockState = 1;
  } else if (state == 0) {
    if (gLastAppliedLockState == 1) QRTLockStateQueue()->resume();
    gLastAppliedLockState = 0;
  }
}

void set_first_boot_work_completed() {
  if (!platform::createFirstBootMarker()) {
    QRTLog(kLogError, "Failed to create semaphore %s: %s", platform::firstBootMarkerPath().c_str(), strerror(errno));
  }
}

bool QRTKernServerStart() {
  // Served on the connections' own threads, never waiting for the main
  // queue: every process start waits on the answer. The listener starts
  // accepting only once start-up is over.
  const std::string path = platform::hostPath("/run/com.norvane.quarterd.upcall");
  platform::UpcallListener* listener = platform::UpcallListener::create(path, demux_server).release();
  {
    std::lock_guard<std::mutex> hold(gListenerLock);
    gUpcallListener = listener;
    if (gTerminating && listener) listener->stopAccepting();  // SIGTERM came first
  }
  if (!listener) {
    QRTLog(kLogError, "Failed to check in %s: %s", path.c_str(), strerror(errno));
    return false;
  }
  // The upcall server looks up other programs' and group containers through
  // the internal client; set here, before any request thread exists, and
  // only written when off, so that readers elsewhere never race a write.
  QRTClientConnection& internal = QRTClientConnection::sharedClientConnection();
  if (!internal.allowOtherIdLookup()) internal.setAllowOtherIdLookup(true);
  if (!internal.allowGroupIdLookup()) internal.setAllowGroupIdLookup(true);
  return true;
}

// Upcalls wait in the socket's backlog until start-up work is over, then are
// served beside requests.
void QRTKernServerResume() {
  std::lock_guard<std::mutex> hold(gListenerLock);
  if (gUpcallListener && !gTerminating) gUpcallListener->resume();
}

int QRTDaemonMain(int argc, char** argv) {
  Options options;
  if (!parseOptions(argc, argv, &options)) {
    usage(stderr);
    return 2;
  }
  QRTMetrics::startTime();  // uptime counts from here
  if (options.help || options.version) {
    if (options.help)
      usage(stdout);
    else
      printf("quarterd %s\n", QRT_VERSION);
    return 0;
  }
  // A client that goes away mid-reply must not end the daemon.
  if (signal(SIGPIPE, SIG_IGN) == SIG_ERR) fprintf(stderr, "quarterd: cannot ignore SIGPIPE: %s\n", strerror(errno));
  // Before any thread exists, so that every thread inherits the blocked
  // SIGHUP and SIGTERM (each handler starts a thread of its own).
  platform::installHangupHandler([] {
    if (platform::logReopen()) QRTLog(kLogNotice, "Log reopened");
  });
  platform::installTerminationHandler(stopListener);
  std::vector<platform::HostProfileLine> profileLines;
  if (!options.root)
    profileLines = setUpHostProfile();
  else if (!setUpDeviceRoot(*options.root))
    return 2;

  platform::transactionBegin();
  openLog(options);
  for (const auto& line : profileLines) QRTLog(line.level, "%s", line.text.c_str());
  if (!takeInstanceLock()) return 1;
  platform::serviceNotifyStatus("Starting: recovering interrupted work");
  QRTLog(kLogDebug, "quarterd built at %s %s started", __DATE__, __TIME__);
  raiseDescriptorLimit();
  // Frames and messages of megabytes go straight back to the system when
  // served, rather than staying in a thread's arena: the request budget then
  // bounds resident memory, not just what is in use. (Sanitizer allocators
  // refuse the setting.)
  if (!platform::returnLargeAllocationsToSystem(256 * 1024)) QRTLog(kLogDebug, "mallopt(M_MMAP_THRESHOLD) refused");

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
  QRTKernServerResume();

  if (!startListener()) return -1;
  // Only now does the request socket answer, and start-up work is done.
  platform::serviceNotifyReady("Serving requests");
  platform::serviceStatusEvery(std::chrono::seconds(10), QRTServiceStatusLine);
  return platform::runMainLoop();
}
