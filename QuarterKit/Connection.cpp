#include <errno.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <mutex>
#include <thread>
#include <unordered_map>
#include <utility>
#include <vector>

#include "QuarterKit/QuarterKit.h"
#include "QuarterKit/Testing.h"
#include "base/Frame.h"

namespace quarterkit {

namespace {
using MaybeReply = std::optional<plist::Dictionary>;
}  // namespace

struct Connection::Impl {
  explicit Impl(int socketFd) : fd(socketFd) {
    reader = std::thread([this] { readLoop(); });
  }
  ~Impl() {
    ::shutdown(fd, SHUT_RDWR);
    if (reader.joinable()) reader.join();
    ::close(fd);
  }

  std::pair<uint64_t, std::future<MaybeReply>> submit(const plist::Dictionary& request);
  void forget(uint64_t id);
  bool writeAll(const uint8_t* p, size_t length);
  void readLoop();
  void deliver(frame::RawFrame&& f);
  void failAll();

  const int fd;
  std::atomic<uint64_t> nextId{1};
  std::atomic<bool> isClosed{false};
  std::atomic<int64_t> replyTimeoutMs{60'000};
  std::mutex writeMutex;
  std::mutex pendingMutex;
  std::unordered_map<uint64_t, std::promise<MaybeReply>> pending;
  std::thread reader;
};

std::pair<uint64_t, std::future<MaybeReply>> Connection::Impl::submit(const plist::Dictionary& request) {
  const uint64_t id = nextId.fetch_add(1, std::memory_order_relaxed);
  std::promise<MaybeReply> promise;
  std::future<MaybeReply> future = promise.get_future();
  {
    std::lock_guard<std::mutex> lock(pendingMutex);
    if (isClosed.load()) {
      promise.set_value(std::nullopt);
      return {id, std::move(future)};
    }
    pending.emplace(id, std::move(promise));
  }
  bool written = false;
  try {
    const std::vector<uint8_t> bytes = frame::encode(id, request);
    if (bytes.size() - 4 > frame::kMaxLength) {
      // The daemon would drop the connection over it; fail it alone.
      forget(id);
      return {id, std::move(future)};
    }
    std::lock_guard<std::mutex> lock(writeMutex);
    written = writeAll(bytes.data(), bytes.size());
  } catch (const std::exception&) {
    // An unencodable request fails alone; the stream is untouched.
    forget(id);
    return {id, std::move(future)};
  }
  if (!written) {
    // A partial frame leaves the stream unusable: end it, so the reader
    // fails every pending request, this one included.
    ::shutdown(fd, SHUT_RDWR);
  }
  return {id, std::move(future)};
}

// Drops a pending request, answering nothing if it was still waiting.
void Connection::Impl::forget(uint64_t id) {
  std::promise<MaybeReply> promise;
  {
    std::lock_guard<std::mutex> lock(pendingMutex);
    auto it = pending.find(id);
    if (it == pending.end()) return;
    promise = std::move(it->second);
    pending.erase(it);
  }
  promise.set_value(std::nullopt);
}

bool Connection::Impl::writeAll(const uint8_t* p, size_t length) { return frame::sendAll(fd, p, length); }

void Connection::Impl::readLoop() {
  frame::Decoder decoder;
  std::vector<uint8_t> buffer(64 * 1024);
  try {
    for (;;) {
      ssize_t n = ::recv(fd, buffer.data(), buffer.size(), 0);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) break;
      decoder.append(buffer.data(), static_cast<size_t>(n));
      while (auto f = decoder.next()) deliver(std::move(*f));
      if (decoder.failed()) break;
    }
  } catch (const std::exception&) {
    // Out of memory while decoding: treat like a broken stream.
  }
  failAll();
}

void Connection::Impl::deliver(frame::RawFrame&& f) {
  std::promise<MaybeReply> promise;
  {
    std::lock_guard<std::mutex> lock(pendingMutex);
    auto it = pending.find(f.messageId);
    if (it == pending.end()) return;  // a reply nobody waits for
    promise = std::move(it->second);
    pending.erase(it);
  }
  // An undecodable payload still has intact framing: only its request fails.
  MaybeReply reply;
  try {
    reply = frame::decodeMessage(f.payload);
  } catch (const std::exception&) {}
  promise.set_value(std::move(reply));
}

void Connection::Impl::failAll() {
  std::unordered_map<uint64_t, std::promise<MaybeReply>> orphans;
  {
    std::lock_guard<std::mutex> lock(pendingMutex);
    isClosed.store(true);
    orphans.swap(pending);
  }
  for (auto& [id, promise] : orphans) promise.set_value(std::nullopt);
}

std::string requestSocketPath(const std::string& deviceRoot) {
  std::string root = deviceRoot;
  while (!root.empty() && root.back() == '/') root.pop_back();
  // No root: this machine's daemon, in the host profile's place.
  if (root.empty()) return "/run/quarterd/request.sock";
  return root + "/run/com.norvane.quarterd";
}

Connection::Connection(std::unique_ptr<Impl> impl) : impl_(std::move(impl)) {}
Connection::~Connection() = default;

std::unique_ptr<Connection> Connection::connect(const std::string& socketPath, std::string* error) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (socketPath.empty() || socketPath.size() >= sizeof(address.sun_path)) {
    if (error) *error = "socket path is empty or too long: " + socketPath;
    return nullptr;
  }
  memcpy(address.sun_path, socketPath.data(), socketPath.size());
  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    if (error) *error = std::string("socket: ") + strerror(errno);
    return nullptr;
  }
  int rc;
  do {
    rc = ::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address));
  } while (rc < 0 && errno == EINTR);
  if (rc < 0) {
    if (error) *error = "cannot connect to " + socketPath + ": " + strerror(errno);
    ::close(fd);
    return nullptr;
  }
  auto connection = detail::ConnectionAccess::adopt(fd);
  if (!connection && error) *error = "cannot start the connection's reader thread";
  return connection;
}

std::unique_ptr<Connection> detail::ConnectionAccess::adopt(int fd) {
  try {
    return std::unique_ptr<Connection>(new Connection(std::make_unique<Connection::Impl>(fd)));
  } catch (const std::exception&) {
    // No reader thread could be started.
    ::close(fd);
    return nullptr;
  }
}

std::future<MaybeReply> Connection::send(const plist::Dictionary& request) { return impl_->submit(request).second; }

MaybeReply Connection::call(const plist::Dictionary& request, std::chrono::milliseconds timeout) {
  auto [id, future] = impl_->submit(request);
  if (future.wait_for(timeout) != std::future_status::ready) {
    impl_->forget(id);
    return std::nullopt;
  }
  return future.get();
}

bool detail::ConnectionAccess::sendRaw(Connection& connection, const void* bytes, size_t length) {
  std::lock_guard<std::mutex> lock(connection.impl_->writeMutex);
  return connection.impl_->writeAll(static_cast<const uint8_t*>(bytes), length);
}

bool Connection::closed() const { return impl_->isClosed.load(); }

void Connection::setReplyTimeout(std::chrono::milliseconds timeout) { impl_->replyTimeoutMs = timeout.count(); }

std::chrono::milliseconds Connection::replyTimeout() const {
  return std::chrono::milliseconds(impl_->replyTimeoutMs.load());
}

}  // namespace quarterkit
