// Helpers shared by the files that implement QRTClientConnection's
// operations (creation, queries, removal, replace).
#pragma once

#include <cstdint>

#include "Daemon/QRTError.h"

// The request layer sees only the code of an operation's error.
inline void reportCode(const QRTErrorRef& error, uint64_t* withError) {
  if (error && withError) *withError = error->resultCode();
}

inline bool hasCode(const QRTErrorRef& error, const char* domain, int32_t code) {
  return error && error->domain() == domain && error->code() == code;
}
