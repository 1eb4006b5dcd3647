#include "platform/ServiceManager.h"

#include <pthread.h>
#include <signal.h>
#include <systemd/sd-daemon.h>
#include <systemd/sd-journal.h>

#include <cstdlib>
#include <cstring>
#include <mutex>
#include <system_error>
#include <thread>

#include "platform/Log.h"

namespace platform {

namespace {

void notify(const std::string& state) {
  // Keeps NOTIFY_SOCKET: the SIGTERM thread notifies after the main thread did.
  int result = sd_notify(0, state.c_str());
  if (result < 0) QRTLog(kLogError, "sd_notify failed: %s", strerror(-result));
}

void hangupThread(sigset_t signals, std::function<void()> reopen) {
  pthread_setname_np(pthread_self(), "sighup");
  for (;;) {
    int signal = 0;
    if (sigwait(&signals, &signal) == 0 && signal == SIGHUP) reopen();
  }
}

// The journal stamps time and pid itself.
void journalSink(int priority, const std::string& function, const std::string& message) {
  sd_journal_send("MESSAGE=%s: %s", function.c_str(), message.c_str(), "PRIORITY=%d", priority, "CODE_FUNC=%s",
                  function.c_str(), "SYSLOG_IDENTIFIER=%s", program_invocation_short_name, nullptr);
}

}  // namespace

void logToJournal() { logSetSink(journalSink); }

void serviceNotifyReady(const std::string& status) { notify("READY=1\nSTATUS=" + status); }

namespace {
// Once stopping is announced, the periodic status line stays quiet.
std::mutex gStatusLock;
bool gStopping = false;
}  // namespace

void serviceNotifyStopping(const std::string& status) {
  std::lock_guard<std::mutex> hold(gStatusLock);
  gStopping = true;
  notify("STOPPING=1\nSTATUS=" + status);
}

void serviceStatusEvery(std::chrono::seconds interval, std::function<std::string()> status) {
  if (!getenv("NOTIFY_SOCKET")) return;
  try {
    std::thread([interval, status = std::move(status)] {
      pthread_setname_np(pthread_self(), "status");
      std::string last;
      for (;;) {
        std::this_thread::sleep_for(interval);
        std::string now = status();
        std::lock_guard<std::mutex> hold(gStatusLock);
        if (gStopping) return;
        if (now != last) notify("STATUS=" + now);
        last = std::move(now);
      }
    }).detach();
  } catch (const std::system_error& e) { QRTLog(kLogError, "Cannot start the status line: %s", e.what()); }
}

void serviceNotifyStatus(const std::string& status) { notify("STATUS=" + status); }

void installHangupHandler(std::function<void()> reopen) {
  static std::once_flag once;
  std::call_once(once, [&] {
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGHUP);
    if (int error = pthread_sigmask(SIG_BLOCK, &signals, nullptr))
      QRTLog(kLogError, "Cannot block SIGHUP: %s", strerror(error));
    // The thread blocks every signal, so that none meant for the process
    // (SIGTERM and its own handler) lands on it.
    sigset_t all, previous;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &previous);
    try {
      std::thread(hangupThread, signals, std::move(reopen)).detach();
    } catch (const std::system_error& e) { QRTLog(kLogError, "Cannot start the SIGHUP handler: %s", e.what()); }
    pthread_sigmask(SIG_SETMASK, &previous, nullptr);
  });
}

}  // namespace platform
