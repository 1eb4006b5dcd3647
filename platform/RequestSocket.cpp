#include "platform/RequestSocket.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <thread>
#include <unordered_map>
#include <vector>

#include "base/Frame.h"
#include "platform/Log.h"

namespace platform {

namespace {

// A client that reads nothing for this long loses its connection rather than
// holding a request thread.
constexpr int kWriteStallMs = 10000;
constexpr size_t kReadChunk = 64 * 1024;
// Requests of one connection queued or running at once; past this the
// connection is not read until some finish, so a flood cannot grow memory.
constexpr int kMaxInFlight = 256;

bool writeAll(int fd, const uint8_t* p, size_t n) {
  while (n > 0) {
    ssize_t w = ::send(fd, p, n, MSG_NOSIGNAL);
    if (w > 0) {
      p += w;
      n -= static_cast<size_t>(w);
      continue;
    }
    if (w < 0 && errno == EINTR) continue;
    if (w < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
      pollfd pfd{fd, POLLOUT, 0};
      int r = ::poll(&pfd, 1, kWriteStallMs);
      if (r > 0 && !(pfd.revents & (POLLERR | POLLHUP | POLLNVAL))) continue;
      if (r < 0 && errno == EINTR) continue;
    }
    return false;
  }
  return true;
}

}  // namespace

RequestConnection::RequestConnection(int fd, std::optional<PeerCredentials> peer)
    : fd_(fd), peer_(std::move(peer)) {}

RequestConnection::~RequestConnection() { ::close(fd_); }

bool RequestConnection::send(uint64_t messageId, const plist::Dictionary& reply) {
  std::vector<uint8_t> bytes = frame::encode(messageId, reply);
  std::lock_guard<std::mutex> hold(writeLock_);
  if (cancelled_) return false;
  if (!writeAll(fd_, bytes.data(), bytes.size())) {
    cancelled_ = true;
    ::shutdown(fd_, SHUT_RDWR);
    return false;
  }
  return true;
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
struct RequestListener::Impl {
  static constexpr int kPollers = 4;

  struct Client {
    ConnectionRef connection;
    frame::Decoder decoder;            // touched only by the thread that owns the armed event
    std::atomic<int> inFlight{0};
    std::mutex pauseLock;
    bool paused = false;               // not armed until its load falls
  };
  using ClientRef = std::shared_ptr<Client>;

  std::string path;
  int listenFd = -1;
  int epollFd = -1;
  int wakeFd = -1;
  std::shared_ptr<Queue> queue;
  RequestHandler handler;
  std::vector<std::thread> pollers;
  std::atomic<bool> stopping{false};
  std::atomic<int> idlePollers{0};
  std::mutex clientsLock;
  std::unordered_map<int, ClientRef> clients;

  ~Impl() {
    stop();
    if (epollFd >= 0) ::close(epollFd);
    if (wakeFd >= 0) ::close(wakeFd);
  }

  void stop() {
    stopping = true;
    uint64_t one = 1;
    if (wakeFd >= 0) (void)!::write(wakeFd, &one, sizeof one);
    for (std::thread& t : pollers) t.join();
    pollers.clear();
    // The epoll set stays open: requests still running may re-arm into it.
    if (listenFd >= 0) ::close(listenFd);
    listenFd = -1;
  }

  void run();
  void arm(int fd, bool listening = false);
  void acceptClients();
  ClientRef findClient(int fd);
  void dropClient(const ClientRef& client);
  // Reads what the socket holds and serves the whole frames.
  void serveClient(const ClientRef& client, bool mayServeInline);
  void dispatch(const ClientRef& client, std::vector<RequestEvent>& events, bool mayServeInline);
  void runEvent(const ClientRef& client, RequestEvent& event);
  void finishEvent(const ClientRef& client);
};

void RequestListener::Impl::arm(int fd, bool listening) {
  epoll_event ev{};
  ev.events = EPOLLIN | EPOLLONESHOT | (listening ? 0u : static_cast<uint32_t>(EPOLLRDHUP));
  ev.data.fd = fd;
  if (::epoll_ctl(epollFd, EPOLL_CTL_MOD, fd, &ev) != 0 && errno == ENOENT) {
    ::epoll_ctl(epollFd, EPOLL_CTL_ADD, fd, &ev);
  }
}

void RequestListener::Impl::acceptClients() {
  for (;;) {
    int fd = ::accept4(listenFd, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
    if (fd < 0) {
      if (errno == EINTR) continue;
      if (errno != EAGAIN && errno != EWOULDBLOCK) QRTLog(kLogError, "accept failed: %s", strerror(errno));
      return;
    }
    auto client = std::make_shared<Client>();
    client->connection = std::make_shared<RequestConnection>(fd, peerCredentials(fd));
    {
      std::lock_guard<std::mutex> hold(clientsLock);
      clients[fd] = client;
    }
    arm(fd);
  }
}

RequestListener::Impl::ClientRef RequestListener::Impl::findClient(int fd) {
  std::lock_guard<std::mutex> hold(clientsLock);
  auto it = clients.find(fd);
  return it == clients.end() ? nullptr : it->second;
}

void RequestListener::Impl::dropClient(const ClientRef& client) {
  int fd = client->connection->fd();
  ::epoll_ctl(epollFd, EPOLL_CTL_DEL, fd, nullptr);
  std::lock_guard<std::mutex> hold(clientsLock);
  auto it = clients.find(fd);
  if (it != clients.end() && it->second == client) clients.erase(it);
}

void RequestListener::Impl::runEvent(const ClientRef& client, RequestEvent& event) {
  handler(client->connection, event);
  finishEvent(client);
}

void RequestListener::Impl::finishEvent(const ClientRef& client) {
  if (client->inFlight.fetch_sub(1) == kMaxInFlight) {
    bool resume = false;
    {
      std::lock_guard<std::mutex> hold(client->pauseLock);
      resume = client->paused;
      client->paused = false;
    }
    // This thread now owns the connection's reading until it re-arms it.
    if (resume) serveClient(client, false);
  }
  transactionEnd();
}

void RequestListener::Impl::serveClient(const ClientRef& client, bool mayServeInline) {
  uint8_t buffer[kReadChunk];
  int fd = client->connection->fd();
  bool eof = false;
  for (;;) {
    ssize_t n = ::recv(fd, buffer, sizeof buffer, 0);
    if (n > 0) {
      client->decoder.append(buffer, static_cast<size_t>(n));
      if (static_cast<size_t>(n) < sizeof buffer) break;
      continue;
    }
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) break;
    eof = true;
    break;
  }
  for (;;) {
    std::vector<RequestEvent> events;
    bool closing = false;
    bool capped = false;  // stopped at the load limit: more frames may be buffered
    for (;;) {
      if (client->inFlight.load() + static_cast<int>(events.size()) >= kMaxInFlight) {
        capped = true;
        break;
      }
      auto raw = client->decoder.next();
      if (!raw) break;
      RequestEvent event;
      event.messageId = raw->messageId;
      event.message = frame::decodeMessage(raw->payload, &event.failure);
      closing = !event.message;
      events.push_back(std::move(event));
      if (closing) break;  // nothing after a frame without reply context is served
    }
    if (!closing && !capped && client->decoder.failed()) {
      RequestEvent event;
      event.failure = client->decoder.failure();
      events.push_back(std::move(event));
      closing = true;
    }
    client->inFlight.fetch_add(static_cast<int>(events.size()));
    for (size_t i = 0; i < events.size(); ++i) transactionBegin();

    if (closing || client->connection->cancelled() || (eof && !capped)) {
      dropClient(client);
      return dispatch(client, events, mayServeInline);
    }
    if (!capped) {
      arm(fd);
      return dispatch(client, events, mayServeInline);
    }
    {
      // Checked under the lock that finishEvent takes, so a request finishing
      // meanwhile either sees the pause or leaves a load this check sees fall.
      std::lock_guard<std::mutex> hold(client->pauseLock);
      if (client->inFlight.load() >= kMaxInFlight) {
        client->paused = true;  // the request that brings the load down serves it again
        return dispatch(client, events, mayServeInline);
      }
    }
    dispatch(client, events, false);  // the load fell meanwhile: serve what is buffered
  }
}

// The last request is served on this thread if another poller is free; the
// rest run on the queue, so that a pipelined batch is served concurrently.
void RequestListener::Impl::dispatch(const ClientRef& client, std::vector<RequestEvent>& events,
                                     bool mayServeInline) {
  const bool inlineLast = mayServeInline && !events.empty() && idlePollers.load() > 0;
  const size_t queued = inlineLast ? events.size() - 1 : events.size();
  for (size_t i = 0; i < queued; ++i) {
    queue->async([this, client, event = std::move(events[i])]() mutable { runEvent(client, event); });
  }
  if (inlineLast) runEvent(client, events.back());
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
    if (fd == listenFd) {
      acceptClients();
      arm(listenFd, true);
    } else if (ClientRef client = findClient(fd)) {
      serveClient(client, true);
    }
  }
}

std::unique_ptr<RequestListener> RequestListener::create(const std::string& path, std::shared_ptr<Queue> queue,
                                                         RequestHandler handler) {
  auto impl = std::make_unique<Impl>();
  impl->path = path;
  impl->queue = std::move(queue);
  impl->handler = std::move(handler);
  sockaddr_un addr{};
  if (path.size() >= sizeof addr.sun_path) {
    errno = ENAMETOOLONG;
    return nullptr;
  }
  addr.sun_family = AF_UNIX;
  memcpy(addr.sun_path, path.c_str(), path.size() + 1);
  impl->listenFd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (impl->listenFd < 0) return nullptr;
  ::unlink(path.c_str());
  if (::bind(impl->listenFd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) return nullptr;
  if (::chmod(path.c_str(), 0666) != 0) return nullptr;
  if (::listen(impl->listenFd, SOMAXCONN) != 0) return nullptr;
  impl->epollFd = ::epoll_create1(EPOLL_CLOEXEC);
  impl->wakeFd = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (impl->epollFd < 0 || impl->wakeFd < 0) return nullptr;
  epoll_event ev{};
  ev.events = EPOLLIN;
  ev.data.fd = impl->wakeFd;
  if (::epoll_ctl(impl->epollFd, EPOLL_CTL_ADD, impl->wakeFd, &ev) != 0) return nullptr;
  return std::unique_ptr<RequestListener>(new RequestListener(std::move(impl)));
}

RequestListener::RequestListener(std::unique_ptr<Impl> impl) : impl_(std::move(impl)) {}
RequestListener::~RequestListener() = default;

void RequestListener::resume() {
  if (!impl_->pollers.empty()) return;
  impl_->arm(impl_->listenFd, true);
  for (int i = 0; i < Impl::kPollers; ++i) impl_->pollers.emplace_back([impl = impl_.get()] { impl->run(); });
}

void RequestListener::stopAccepting() {
  if (impl_->pollers.empty()) return;
  impl_->stop();
  ::unlink(impl_->path.c_str());
}

}  // namespace platform
