#include "base/QRTURL.h"

namespace {

// Collapses repeated slashes and drops a trailing one ("/" stays "/").
std::string normalisePath(std::string_view path) {
  // Most paths are already in the form: one copy, no character-by-character rebuild.
  if (path.find("//") == std::string_view::npos && (path.size() <= 1 || path.back() != '/')) return std::string(path);
  std::string out;
  out.reserve(path.size());
  for (char c : path) {
    if (c == '/' && !out.empty() && out.back() == '/') continue;
    out += c;
  }
  if (out.size() > 1 && out.back() == '/') out.pop_back();
  return out;
}

}  // namespace

QRTURL QRTURL::fileURL(std::string_view path, bool isDirectory) {
  QRTURL url;
  url.path_ = normalisePath(path);
  url.isDirectory_ = isDirectory;
  return url;
}

QRTURL QRTURL::URLByAppendingPathComponent(std::string_view component, bool isDirectory) const {
  std::string joined = path_;
  joined += '/';
  joined += component;
  return fileURL(joined, isDirectory);
}

QRTURL QRTURL::URLByDeletingLastPathComponent() const {
  size_t slash = path_.rfind('/');
  if (slash == std::string::npos) return fileURL("", true);  // a relative single component
  return fileURL(slash == 0 ? std::string_view("/") : std::string_view(path_).substr(0, slash), true);
}

std::string QRTURL::lastPathComponent() const {
  if (path_ == "/") return path_;
  size_t slash = path_.rfind('/');
  return slash == std::string::npos ? path_ : path_.substr(slash + 1);
}
