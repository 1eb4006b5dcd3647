// The request listener's inside, shared by the files that make it up:
// RequestSocket.cpp (set-up, the pollers, stopping), RequestAdmission.cpp
// (accepting, per-user limits, dropping and idle connections) and
// RequestReading.cpp (reading frames under the budget and serving them).
#pragma once

#include <sys/epoll.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "base/Frame.h"
#include "platform/ByteBudget.h"
#include "platform/RequestSocket.h"

namespace platform {

namespace request_listener {

using Clock = std::chrono::steady_clock;

// Empties an eventfd or a timerfd that woke a poller.
inline void drain(int fd) {
  uint64_t value;
  while (::read(fd, &value, sizeof value) < 0 && errno == EINTR) {}
}

}  // namespace request_listener

// Several threads wait on one epoll set; each connection is armed one-shot,
// so only one thread reads it at a time. The thread that read a request
// serves it itself when another poller is free to take new events; other
// requests (the rest of a pipelined batch, or all of them when every poller
// is busy) go to the listener queue. Serving inline saves a thread hand-off
// on every request.
//
// A connection is read by whoever holds it: the poller its event woke, the
// request that brings its load back under the in-flight cap, or the poller
// that runs it off the budget's waiting list. It is re-armed, paused (load)
// or parked (budget) by that holder, and by no one else.
struct RequestListener::Impl {
  using Clock = request_listener::Clock;
  static constexpr int kPollers = 4;

  struct Client {
    ConnectionRef connection;
    uint32_t uid = UINT32_MAX;  // UINT32_MAX: credentials unreadable
    frame::Decoder decoder;     // touched only by the connection's holder
    size_t reserved = 0;        // budget held for the frame being read; holder only
    std::atomic<int> inFlight{0};
    std::atomic<bool> parked{false};  // waits for budget
    std::atomic<Clock::rep> lastActive{0};
    std::mutex pauseLock;
    bool paused = false;  // not armed until its load falls

    void touch() { lastActive.store(Clock::now().time_since_epoch().count()); }
  };
  using ClientRef = std::shared_ptr<Client>;

  std::string path;
  int listenFd = -1;
  int epollFd = -1;
  int wakeFd = -1;     // stop
  int budgetFd = -1;   // budget freed with waiters queued
  int backoffFd = -1;  // timer: accept again after running out of descriptors
  int sweepFd = -1;    // timer: close idle connections
  std::shared_ptr<ByteBudget> budget;
  std::shared_ptr<Queue> queue;
  RequestHandler handler;
  // Pollers are detached: after stopAccepting one may still be busy with a
  // request, and the process does not wait for it. Destruction does.
  std::mutex pollersLock;
  std::condition_variable pollersGone;
  int runningPollers = 0;
  bool started = false;
  std::atomic<bool> stopping{false};
  std::atomic<int> idlePollers{0};
  std::atomic<bool> acceptShort{false};  // out of descriptors (or memory) at the last accept
  std::mutex clientsLock;
  std::unordered_map<int, ClientRef> clients;
  struct UserSlots {
    int open = 0;
    bool warned = false;  // a refusal was logged since the user last had room
  };
  std::unordered_map<uint32_t, UserSlots> perUser;  // under clientsLock

  ~Impl();
  void stop();

  void run();
  void arm(int fd, uint32_t events);
  void armClient(int fd) { arm(fd, EPOLLIN | EPOLLRDHUP | EPOLLONESHOT); }
  void acceptClients();
  bool admit(const std::optional<PeerCredentials>& peer, uint32_t* uid);
  ClientRef findClient(int fd);
  void dropClient(const ClientRef& client);
  void serveWaiters();
  void sweepIdle();
  // Reads what the socket holds and the budget allows, and serves the whole frames.
  void serveClient(const ClientRef& client, bool mayServeInline);
  enum class ReadResult { Event, Empty, Parked, Closed };
  ReadResult readEvent(const ClientRef& client, RequestEvent& event);
  void dispatch(const ClientRef& client, std::vector<RequestEvent>& events, bool mayServeInline);
  void runEvent(const ClientRef& client, RequestEvent& event);
  void finishEvent(const ClientRef& client, size_t charge);
};

}  // namespace platform
