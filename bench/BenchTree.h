// What the tree benchmarks share: a tree of small files, a settled disk
// before each timed run, and the median of the rounds.
#pragma once

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <string>
#include <vector>

namespace bench {

// root/dirD/fileF, each file holding fileSize bytes; any failure ends the program.
inline void buildTree(const std::string& root, int directories, int filesPerDirectory, size_t fileSize) {
  const std::string content(fileSize, 'x');
  auto fail = [](const std::string& what) {
    std::perror(what.c_str());
    std::exit(1);
  };
  if (mkdir(root.c_str(), 0755) != 0) fail(root);
  for (int d = 0; d < directories; ++d) {
    const std::string dir = root + "/dir" + std::to_string(d);
    if (mkdir(dir.c_str(), 0755) != 0) fail(dir);
    for (int f = 0; f < filesPerDirectory; ++f) {
      const std::string file = dir + "/file" + std::to_string(f);
      int fd = open(file.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
      if (fd < 0 || write(fd, content.data(), content.size()) != static_cast<ssize_t>(content.size())) fail(file);
      close(fd);
    }
  }
}

// Written-back pages of the trees just built, and the discards of earlier
// removals (the disk is mounted with online discard), would otherwise land
// on whichever run comes next.
inline void settle() {
  sync();
  sleep(3);
  sync();
}

// Seconds the work takes, on a settled disk.
inline double timed(const std::function<void()>& work) {
  settle();
  auto start = std::chrono::steady_clock::now();
  work();
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

inline double median(std::vector<double> v) {
  std::sort(v.begin(), v.end());
  return v[v.size() / 2];
}

}  // namespace bench
