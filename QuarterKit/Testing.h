// Calls that only tests of the daemon and of the library need; not installed.
#pragma once

#include <cstddef>
#include <memory>

#include "QuarterKit/QuarterKit.h"

namespace quarterkit::detail {

struct ConnectionAccess {
  // Takes over an already connected stream socket (a socketpair end).
  static std::unique_ptr<Connection> adopt(int fd);
  // Arbitrary bytes on the socket (tests of the daemon's framing).
  static bool sendRaw(Connection& connection, const void* bytes, size_t length);
};

}  // namespace quarterkit::detail

namespace quarterkit::testing {
using detail::ConnectionAccess;
}  // namespace quarterkit::testing
