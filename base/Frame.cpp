#include "base/Frame.h"

#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "base/PlistCodec.h"

namespace frame {
namespace {

constexpr uint64_t kMoveThreshold = 64 * 1024;

void putLE(std::vector<uint8_t>& out, uint64_t v, int bytes) {
  for (int i = 0; i < bytes; ++i) out.push_back(static_cast<uint8_t>(v >> (8 * i)));
}

uint64_t getLE(const uint8_t* p, int bytes) {
  uint64_t v = 0;
  for (int i = bytes - 1; i >= 0; --i) v = (v << 8) | p[i];
  return v;
}

}  // namespace

std::vector<uint8_t> encode(uint64_t messageId, const plist::Dictionary& message) {
  plist::Data body = plist::writeBinary(plist::Value(message));
  std::vector<uint8_t> out;
  out.reserve(kHeaderSize + body.size());
  putLE(out, body.size() + 8, 4);
  putLE(out, messageId, 8);
  out.insert(out.end(), body.begin(), body.end());
  return out;
}

void Decoder::append(const void* bytes, size_t length) {
  if (failed_ || length == 0) return;
  // Drop consumed bytes before growing, so a long-lived connection's buffer
  // stays the size of the frames in flight.
  if (start_ > 0 && start_ == buffer_.size()) {
    buffer_.clear();
    start_ = 0;
  } else if (start_ > 65536 && start_ * 2 > buffer_.size()) {
    buffer_.erase(buffer_.begin(), buffer_.begin() + static_cast<std::ptrdiff_t>(start_));
    start_ = 0;
  }
  // A frame whose length is known gets its room at once (and its successor's
  // header with it) instead of by doubling, so a big frame costs its size.
  const size_t whole = pendingFrameSize();
  if (whole && start_ + whole + kHeaderSize > buffer_.capacity()) buffer_.reserve(start_ + whole + kHeaderSize);
  const auto* p = static_cast<const uint8_t*>(bytes);
  buffer_.insert(buffer_.end(), p, p + length);
}

std::optional<RawFrame> Decoder::next() {
  if (failed_) return std::nullopt;
  size_t avail = buffer_.size() - start_;
  if (avail < 4) return std::nullopt;
  const uint8_t* p = buffer_.data() + start_;
  uint64_t n = getLE(p, 4);
  if (n < kMinLength || n > kMaxLength) {
    failed_ = true;
    failure_ = "frame length " + std::to_string(n) + " out of range";
    return std::nullopt;
  }
  if (avail < 4 + n) return std::nullopt;
  RawFrame f;
  f.messageId = getLE(p + 4, 8);
  const size_t end = start_ + 4 + n;
  if (start_ == 0 && n >= kMoveThreshold) {
    // A big frame leaves in the buffer it arrived in: no second copy, and
    // the decoder keeps nothing of its size.
    std::vector<uint8_t> rest(buffer_.begin() + static_cast<std::ptrdiff_t>(end), buffer_.end());
    f.payload = std::move(buffer_);
    f.payload.resize(end);
    f.payload.erase(f.payload.begin(), f.payload.begin() + kHeaderSize);
    buffer_ = std::move(rest);
    return f;
  }
  f.payload.assign(p + kHeaderSize, p + 4 + n);
  start_ = end;
  return f;
}

size_t Decoder::pendingFrameSize() const {
  if (failed_ || buffered() < 4) return 0;
  return 4 + static_cast<size_t>(getLE(buffer_.data() + start_, 4));
}

std::optional<plist::Dictionary> decodeMessage(const std::vector<uint8_t>& payload, std::string* error,
                                               uint64_t* footprint) {
  auto value = plist::parseBinary(payload.data(), payload.size(), error, footprint);
  if (!value) return std::nullopt;
  if (!value->isDictionary()) {
    if (error) *error = "top level is not a dictionary";
    return std::nullopt;
  }
  return std::move(value->dictionary());
}

int writeAll(int fd, const void* data, size_t size, bool socket, bool (*waitWritable)(int fd)) {
  const uint8_t* p = static_cast<const uint8_t*>(data);
  while (size > 0) {
    ssize_t n = socket ? ::send(fd, p, size, MSG_NOSIGNAL) : ::write(fd, p, size);
    if (n > 0) {
      p += n;
      size -= static_cast<size_t>(n);
      continue;
    }
    if (n == 0) return EIO;
    if (errno == EINTR) continue;
    if ((errno == EAGAIN || errno == EWOULDBLOCK) && waitWritable && waitWritable(fd)) continue;
    return errno;
  }
  return 0;
}

bool recvAll(int fd, void* data, size_t size) {
  uint8_t* p = static_cast<uint8_t*>(data);
  while (size > 0) {
    ssize_t n = ::recv(fd, p, size, 0);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    p += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

}  // namespace frame
