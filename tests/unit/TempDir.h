// A scratch directory made fresh for one test (or suite) and removed with
// everything below it when the object goes away.
#pragma once

#include <stdlib.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <filesystem>
#include <fstream>
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

inline std::string fileText(const std::string& path) {
  std::stringstream s;
  s << std::ifstream(path).rdbuf();
  return s.str();
}

// Owner, mode, link count (if asked), attribute names and content of every
// item below dir: what a marker tree compares before and after a test.
inline std::map<std::string, std::string> treeSnapshot(const std::string& dir, bool linkCount = true) {
  std::map<std::string, std::string> items;
  for (auto& e : std::filesystem::recursive_directory_iterator(dir)) {
    struct stat st {};
    lstat(e.path().c_str(), &st);
    char names[1024] = {};
    ssize_t n = llistxattr(e.path().c_str(), names, sizeof names);
    std::ostringstream o;
    o << st.st_uid << ':' << st.st_gid << ':' << std::oct << st.st_mode << ':' << (linkCount ? st.st_nlink : 0) << ':'
      << std::string(names, n > 0 ? static_cast<size_t>(n) : 0);
    if (S_ISREG(st.st_mode)) o << ':' << fileText(e.path());
    items[e.path()] = o.str();
  }
  return items;
}
