// The client library of quarterd: one connection to the request socket with
// any number of requests in flight, matched to their replies by message id.
#pragma once

#include <chrono>
#include <cstdint>
#include <future>
#include <memory>
#include <optional>
#include <string>

#include <quarterkit/PlistValue.h>

namespace quarterkit {

namespace detail {
struct ConnectionAccess;
}  // namespace detail

// R + "/run/com.norvane.quarterd" for a device root R; "/" or "" (no root)
// gives the host daemon's /run/quarterd/request.sock.
std::string requestSocketPath(const std::string& deviceRoot = "/");

class Connection {
 public:
  // Connects to the socket; nullptr with a reason in *error when it cannot.
  static std::unique_ptr<Connection> connect(const std::string& socketPath, std::string* error = nullptr);
  ~Connection();

  // Sends a request; the future yields the reply, or nothing when the
  // connection closed first.
  std::future<std::optional<plist::Dictionary>> send(const plist::Dictionary& request);
  // send() and wait; nothing on close or timeout.
  std::optional<plist::Dictionary> call(const plist::Dictionary& request,
                                        std::chrono::milliseconds timeout = std::chrono::seconds(60));
  // How long the typed calls of Requests.h wait for a reply (default 60 s).
  void setReplyTimeout(std::chrono::milliseconds timeout);
  std::chrono::milliseconds replyTimeout() const;
  // Whether the daemon has closed the connection.
  bool closed() const;

  struct Impl;

 private:
  friend struct detail::ConnectionAccess;
  explicit Connection(std::unique_ptr<Impl> impl);
  std::unique_ptr<Impl> impl_;
};

}  // namespace quarterkit
