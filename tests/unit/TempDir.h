// A scratch directory made fresh for one test (or suite) and removed with
// everything below it when the object goes away.
#pragma once

#include <stdlib.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <sstream>
#include <stdexcept>
#include <string>
#include <system_error>

class TempDir {
 public:
  explicit TempDir(const std::string& prefix = "/tmp/qrt-test") : path_(prefix + ".XXXXXX") {
    // Never hand out an empty path: the tests would then work on "/".
    if (!mkdtemp(path_.data())) throw std::runtime_error("mkdtemp " + prefix + " failed");
  }
  ~TempDir() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;

  const std::string& path() const { return path_; }
  std::string operator/(const std::string& relative) const { return path_ + "/" + relative; }

 private:
  std::string path_;
};

inline struct stat lstatOf(const std::string& path) {
  struct stat st {};
  if (lstat(path.c_str(), &st) != 0) throw std::runtime_error("lstat " + path + " failed");
  return st;
}

// marker/{file, dir/inner}: stands for what a user may not change; a test
// compares its treeSnapshot before and after.
inline void makeMarkerTree(const std::string& marker) {
  std::filesystem::create_directories(marker + "/dir");
  std::ofstream(marker + "/file") << "precious";
  std::ofstream(marker + "/dir/inner") << "inner";
  if (setxattr((marker + "/file").c_str(), "user.mark", "m", 1, 0) != 0) throw std::runtime_error("setxattr");
}

// The protection class an item carries: 0 without the attribute.
inline int32_t protectionClassOf(const std::string& path) {
  uint8_t b[4] = {};
  if (lgetxattr(path.c_str(), "trusted.com.norvane.protection-class", b, sizeof b) != sizeof b) return 0;
  return static_cast<int32_t>(b[0] | b[1] << 8 | b[2] << 16 | static_cast<uint32_t>(b[3]) << 24);
}

inline std::string fileText(const std::string& path) {
  std::stringstream s;
  s << std::ifstream(path).rdbuf();
  return s.str();
}

// Owner, mode, link count (if asked), size, content, link target and
// attributes of the item, "" when there is none: whatever a write, chown,
// chmod, setxattr or unlink through a followed link would change.
inline std::string itemState(const std::string& path, bool linkCount = true) {
  struct stat st {};
  if (lstat(path.c_str(), &st) != 0) return "";
  std::ostringstream o;
  o << "owner " << st.st_uid << ':' << st.st_gid << " mode " << std::oct << st.st_mode << std::dec << " links "
    << (linkCount ? st.st_nlink : 0) << " size " << (S_ISDIR(st.st_mode) ? 0 : st.st_size);
  if (S_ISREG(st.st_mode)) o << " content " << std::hash<std::string>{}(fileText(path));
  char buffer[4096];
  ssize_t n = readlink(path.c_str(), buffer, sizeof buffer);
  if (n >= 0) o << " -> " << std::string(buffer, static_cast<size_t>(n));
  char names[4096];
  n = llistxattr(path.c_str(), names, sizeof names);
  for (ssize_t i = 0; i < n; i += static_cast<ssize_t>(strlen(names + i)) + 1) {
    ssize_t v = lgetxattr(path.c_str(), names + i, buffer, sizeof buffer);
    o << ' ' << names + i << '=' << std::hash<std::string>{}(std::string(buffer, v > 0 ? static_cast<size_t>(v) : 0));
  }
  return o.str();
}

// The state of every item below dir: what a marker tree compares before and after.
inline std::map<std::string, std::string> treeSnapshot(const std::string& dir, bool linkCount = true) {
  std::map<std::string, std::string> items;
  for (auto& e : std::filesystem::recursive_directory_iterator(dir)) items[e.path()] = itemState(e.path(), linkCount);
  return items;
}
