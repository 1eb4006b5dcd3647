// The reply side of a request connection: frames written whole under the
// connection's write lock, a client that stops reading given up after a while.
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <vector>

#include "base/Frame.h"
#include "platform/ByteBudget.h"
#include "platform/RequestSocket.h"

namespace platform {

namespace {

using Clock = std::chrono::steady_clock;

// A client that reads nothing for this long loses its connection rather than
// holding a request thread.
constexpr int kWriteStallMs = 10000;
constexpr int kDrainWriteStallMs = 2000;

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

}  // namespace platform
