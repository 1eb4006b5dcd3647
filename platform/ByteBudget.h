// The request socket's byte budget: the bytes read from clients and not yet
// served and the reply bytes being written, shared by every connection.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <mutex>
#include <unordered_map>

namespace platform {

// The bytes buffered from and for clients. A reader takes the whole of a
// frame once its length is known, so every byte held belongs to a frame
// that can complete, a request that will finish or a reply being written:
// whoever waits for room is never waiting on another waiter. A user other
// than root holds at most half, so that no one user can starve the others.
class ByteBudget {
 public:
  using Waiter = std::function<void()>;
  static constexpr uint32_t kNoUser = UINT32_MAX - 1;  // replies: counted globally only

  ByteBudget(size_t limit, int wakeFd) : limit_(limit), wakeFd_(wakeFd) {}

  // Takes n bytes for user when they fit; otherwise queues waiter, which a
  // poller runs once bytes come back.
  bool takeOrWait(size_t n, uint32_t user, Waiter waiter) {
    std::lock_guard<std::mutex> hold(lock_);
    if (takeLocked(n, user)) return true;
    waiters_.push_back(std::move(waiter));
    return false;
  }
  // Takes n bytes for user when they fit; nothing is queued when not.
  bool tryTake(size_t n, uint32_t user) {
    std::lock_guard<std::mutex> hold(lock_);
    return takeLocked(n, user);
  }
  // For work already admitted: a decoded message, a reply.
  void force(size_t n, uint32_t user = kNoUser) {
    std::lock_guard<std::mutex> hold(lock_);
    addLocked(n, user);
  }
  void give(size_t n, uint32_t user = kNoUser) {
    if (n == 0) return;
    bool signal;
    {
      std::lock_guard<std::mutex> hold(lock_);
      used_ -= std::min(n, used_);
      if (user != kNoUser) {
        auto it = perUser_.find(user);
        if (it != perUser_.end() && (it->second -= std::min(n, it->second)) == 0) perUser_.erase(it);
      }
      signal = !waiters_.empty() && !signalled_;
      signalled_ = signalled_ || signal;
    }
    if (signal) wakeWaiters();
  }
  // The waiters queued now; each either fits or queues itself again.
  std::deque<Waiter> takeWaiters() {
    std::lock_guard<std::mutex> hold(lock_);
    signalled_ = false;
    std::deque<Waiter> ready;
    ready.swap(waiters_);
    return ready;
  }

 private:
  size_t heldBy(uint32_t user) const {
    auto it = perUser_.find(user);
    return it == perUser_.end() ? 0 : it->second;
  }
  // Signals the poller that serves the waiters.
  void wakeWaiters();
  bool takeLocked(size_t n, uint32_t user) {
    const size_t held = heldBy(user);
    const bool userRoom = user == 0 || user == kNoUser || held == 0 || held + n <= limit_ / 2;
    if (!userRoom || (used_ != 0 && used_ + n > limit_)) return false;
    addLocked(n, user);
    return true;
  }
  void addLocked(size_t n, uint32_t user) {
    used_ += n;
    if (user != kNoUser) perUser_[user] += n;
  }

  mutable std::mutex lock_;
  const size_t limit_;
  const int wakeFd_;
  size_t used_ = 0;
  std::unordered_map<uint32_t, size_t> perUser_;
  bool signalled_ = false;
  std::deque<Waiter> waiters_;
};

}  // namespace platform
