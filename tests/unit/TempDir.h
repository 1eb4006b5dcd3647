// A scratch directory made fresh for one test (or suite) and removed with
// everything below it when the object goes away.
#pragma once

#include <stdlib.h>

#include <filesystem>
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
