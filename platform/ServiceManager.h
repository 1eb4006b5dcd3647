// Talking to the service manager: readiness, stopping and status lines
// through the notify socket (a no-op when not started by one), and the
// SIGHUP that asks for the log to be reopened.
#pragma once

#include <chrono>
#include <functional>
#include <string>

namespace platform {

// READY=1 with a STATUS= line: the request socket answers and start-up work is done.
void serviceNotifyReady(const std::string& status);
// STOPPING=1 with a STATUS= line.
void serviceNotifyStopping(const std::string& status);
void serviceNotifyStatus(const std::string& status);
// Under a service manager: a thread that sends status() as the STATUS= line
// every interval when it changed, until stopping is announced.
void serviceStatusEvery(std::chrono::seconds interval, std::function<std::string()> status);

// Sends the log's lines to the systemd journal (level as PRIORITY, the
// function as CODE_FUNC) instead of the file.
void logToJournal();

// On SIGHUP calls reopen from a thread of its own. Like
// installTerminationHandler, call it before any other thread exists.
void installHangupHandler(std::function<void()> reopen);

}  // namespace platform
