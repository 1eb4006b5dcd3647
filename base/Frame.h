// The request socket's framing: a 4-byte little-endian length N (8 to 16 MiB),
// an 8-byte little-endian message id, then N - 8 bytes of a binary property
// list whose top level is a dictionary. Shared by the daemon and its clients.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "base/PlistValue.h"

namespace frame {

constexpr uint32_t kMinLength = 8;
constexpr uint32_t kMaxLength = 16u * 1024 * 1024;
constexpr size_t kHeaderSize = 12;

// The bytes of one frame.
std::vector<uint8_t> encode(uint64_t messageId, const plist::Dictionary& message);

struct RawFrame {
  uint64_t messageId = 0;
  std::vector<uint8_t> payload;
};

// Splits a byte stream into frames. Bytes are appended as they arrive; next()
// hands out whole frames. A length out of range poisons the decoder: the
// stream cannot be resynchronised and the connection must be closed.
class Decoder {
 public:
  void append(const void* bytes, size_t length);
  // A whole frame, or nothing when more bytes are needed (or on error).
  std::optional<RawFrame> next();
  bool failed() const { return failed_; }
  const std::string& failure() const { return failure_; }
  size_t buffered() const { return buffer_.size() - start_; }
  // The whole size (header included) of the frame that the buffered bytes
  // begin, once its length field has arrived; 0 before.
  size_t pendingFrameSize() const;

 private:
  std::vector<uint8_t> buffer_;
  size_t start_ = 0;
  bool failed_ = false;
  std::string failure_;
};

// The payload as a message dictionary; nothing when it is not a property list
// or its top level is not a dictionary. *footprint, when given, receives the
// message's estimated memory cost.
std::optional<plist::Dictionary> decodeMessage(const std::vector<uint8_t>& payload, std::string* error = nullptr,
                                               uint64_t* footprint = nullptr);

// The whole buffer: write(2), or send(2) without SIGPIPE on a socket. When
// the descriptor would block, waitWritable (if any) says whether to go on.
// 0 or an errno value (EIO when nothing more could be written).
int writeAll(int fd, const void* data, size_t size, bool socket, bool (*waitWritable)(int fd) = nullptr);

// Whole buffers over a blocking stream socket (no SIGPIPE); false when the
// peer went away or the socket failed.
inline bool sendAll(int fd, const void* data, size_t size) { return writeAll(fd, data, size, true) == 0; }
bool recvAll(int fd, void* data, size_t size);

}  // namespace frame
