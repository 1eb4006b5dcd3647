// The administrator's check of the store: whether the containers on disk,
// the container cache, the sandbox mappings, the code-signing database and
// the daemon's own directories agree. A repair does only what the next
// start's recovery would redo or undo: it forgets, adds again, moves to
// death row, empties death row, and stamps owners and ACLs anew. It never
// removes anything outside death row.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

struct QRTFinding {
  enum class Severity { notice, warning, error };
  // A stable name for scripts ("metadata-unreadable").
  std::string kind;
  Severity severity = Severity::warning;
  // The path or identifier the finding is about.
  std::string subject;
  std::string detail;
  // What an administrator should do, or what the repair does.
  std::string action;
  bool repaired = false;
};

struct QRTVerifyReport {
  uint64_t containers = 0;  // container directories looked at
  std::vector<QRTFinding> findings;
};

const char* QRTFindingSeverityName(QRTFinding::Severity severity);

// Runs every check; with repair, fixes what is safe to fix. Holds the
// all-identifiers lock (for writing when repairing) over the store's part,
// so that no container is made or removed meanwhile.
QRTVerifyReport QRTVerifyStore(bool repair);
