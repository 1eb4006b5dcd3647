#include "platform/RequestSocket.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/timerfd.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <system_error>
#include <thread>
#include <unordered_map>
#include <vector>

#include "base/Frame.h"
#include "platform/ByteBudget.h"
#include "platform/Log.h"
#include "platform/SafePath.h"

namespace platform {

namespace {

using Clock = std::chrono::steady_clock;

// A client that reads nothing for this long loses its connection rather than
// holding a request thread.
constexpr int kWriteStallMs = 10000;
constexpr int kDrainWriteStallMs = 2000;
constexpr size_t kReadChunk = 64 * 1024;
// Read ahead when no frame is pending: most requests fit in it whole.
constexpr size_t kSmallFrame = 1024;
// Requests of one connection queued or running at once; past this the
// connection is not read until some finish, so a flood cannot grow memory.
constexpr int kMaxInFlight = 256;
constexpr auto kIdleSweepInterval = std::chrono::seconds(5);

// Waits for the socket to take more, at most the stall limit. Once SIGTERM
// came, a client that takes nothing for a shorter while is given up, so that
// the requests queued behind it finish and the process exits early.
bool waitWritable(int fd) {
  const auto start = Clock::now();
  auto deadline = start + std::chrono::milliseconds(kWriteStallMs);
  bool draining = false;
  for (;;) {
    const auto now = Clock::now();
    if (!draining && exitDeadline() != Clock::time_point::max()) {
      draining = true;
      deadline = std::min({deadline, now + std::chrono::milliseconds(kDrainWriteStallMs), exitDeadline()});
    }
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - now).count();
    if (left <= 0) return false;
    pollfd pfd{fd, POLLOUT, 0};
    // Short slices, so that a SIGTERM meanwhile is noticed.
    int r = ::poll(&pfd, 1, static_cast<int>(std::min<long long>(left, 250)));
    if (r > 0) return !(pfd.revents & (POLLERR | POLLHUP | POLLNVAL));
    if (r < 0 && errno != EINTR) return false;
  }
}

void wake(int eventFd, const char* what) {
  uint64_t one = 1;
  if (::write(eventFd, &one, sizeof one) < 0 && errno != EAGAIN)
    QRTLog(kLogError, "Cannot wake the %s: %s", what, strerror(errno));
}

void drain(int fd) {
  uint64_t value;
  while (::read(fd, &value, sizeof value) < 0 && errno == EINTR) {}
}

}  // namespace

RequestConnection::RequestConnection(int fd, std::optional<PeerCredentials> peer, std::shared_ptr<ByteBudget> budget)
    : fd_(fd), peer_(std::move(peer)), budget_(std::move(budget)) {}

RequestConnection::~RequestConnection() { ::close(fd_); }

SendResult RequestConnection::send(uint64_t messageId, const plist::Dictionary& reply) {
  std::vector<uint8_t> bytes = frame::encode(messageId, reply);
  if (bytes.size() - 4 > frame::kMaxLength) return SendResult::TooLarge;
  if (budget_) budget_->force(bytes.size());
  bool sent = false;
  {
    std::lock_guard<std::mutex> hold(writeLock_);
    if (!cancelled_) {
      sent = frame::writeAll(fd_, bytes.data(), bytes.size(), true, waitWritable) == 0;
      if (!sent) {
        cancelled_ = true;
        ::shutdown(fd_, SHUT_RDWR);
      }
    }
  }
  if (budget_) budget_->give(bytes.size());
  return sent ? SendResult::Sent : SendResult::Gone;
}

void RequestConnection::cancel() {
  std::lock_guard<std::mutex> hold(writeLock_);
  if (cancelled_.exchange(true)) return;
  // The reader sees end of file and forgets the connection; the descriptor
  // is closed when the last reference goes.
  ::shutdown(fd_, SHUT_RDWR);
}

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

  ~Impl() {
    stop();
    {
      std::unique_lock<std::mutex> hold(pollersLock);
      pollersGone.wait(hold, [&] { return runningPollers == 0; });
    }
    // Requests still running may re-arm into the epoll set: it stays open
    // until no poller or request can use it, which a joined listener means.
    for (int fd : {listenFd, epollFd, wakeFd, budgetFd, backoffFd, sweepFd})
      if (fd >= 0) ::close(fd);
  }

  void stop() {
    if (stopping.exchange(true)) return;
    if (wakeFd >= 0) wake(wakeFd, "request pollers");
  }

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

void RequestListener::Impl::arm(int fd, uint32_t events) {
  epoll_event ev{};
  ev.events = events;
  ev.data.fd = fd;
  if (::epoll_ctl(epollFd, EPOLL_CTL_MOD, fd, &ev) == 0) return;
  if (errno == ENOENT && ::epoll_ctl(epollFd, EPOLL_CTL_ADD, fd, &ev) == 0) return;
  // Only a connection already dropped (its descriptor gone) gets here in
  // normal running; anything else leaves it unserved, which the log shows.
  if (errno != EBADF) QRTLog(kLogError, "epoll_ctl for descriptor %d failed: %s", fd, strerror(errno));
}

// The per-user connection limit; the caller closes a refused descriptor.
bool RequestListener::Impl::admit(const std::optional<PeerCredentials>& peer, uint32_t* uid) {
  *uid = peer ? static_cast<uint32_t>(peer->uid) : UINT32_MAX;
  std::lock_guard<std::mutex> hold(clientsLock);
  UserSlots& slots = perUser[*uid];
  if (*uid != 0 && slots.open >= kMaxConnectionsPerUser) {
    // One line per burst: the first refusal after the user last had room.
    if (!slots.warned)
      QRTLog(kLogError, "Refusing connections from uid %u: %d already open", *uid, kMaxConnectionsPerUser);
    slots.warned = true;
    return false;
  }
  ++slots.open;
  return true;
}

void RequestListener::Impl::acceptClients() {
  while (!stopping.load()) {
    int fd = ::accept4(listenFd, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
    if (fd < 0) {
      if (errno == EINTR || errno == ECONNABORTED) continue;
      if (errno == EAGAIN || errno == EWOULDBLOCK) break;
      const bool exhausted = errno == EMFILE || errno == ENFILE || errno == ENOBUFS || errno == ENOMEM;
      // Once per shortage, not at every retry.
      if (!exhausted || !acceptShort.exchange(true)) QRTLog(kLogError, "accept failed: %s", strerror(errno));
      if (!exhausted) break;
      // Pending connections keep the listener readable: polling it now would
      // spin. Accepting resumes when the timer fires.
      itimerspec once{};
      once.it_value.tv_nsec = std::chrono::duration_cast<std::chrono::nanoseconds>(kAcceptBackoff).count();
      if (::timerfd_settime(backoffFd, 0, &once, nullptr) != 0) {
        QRTLog(kLogError, "Cannot arm the accept back-off timer: %s", strerror(errno));
        break;
      }
      return;
    }
    if (acceptShort.exchange(false)) QRTLog(kLogNotice, "Accepting connections again");
    std::optional<PeerCredentials> peer = peerCredentials(fd);
    uint32_t uid;
    if (!admit(peer, &uid)) {
      ::close(fd);
      continue;
    }
    auto client = std::make_shared<Client>();
    client->connection = std::make_shared<RequestConnection>(fd, std::move(peer), budget);
    client->uid = uid;
    client->touch();
    {
      std::lock_guard<std::mutex> hold(clientsLock);
      clients[fd] = client;
    }
    armClient(fd);
  }
  if (!stopping.load()) arm(listenFd, EPOLLIN | EPOLLONESHOT);
}

RequestListener::Impl::ClientRef RequestListener::Impl::findClient(int fd) {
  std::lock_guard<std::mutex> hold(clientsLock);
  auto it = clients.find(fd);
  return it == clients.end() ? nullptr : it->second;
}

// Called by the connection's holder, once.
void RequestListener::Impl::dropClient(const ClientRef& client) {
  int fd = client->connection->fd();
  if (::epoll_ctl(epollFd, EPOLL_CTL_DEL, fd, nullptr) != 0 && errno != ENOENT)
    QRTLog(kLogError, "epoll_ctl(DEL) for descriptor %d failed: %s", fd, strerror(errno));
  budget->give(client->reserved, client->uid);
  client->reserved = 0;
  std::lock_guard<std::mutex> hold(clientsLock);
  auto it = clients.find(fd);
  if (it != clients.end() && it->second == client) {
    clients.erase(it);
    auto user = perUser.find(client->uid);
    if (user != perUser.end() && --user->second.open <= 0)
      perUser.erase(user);
    else if (user != perUser.end())
      user->second.warned = false;
  }
}

void RequestListener::Impl::runEvent(const ClientRef& client, RequestEvent& event) {
  const size_t charge = event.charge;
  handler(client->connection, event);
  event.message.reset();
  finishEvent(client, charge);
}

void RequestListener::Impl::finishEvent(const ClientRef& client, size_t charge) {
  client->touch();
  budget->give(charge, client->uid);
  if (client->inFlight.fetch_sub(1) == kMaxInFlight) {
    bool resume = false;
    {
      std::lock_guard<std::mutex> hold(client->pauseLock);
      resume = client->paused;
      client->paused = false;
    }
    // This thread now holds the connection until it re-arms it.
    if (resume) serveClient(client, false);
  }
  transactionEnd();
}

// Reads toward the next whole frame: the length field alone, then (with the
// whole frame taken from the budget) the rest of the frame and the next
// length field, so that no byte is read that the budget has not admitted.
// With nothing buffered, a small read taken from the budget ahead brings a
// small frame in whole with one recv.
RequestListener::Impl::ReadResult RequestListener::Impl::readEvent(const ClientRef& client, RequestEvent& event) {
  uint8_t buffer[kReadChunk];
  frame::Decoder& decoder = client->decoder;
  const int fd = client->connection->fd();
  for (;;) {
    if (auto raw = decoder.next()) {
      event.messageId = raw->messageId;
      event.charge = client->reserved;
      client->reserved = 0;
      uint64_t footprint = 0;
      event.message = frame::decodeMessage(raw->payload, &event.failure, &footprint);
      raw->payload = {};
      // The decoded message replaces the frame's bytes; what it costs beyond
      // them is held too. It is admitted work: it may go over the budget.
      if (footprint > event.charge) {
        budget->force(footprint - event.charge, client->uid);
        event.charge = footprint;
      }
      client->touch();
      return ReadResult::Event;
    }
    if (decoder.failed()) {
      event.failure = decoder.failure();
      return ReadResult::Event;  // no message: the connection closes
    }
    size_t want = 4 - std::min<size_t>(decoder.buffered(), 4);
    if (const size_t whole = decoder.pendingFrameSize()) {
      if (client->reserved < whole) {
        client->parked = true;
        std::weak_ptr<Client> weak = client;
        auto resume = [this, weak] {
          if (ClientRef c = weak.lock()) {
            c->parked = false;
            serveClient(c, false);
          }
        };
        if (!budget->takeOrWait(whole - client->reserved, client->uid, std::move(resume))) {
          const auto& peer = client->connection->peer();
          QRTLog(kLogDebug, "Request buffer budget full: connection of pid %d waits for %zu bytes",
                 peer ? static_cast<int>(peer->pid) : 0, whole);
          return ReadResult::Parked;
        }
        client->parked = false;
        client->reserved = whole;
      }
      want = whole - decoder.buffered() + 4;
    } else if (decoder.buffered() == 0 && client->reserved == 0 && budget->tryTake(kSmallFrame, client->uid)) {
      client->reserved = kSmallFrame;
      want = kSmallFrame;
    }
    ssize_t n = ::recv(fd, buffer, std::min(want, sizeof buffer), 0);
    if (n > 0) {
      decoder.append(buffer, static_cast<size_t>(n));
      continue;
    }
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
      // A read ahead that found nothing is not held while the client idles.
      if (decoder.buffered() == 0 && client->reserved != 0) {
        budget->give(client->reserved, client->uid);
        client->reserved = 0;
      }
      return ReadResult::Empty;
    }
    return ReadResult::Closed;
  }
}

void RequestListener::Impl::serveClient(const ClientRef& client, bool mayServeInline) {
  for (;;) {
    std::vector<RequestEvent> events;
    bool closing = stopping.load() || client->connection->cancelled();
    bool capped = false;  // stopped at the load limit: more frames may wait in the socket
    ReadResult read = ReadResult::Empty;
    while (!closing) {
      if (client->inFlight.load() + static_cast<int>(events.size()) >= kMaxInFlight) {
        capped = true;
        break;
      }
      RequestEvent event;
      read = readEvent(client, event);
      if (read != ReadResult::Event) {
        closing = read == ReadResult::Closed;
        break;
      }
      closing = !event.message;  // nothing after a frame without reply context is served
      events.push_back(std::move(event));
    }
    client->inFlight.fetch_add(static_cast<int>(events.size()));
    for (size_t i = 0; i < events.size(); ++i) transactionBegin();

    if (closing) {
      dropClient(client);
      return dispatch(client, events, mayServeInline);
    }
    if (!capped) {
      // Parked: the budget's waiting list holds the connection now.
      if (read == ReadResult::Empty) armClient(client->connection->fd());
      return dispatch(client, events, mayServeInline);
    }
    bool paused = false;
    {
      // Checked under the lock that finishEvent takes, so a request finishing
      // meanwhile either sees the pause or leaves a load this check sees fall.
      std::lock_guard<std::mutex> hold(client->pauseLock);
      if (client->inFlight.load() >= kMaxInFlight) {
        client->paused = true;  // the request that brings the load down serves it again
        paused = true;
      }
    }
    // Dispatched with the lock released: a request served inline here may be
    // the one that brings the load down, and finishEvent takes the lock.
    if (paused) return dispatch(client, events, mayServeInline);
    dispatch(client, events, false);  // the load fell meanwhile: read on
  }
}

// The last request is served on this thread if another poller is free; the
// rest run on the queue, so that a pipelined batch is served concurrently.
void RequestListener::Impl::dispatch(const ClientRef& client, std::vector<RequestEvent>& events, bool mayServeInline) {
  const bool inlineLast = mayServeInline && !events.empty() && idlePollers.load() > 0;
  const size_t queued = inlineLast ? events.size() - 1 : events.size();
  for (size_t i = 0; i < queued; ++i) {
    queue->async([this, client, event = std::move(events[i])]() mutable { runEvent(client, event); });
  }
  if (inlineLast) runEvent(client, events.back());
}

void RequestListener::Impl::serveWaiters() {
  drain(budgetFd);
  arm(budgetFd, EPOLLIN | EPOLLONESHOT);
  for (ByteBudget::Waiter& waiter : budget->takeWaiters()) waiter();
}

// Shutting the socket down wakes its armed event with end of file, so the
// connection's holder drops it as it would any closed one.
void RequestListener::Impl::sweepIdle() {
  drain(sweepFd);
  const auto cutoff = (Clock::now() - kIdleConnectionTimeout).time_since_epoch().count();
  std::vector<ClientRef> idle;
  {
    std::lock_guard<std::mutex> hold(clientsLock);
    for (auto& [fd, client] : clients) {
      if (client->inFlight.load() == 0 && client->connection->repliesDue() == 0 && !client->parked.load() &&
          client->lastActive.load() < cutoff)
        idle.push_back(client);
    }
  }
  for (const ClientRef& client : idle) {
    const auto& peer = client->connection->peer();
    QRTLog(kLogDebug, "Closing connection of pid %d: idle for %lld s", peer ? static_cast<int>(peer->pid) : 0,
           static_cast<long long>(kIdleConnectionTimeout.count()));
    client->connection->cancel();
  }
}

void RequestListener::Impl::run() {
  while (!stopping) {
    epoll_event event;
    idlePollers.fetch_add(1);
    int n = ::epoll_wait(epollFd, &event, 1, -1);
    idlePollers.fetch_sub(1);
    if (n < 0) {
      if (errno == EINTR) continue;
      QRTLog(kLogError, "epoll_wait failed: %s", strerror(errno));
      return;
    }
    if (n == 0 || stopping) continue;
    int fd = event.data.fd;
    if (fd == wakeFd) continue;
    if (fd == listenFd || fd == backoffFd) {
      if (fd == backoffFd) {
        drain(backoffFd);
        arm(backoffFd, EPOLLIN | EPOLLONESHOT);
      }
      acceptClients();
    } else if (fd == budgetFd) {
      serveWaiters();
    } else if (fd == sweepFd) {
      sweepIdle();
    } else if (ClientRef client = findClient(fd)) {
      serveClient(client, true);
    }
  }
}

std::unique_ptr<RequestListener> RequestListener::create(const std::string& path, std::shared_ptr<Queue> queue,
                                                         RequestHandler handler) {
  auto impl = std::make_unique<Impl>();
  // The caller reads errno: keep it past the clean-up of what was opened.
  auto fail = [&impl]() -> std::unique_ptr<RequestListener> {
    const int error = errno;
    impl.reset();
    errno = error;
    return nullptr;
  };
  impl->path = path;
  impl->queue = std::move(queue);
  impl->handler = std::move(handler);
  // Any process may connect; entitlements decide what it may do.
  UniqueFd listening;
  if (int err = safeListenUnixSocket(path, 0666, SOCK_NONBLOCK, &listening)) {
    errno = err;
    return fail();
  }
  impl->listenFd = listening.release();
  auto failBound = [&] {
    const int error = errno;
    safeUnlink(path);
    errno = error;
    return fail();
  };
  impl->epollFd = ::epoll_create1(EPOLL_CLOEXEC);
  impl->wakeFd = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  impl->budgetFd = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  impl->backoffFd = ::timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK);
  impl->sweepFd = ::timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK);
  if (impl->epollFd < 0 || impl->wakeFd < 0 || impl->budgetFd < 0 || impl->backoffFd < 0 || impl->sweepFd < 0)
    return failBound();
  impl->budget = std::make_shared<ByteBudget>(kRequestBufferBudget, impl->budgetFd);
  itimerspec sweep{};
  sweep.it_value.tv_sec = sweep.it_interval.tv_sec = kIdleSweepInterval.count();
  if (::timerfd_settime(impl->sweepFd, 0, &sweep, nullptr) != 0) return failBound();
  // The stop event stays readable, so that it wakes every poller.
  epoll_event ev{};
  ev.events = EPOLLIN;
  ev.data.fd = impl->wakeFd;
  if (::epoll_ctl(impl->epollFd, EPOLL_CTL_ADD, impl->wakeFd, &ev) != 0) return failBound();
  for (int fd : {impl->budgetFd, impl->backoffFd}) {
    ev.events = EPOLLIN | EPOLLONESHOT;
    ev.data.fd = fd;
    if (::epoll_ctl(impl->epollFd, EPOLL_CTL_ADD, fd, &ev) != 0) return failBound();
  }
  // The sweep's readiness is taken by one poller each time it fires.
  ev.events = EPOLLIN | EPOLLET;
  ev.data.fd = impl->sweepFd;
  if (::epoll_ctl(impl->epollFd, EPOLL_CTL_ADD, impl->sweepFd, &ev) != 0) return failBound();
  return std::unique_ptr<RequestListener>(new RequestListener(std::move(impl)));
}

RequestListener::RequestListener(std::unique_ptr<Impl> impl) : impl_(std::move(impl)) {}
RequestListener::~RequestListener() = default;

void RequestListener::resume() {
  Impl* impl = impl_.get();
  {
    std::lock_guard<std::mutex> hold(impl->pollersLock);
    if (impl->started) return;
    impl->started = true;
  }
  impl->arm(impl->listenFd, EPOLLIN | EPOLLONESHOT);
  for (int i = 0; i < Impl::kPollers; ++i) {
    {
      std::lock_guard<std::mutex> hold(impl->pollersLock);
      ++impl->runningPollers;
    }
    try {
      std::thread([impl] {
        impl->run();
        std::lock_guard<std::mutex> hold(impl->pollersLock);
        if (--impl->runningPollers == 0) impl->pollersGone.notify_all();
      }).detach();
    } catch (const std::system_error& e) {
      QRTLog(kLogError, "Cannot start a request poller: %s", e.what());
      std::lock_guard<std::mutex> hold(impl->pollersLock);
      --impl->runningPollers;
    }
  }
}

// Pollers busy with a request (or a reply to a client that does not read)
// finish on their own; the process does not wait for them here.
void RequestListener::stopAccepting() {
  if (impl_->stopping.load()) return;
  if (::epoll_ctl(impl_->epollFd, EPOLL_CTL_DEL, impl_->listenFd, nullptr) != 0 && errno != ENOENT)
    QRTLog(kLogError, "epoll_ctl(DEL) for the listener failed: %s", strerror(errno));
  impl_->stop();
  if (int err = safeUnlink(impl_->path)) QRTLog(kLogError, "Cannot remove %s: %s", impl_->path.c_str(), strerror(err));
}

}  // namespace platform
