// A file URL: an absolute host path and whether it names a directory.
#pragma once

#include <string>
#include <string_view>

class QRTURL {
 public:
  QRTURL() = default;
  // A file URL for the path. Repeated slashes and a trailing slash are
  // dropped from the stored path ("/" stays "/").
  static QRTURL fileURL(std::string_view path, bool isDirectory = false);

  const std::string& path() const { return path_; }
  // The bytes to hand to system calls.
  const char* fileSystemRepresentation() const { return path_.c_str(); }
  bool isDirectory() const { return isDirectory_; }
  bool empty() const { return path_.empty(); }

  QRTURL URLByAppendingPathComponent(std::string_view component, bool isDirectory = false) const;
  QRTURL URLByDeletingLastPathComponent() const;
  std::string lastPathComponent() const;
  // The URL's path, for %@.
  const std::string& description() const { return path_; }

  bool operator==(const QRTURL& o) const { return path_ == o.path_; }
  bool operator<(const QRTURL& o) const { return path_ < o.path_; }

 private:
  std::string path_;
  bool isDirectory_ = false;
};
