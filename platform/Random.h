// The kernel's random source, for fresh names.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace platform {

// Fills the buffer from getrandom without waiting for the pool at early boot;
// false when the kernel gave less than asked.
bool randomBytes(void* buffer, size_t length);
// Up to 16 characters of [A-Za-z0-9] for a fresh name (never a secret: when
// the kernel does not answer, the process id and a counter stand in).
std::string randomAlphanumeric(size_t length);
// A hidden name for a file being made beside NAME (".NAME.pid-counter-random"):
// the process id and the counter keep writers in this process or another apart.
std::string temporaryName(std::string_view name);

}  // namespace platform
