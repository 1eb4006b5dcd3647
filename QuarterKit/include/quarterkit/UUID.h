// A 128-bit UUID: random version-4 values and the canonical upper-case text form.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace quarterkit {

class UUID {
 public:
  UUID() = default;
  explicit UUID(const std::array<uint8_t, 16>& bytes) : bytes_(bytes) {}
  static UUID random();
  // Accepts the 36-character form with hyphens in either case.
  static std::optional<UUID> fromString(std::string_view text);
  static std::optional<UUID> fromBytes(const void* bytes, size_t length);

  const std::array<uint8_t, 16>& bytes() const { return bytes_; }
  std::string UUIDString() const;  // upper case
  std::string description() const { return UUIDString(); }

  bool operator==(const UUID& o) const { return bytes_ == o.bytes_; }
  bool operator!=(const UUID& o) const { return bytes_ != o.bytes_; }
  bool operator<(const UUID& o) const { return bytes_ < o.bytes_; }

 private:
  std::array<uint8_t, 16> bytes_{};
};

}  // namespace quarterkit
