// The request socket: a Unix stream socket whose frames carry message
// dictionaries. Each frame becomes one event handed to the handler on the
// listener's queue; replies go back on the frame's connection.
#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "base/PlistValue.h"
#include "platform/Identity.h"
#include "platform/Queue.h"

namespace platform {

// Limits of the request socket. Bytes read from clients and not yet served
// (a frame counts from when its length arrives, its decoded message from when
// it is decoded) and reply bytes being written share one budget; a connection
// whose next frame does not fit is not read until the budget frees. A user
// other than root holds at most half of it.
inline constexpr size_t kRequestBufferBudget = size_t{64} << 20;
// Connections open at once per user id; root is not limited.
inline constexpr int kMaxConnectionsPerUser = 64;
// A connection with nothing in flight that completes no frame for this long
// is closed.
inline constexpr std::chrono::seconds kIdleConnectionTimeout{60};
// How long accepting pauses when the process is out of descriptors.
inline constexpr std::chrono::milliseconds kAcceptBackoff{100};

class ByteBudget;

enum class SendResult { Sent, Gone, TooLarge };

class RequestConnection {
 public:
  RequestConnection(int fd, std::optional<PeerCredentials> peer, std::shared_ptr<ByteBudget> budget = nullptr);
  ~RequestConnection();
  RequestConnection(const RequestConnection&) = delete;
  RequestConnection& operator=(const RequestConnection&) = delete;

  // Read once when the client connected; nothing when they could not be read.
  const std::optional<PeerCredentials>& peer() const { return peer_; }
  // Sends a reply frame. TooLarge (nothing sent, the stream intact) when it
  // would not fit in one frame; Gone when the connection is.
  SendResult send(uint64_t messageId, const plist::Dictionary& reply);
  // Closes the connection; replies due to it are dropped.
  void cancel();
  bool cancelled() const { return cancelled_; }
  // Replies promised by work that finishes after its request (a connection
  // owed one is not idle).
  void replyDue() { repliesDue_.fetch_add(1); }
  void replyDone() { repliesDue_.fetch_sub(1); }
  int repliesDue() const { return repliesDue_.load(); }
  int fd() const { return fd_; }

 private:
  int fd_;
  std::optional<PeerCredentials> peer_;
  std::shared_ptr<ByteBudget> budget_;
  std::mutex writeLock_;
  std::atomic<bool> cancelled_{false};
  std::atomic<int> repliesDue_{0};
};

using ConnectionRef = std::shared_ptr<RequestConnection>;

// One event of a connection: a message, or (message empty) a frame that is not
// a property-list dictionary, which has no reply context.
struct RequestEvent {
  uint64_t messageId = 0;
  std::optional<plist::Dictionary> message;
  std::string failure;  // why message is empty
  size_t charge = 0;    // budget bytes held until the event is served
};

using RequestHandler = std::function<void(const ConnectionRef&, RequestEvent&)>;

class RequestListener {
 public:
  // Binds path (mode 0666, a stale socket file is replaced). Nothing, with
  // errno set, when it cannot.
  static std::unique_ptr<RequestListener> create(const std::string& path, std::shared_ptr<Queue> queue,
                                                 RequestHandler handler);
  ~RequestListener();
  // Starts accepting and serving.
  void resume();
  // Stops accepting and reading requests without waiting for the threads
  // that serve them; replies of requests in flight are still sent.
  void stopAccepting();

  struct Impl;

 private:
  explicit RequestListener(std::unique_ptr<Impl> impl);
  std::unique_ptr<Impl> impl_;
};

}  // namespace platform
