// Whether a path a client named stays inside a base directory. Nothing here
// follows a link: every component is resolved from the device root with no
// link allowed (platform/SafePath.h), so the only link ever looked at is a
// relative one as the last component, whose target is judged on its own.
#include <errno.h>
#include <string.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "Daemon/fileops/QRTFileManager.h"
#include "platform/DeviceRoot.h"
#include "platform/HostProfile.h"
#include "platform/Log.h"
#include "platform/SafePath.h"

using platform::kLogDebug;
using platform::kLogError;

namespace {

// A link to a link to a link: enough for any tree a program lays out itself.
constexpr int kMaxLinkHops = 8;

// "/" first for an absolute path, then the named components ("" skipped).
std::vector<std::string> pathComponents(const std::string& path) {
  std::vector<std::string> out;
  if (!path.empty() && path.front() == '/') out.push_back("/");
  size_t i = 0;
  while (i <= path.size()) {
    size_t slash = path.find('/', i);
    if (slash == std::string::npos) slash = path.size();
    if (slash > i) out.push_back(path.substr(i, slash - i));
    i = slash + 1;
  }
  return out;
}

// The data volume is reached as /var and as /private/var; the daemon's own
// paths use the latter, so a client's /var path is moved there.
QRTURL neutralisePrivate(const QRTURL& url) {
  std::string relative;
  if (platform::hostProfile() || platform::pathBelowDeviceRoot(url.path(), &relative) != 0) return url;
  if (relative == "var" || relative.starts_with("var/"))
    return QRTURL::fileURL(platform::rootedPath("/private/" + relative));
  return url;
}

// The host path for a path below the device root, with "." and "//" gone.
std::string normalisedHostPath(const std::string& relative) {
  return relative == "." ? platform::deviceRoot() : platform::rootedPath("/" + relative);
}

// dir + target with ".." taken away lexically: the components it undoes were
// checked to be real directories, and whatever is done with the result never
// follows a link either. Empty when it climbs above "/".
std::string joinLexically(const std::string& dir, const std::string& target) {
  std::vector<std::string> kept;
  for (const std::string& c : pathComponents(dir + "/" + target)) {
    if (c == "/" || c == ".") continue;
    if (c == "..") {
      if (kept.empty()) return {};
      kept.pop_back();
      continue;
    }
    kept.push_back(c);
  }
  std::string out;
  for (const std::string& c : kept) out += "/" + c;
  return out.empty() ? "/" : out;
}

}  // namespace

bool QRTFileManager::_validateSymlink(const std::optional<std::string>& path, int32_t withStartingDepth,
                                      int32_t* andEndingDepth) {
  if (!path) return false;
  int64_t depth = withStartingDepth;
  for (const std::string& c : pathComponents(*path)) {
    if (c == "..") {
      --depth;
    } else if (c != "." && c != "/") {
      ++depth;
    }
    if (depth < withStartingDepth) return false;
  }
  if (andEndingDepth) *andEndingDepth = static_cast<int32_t>(depth);
  return true;
}

std::optional<QRTURL> QRTFileManager::_realPathForURL(const QRTURL& url, bool allowNonExistentPathComponents) {
  std::string relative;
  int err = platform::pathBelowDeviceRoot(url.path(), &relative);
  struct stat st {};
  if (err == 0) err = platform::safeStat(url.path(), &st);
  if (err == 0 && S_ISLNK(st.st_mode)) err = ELOOP;
  if (err == 0) return QRTURL::fileURL(normalisedHostPath(relative));
  if (err == ENOENT && allowNonExistentPathComponents) return _realPathWhatExistsInPath(url.path());
  QRTLog(kLogError, "Failed to realpath %s : %s at %s", url.path().c_str(), strerror(err), relative.c_str());
  return std::nullopt;
}

std::optional<QRTURL> QRTFileManager::_realPathWhatExistsInPath(const std::string& path) {
  std::vector<std::string> components = pathComponents(path);
  for (size_t n = components.size(); n >= 2; --n) {
    std::string prefix;
    for (size_t i = 1; i < n; ++i) prefix += "/" + components[i];
    struct stat st {};
    int err = platform::safeStat(prefix, &st);
    if (err == ENOENT) continue;
    // A link, or anything but a missing item, on the way settles it.
    if (err != 0 || S_ISLNK(st.st_mode)) return std::nullopt;
    std::optional<QRTURL> resolved = _realPathForURL(QRTURL::fileURL(prefix), false);
    if (!resolved) return std::nullopt;
    std::string rest;
    for (size_t i = n; i < components.size(); ++i) rest += (rest.empty() ? "" : "/") + components[i];
    QRTLog(kLogDebug, "Realpathed %@ ; appending non-existing components %@", *resolved, rest);
    return rest.empty() ? *resolved : QRTURL::fileURL(resolved->path() + "/" + rest);
  }
  return std::nullopt;
}

namespace {

std::optional<QRTURL> containedPath(QRTFileManager& fm, const QRTURL& suspicious, const QRTURL& base, int hops);

// The last component of suspicious is a link: only a relative one that stays
// below the base's level is followed, and where it leads is judged again.
std::optional<QRTURL> followLink(QRTFileManager& fm, const QRTURL& suspicious, const QRTURL& base, int hops) {
  platform::SafeParent parent;
  std::string linkTarget;
  int err = platform::safeOpenParent(suspicious.path(), &parent);
  if (err == 0) err = platform::readLinkAt(parent.fd.get(), parent.name.c_str(), &linkTarget, 1024);
  if (err != 0) {
    QRTLog(kLogError, "Readlink failed: %s", strerror(err));
    return std::nullopt;
  }
  if (!linkTarget.empty() && linkTarget.front() == '/') {
    QRTLog(kLogError, "Rejecting %@ -> %s, as absolute symlinks are not allowed", suspicious, linkTarget.c_str());
    return std::nullopt;
  }
  int32_t baseDepth = 0;
  if (!fm._validateSymlink(base.path(), 0, &baseDepth)) {
    QRTLog(kLogError, "Failed to retrieve depth of %@", base);
    return std::nullopt;
  }
  std::string below = suspicious.path().substr(base.path().size());
  size_t slash = below.rfind('/');
  std::string relativeTarget = (slash == std::string::npos ? std::string() : below.substr(0, slash)) + "/" + linkTarget;
  if (!fm._validateSymlink(relativeTarget, baseDepth, nullptr)) {
    QRTLog(kLogError, "Rejecting %@ -> %@, as it is points outside or to the base %@", suspicious, relativeTarget,
           base);
    return std::nullopt;
  }
  if (hops >= kMaxLinkHops) {
    QRTLog(kLogError, "Rejecting %@: more than %d links in a row", suspicious, kMaxLinkHops);
    return std::nullopt;
  }
  std::string joined = joinLexically(suspicious.URLByDeletingLastPathComponent().path(), linkTarget);
  if (joined.empty()) {
    QRTLog(kLogError, "Rejecting %@ -> %s, as it climbs above the root", suspicious, linkTarget.c_str());
    return std::nullopt;
  }
  return containedPath(fm, QRTURL::fileURL(joined), base, hops + 1);
}

std::optional<QRTURL> compareResolved(QRTFileManager& fm, const QRTURL& suspicious, const QRTURL& base) {
  std::optional<QRTURL> realBase = fm._realPathForURL(base, false);
  if (!realBase) {
    QRTLog(kLogError, "Failed to retrieve realpath for base path %@ ", base);
    return std::nullopt;
  }
  std::optional<QRTURL> realSuspicious = fm._realPathForURL(suspicious, true);
  if (!realSuspicious) {
    QRTLog(kLogError, "Failed to retrieve realpath for suspicious path %@", suspicious);
    return std::nullopt;
  }
  std::vector<std::string> b = pathComponents(realBase->path()), s = pathComponents(realSuspicious->path());
  if (b.size() < 2 || s.size() < 2) {
    QRTLog(kLogError, "Rejecting %@ with base %@ because real component counts don't make sense (reals %@ ; %@)",
           suspicious, base, realSuspicious, realBase);
    return std::nullopt;
  }
  size_t bi = b[1] == "private" ? 2 : 1, si = s[1] == "private" ? 2 : 1;
  if (b.size() - bi > s.size() - si) {
    QRTLog(
        kLogError,
        "Rejecting %@ with base %@ because base component count is greater than child component count (reals %@ ; %@)",
        suspicious, base, realSuspicious, realBase);
    return std::nullopt;
  }
  for (size_t k = 0; bi + k < b.size(); ++k) {
    if (b[bi + k] != s[si + k]) {
      QRTLog(kLogError, "Rejecting %@ with base %@ (reals %@ ; %@) because components diverge at %@ != %@", suspicious,
             base, realSuspicious, realBase, b[bi + k], s[si + k]);
      return std::nullopt;
    }
  }
  return realSuspicious;
}

std::optional<QRTURL> containedPath(QRTFileManager& fm, const QRTURL& suspicious, const QRTURL& base, int hops) {
  if (!suspicious.path().starts_with(base.path())) {
    QRTLog(kLogError, "supiscious path %@ does not contain base path %@ as a prefix", suspicious, base);
    return std::nullopt;
  }
  if (containsDotDotPathComponents(suspicious.path())) {
    QRTLog(kLogError, "The suspicious path %@ contains '..' paths, which are invalid", suspicious);
    return std::nullopt;
  }
  struct stat st {};
  int err = platform::safeStat(suspicious.path(), &st);
  if (err == 0 && S_ISLNK(st.st_mode)) {
    // The link must itself lie inside the base before it is worth following.
    if (!compareResolved(fm, suspicious.URLByDeletingLastPathComponent(), base)) return std::nullopt;
    return followLink(fm, suspicious, base, hops);
  }
  if (err != 0 && err != ENOENT) {
    // ELOOP: a link on the way; EXDEV: outside the device root.
    QRTLog(kLogError, "Readlink failed: %s", strerror(err));
    return std::nullopt;
  }
  return compareResolved(fm, suspicious, base);
}

}  // namespace

std::optional<QRTURL> QRTFileManager::realPathForURL(const std::optional<QRTURL>& url,
                                                     const std::optional<QRTURL>& ifChildOfURL) {
  if (!url || !ifChildOfURL) {
    QRTLog(kLogError, "The base path %@ and/or suspicious path %@ were nil", ifChildOfURL, url);
    return std::nullopt;
  }
  return containedPath(*this, neutralisePrivate(*url), neutralisePrivate(*ifChildOfURL), 0);
}
