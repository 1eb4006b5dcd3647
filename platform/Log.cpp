#include "platform/Log.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <map>
#include <mutex>
#include <optional>
#include <unordered_map>
#include <string_view>
#include <thread>

#include "platform/FileIO.h"
#include "platform/SafePath.h"

namespace platform {

namespace {

struct LogFile {
  std::mutex mutex;
  int fd = -1;
  std::string path;
  // The log's directory and the file's name in it: opening and rotation act
  // relative to the directory, never on the path again.
  UniqueFd directory;
  std::string name;
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
std::atomic<LogSink> gSink{nullptr};

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
// control bytes (but the tab some fixed messages begin with) and DEL are
// written as \xNN.
std::string escaped(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  for (unsigned char c : text) {
    if ((c >= 0x20 || c == '\t') && c != 0x7f) {
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

// The directory is resolved like every path below the device root; a log
// elsewhere (a test's /dev/null) is opened as it is, still with no link at
// its last component followed.
bool openDirectoryLocked(LogFile& file) {
  const size_t slash = file.path.rfind('/');
  const std::string directory = slash == std::string::npos ? "." : slash == 0 ? "/" : file.path.substr(0, slash);
  file.name = file.path.substr(slash == std::string::npos ? 0 : slash + 1);
  file.directory.reset();
  int err = safeOpen(directory, O_RDONLY | O_DIRECTORY, &file.directory);
  if (err == EXDEV)
    file.directory.reset(open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  else if (err)
    errno = err;
  return file.directory.valid();
}

bool openFileLocked(LogFile& file) {
  file.fd = file.directory.valid() ? openat(file.directory.get(), file.name.c_str(),
                                            O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC | O_NOCTTY | O_NOFOLLOW, 0644)
                                   : -1;
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

std::string numbered(const std::string& name, uint32_t index) { return name + "." + std::to_string(index); }

// The log cannot report on itself: the system log and standard error do.
void rotationFailed(const char* step, const std::string& path, int err) {
  std::string text = "Log rotation failed to " + std::string(step) + " " + escaped(path) + ": " + strerror(err);
  syslog(LOG_ERR, "%s", text.c_str());
  text += '\n';
  writeAll(STDERR_FILENO, text);
}

// A missing older file is no failure.
void renameForRotation(const LogFile& file, const std::string& from, const std::string& to) {
  if (renameat(file.directory.get(), from.c_str(), file.directory.get(), to.c_str()) != 0 && errno != ENOENT)
    rotationFailed("rename", file.path.substr(0, file.path.size() - file.name.size()) + from, errno);
}

// quarterd.log -> .0, .0 -> .1, ...; files numbered fileCount and up go away.
void rotateLocked(LogFile& file) {
  closeFileLocked(file);
  const int dir = file.directory.get();
  if (file.fileCount == 0) {
    if (unlinkat(dir, file.name.c_str(), 0) != 0 && errno != ENOENT) rotationFailed("remove", file.path, errno);
  } else {
    for (uint32_t i = file.fileCount - 1; i >= 1; --i)
      renameForRotation(file, numbered(file.name, i - 1), numbered(file.name, i));
    renameForRotation(file, file.name, numbered(file.name, 0));
  }
  for (uint32_t i = file.fileCount;; ++i) {
    std::string old = numbered(file.name, i);
    if (unlinkat(dir, old.c_str(), 0) == 0) continue;
    if (errno != ENOENT) rotationFailed("remove", numbered(file.path, i), errno);
    break;
  }
  if (!openFileLocked(file))
    syslog(LOG_ERR, "Failed to reopen log %s after rotation: %s", file.path.c_str(), strerror(errno));
}

thread_local std::optional<uint32_t> tRequestCaller;

void writeLine(int level, const char* function, const std::string& message) {
  std::string line = formatLine(level, function, message);
  if (LogSink sink = gSink.load()) {
    sink(syslogPriority(level), escaped(function ? function : "(null)"), escaped(message));
    if (gStderr) writeAll(STDERR_FILENO, line);
    return;
  }
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

// Refusal lines admitted in the current second, per caller uid.
struct RefusalBudget {
  std::mutex mutex;
  int64_t second = 0;
  std::unordered_map<uint32_t, uint32_t> admitted;
  std::map<uint32_t, uint64_t> leftOut;
  std::condition_variable leftOutChanged;
};

RefusalBudget& refusalBudget() {
  static RefusalBudget* budget = new RefusalBudget;
  return *budget;
}
std::atomic<bool> gRefusalsLeftOut{false};

int64_t monotonicSecond() {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  return now.tv_sec;
}

// Starts a new second when one has passed; the summary of the last one's
// left-out lines, or nothing.
std::optional<std::string> turnSecondLocked(RefusalBudget& budget, int64_t now) {
  if (now == budget.second) return std::nullopt;
  budget.second = now;
  budget.admitted.clear();
  if (budget.leftOut.empty()) return std::nullopt;
  std::string text = "Left out refusal lines over " + std::to_string(kRefusalLinesPerSecond) + " a second:";
  for (const auto& [uid, count] : budget.leftOut) text += " uid " + std::to_string(uid) + " " + std::to_string(count);
  budget.leftOut.clear();
  gRefusalsLeftOut = false;
  return text;
}

// Says what was left out once its second is over, on the next line logged.
void flushRefusalSummary() {
  if (!gRefusalsLeftOut.load(std::memory_order_relaxed)) return;
  RefusalBudget& budget = refusalBudget();
  std::optional<std::string> summary;
  {
    std::lock_guard lock(budget.mutex);
    summary = turnSecondLocked(budget, monotonicSecond());
  }
  if (summary) writeLine(kLogError, "logRefusal", *summary);
}

// The summary of a second is written when it is over, even if nothing else
// is logged after it.
void startRefusalSummaries(RefusalBudget& budget) {
  static std::once_flag once;
  std::call_once(once, [&budget] {
    std::thread([&budget] {
      for (;;) {
        {
          std::unique_lock lock(budget.mutex);
          budget.leftOutChanged.wait(lock, [&] { return !budget.leftOut.empty(); });
        }
        std::this_thread::sleep_for(std::chrono::seconds(1));
        flushRefusalSummary();
      }
    }).detach();
  });
}

}  // namespace

void logRefusal(uint32_t callerUid, const char* function, const std::string& message) {
  RefusalBudget& budget = refusalBudget();
  std::optional<std::string> summary;
  bool admit;
  {
    std::lock_guard lock(budget.mutex);
    summary = turnSecondLocked(budget, monotonicSecond());
    admit = ++budget.admitted[callerUid] <= kRefusalLinesPerSecond;
    if (!admit) {
      ++budget.leftOut[callerUid];
      gRefusalsLeftOut = true;
      budget.leftOutChanged.notify_one();
    }
  }
  if (!admit) startRefusalSummaries(budget);
  if (summary) writeLine(kLogError, "logRefusal", *summary);
  if (admit) writeLine(kLogError, function, message);
}

std::string logIdentifier(std::string_view identifier) {
  constexpr size_t kShown = 255;
  if (identifier.size() <= kShown) return std::string(identifier);
  return std::string(identifier.substr(0, kShown)) + "... (" + std::to_string(identifier.size()) + " bytes)";
}

bool logOpen(const std::string& path, const std::string& name, int level) {
  LogFile& file = logFile();
  std::lock_guard lock(file.mutex);
  setSyslogIdentity(name);
  gLevel = level;
  closeFileLocked(file);
  file.path = path;
  return openDirectoryLocked(file) && openFileLocked(file);
}

void logSetRotation(uint32_t fileCount, uint64_t sizeLimit) {
  LogFile& file = logFile();
  std::lock_guard lock(file.mutex);
  file.fileCount = fileCount;
  file.sizeLimit = sizeLimit;
}

void logSetLevel(int level) { gLevel = level; }

int logLevel() { return gLevel; }

bool logEnabled(int level) {
  const bool filtered = gFileOpen.load(std::memory_order_relaxed) || gSink.load(std::memory_order_relaxed);
  return !filtered || level <= gLevel.load(std::memory_order_relaxed);
}

void logSetStderr(bool on) { gStderr = on; }

void logSetSink(LogSink sink) { gSink = sink; }

bool logReopen() {
  LogFile& file = logFile();
  std::lock_guard lock(file.mutex);
  if (file.path.empty()) return false;
  closeFileLocked(file);
  return openDirectoryLocked(file) && openFileLocked(file);
}

void logWrite(int level, const char* function, const std::string& message) {
  // What a request logs as an error its caller can make at will.
  if (level <= kLogError && tRequestCaller) {
    logRefusal(*tRequestCaller, function, message);
    return;
  }
  flushRefusalSummary();
  writeLine(level, function, message);
}

RefusalScope::RefusalScope(uint32_t callerUid) : previous_(tRequestCaller) { tRequestCaller = callerUid; }
RefusalScope::~RefusalScope() { tRequestCaller = previous_; }

void syslogWrite(int priority, const std::string& message) { syslog(priority, "%s", escaped(message).c_str()); }

void logClose() {
  LogFile& file = logFile();
  std::lock_guard lock(file.mutex);
  closeFileLocked(file);
}

}  // namespace platform
