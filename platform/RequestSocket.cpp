#include "platform/RequestSocket.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/timerfd.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <system_error>
#include <thread>

#include "platform/Log.h"
#include "platform/RequestListenerImpl.h"
#include "platform/SafePath.h"

namespace platform {

namespace {

constexpr auto kIdleSweepInterval = std::chrono::seconds(5);

void wake(int eventFd, const char* what) {
  uint64_t one = 1;
  if (::write(eventFd, &one, sizeof one) < 0 && errno != EAGAIN)
    QRTLog(kLogError, "Cannot wake the %s: %s", what, strerror(errno));
}

}  // namespace

using request_listener::drain;

RequestListener::Impl::~Impl() {
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

void RequestListener::Impl::stop() {
  if (stopping.exchange(true)) return;
  if (wakeFd >= 0) wake(wakeFd, "request pollers");
}

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
