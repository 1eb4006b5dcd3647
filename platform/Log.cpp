#include "platform/Log.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <mutex>
#include <string_view>

#include "platform/FileIO.h"

namespace platform {

namespace {

struct LogFile {
  std::mutex mutex;
  int fd = -1;
  std::string path;
  uint32_t fileCount = 1;
  uint64_t sizeLimit = 0;  // 0: never rotate
  uint64_t size = 0;
};

// Never destroyed: threads may still log while the process exits.
LogFile& logFile() {
  static LogFile* file = new LogFile;
  return *file;
}

std::atomic<bool> gFileOpen{false};
std::atomic<int> gLevel{kLogNotice};
std::atomic<bool> gStderr{false};

std::string levelTag(int level) {
  switch (level) {
    case kLogError: return "<Error>";
    case kLogNotice: return "<Notice>";
    case kLogDebug: return "<Debug>";
    default: return "<Level " + std::to_string(level) + ">";
  }
}

int syslogPriority(int level) { return level < LOG_EMERG ? LOG_EMERG : level > LOG_DEBUG ? LOG_DEBUG : level; }

// A message is one line whatever a client put in an identifier or a path:
// control bytes and DEL are written as \xNN.
std::string escaped(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  for (unsigned char c : text) {
    if (c >= 0x20 && c != 0x7f) {
      out += static_cast<char>(c);
      continue;
    }
    static const char kHex[] = "0123456789abcdef";
    out += "\\x";
    out += kHex[c >> 4];
    out += kHex[c & 0xf];
  }
  return out;
}

std::string formatLine(int level, const char* function, const std::string& message) {
  timespec now{};
  clock_gettime(CLOCK_REALTIME, &now);
  tm local{};
  localtime_r(&now.tv_sec, &local);
  char stamp[32];
  strftime(stamp, sizeof stamp, "%Y-%m-%d %H:%M:%S", &local);
  char head[128];
  snprintf(head, sizeof head, "%s.%06ld %s[%d] ", stamp, now.tv_nsec / 1000L, program_invocation_short_name,
           static_cast<int>(getpid()));
  std::string line = head;
  line += levelTag(level);
  line += ' ';
  line += escaped(function ? function : "(null)");
  line += ": ";
  line += escaped(message);
  line += '\n';
  return line;
}

// openlog keeps the pointer it is given, so identities are never freed.
void setSyslogIdentity(const std::string& name) {
  static std::string* current = nullptr;
  if (current && *current == name) return;
  current = new std::string(name);
  openlog(current->c_str(), LOG_PID, LOG_DAEMON);
}

bool openFileLocked(LogFile& file) {
  // The log lives in root's own directories; a link put in its place is
  // still not followed.
  file.fd = open(file.path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC | O_NOCTTY | O_NOFOLLOW, 0644);
  if (file.fd < 0) {
    gFileOpen = false;
    return false;
  }
  struct stat st;
  file.size = fstat(file.fd, &st) == 0 ? static_cast<uint64_t>(st.st_size) : 0;
  gFileOpen = true;
  return true;
}

void closeFileLocked(LogFile& file) {
  if (file.fd >= 0) close(file.fd);
  file.fd = -1;
  gFileOpen = false;
}

std::string numbered(const std::string& path, uint32_t index) { return path + "." + std::to_string(index); }

// The log cannot report on itself: the system log and standard error do.
void rotationFailed(const char* step, const std::string& path, int err) {
  std::string text = "Log rotation failed to " + std::string(step) + " " + escaped(path) + ": " + strerror(err);
  syslog(LOG_ERR, "%s", text.c_str());
  text += '\n';
  writeAll(STDERR_FILENO, text);
}

// A missing older file is no failure.
void renameForRotation(const std::string& from, const std::string& to) {
  if (rename(from.c_str(), to.c_str()) != 0 && errno != ENOENT) rotationFailed("rename", from, errno);
}

// quarterd.log -> .0, .0 -> .1, ...; files numbered fileCount and up go away.
void rotateLocked(LogFile& file) {
  closeFileLocked(file);
  if (file.fileCount == 0) {
    if (unlink(file.path.c_str()) != 0 && errno != ENOENT) rotationFailed("remove", file.path, errno);
  } else {
    for (uint32_t i = file.fileCount - 1; i >= 1; --i) renameForRotation(numbered(file.path, i - 1), numbered(file.path, i));
    renameForRotation(file.path, numbered(file.path, 0));
  }
  for (uint32_t i = file.fileCount;; ++i) {
    std::string old = numbered(file.path, i);
    if (unlink(old.c_str()) == 0) continue;
    if (errno != ENOENT) rotationFailed("remove", old, errno);
    break;
  }
  if (!openFileLocked(file))
    syslog(LOG_ERR, "Failed to reopen log %s after rotation: %s", file.path.c_str(), strerror(errno));
}

}  // namespace

bool logOpen(const std::string& path, const std::string& name, int level) {
  LogFile& file = logFile();
  std::lock_guard lock(file.mutex);
  setSyslogIdentity(name);
  gLevel = level;
  closeFileLocked(file);
  file.path = path;
  return openFileLocked(file);
}

void logSetRotation(uint32_t fileCount, uint64_t sizeLimit) {
  LogFile& file = logFile();
  std::lock_guard lock(file.mutex);
  file.fileCount = fileCount;
  file.sizeLimit = sizeLimit;
}

void logSetLevel(int level) { gLevel = level; }

int logLevel() { return gLevel; }

bool logEnabled(int level) { return !gFileOpen.load(std::memory_order_relaxed) || level <= gLevel.load(std::memory_order_relaxed); }

void logSetStderr(bool on) { gStderr = on; }

void logWrite(int level, const char* function, const std::string& message) {
  std::string line = formatLine(level, function, message);
  LogFile& file = logFile();
  std::lock_guard lock(file.mutex);
  if (file.fd >= 0 && file.sizeLimit > 0 && file.size > 0 && file.size + line.size() > file.sizeLimit)
    rotateLocked(file);
  if (file.fd >= 0) {
    writeAll(file.fd, line);
    file.size += line.size();
  } else {
    syslog(syslogPriority(level), "%s: %s", escaped(function ? function : "(null)").c_str(), escaped(message).c_str());
  }
  if (gStderr) writeAll(STDERR_FILENO, line);
}

void syslogWrite(int priority, const std::string& message) { syslog(priority, "%s", escaped(message).c_str()); }

void logClose() {
  LogFile& file = logFile();
  std::lock_guard lock(file.mutex);
  closeFileLocked(file);
}

}  // namespace platform
