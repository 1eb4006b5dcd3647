#include "platform/LockState.h"

#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <climits>
#include <cstring>
#include <optional>
#include <string>
#include <system_error>
#include <thread>

#include "platform/DeviceRoot.h"
#include "platform/FileIO.h"
#include "platform/SafePath.h"
#include "platform/Log.h"
#include "platform/Queue.h"

namespace platform {

namespace {

constexpr int kTransitionalState = 2;
constexpr const char* kStateFileName = "lockstate";

std::string stateDirectory() { return hostPath("/run/device"); }

// Reads inotify events until the watch goes away; each batch that touched the
// state file posts one onChange to the main queue.
void watchLoop(int inotifyFd, const std::function<void()>& onChange) {
  alignas(inotify_event) char buffer[4096];
  bool watching = true;
  while (watching) {
    ssize_t length = read(inotifyFd, buffer, sizeof buffer);
    if (length < 0 && errno == EINTR) continue;
    if (length <= 0) {
      QRTLog(kLogError, "Lock state watch ended: %s", length < 0 ? strerror(errno) : "end of file");
      break;
    }
    bool changed = false;
    for (ssize_t offset = 0; offset < length;) {
      const auto* event = reinterpret_cast<const inotify_event*>(buffer + offset);
      if (event->mask & IN_IGNORED) watching = false;  // the directory is gone
      if (event->len > 0 && strcmp(event->name, kStateFileName) == 0) changed = true;
      offset += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
    }
    if (changed) mainQueue().async(onChange);
  }
  close(inotifyFd);
}

}  // namespace

int deviceLockState() {
  std::optional<std::string> content = readHostFile(stateDirectory() + "/" + kStateFileName, 64);
  if (!content) return errno == ENOENT ? 0 : kTransitionalState;
  std::string_view text = *content;
  while (!text.empty() && (text.back() == '\n' || text.back() == ' ' || text.back() == '\r')) text.remove_suffix(1);
  while (!text.empty() && text.front() == ' ') text.remove_prefix(1);
  int state = 0;
  auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), state);
  if (text.empty() || error != std::errc() || end != text.data() + text.size()) return kTransitionalState;
  return state;
}

int watchLockState(std::function<void()> onChange) {
  UniqueFd directory;
  if (int error = safeMakeDirectory(stateDirectory(), 0755, true, kAnyOwner, &directory); error != 0) return error;
  int inotifyFd = inotify_init1(IN_CLOEXEC);
  if (inotifyFd < 0) return errno;
  uint32_t events = IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_CREATE | IN_DELETE | IN_ONLYDIR;
  // The directory just checked, through its descriptor's own entry.
  std::string watched = "/proc/self/fd/" + std::to_string(directory.get());
  if (inotify_add_watch(inotifyFd, watched.c_str(), events) < 0) {
    int error = errno;
    close(inotifyFd);
    return error;
  }
  try {
    std::thread(watchLoop, inotifyFd, std::move(onChange)).detach();
  } catch (const std::system_error& e) {
    close(inotifyFd);
    return e.code().value() != 0 ? e.code().value() : EAGAIN;
  }
  return 0;
}

}  // namespace platform
