// What the daemon's result codes mean, for tools that show them to people.
#pragma once

#include <cstdint>
#include <string>

namespace qk {

// A short lower-case text for a result code ("no such container" for 21);
// nullptr for a code the daemon does not send.
const char* errorText(uint64_t code);
// The code's name in the daemon's error table ("QRTErrorNotFound" for 21);
// nullptr for a code the daemon does not send.
const char* errorName(uint64_t code);
// "ok" for 1, "error 21 (no such container)", or "error N" for an unknown code.
std::string describeResult(uint64_t code);

}  // namespace qk
