#include "base/QRTUUID.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <random>

namespace {

bool fillFromURandom(uint8_t* buf, size_t length) {
  int fd = open("/dev/urandom", O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  size_t done = 0;
  while (done < length) {
    ssize_t n = read(fd, buf + done, length - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    done += static_cast<size_t>(n);
  }
  close(fd);
  return done == length;
}

int hexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

bool isHyphenPosition(size_t i) { return i == 8 || i == 13 || i == 18 || i == 23; }

}  // namespace

QRTUUID QRTUUID::random() {
  std::array<uint8_t, 16> bytes{};
  if (!fillFromURandom(bytes.data(), bytes.size())) {
    // The kernel source did not answer (a seccomp filter, no /dev): a seeded
    // generator is still better than a fixed or failed identifier.
    uint64_t seed = static_cast<uint64_t>(std::chrono::steady_clock::now().time_since_epoch().count()) ^
                    (static_cast<uint64_t>(getpid()) << 32);
    try {
      std::random_device device;
      seed ^= (static_cast<uint64_t>(device()) << 32) ^ device();
    } catch (const std::exception&) {}
    std::mt19937_64 engine(seed);
    for (auto& b : bytes) b = static_cast<uint8_t>(engine());
  }
  bytes[6] = static_cast<uint8_t>((bytes[6] & 0x0F) | 0x40);  // version 4
  bytes[8] = static_cast<uint8_t>((bytes[8] & 0x3F) | 0x80);  // RFC 4122 variant
  return QRTUUID(bytes);
}

std::optional<QRTUUID> QRTUUID::fromString(std::string_view text) {
  if (text.size() != 36) return std::nullopt;
  std::array<uint8_t, 16> bytes{};
  size_t nibble = 0;
  for (size_t i = 0; i < text.size(); ++i) {
    if (isHyphenPosition(i)) {
      if (text[i] != '-') return std::nullopt;
      continue;
    }
    int v = hexValue(text[i]);
    if (v < 0) return std::nullopt;
    bytes[nibble / 2] = static_cast<uint8_t>(bytes[nibble / 2] | (nibble % 2 ? v : v << 4));
    ++nibble;
  }
  return QRTUUID(bytes);
}

std::optional<QRTUUID> QRTUUID::fromBytes(const void* bytes, size_t length) {
  if (!bytes || length != 16) return std::nullopt;
  std::array<uint8_t, 16> copy{};
  const auto* p = static_cast<const uint8_t*>(bytes);
  std::copy(p, p + 16, copy.begin());
  return QRTUUID(copy);
}

std::string QRTUUID::UUIDString() const {
  static const char kHex[] = "0123456789ABCDEF";
  std::string out;
  out.reserve(36);
  for (size_t i = 0; i < bytes_.size(); ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) out += '-';
    out += kHex[bytes_[i] >> 4];
    out += kHex[bytes_[i] & 0x0F];
  }
  return out;
}
