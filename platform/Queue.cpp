#include "platform/Queue.h"

#include <pthread.h>
#include <signal.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <future>
#include <mutex>
#include <system_error>
#include <thread>

#include "platform/Log.h"
#include "platform/ProcessLimits.h"

namespace platform {

namespace {

constexpr size_t kMaxPoolThreads = 512;
constexpr auto kPoolIdleExit = std::chrono::seconds(5);
constexpr auto kTerminationGrace = std::chrono::seconds(10);

// The queue state whose work the current thread is running, so that a queue
// can tell its own workers apart (sync from inside, destruction from inside).
thread_local const void* tCurrentQueue = nullptr;

void runGuarded(const std::string& label, Work& work) {
  try {
    work();
  } catch (const std::exception& e) {
    QRTLog(kLogError, "Work item on queue %@ threw: %s", label, e.what());
  } catch (...) { QRTLog(kLogError, "Work item on queue %@ threw a non-standard exception", label); }
}

// Runs the front item with the lock released; the item is destroyed unlocked
// too, since what it captured may submit more work when it goes.
void runFront(std::deque<Work>& items, const std::string& label, std::unique_lock<std::mutex>& lock) {
  Work work = std::move(items.front());
  items.pop_front();
  lock.unlock();
  runGuarded(label, work);
  work = nullptr;
  lock.lock();
}

// Thread names hold 15 characters: keep the label's last component.
void nameThisThread(const std::string& label) {
  size_t dot = label.rfind('.');
  std::string name = dot == std::string::npos || dot + 1 == label.size() ? label : label.substr(dot + 1);
  pthread_setname_np(pthread_self(), name.substr(0, 15).c_str());
}

// Lower priority for background work; a refusal leaves the default.
void lowerThisThreadPriority() {
  pid_t tid = gettid();
  errno = 0;
  int nice = getpriority(PRIO_PROCESS, static_cast<id_t>(tid));
  if (nice == -1 && errno != 0) return;
  setpriority(PRIO_PROCESS, static_cast<id_t>(tid), std::min(nice + 10, 19));
}

class QueueBase : public Queue {
 public:
  explicit QueueBase(std::string label) : label_(std::move(label)) {}
  const std::string& label() const override { return label_; }

  void sync(Work work) override {
    if (runsInline()) {
      runGuarded(label_, work);
      return;
    }
    std::promise<void> done;
    std::future<void> finished = done.get_future();
    async([&done, &work] {
      struct Signal {
        std::promise<void>& done;
        ~Signal() { done.set_value(); }
      } signal{done};
      work();
    });
    finished.wait();
  }

 protected:
  // True when waiting for our own item would deadlock (serial queues called
  // from their own work).
  virtual bool runsInline() const { return false; }

 private:
  std::string label_;
};

// ---- serial queues ----

struct SerialState {
  std::mutex mutex;
  std::condition_variable wake;
  std::deque<Work> items;
  int suspended = 0;
  bool closing = false;
  std::string label;
  QueuePriority priority;
};

void serialWorker(std::shared_ptr<SerialState> state) {
  tCurrentQueue = state.get();
  nameThisThread(state->label);
  if (state->priority == QueuePriority::Background) lowerThisThreadPriority();
  if (state->priority == QueuePriority::Idle) {
    if (int error = makeThisThreadIdle())
      QRTLog(kLogError, "%s stays at normal priority: %s", state->label.c_str(), strerror(error));
  }
  std::unique_lock lock(state->mutex);
  for (;;) {
    state->wake.wait(lock, [&] { return state->closing || (state->suspended == 0 && !state->items.empty()); });
    if (state->suspended > 0 || state->items.empty()) break;  // closing, with nothing it may run
    runFront(state->items, state->label, lock);
  }
  std::deque<Work> dropped;
  dropped.swap(state->items);
  lock.unlock();
  if (state->priority == QueuePriority::Idle) forgetThisIdleThread();
}

class SerialQueue final : public QueueBase {
 public:
  SerialQueue(const std::string& label, QueuePriority priority)
      : QueueBase(label), state_(std::make_shared<SerialState>()) {
    state_->label = label;
    state_->priority = priority;
  }

  // Pending items still run unless the queue is suspended; a queue released
  // by its own work lets its worker finish alone.
  ~SerialQueue() override {
    {
      std::lock_guard lock(state_->mutex);
      state_->closing = true;
    }
    state_->wake.notify_all();
    if (!worker_.joinable()) return;
    if (tCurrentQueue == state_.get())
      worker_.detach();
    else
      worker_.join();
  }

  void async(Work work) override {
    std::lock_guard lock(state_->mutex);
    state_->items.push_back(std::move(work));
    if (worker_.joinable()) {
      state_->wake.notify_one();
      return;
    }
    try {
      worker_ = std::thread(serialWorker, state_);
    } catch (const std::system_error& e) {
      QRTLog(kLogError, "Cannot start the worker of queue %@: %s", label(), e.what());
    }
  }

  void suspend() override {
    std::lock_guard lock(state_->mutex);
    ++state_->suspended;
  }

  void resume() override {
    std::lock_guard lock(state_->mutex);
    if (state_->suspended == 0) return;
    if (--state_->suspended == 0) state_->wake.notify_one();
  }

 protected:
  bool runsInline() const override { return tCurrentQueue == state_.get(); }

 private:
  std::shared_ptr<SerialState> state_;
  std::thread worker_;
};

// ---- concurrent queues ----

struct PoolState {
  std::mutex mutex;
  std::condition_variable wake;     // workers wait here for items
  std::condition_variable drained;  // the destructor waits here for workers
  std::deque<Work> items;
  int suspended = 0;
  bool closing = false;
  size_t threads = 0;   // started and not yet gone
  size_t starting = 0;  // started, not yet looking for items
  size_t idle = 0;      // waiting for items
  std::string label;
};

void poolWorker(std::shared_ptr<PoolState> state);

void spawnPoolWorkerLocked(const std::shared_ptr<PoolState>& state) {
  if (state->threads >= kMaxPoolThreads) return;
  try {
    std::thread(poolWorker, state).detach();
  } catch (const std::system_error& e) {
    QRTLog(kLogError, "Cannot add a worker to queue %@: %s", state->label, e.what());
    return;
  }
  ++state->threads;
  ++state->starting;
}

// Every runnable item gets a worker: an idle one, one starting, or a new one.
void staffPoolLocked(const std::shared_ptr<PoolState>& state, bool wakeAll) {
  if (state->suspended > 0) return;
  if (wakeAll)
    state->wake.notify_all();
  else
    state->wake.notify_one();
  while (state->items.size() > state->idle + state->starting && state->threads < kMaxPoolThreads) {
    size_t before = state->threads;
    spawnPoolWorkerLocked(state);
    if (state->threads == before) break;
  }
}

void poolWorker(std::shared_ptr<PoolState> state) {
  tCurrentQueue = state.get();
  nameThisThread(state->label);
  std::unique_lock lock(state->mutex);
  --state->starting;
  for (;;) {
    if (state->suspended == 0 && !state->items.empty()) {
      runFront(state->items, state->label, lock);
      continue;
    }
    if (state->closing) break;
    ++state->idle;
    bool timedOut = state->wake.wait_for(lock, kPoolIdleExit) == std::cv_status::timeout;
    --state->idle;
    bool nothingToRun = state->suspended > 0 || state->items.empty();
    if (timedOut && nothingToRun && state->threads > 1) break;
  }
  if (--state->threads == 0) state->drained.notify_all();
}

class ConcurrentQueue final : public QueueBase {
 public:
  explicit ConcurrentQueue(const std::string& label) : QueueBase(label), state_(std::make_shared<PoolState>()) {
    state_->label = label;
  }

  ~ConcurrentQueue() override {
    std::unique_lock lock(state_->mutex);
    state_->closing = true;
    state_->wake.notify_all();
    if (tCurrentQueue == state_.get()) return;  // our own worker: the others finish alone
    state_->drained.wait(lock, [&] { return state_->threads == 0; });
  }

  void async(Work work) override {
    std::lock_guard lock(state_->mutex);
    state_->items.push_back(std::move(work));
    staffPoolLocked(state_, false);
  }

  void suspend() override {
    std::lock_guard lock(state_->mutex);
    ++state_->suspended;
  }

  void resume() override {
    std::lock_guard lock(state_->mutex);
    if (state_->suspended == 0) return;
    if (--state_->suspended == 0) staffPoolLocked(state_, true);
  }

 private:
  std::shared_ptr<PoolState> state_;
};

// ---- the main queue ----

class MainQueue final : public QueueBase {
 public:
  MainQueue() : QueueBase("com.norvane.quarterd.main") {}

  void async(Work work) override {
    std::lock_guard lock(mutex_);
    items_.push_back(std::move(work));
    wake_.notify_one();
  }

  void suspend() override {
    std::lock_guard lock(mutex_);
    ++suspended_;
  }

  void resume() override {
    std::lock_guard lock(mutex_);
    if (suspended_ == 0) return;
    if (--suspended_ == 0) wake_.notify_one();
  }

  int run() {
    const void* outer = tCurrentQueue;
    tCurrentQueue = this;
    std::unique_lock lock(mutex_);
    for (;;) {
      wake_.wait(lock, [&] { return stopRequested_ || (suspended_ == 0 && !items_.empty()); });
      if (stopRequested_) break;
      runFront(items_, label(), lock);
    }
    stopRequested_ = false;
    tCurrentQueue = outer;
    return 0;
  }

  void stop() {
    std::lock_guard lock(mutex_);
    stopRequested_ = true;
    wake_.notify_all();
  }

 protected:
  bool runsInline() const override { return tCurrentQueue == this; }

 private:
  std::mutex mutex_;
  std::condition_variable wake_;
  std::deque<Work> items_;
  int suspended_ = 0;
  bool stopRequested_ = false;
};

MainQueue& theMainQueue() {
  static MainQueue* queue = new MainQueue;  // outlives every thread that may post to it
  return *queue;
}

// ---- keep-alive transactions ----

struct Transactions {
  std::atomic<int> count{0};
  std::mutex mutex;
  std::condition_variable zero;
};

Transactions& transactions() {
  static Transactions* t = new Transactions;
  return *t;
}

// Set once by the SIGTERM thread, read by writers on any thread.
std::atomic<std::chrono::steady_clock::rep> gExitDeadline{
    std::chrono::steady_clock::time_point::max().time_since_epoch().count()};

void terminationThread(sigset_t signals, const std::function<void()>& stopAccepting) {
  int received = 0;
  while (sigwait(&signals, &received) != 0) {}
  const auto deadline = std::chrono::steady_clock::now() + kTerminationGrace;
  gExitDeadline.store(deadline.time_since_epoch().count());
  QRTLog(kLogNotice, "SIGTERM received; %d transactions open", transactionCount());
  try {
    if (stopAccepting) stopAccepting();
  } catch (const std::exception& e) { QRTLog(kLogError, "Stopping the listener threw: %s", e.what()); } catch (...) {
  }
  const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
  if (!waitForTransactions(std::max(left, std::chrono::milliseconds(0))))
    QRTLog(kLogError, "Exiting with %d transactions still open", transactionCount());
  logClose();
  _exit(0);
}

}  // namespace

std::shared_ptr<Queue> makeSerialQueue(const std::string& label, QueuePriority priority) {
  return std::make_shared<SerialQueue>(label, priority);
}

std::shared_ptr<Queue> makeConcurrentQueue(const std::string& label) {
  return std::make_shared<ConcurrentQueue>(label);
}

Queue& mainQueue() { return theMainQueue(); }

int runMainLoop() { return theMainQueue().run(); }

void stopMainLoop() { theMainQueue().stop(); }

void transactionBegin() { transactions().count.fetch_add(1); }

void transactionEnd() {
  Transactions& t = transactions();
  int current = t.count.load();
  do {
    if (current <= 0) return;  // unbalanced end: ignored
  } while (!t.count.compare_exchange_weak(current, current - 1));
  if (current == 1) {
    std::lock_guard lock(t.mutex);
    t.zero.notify_all();
  }
}

int transactionCount() { return transactions().count.load(); }

bool waitForTransactions(std::chrono::milliseconds timeout) {
  Transactions& t = transactions();
  std::unique_lock lock(t.mutex);
  return t.zero.wait_for(lock, timeout, [&] { return t.count.load() == 0; });
}

std::chrono::steady_clock::time_point exitDeadline() {
  return std::chrono::steady_clock::time_point(std::chrono::steady_clock::duration(gExitDeadline.load()));
}

void installTerminationHandler(std::function<void()> stopAccepting) {
  static std::once_flag once;
  std::call_once(once, [&] {
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGTERM);
    if (int error = pthread_sigmask(SIG_BLOCK, &signals, nullptr))
      QRTLog(kLogError, "Cannot block SIGTERM: %s", strerror(error));
    try {
      std::thread(terminationThread, signals, std::move(stopAccepting)).detach();
    } catch (const std::system_error& e) { QRTLog(kLogError, "Cannot start the SIGTERM handler: %s", e.what()); }
  });
}

}  // namespace platform
