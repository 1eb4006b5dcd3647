// The code-signing database "containers.sqlite3": one row per program
// identifier with its flags and data class, its code-signing dictionary as a
// binary property list, and its child bundles. Used from one serial queue
// only, so it takes no locks; the connection holds the file exclusively.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/QRTURL.h"
#include "Daemon/QRTError.h"
#include "Daemon/codesign/QRTCodeSigningEntry.h"

struct sqlite3;
class QRTSQLiteDBStatementCache;

class QRTSQLiteDB {
 public:
  // Null when the file URL can't be formed or the database can't be opened.
  static std::unique_ptr<QRTSQLiteDB> initWithParentDirectoryURL(const QRTURL& directory);
  static sqlite3* openDBWithURL(const QRTURL& url);
  ~QRTSQLiteDB();
  QRTSQLiteDB(const QRTSQLiteDB&) = delete;
  QRTSQLiteDB& operator=(const QRTSQLiteDB&) = delete;

  void closeDB();
  const QRTURL& url() const { return url_; }

  // Upsert of the info row, the data row and a row per child, in one transaction.
  bool addCodeSigningEntry(const QRTCodeSigningEntry* entry, const std::optional<std::string>& withIdentifier,
                           QRTErrorRef* error);
  bool deleteCodeSigningEntryWithIdentifier(const std::optional<std::string>& identifier, QRTErrorRef* error);
  // Error 67 (not logged) when there is no entry.
  std::optional<QRTCodeSigningEntry> codeSigningEntryWithIdentifier(const std::string& identifier, QRTErrorRef* error);
  bool invalidateCodeSigningWithIdentifier(const std::string& identifier, QRTErrorRef* error);
  bool invalidateCodeSigningForIdentifierAndAllChildren(const std::string& identifier, QRTErrorRef* error);
  // The last error met, or null when every row went through.
  QRTErrorRef enumerateIdentifiersAndCodeSigningInfoUsingBlock(
      const std::function<void(const std::string& identifier, QRTCodeSigningEntry&& entry)>& block);
  // Error 67 (not logged) when the parent has no children.
  std::optional<std::vector<std::string>> childIdentifiersForParentIdentifier(const std::string& identifier,
                                                                              QRTErrorRef* error);
  // What "PRAGMA integrity_check" and "PRAGMA foreign_key_check" report, one
  // line per problem; empty when the database is sound.
  std::vector<std::string> integrityProblems();

 private:
  QRTSQLiteDB(sqlite3* db, QRTURL url);

  sqlite3* db_ = nullptr;
  QRTURL url_;
  // Statements prepared once for the connection's life.
  std::unique_ptr<QRTSQLiteDBStatementCache> statements_;
};
