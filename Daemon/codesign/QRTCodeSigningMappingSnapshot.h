// The code-signing entries as the database holds them, kept in memory for
// the paths that must not wait on the database queue: the upcall and the
// look-up command. The mapping's one writer keeps it equal to the database by
// reading back, after each write, every row that write may have changed.
//
// Each entry is an immutable object shared with its readers: a reader finds
// it under the shared side of the lock and keeps it after letting go, so a
// write replaces one entry and never waits on, or changes, what a reader
// holds.
#pragma once

#include <cstddef>
#include <memory>
#include <optional>
#include <shared_mutex>
#include <string>
#include <unordered_map>
#include <vector>

#include "Daemon/codesign/QRTCodeSigningEntry.h"

class QRTCodeSigningMappingSnapshot {
 public:
  using EntryRef = std::shared_ptr<const QRTCodeSigningEntry>;
  using Entries = std::unordered_map<std::string, EntryRef>;

  // Unknown: the snapshot cannot answer (not loaded, or a read-back failed);
  // ask the database.
  enum class Lookup { Found, Absent, Unknown };
  Lookup find(const std::string& identifier, EntryRef* entry) const;

  // The writer's side, on the database queue only.
  // Everything, read whole from the database.
  void replaceAll(Entries entries);
  // One row as read back: an entry, or none when the row is gone.
  void set(const std::string& identifier, std::optional<QRTCodeSigningEntry> entry);
  // Until the next replaceAll every look-up answers Unknown.
  void invalidate();
  bool loaded() const;
  // The programs whose child lists name any of these (to read back after a
  // write that may move the children).
  std::vector<std::string> parentsOf(const std::vector<std::string>& children) const;
  // A copy of every entry (tests compare it with the database).
  std::optional<Entries> copy() const;

 private:
  void indexChildren(const std::string& parent, const EntryRef& entry, bool add);

  mutable std::shared_mutex lock_;
  bool loaded_ = false;
  Entries entries_;
  std::unordered_map<std::string, std::string> parentOfChild_;
};
