// The request socket: a Unix stream socket whose frames carry message
// dictionaries. Each frame becomes one event handed to the handler on the
// listener's queue; replies go back on the frame's connection.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "base/PlistValue.h"
#include "platform/Identity.h"
#include "platform/Queue.h"

namespace platform {

class RequestConnection {
 public:
  RequestConnection(int fd, std::optional<PeerCredentials> peer);
  ~RequestConnection();
  RequestConnection(const RequestConnection&) = delete;
  RequestConnection& operator=(const RequestConnection&) = delete;

  // Read once when the client connected; nothing when they could not be read.
  const std::optional<PeerCredentials>& peer() const { return peer_; }
  // Sends a reply frame; false when the connection is gone.
  bool send(uint64_t messageId, const plist::Dictionary& reply);
  // Closes the connection; replies due to it are dropped.
  void cancel();
  bool cancelled() const { return cancelled_; }
  int fd() const { return fd_; }

 private:
  int fd_;
  std::optional<PeerCredentials> peer_;
  std::mutex writeLock_;
  std::atomic<bool> cancelled_{false};
};

using ConnectionRef = std::shared_ptr<RequestConnection>;

// One event of a connection: a message, or (message empty) a frame that is not
// a property-list dictionary, which has no reply context.
struct RequestEvent {
  uint64_t messageId = 0;
  std::optional<plist::Dictionary> message;
  std::string failure;  // why message is empty
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
  // Closes the listening socket and stops reading requests; replies of
  // requests in flight are still sent.
  void stopAccepting();

  struct Impl;

 private:
  explicit RequestListener(std::unique_ptr<Impl> impl);
  std::unique_ptr<Impl> impl_;
};

}  // namespace platform
