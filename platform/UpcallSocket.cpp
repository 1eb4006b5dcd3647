#include "platform/UpcallSocket.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
#include <system_error>
#include <thread>

#include "base/Frame.h"
#include "platform/FileIO.h"
#include "platform/Log.h"
#include "platform/SafePath.h"

namespace platform {

namespace {

uint32_t readU32(const uint8_t* p) {
  uint32_t v;
  memcpy(&v, p, 4);
  return v;
}

void appendU32(std::vector<uint8_t>& out, uint32_t v) {
  uint8_t b[4];
  memcpy(b, &v, 4);
  out.insert(out.end(), b, b + 4);
}

}  // namespace

UpcallParse parseUpcallFrame(std::span<const uint8_t> bytes, UpcallMessage* out, size_t* consumed) {
  if (bytes.size() < kUpcallHeaderSize) return UpcallParse::NeedMore;
  const uint8_t* p = bytes.data();
  const uint32_t regionSize = readU32(p + 16);
  if (regionSize > kUpcallMaxRegion) return UpcallParse::TooLarge;
  if (bytes.size() - kUpcallHeaderSize < regionSize) return UpcallParse::NeedMore;
  out->id = readU32(p);
  out->bits = readU32(p + 4);
  out->descriptorCount = readU32(p + 8);
  out->descriptorType = readU32(p + 12);
  out->regionSize = regionSize;
  out->requestSize = readU32(p + 20);
  out->region = bytes.subspan(kUpcallHeaderSize, regionSize);
  *consumed = kUpcallHeaderSize + regionSize;
  return UpcallParse::Message;
}

std::vector<uint8_t> encodeUpcallReply(const UpcallReply& reply) {
  const bool withData = reply.returnCode == 0;
  std::vector<uint8_t> out;
  out.reserve(12 + (withData ? reply.data.size() : 0));
  appendU32(out, reply.id);
  appendU32(out, static_cast<uint32_t>(reply.returnCode));
  appendU32(out, withData ? static_cast<uint32_t>(reply.data.size()) : 0);
  if (withData) out.insert(out.end(), reply.data.begin(), reply.data.end());
  return out;
}

struct UpcallListener::Impl {
  std::string path;
  std::atomic<bool> stopping{false};
  UpcallHandler handler;
  UniqueFd listenFd;
  std::atomic<int> connections{0};
  bool started = false;

  void acceptLoop(const std::shared_ptr<Impl>& self);
  void serve(int fd);
};

void UpcallListener::Impl::acceptLoop(const std::shared_ptr<Impl>& self) {
  for (;;) {
    int fd = ::accept4(listenFd.get(), nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0) {
      if (errno == EINTR || errno == ECONNABORTED) continue;
      if (errno == EMFILE || errno == ENFILE || errno == ENOBUFS || errno == ENOMEM) {
        // Out of descriptors or memory: wait for some to come back.
        QRTLog(kLogError, "accept on the upcall socket: %s", strerror(errno));
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
        continue;
      }
      if (!stopping.load()) QRTLog(kLogError, "The upcall socket stops accepting: %s", strerror(errno));
      return;
    }
    if (connections.fetch_add(1) >= kUpcallMaxConnections) {
      QRTLog(kLogError, "Too many upcall connections; closing a new one");
      connections.fetch_sub(1);
      ::close(fd);
      continue;
    }
    try {
      std::thread([self, fd] {
        self->serve(fd);
        ::close(fd);
        self->connections.fetch_sub(1);
      }).detach();
    } catch (const std::system_error& e) {
      QRTLog(kLogError, "Cannot start an upcall connection: %s", e.what());
      connections.fetch_sub(1);
      ::close(fd);
    }
  }
}

void UpcallListener::Impl::serve(int fd) {
  ucred cred{};
  socklen_t length = sizeof cred;
  const bool credentialsValid = ::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &length) == 0 && length == sizeof cred;
  if (!credentialsValid) QRTLog(kLogError, "Cannot read the upcall peer's credentials: %s", strerror(errno));
  const pid_t pid = !credentialsValid ? -1 : cred.uid == 0 ? 0 : cred.pid;

  std::vector<uint8_t> buffer;
  size_t start = 0;  // bytes before it are served
  uint8_t chunk[64 * 1024];
  for (;;) {
    UpcallMessage message;
    size_t consumed = 0;
    UpcallParse parsed = parseUpcallFrame(std::span<const uint8_t>(buffer).subspan(start), &message, &consumed);
    if (parsed == UpcallParse::TooLarge) {
      QRTLog(kLogError, "Upcall region over %zu bytes; closing the connection", kUpcallMaxRegion);
      return;
    }
    if (parsed == UpcallParse::NeedMore) {
      if (start > 0) {
        buffer.erase(buffer.begin(), buffer.begin() + static_cast<ptrdiff_t>(start));
        start = 0;
      }
      ssize_t n = ::recv(fd, chunk, sizeof chunk, 0);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return;
      buffer.insert(buffer.end(), chunk, chunk + n);
      continue;
    }
    message.credentialsValid = credentialsValid;
    message.pid = pid;
    UpcallReply reply;
    if (!handler(message, &reply)) return;
    start += consumed;
    std::vector<uint8_t> frame = encodeUpcallReply(reply);
    if (!frame::sendAll(fd, frame.data(), frame.size())) return;
  }
}

std::unique_ptr<UpcallListener> UpcallListener::create(const std::string& path, UpcallHandler handler) {
  auto impl = std::make_shared<Impl>();
  impl->path = path;
  impl->handler = std::move(handler);
  // Made 0600 and listening before it has its name: no one but root ever finds it open.
  if (int err = safeListenUnixSocket(path, 0600, 0, &impl->listenFd)) {
    errno = err;
    return nullptr;
  }
  return std::unique_ptr<UpcallListener>(new UpcallListener(std::move(impl)));
}

UpcallListener::UpcallListener(std::shared_ptr<Impl> impl) : impl_(std::move(impl)) {}

// The daemon keeps its listener for the life of the process; a listener
// dropped earlier (tests) stops accepting, and connections in progress end
// with their peers.
UpcallListener::~UpcallListener() {
  if (impl_->listenFd.get() >= 0) ::shutdown(impl_->listenFd.get(), SHUT_RDWR);
}

void UpcallListener::stopAccepting() {
  if (impl_->stopping.exchange(true)) return;
  ::shutdown(impl_->listenFd.get(), SHUT_RDWR);
  if (int err = safeUnlink(impl_->path)) QRTLog(kLogError, "Cannot remove %s: %s", impl_->path.c_str(), strerror(err));
}

void UpcallListener::resume() {
  if (impl_->started) return;
  impl_->started = true;
  std::shared_ptr<Impl> impl = impl_;
  std::thread([impl] { impl->acceptLoop(impl); }).detach();
}

}  // namespace platform
