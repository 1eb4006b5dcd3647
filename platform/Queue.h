// Work queues: serial queues (one item at a time, in order), concurrent
// queues, the main queue served by the main thread, and the process-wide
// keep-alive transaction count that SIGTERM waits on.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>

namespace platform {

using Work = std::function<void()>;

// Background lowers the worker's nice value; Idle makes it yield the
// processor and the disk to all other work (makeThisThreadIdle).
enum class QueuePriority { Default, Background, Idle };

class Queue {
 public:
  virtual ~Queue() = default;
  virtual void async(Work work) = 0;
  // Runs work on the queue and waits for it. Called from the queue's own work
  // on a serial queue (or the main queue) it runs the work at once instead.
  virtual void sync(Work work) = 0;
  // A suspended queue keeps its items and starts none until resumed.
  // Suspensions nest: each suspend needs its own resume.
  virtual void suspend() = 0;
  virtual void resume() = 0;
  virtual const std::string& label() const = 0;
};

std::shared_ptr<Queue> makeSerialQueue(const std::string& label, QueuePriority priority = QueuePriority::Default);
// A concurrent queue grows its threads when all are busy (work may block on
// locks) and lets idle ones go.
std::shared_ptr<Queue> makeConcurrentQueue(const std::string& label);

// The main queue runs its items on the thread that calls runMainLoop, only
// once that call is made.
Queue& mainQueue();
// Serves the main queue until stopMainLoop; returns 0 then.
int runMainLoop();
void stopMainLoop();

// Keep-alive transactions: while the count is above 0 the daemon is busy.
void transactionBegin();
void transactionEnd();
int transactionCount();
// Waits until the count is 0 or the timeout passes; true when it reached 0.
bool waitForTransactions(std::chrono::milliseconds timeout);

// On SIGTERM: calls stopAccepting (from a thread of its own), waits until 10 s
// after the signal for the transaction count to fall to 0, closes the log and
// exits with 0. Call it from main before any other thread exists: it blocks
// SIGTERM in the calling thread, and only threads created afterwards inherit
// that mask.
void installTerminationHandler(std::function<void()> stopAccepting);
// When the process exits after SIGTERM; time_point::max() until the signal
// came. Work that may block (a write to a client) waits no longer than this.
std::chrono::steady_clock::time_point exitDeadline();

}  // namespace platform
