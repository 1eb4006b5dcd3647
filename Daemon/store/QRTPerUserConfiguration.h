// The paths of the container store under one user's home directory. Every
// path is absent when the user has no account; getters that create their
// directory do so on every call.
#pragma once

#include <cstdint>
#include <mutex>
#include <optional>

#include "base/QRTURL.h"

class QRTPerUserConfiguration {
 public:
  explicit QRTPerUserConfiguration(uint32_t userId);

  uint32_t userId() const { return userId_; }
  // Whether the home directory itself exists.
  bool existsUserBaseDirectory();

  const std::optional<QRTURL>& userHomeDirectory() const { return userHomeDirectory_; }
  // home + "Containers", created.
  std::optional<QRTURL> userBaseDirectory();
  // The same path, nothing created.
  std::optional<QRTURL> userBaseDirectoryPath() const { return homeRelative("Containers"); }
  // home + "Library/Caches/com.norvane.quarterd/Temp", created.
  std::optional<QRTURL> transientDirectory();
  // home + "Library/Backup/SystemContainers" and its "Data" and "Shared"; not created.
  std::optional<QRTURL> systemContainerBackupBaseDirectory() const;
  std::optional<QRTURL> systemContainerBackupDirectory() const;
  std::optional<QRTURL> systemGroupContainerBackupDirectory() const;
  std::optional<QRTURL> oldLibraryDirectoryPath() const;
  std::optional<QRTURL> oldLoggingPath() const;

  // The per-user class directory, created; nothing for another class.
  std::optional<QRTURL> containerDirectoryURLForContentClass(uint64_t contentClass, bool transient);

 private:
  std::optional<QRTURL> homeRelative(const char* path) const;
  std::optional<QRTURL> cachedDirectory(std::optional<QRTURL>& slot, const char* path, const char* getter,
                                        const char* failureMessage);

  std::recursive_mutex lock_;
  uint32_t userId_;
  std::optional<QRTURL> userHomeDirectory_;
  std::optional<QRTURL> userBaseDirectory_;
  std::optional<QRTURL> transientDirectory_;
};
