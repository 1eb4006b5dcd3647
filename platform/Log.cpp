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
  line += function ? function : "(null)";
  line += ": ";
  line += message;
  line += '\n';
  return line;
}

void writeAll(int fd, const std::string& text) {
  size_t done = 0;
  while (done < text.size()) {
    ssize_t n = write(fd, text.data() + done, text.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return;
    done += static_cast<size_t>(n);
  }
}

// openlog keeps the pointer it is given, so identities are never freed.
void setSyslogIdentity(const std::string& name) {
  static std::string* current = nullptr;
  if (current && *current == name) return;
  current = new std::string(name);
  openlog(current->c_str(), LOG_PID, LOG_DAEMON);
}

bool openFileLocked(LogFile& file) {
  file.fd = open(file.path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC | O_NOCTTY, 0644);
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

// quarterd.log -> .0, .0 -> .1, ...; files numbered fileCount and up go away.
void rotateLocked(LogFile& file) {
  closeFileLocked(file);
  if (file.fileCount == 0) {
    unlink(file.path.c_str());
  } else {
    for (uint32_t i = file.fileCount - 1; i >= 1; --i)
      rename(numbered(file.path, i - 1).c_str(), numbered(file.path, i).c_str());
    rename(file.path.c_str(), numbered(file.path, 0).c_str());
  }
  for (uint32_t i = file.fileCount; unlink(numbered(file.path, i).c_str()) == 0; ++i) {
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
    syslog(syslogPriority(level), "%s: %s", function ? function : "(null)", message.c_str());
  }
  if (gStderr) writeAll(STDERR_FILENO, line);
}

void syslogWrite(int priority, const std::string& message) { syslog(priority, "%s", message.c_str()); }

void logClose() {
  LogFile& file = logFile();
  std::lock_guard lock(file.mutex);
  closeFileLocked(file);
}

}  // namespace platform
