// The kernel upcall socket (R/run/com.norvane.quarterd.upcall): a Unix stream
// socket, mode 0600, on which the sandbox launcher asks for a starting
// process's containers. Frames are cut here; what a frame means is the
// server's business. Each connection has a thread of its own, which reads
// its frames one at a time and serves each itself.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <span>
#include <string>
#include <vector>

namespace platform {

inline constexpr size_t kUpcallHeaderSize = 24;
// A larger region closes the connection unread.
inline constexpr size_t kUpcallMaxRegion = size_t{1} << 20;
// Connections served at once; one more is closed at once.
inline constexpr int kUpcallMaxConnections = 64;

// One request frame as it came, fields unchecked but the region's length.
struct UpcallMessage {
  uint32_t id = 0;
  uint32_t bits = 0;
  uint32_t descriptorCount = 0;
  uint32_t descriptorType = 0;
  uint32_t regionSize = 0;
  uint32_t requestSize = 0;
  std::span<const uint8_t> region;
  // The sender's credentials, read when it connected: a peer of uid 0 is the
  // kernel and has pid 0, any other its real pid.
  bool credentialsValid = false;
  pid_t pid = -1;
};

struct UpcallReply {
  uint32_t id = 0;
  int32_t returnCode = 0;
  std::vector<uint8_t> data;  // sent only with return code 0
};

enum class UpcallParse { NeedMore, TooLarge, Message };

// Looks at the start of a connection's unread bytes. Message: the first
// *consumed bytes are one frame, described in *out (region pointing into
// bytes). TooLarge: the frame's region is over the limit. Pure, for fuzzing.
UpcallParse parseUpcallFrame(std::span<const uint8_t> bytes, UpcallMessage* out, size_t* consumed);
// Message id, return code, size, then the data (none when the code is not 0).
std::vector<uint8_t> encodeUpcallReply(const UpcallReply& reply);

// True with *reply filled to answer; false closes the connection.
using UpcallHandler = std::function<bool(const UpcallMessage& request, UpcallReply* reply)>;

class UpcallListener {
 public:
  // Binds path (mode 0600; a stale socket is replaced). Nothing, with errno
  // set, when it cannot. The handler runs on the connection's thread, at
  // once and beside the other connections' (it must be safe to call from
  // several threads).
  static std::unique_ptr<UpcallListener> create(const std::string& path, UpcallHandler handler);
  ~UpcallListener();
  // Starts accepting.
  void resume();
  // Stops accepting and removes the socket (a clean exit); connections being
  // served finish.
  void stopAccepting();

  struct Impl;

 private:
  explicit UpcallListener(std::shared_ptr<Impl> impl);
  std::shared_ptr<Impl> impl_;
};

}  // namespace platform
