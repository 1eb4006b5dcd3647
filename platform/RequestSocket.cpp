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

struct RequestListener::Impl {
  std::string path;
  int listenFd = -1;
  int epollFd = -1;
  int wakeFd = -1;
  std::shared_ptr<Queue> queue;
  RequestHandler handler;
  std::thread poller;
  std::atomic<bool> stopping{false};

  struct Client {
    ConnectionRef connection;
    frame::Decoder decoder;
    std::shared_ptr<std::atomic<int>> inFlight = std::make_shared<std::atomic<int>>(0);
    bool paused = false;
  };
  std::unordered_map<int, Client> clients;  // poller thread only
  std::mutex resumeLock;
  std::vector<ConnectionRef> toResume;  // paused clients whose load fell

  ~Impl() {
    if (poller.joinable()) {
      stopping = true;
      uint64_t one = 1;
      (void)!::write(wakeFd, &one, sizeof one);
      poller.join();
    }
    if (listenFd >= 0) ::close(listenFd);
    if (epollFd >= 0) ::close(epollFd);
    if (wakeFd >= 0) ::close(wakeFd);
  }

  void run();
  void acceptClients();
  void readClient(int fd);
  void dropClient(int fd);
  void dispatch(Client& client, RequestEvent event);
  void setReading(int fd, bool on);
  void resumePaused();
};

void RequestListener::Impl::dispatch(Client& client, RequestEvent event) {
  transactionBegin();
  client.inFlight->fetch_add(1);
  queue->async([this, connection = client.connection, inFlight = client.inFlight,
                event = std::move(event)]() mutable {
    handler(connection, event);
    if (inFlight->fetch_sub(1) == kMaxInFlight) {
      std::lock_guard<std::mutex> hold(resumeLock);
      toResume.push_back(connection);
      uint64_t one = 1;
      (void)!::write(wakeFd, &one, sizeof one);
    }
    transactionEnd();
  });
}

void RequestListener::Impl::setReading(int fd, bool on) {
  epoll_event ev{};
  ev.events = on ? (EPOLLIN | EPOLLRDHUP) : 0;
  ev.data.fd = fd;
  ::epoll_ctl(epollFd, EPOLL_CTL_MOD, fd, &ev);
}

void RequestListener::Impl::resumePaused() {
  uint64_t count;
  (void)!::read(wakeFd, &count, sizeof count);
  std::vector<ConnectionRef> ready;
  {
    std::lock_guard<std::mutex> hold(resumeLock);
    ready.swap(toResume);
  }
  for (const ConnectionRef& connection : ready) {
    auto it = clients.find(connection->fd());
    if (it == clients.end() || it->second.connection != connection || !it->second.paused) continue;
    it->second.paused = false;
    setReading(connection->fd(), true);
    readClient(connection->fd());
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
    auto connection = std::make_shared<RequestConnection>(fd, peerCredentials(fd));
    epoll_event ev{};
    ev.events = EPOLLIN | EPOLLRDHUP;
    ev.data.fd = fd;
    if (::epoll_ctl(epollFd, EPOLL_CTL_ADD, fd, &ev) != 0) {
      QRTLog(kLogError, "epoll_ctl failed for a new client: %s", strerror(errno));
      continue;  // connection closes with its last reference
    }
    clients.emplace(fd, Client{std::move(connection), frame::Decoder()});
  }
}

void RequestListener::Impl::dropClient(int fd) {
  ::epoll_ctl(epollFd, EPOLL_CTL_DEL, fd, nullptr);
  clients.erase(fd);
}

void RequestListener::Impl::readClient(int fd) {
  auto it = clients.find(fd);
  if (it == clients.end()) return;
  Client& client = it->second;
  uint8_t buffer[kReadChunk];
  bool eof = false;
  for (;;) {
    ssize_t n = ::recv(fd, buffer, sizeof buffer, 0);
    if (n > 0) {
      client.decoder.append(buffer, static_cast<size_t>(n));
      if (static_cast<size_t>(n) < sizeof buffer) break;
      continue;
    }
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) break;
    eof = true;
    break;
  }
  while (client.inFlight->load() < kMaxInFlight) {
    auto raw = client.decoder.next();
    if (!raw) break;
    RequestEvent event;
    event.messageId = raw->messageId;
    event.message = frame::decodeMessage(raw->payload, &event.failure);
    bool bad = !event.message;
    dispatch(client, std::move(event));
    if (bad) {
      // Nothing after a frame without reply context is served.
      dropClient(fd);
      return;
    }
  }
  if (client.decoder.failed()) {
    RequestEvent event;
    event.failure = client.decoder.failure();
    dispatch(client, std::move(event));
    dropClient(fd);
    return;
  }
  if (eof || client.connection->cancelled()) {
    dropClient(fd);
  } else if (client.inFlight->load() >= kMaxInFlight && !client.paused) {
    client.paused = true;
    setReading(fd, false);
  }
}

void RequestListener::Impl::run() {
  epoll_event events[64];
  while (!stopping) {
    int n = ::epoll_wait(epollFd, events, 64, -1);
    if (n < 0) {
      if (errno == EINTR) continue;
      QRTLog(kLogError, "epoll_wait failed: %s", strerror(errno));
      return;
    }
    for (int i = 0; i < n && !stopping; ++i) {
      int fd = events[i].data.fd;
      if (fd == wakeFd) {
        resumePaused();
        continue;
      }
      if (fd == listenFd) {
        acceptClients();
      } else {
        readClient(fd);
      }
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
  if (impl_->poller.joinable()) return;
  epoll_event ev{};
  ev.events = EPOLLIN;
  ev.data.fd = impl_->listenFd;
  ::epoll_ctl(impl_->epollFd, EPOLL_CTL_ADD, impl_->listenFd, &ev);
  impl_->poller = std::thread([impl = impl_.get()] { impl->run(); });
}

void RequestListener::stopAccepting() {
  if (!impl_->poller.joinable()) return;
  impl_->stopping = true;
  uint64_t one = 1;
  (void)!::write(impl_->wakeFd, &one, sizeof one);
  impl_->poller.join();
  ::close(impl_->listenFd);
  impl_->listenFd = -1;
  ::unlink(impl_->path.c_str());
}

}  // namespace platform
