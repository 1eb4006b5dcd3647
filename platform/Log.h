// The daemon's log: a plain text file rotated at a size limit, with syslog as
// the fallback when the file cannot be opened.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "base/QRTFormat.h"

namespace platform {

enum LogLevel : int { kLogError = 3, kLogNotice = 5, kLogDebug = 7 };

// Opens (creating) the log file at path. The name is the log's identity (the
// system log's ident); each line carries the program's short name and pid.
// False when the file cannot be opened; lines then go to syslog.
bool logOpen(const std::string& path, const std::string& name, int level);
// Rotation: at sizeLimit bytes quarterd.log becomes quarterd.log.0, older
// files shift up by one and those beyond fileCount are deleted.
void logSetRotation(uint32_t fileCount, uint64_t sizeLimit);
void logSetLevel(int level);
int logLevel();
bool logEnabled(int level);
// Every line is copied to standard error as well.
void logSetStderr(bool on);
// Where lines go instead of the file (the journal, ServiceManager.h); set
// before logging starts. Function and message arrive escaped.
using LogSink = void (*)(int level, const std::string& function, const std::string& message);
void logSetSink(LogSink sink);
// Closes and reopens the file at its path, for an outside rotation (SIGHUP).
bool logReopen();
// Control bytes (below 0x20, and 0x7f) of the function name and the message
// are written as \xNN, so that every message stays one line.
void logWrite(int level, const char* function, const std::string& message);
// Refusal lines (a missing entitlement, a user check, a bad parameter) are
// what any caller can make at will, so each caller uid gets 20 a second; the
// rest are counted and one line a second says how many were left out.
inline constexpr uint32_t kRefusalLinesPerSecond = 20;
void logRefusal(uint32_t callerUid, const char* function, const std::string& message);
// While a request is served on this thread, its error lines count as its
// caller's refusals.
class RefusalScope {
 public:
  explicit RefusalScope(uint32_t callerUid);
  ~RefusalScope();
  RefusalScope(const RefusalScope&) = delete;
  RefusalScope& operator=(const RefusalScope&) = delete;

 private:
  std::optional<uint32_t> previous_;
};
// An identifier as a log line shows it: cut to 255 bytes.
std::string logIdentifier(std::string_view identifier);
inline std::string logIdentifier(const std::string& identifier) { return logIdentifier(std::string_view(identifier)); }
inline std::optional<std::string> logIdentifier(const std::optional<std::string>& identifier) {
  return identifier ? std::optional(logIdentifier(std::string_view(*identifier))) : std::nullopt;
}
// Straight to the system log, for lines about the log itself.
void syslogWrite(int priority, const std::string& message);
// Closes the file (tests reopen the log on another path).
void logClose();

}  // namespace platform

// QRTLog(level, format, args...): one line under the calling function's name;
// formatting is skipped when the level is off.
#define QRTLog(level, ...)                                                                              \
  do {                                                                                                  \
    if (::platform::logEnabled(level)) ::platform::logWrite((level), __func__, QRTFormat(__VA_ARGS__)); \
  } while (0)
#define QRTLogRefusal(callerUid, ...)                                        \
  do {                                                                       \
    if (::platform::logEnabled(::platform::kLogError))                       \
      ::platform::logRefusal((callerUid), __func__, QRTFormat(__VA_ARGS__)); \
  } while (0)
#define QRTLogAs(level, function, ...)                                                                    \
  do {                                                                                                    \
    if (::platform::logEnabled(level)) ::platform::logWrite((level), (function), QRTFormat(__VA_ARGS__)); \
  } while (0)
