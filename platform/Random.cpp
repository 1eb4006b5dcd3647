#include "platform/Random.h"

#include <sys/random.h>
#include <unistd.h>

#include <atomic>
#include <cstdint>

namespace platform {

bool randomBytes(void* buffer, size_t length) {
  return getrandom(buffer, length, GRND_NONBLOCK) == static_cast<ssize_t>(length);
}

std::string randomAlphanumeric(size_t length) {
  static const char kAlphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789";
  unsigned char bytes[16];
  if (!randomBytes(bytes, sizeof bytes)) {
    static std::atomic<uint64_t> counter{0};
    uint64_t seed = static_cast<uint64_t>(getpid()) * 0x9E3779B97F4A7C15ull + counter.fetch_add(1) * 7919;
    for (unsigned char& b : bytes) b = static_cast<unsigned char>(seed >>= 3);
  }
  std::string text;
  for (size_t i = 0; i < length && i < sizeof bytes; ++i) text += kAlphabet[bytes[i] % (sizeof kAlphabet - 1)];
  return text;
}

std::string temporaryName(std::string_view name) {
  static std::atomic<uint64_t> counter{0};
  uint64_t random = 0;
  if (!randomBytes(&random, sizeof random)) random = counter.load();
  std::string temp = ".";
  temp += name.substr(0, 200);
  temp += ".";
  temp +=
      std::to_string(getpid()) + "-" + std::to_string(counter.fetch_add(1)) + "-" + std::to_string(random % 1000000);
  return temp;
}

}  // namespace platform
