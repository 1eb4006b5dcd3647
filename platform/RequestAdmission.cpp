// Connections coming and going: accepting (with a pause when the process is
// out of descriptors), the per-user limit, forgetting a closed connection and
// closing idle ones.
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/Log.h"
#include "platform/RequestListenerImpl.h"

namespace platform {

using request_listener::drain;

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

}  // namespace platform
