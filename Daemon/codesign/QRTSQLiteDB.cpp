#include "Daemon/codesign/QRTSQLiteDB.h"

#include <sqlite3.h>

#include <mutex>
#include <unordered_map>
#include <utility>

#include "base/PlistCodec.h"
#include "platform/Log.h"

using platform::kLogDebug;
using platform::kLogError;

namespace {

constexpr const char* kSchema =
    "PRAGMA journal_mode = WAL;PRAGMA foreign_keys = ON;PRAGMA auto_vacuum = FULL;CREATE TABLE IF NOT EXISTS "
    "code_signing_info(id INTEGER PRIMARY KEY AUTOINCREMENT,code_signing_id_text TEXT NOT NULL UNIQUE,invalid "
    "INTEGER NOT NULL DEFAULT 0,placeholder INTEGER NOT NULL DEFAULT 0,registered_by_caller INTEGER NOT NULL "
    "DEFAULT 0,data_container_class INTEGER NOT NULL DEFAULT 0);CREATE TABLE IF NOT EXISTS code_signing_data(id "
    "INTEGER PRIMARY KEY AUTOINCREMENT,cs_info_id INTEGER NOT NULL UNIQUE,data BLOB NOT NULL,FOREIGN "
    "KEY(cs_info_id) REFERENCES code_signing_info(id) ON DELETE CASCADE);CREATE TABLE IF NOT EXISTS "
    "child_bundles(id INTEGER PRIMARY KEY AUTOINCREMENT,child_code_signing_id_text TEXT NOT NULL UNIQUE,parent_id "
    "INTEGER NOT NULL,FOREIGN KEY(parent_id) REFERENCES code_signing_info(id) ON DELETE CASCADE);CREATE INDEX IF "
    "NOT EXISTS code_signing_id_text_idx ON code_signing_info(code_signing_id_text);CREATE INDEX IF NOT EXISTS "
    "cs_info_id_idx ON code_signing_data(cs_info_id);CREATE INDEX IF NOT EXISTS parent_id_idx ON "
    "child_bundles(parent_id);";

constexpr const char* kUpdateInfo =
    "UPDATE code_signing_info SET invalid=?, placeholder=?, registered_by_caller=?, data_container_class=? WHERE "
    "code_signing_id_text=?;";
constexpr const char* kInsertInfo =
    "INSERT INTO code_signing_info (invalid, placeholder, registered_by_caller, data_container_class, "
    "code_signing_id_text) VALUES (?, ?, ?, ?, ?);";
constexpr const char* kInsertData =
    "INSERT OR REPLACE INTO code_signing_data (cs_info_id, data) SELECT id, ? FROM code_signing_info WHERE "
    "code_signing_id_text = ?;";
constexpr const char* kInsertChild =
    "INSERT OR REPLACE INTO child_bundles (parent_id, child_code_signing_id_text) SELECT id, ? FROM "
    "code_signing_info WHERE code_signing_id_text = ?;";
constexpr const char* kDelete = "DELETE FROM code_signing_info WHERE code_signing_id_text=?;";
constexpr const char* kInvalidate = "UPDATE code_signing_info SET invalid=1 WHERE code_signing_id_text = ?;";
constexpr const char* kSelectEntry =
    "SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
    "code_signing_info.registered_by_caller, code_signing_info.data_container_class FROM code_signing_info, "
    "code_signing_data WHERE code_signing_info.id = code_signing_data.cs_info_id AND "
    "code_signing_info.code_signing_id_text = ?;";
constexpr const char* kSelectAll =
    "SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
    "code_signing_info.registered_by_caller, code_signing_info.data_container_class, "
    "code_signing_info.code_signing_id_text FROM code_signing_info, code_signing_data WHERE code_signing_info.id "
    "= code_signing_data.cs_info_id;";
// Every child row with its parent's identifier, in the order each parent's look-up gives them.
constexpr const char* kSelectAllChildren =
    "SELECT code_signing_info.code_signing_id_text, child_bundles.child_code_signing_id_text FROM child_bundles, "
    "code_signing_info WHERE child_bundles.parent_id=code_signing_info.id ORDER BY child_bundles.id;";
constexpr const char* kSelectChildren =
    "SELECT child_bundles.child_code_signing_id_text FROM child_bundles, code_signing_info WHERE "
    "code_signing_info.code_signing_id_text = ? AND child_bundles.parent_id=code_signing_info.id;";

}  // namespace

// The connection's statements, each prepared once (persistent) and reset
// after every use. A statement already in use (a nested call, or the
// snapshot's read on its own thread) gets a copy of its own for that call.
class QRTSQLiteDBStatementCache {
 public:
  QRTSQLiteDBStatementCache(sqlite3* db, const QRTURL& url) : db(db), url(url) {}
  ~QRTSQLiteDBStatementCache() { close(); }
  // Before the connection closes; later uses find no connection.
  void close() {
    for (auto& [sql, slot] : slots) finalize(slot.statement);
    slots.clear();
    db = nullptr;
  }
  void finalize(sqlite3_stmt* statement) const {
    if (statement && sqlite3_finalize(statement) != SQLITE_OK) {
      QRTLog(kLogError, "sqlite3_finalize for %@ failed: %s", url, sqlite3_errmsg(db));
    }
  }

  sqlite3* db;
  const QRTURL& url;
  struct Slot {
    sqlite3_stmt* statement = nullptr;
    bool inUse = false;
  };
  // Keyed by the text's address: every statement is one of the constants above.
  std::unordered_map<const char*, Slot> slots;
  // Guards slots: the connection itself is serialized by SQLite.
  std::mutex lock;
};

namespace {

// A statement of the connection for one use: bindings and state are reset on
// every way out.
class Statement {
 public:
  Statement(QRTSQLiteDBStatementCache& cache, const char* sql) : cache_(cache) {
    std::lock_guard<std::mutex> hold(cache.lock);
    QRTSQLiteDBStatementCache::Slot& slot = cache.slots[sql];
    if (slot.statement && !slot.inUse) {
      slot_ = &slot;
    } else if (sqlite3_prepare_v3(cache.db, sql, -1, slot.inUse ? 0 : SQLITE_PREPARE_PERSISTENT, &stmt_, nullptr) !=
               SQLITE_OK) {
      cache.finalize(std::exchange(stmt_, nullptr));
      return;
    } else if (!slot.inUse) {
      slot.statement = stmt_;
      slot_ = &slot;
    }
    if (slot_) {
      slot_->inUse = true;
      stmt_ = slot_->statement;
    }
  }
  ~Statement() {
    if (!slot_) {
      cache_.finalize(stmt_);
      return;
    }
    sqlite3_reset(stmt_);
    sqlite3_clear_bindings(stmt_);
    std::lock_guard<std::mutex> hold(cache_.lock);
    slot_->inUse = false;
  }
  Statement(const Statement&) = delete;
  Statement& operator=(const Statement&) = delete;
  bool prepared() const { return stmt_ != nullptr; }
  sqlite3_stmt* get() const { return stmt_; }
  bool bindText(int index, const std::string& text) {
    return sqlite3_bind_text(stmt_, index, text.c_str(), -1, SQLITE_TRANSIENT) == SQLITE_OK;
  }
  bool bindInt(int index, int value) { return sqlite3_bind_int(stmt_, index, value) == SQLITE_OK; }

 private:
  QRTSQLiteDBStatementCache& cache_;
  QRTSQLiteDBStatementCache::Slot* slot_ = nullptr;
  sqlite3_stmt* stmt_ = nullptr;
};

#define DB_ERROR(underlying, ...) \
  QRTCreateError(__func__, __LINE__, QRTErrorDomain, QRTErrorDatabase, (underlying), nullptr, true, __VA_ARGS__)

bool isError(const QRTErrorRef& error, QRTErrorCode code) {
  return error && error->domain() == QRTErrorDomain && error->code() == static_cast<int32_t>(code);
}

}  // namespace

// The private building blocks share the connection and the URL.
struct QRTSQLiteDBStatements {
  static QRTErrorRef performTwoParameterQuery(QRTSQLiteDBStatementCache& cache, const char* sql, const std::string& one,
                                              const std::optional<std::string>& two, int expectedChanges) {
    sqlite3* const db = cache.db;
    const QRTURL& url = cache.url;
    Statement statement(cache, sql);
    if (!statement.prepared())
      return DB_ERROR(nullptr, "sqlite3_prepare(insert) for %@ failed: %s", url, sqlite3_errmsg(db));
    if (!statement.bindText(1, one)) {
      return DB_ERROR(nullptr, "sqlite3_bind_text for identifier=%@ at %@ failed: %s", one, url, sqlite3_errmsg(db));
    }
    if (two && !statement.bindText(2, *two)) {
      return DB_ERROR(nullptr, "sqlite3_bind_text for identifier=%@ at %@ failed: %s", *two, url, sqlite3_errmsg(db));
    }
    if (sqlite3_step(statement.get()) != SQLITE_DONE) {
      return DB_ERROR(nullptr, "sqlite3_step for %@ failed: %s", url, sqlite3_errmsg(db));
    }
    const int changes = sqlite3_changes(db);
    if (expectedChanges != -1 && changes != expectedChanges) {
      return QRT_ERROR(QRTErrorUnexpectedChangeCount, nullptr, false,
                       "sqlite3_changes for %s in %@: %d, but expecting %d", sql, url, changes, expectedChanges);
    }
    return nullptr;
  }

  static QRTErrorRef performInsertOrUpdateQuery(QRTSQLiteDBStatementCache& cache, const char* sql,
                                                const QRTCodeSigningEntry& entry, const std::string& identifier,
                                                bool isUpdate) {
    sqlite3* const db = cache.db;
    const QRTURL& url = cache.url;
    Statement statement(cache, sql);
    if (!statement.prepared())
      return DB_ERROR(nullptr, "sqlite3_prepare(insert) for %@ failed: %s", url, sqlite3_errmsg(db));
    if (!statement.bindInt(1, entry.invalid)) {
      return DB_ERROR(nullptr, "sqlite3_bind_int for invalid=%d at %@ failed: %s", int(entry.invalid), url,
                      sqlite3_errmsg(db));
    }
    if (!statement.bindInt(2, entry.placeholder)) {
      return DB_ERROR(nullptr, "sqlite3_bind_int for placeholder=%d at %@ failed: %s", int(entry.placeholder), url,
                      sqlite3_errmsg(db));
    }
    if (!statement.bindInt(3, entry.registeredByCaller)) {
      return DB_ERROR(nullptr, "sqlite3_bind_int for registered_by_caller=%d at %@ failed: %s",
                      int(entry.registeredByCaller), url, sqlite3_errmsg(db));
    }
    // Content classes are small; the column holds them as 32-bit integers.
    if (!statement.bindInt(4, static_cast<int>(entry.dataContainerClass))) {
      return DB_ERROR(nullptr, "sqlite3_bind_int for data_container_class=%llu at %@ failed: %s",
                      static_cast<unsigned long long>(entry.dataContainerClass), url, sqlite3_errmsg(db));
    }
    if (!statement.bindText(5, identifier)) {
      return DB_ERROR(nullptr, "sqlite3_bind_text for code_signing_id=%@ at %@ failed: %s", identifier, url,
                      sqlite3_errmsg(db));
    }
    if (sqlite3_step(statement.get()) != SQLITE_DONE) {
      return DB_ERROR(nullptr, "sqlite3_step for %@ failed: %s", url, sqlite3_errmsg(db));
    }
    const int changes = sqlite3_changes(db);
    if (isUpdate && changes != 1) {
      return QRT_ERROR(QRTErrorUnexpectedChangeCount, nullptr, false,
                       "sqlite3_changes for %s in %@: %d, but expecting 1", sql, url, changes);
    }
    return nullptr;
  }

  static QRTErrorRef insertCodeSigningInfo(QRTSQLiteDBStatementCache& cache, const QRTCodeSigningEntry& entry,
                                           const std::string& identifier) {
    QRTErrorRef error = performInsertOrUpdateQuery(cache, kUpdateInfo, entry, identifier, true);
    if (!error) return nullptr;
    if (!isError(error, QRTErrorUnexpectedChangeCount)) {
      return DB_ERROR(error, "Error performing UPDATE operation for %@", identifier);
    }
    error = performInsertOrUpdateQuery(cache, kInsertInfo, entry, identifier, false);
    if (error) return DB_ERROR(error, "Error performing INSERT operation for %@", identifier);
    return nullptr;
  }

  static QRTErrorRef insertCodeSigningData(QRTSQLiteDBStatementCache& cache, const QRTCodeSigningEntry& entry,
                                           const std::string& identifier) {
    sqlite3* const db = cache.db;
    const QRTURL& url = cache.url;
    Statement statement(cache, kInsertData);
    if (!statement.prepared())
      return DB_ERROR(nullptr, "sqlite3_prepare(insert) for %@ failed: %s", url, sqlite3_errmsg(db));
    const plist::Value info = entry.codeSigningInfo ? plist::Value(*entry.codeSigningInfo) : plist::Value();
    if (!entry.codeSigningInfo) {
      return DB_ERROR(QRT_ERROR(QRTErrorInvalidArgument, nullptr, false, "no code signing info"),
                      "Error creating Bytebox from code signing info: %@", nullptr);
    }
    const plist::Data bytes = plist::writeBinary(info);
    if (sqlite3_bind_blob64(statement.get(), 1, bytes.data(), bytes.size(), SQLITE_TRANSIENT) != SQLITE_OK) {
      return DB_ERROR(nullptr, "sqlite3_bind_blob64 for codeSigningInfoData at %@ failed: %s", url, sqlite3_errmsg(db));
    }
    if (!statement.bindText(2, identifier)) {
      return DB_ERROR(nullptr, "sqlite3_bind_text for code_signing_id_text=%@ at %@ failed: %s", identifier, url,
                      sqlite3_errmsg(db));
    }
    if (sqlite3_step(statement.get()) != SQLITE_DONE) {
      return DB_ERROR(nullptr, "sqlite3_step for %@ failed: %s", url, sqlite3_errmsg(db));
    }
    return nullptr;
  }

  static std::optional<QRTCodeSigningEntry> entryFromStatementRow(sqlite3_stmt* statement, QRTErrorRef* error) {
    const void* blob = sqlite3_column_blob(statement, 0);
    const int length = sqlite3_column_bytes(statement, 0);
    if (!blob && sqlite3_column_type(statement, 0) == SQLITE_NULL) {
      QRTSetError(error, DB_ERROR(nullptr, "Failed to create code signing entry from statement row"));
      return std::nullopt;
    }
    std::string reason;
    std::optional<plist::Value> value = plist::parse(blob ? blob : "", static_cast<size_t>(length), &reason);
    if (!value || !value->isDictionary()) {
      QRTErrorRef formatting = QRTCreateError(__func__, __LINE__, QRTPropertyListErrorDomain, 2048, nullptr, nullptr,
                                              false, "%@", value ? std::string("not a dictionary") : reason);
      QRTSetError(error, DB_ERROR(formatting, "Error formatting info data from DB"));
      return std::nullopt;
    }
    QRTCodeSigningEntry entry(std::move(value->dictionary()));
    entry.invalid = sqlite3_column_int(statement, 1) != 0;
    entry.placeholder = sqlite3_column_int(statement, 2) != 0;
    entry.registeredByCaller = sqlite3_column_int(statement, 3) != 0;
    // Read as 32 bits and widened with sign extension, as it was written.
    entry.dataContainerClass = static_cast<uint64_t>(static_cast<int64_t>(sqlite3_column_int(statement, 4)));
    return entry;
  }

  // BEGIN, body, COMMIT; a body that fails or throws (error 40) is rolled
  // back, and a failing ROLLBACK's error replaces the body's.
  static QRTErrorRef transaction(sqlite3* db, const std::function<QRTErrorRef()>& body) {
    if (QRTErrorRef failed = exec(db, "BEGIN;", "failed _sqliteExec begin")) return failed;
    QRTErrorRef result;
    if (QRTErrorRef thrown = QRT_GUARD([&] { result = body(); })) result = thrown;
    if (!result) result = exec(db, "COMMIT;", "failed _sqliteExec commit");
    if (result && sqlite3_get_autocommit(db) == 0) {
      if (QRTErrorRef rollback = exec(db, "ROLLBACK;", "failed _sqliteExec rollback")) result = rollback;
    }
    return result;
  }

  static QRTErrorRef exec(sqlite3* db, const char* sql, const char* failure) {
    char* message = nullptr;
    if (sqlite3_exec(db, sql, nullptr, nullptr, &message) == SQLITE_OK) return nullptr;
    QRTErrorRef underlying = QRTCreateError(__func__, __LINE__, QRTErrorDomain, QRTErrorDatabase, nullptr, nullptr,
                                            false, "%s", message ? message : sqlite3_errmsg(db));
    sqlite3_free(message);
    return DB_ERROR(underlying, "%s", failure);
  }
};
using S = QRTSQLiteDBStatements;

sqlite3* QRTSQLiteDB::openDBWithURL(const QRTURL& url) {
  sqlite3* db = nullptr;
  // The library directory is root's; NOFOLLOW keeps a planted link from
  // taking the file elsewhere all the same.
  // Serialized: the snapshot is read on a thread of its own beside the queue.
  const int flags = SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOFOLLOW | SQLITE_OPEN_FULLMUTEX;
  if (sqlite3_open_v2(url.fileSystemRepresentation(), &db, flags, nullptr) != SQLITE_OK) {
    QRTLog(kLogError, "opening %@ failed: %s", url, db ? sqlite3_errmsg(db) : "out of memory");
    sqlite3_close(db);
    return nullptr;
  }
  char* message = nullptr;
  if (sqlite3_exec(db, kSchema, nullptr, nullptr, &message) != SQLITE_OK) {
    QRTLog(kLogError, "table create for %@ failed: %s", url, message ? message : sqlite3_errmsg(db));
    sqlite3_free(message);
    sqlite3_close(db);
    return nullptr;
  }
  QRTLog(kLogDebug, "opening %@", url);
  message = nullptr;
  if (sqlite3_exec(db, "PRAGMA locking_mode = EXCLUSIVE;", nullptr, nullptr, &message) != SQLITE_OK) {
    QRTLog(kLogError, "enabling exclusive locking mode for %@ failed: %s", url, message ? message : sqlite3_errmsg(db));
    sqlite3_free(message);
  }
  // The lock is taken at the first access; take it now, so that nothing else
  // opens the file while the daemon runs.
  sqlite3_exec(db, "SELECT count(*) FROM code_signing_info;", nullptr, nullptr, nullptr);
  return db;
}

std::unique_ptr<QRTSQLiteDB> QRTSQLiteDB::initWithParentDirectoryURL(const QRTURL& directory) {
  if (directory.empty()) return nullptr;
  QRTURL url = QRTURL::fileURL(directory.URLByAppendingPathComponent("containers", true).path() + ".sqlite3");
  sqlite3* db = openDBWithURL(url);
  if (!db) return nullptr;
  return std::unique_ptr<QRTSQLiteDB>(new QRTSQLiteDB(db, std::move(url)));
}

QRTSQLiteDB::QRTSQLiteDB(sqlite3* db, QRTURL url)
    : db_(db), url_(std::move(url)), statements_(std::make_unique<QRTSQLiteDBStatementCache>(db_, url_)) {}

QRTSQLiteDB::~QRTSQLiteDB() { closeDB(); }

void QRTSQLiteDB::closeDB() {
  if (!db_) return;
  statements_->close();
  QRTLog(kLogDebug, "closing %@", url_);
  const int rc = sqlite3_close(db_);
  if (rc != SQLITE_OK) QRTLog(kLogError, "sqlite3_close for %@ failed: %d", url_, rc);
  db_ = nullptr;
}

bool QRTSQLiteDB::addCodeSigningEntry(const QRTCodeSigningEntry* entry,
                                      const std::optional<std::string>& withIdentifier, QRTErrorRef* error) {
  if (!entry || !withIdentifier) {
    QRTSetError(error,
                QRT_ERROR(QRTErrorInvalidArgument, nullptr, true, "codeSigningEntry %@ and identifier %@ cannot be nil",
                          entry ? QRTFormatArg(*entry) : QRTFormatArg(nullptr), withIdentifier));
    return false;
  }
  QRTErrorRef result = S::transaction(db_, [&]() -> QRTErrorRef {
    if (QRTErrorRef failed = S::insertCodeSigningInfo(*statements_, *entry, *withIdentifier)) return failed;
    if (QRTErrorRef failed = S::insertCodeSigningData(*statements_, *entry, *withIdentifier)) return failed;
    // A child that can't be written doesn't fail the parent.
    for (const std::string& child : entry->childBundleIdentifiers.value_or(std::vector<std::string>{})) {
      S::performTwoParameterQuery(*statements_, kInsertChild, child, *withIdentifier, -1);
    }
    return nullptr;
  });
  QRTSetError(error, result);
  return !result;
}

bool QRTSQLiteDB::deleteCodeSigningEntryWithIdentifier(const std::optional<std::string>& identifier,
                                                       QRTErrorRef* error) {
  if (!identifier) {
    QRTSetError(error, QRT_ERROR(QRTErrorInvalidArgument, nullptr, true, "\bidentifier %@ cannot be nil", nullptr));
    return false;
  }
  if (QRTErrorRef failed = S::performTwoParameterQuery(*statements_, kDelete, *identifier, std::nullopt, 1)) {
    QRTSetError(error, DB_ERROR(failed, "failed to delete from code_signing_info"));
    return false;
  }
  return true;
}

std::optional<QRTCodeSigningEntry> QRTSQLiteDB::codeSigningEntryWithIdentifier(const std::string& identifier,
                                                                               QRTErrorRef* error) {
  QRTErrorRef failure;
  std::optional<QRTCodeSigningEntry> entry;
  {
    Statement statement(*statements_, kSelectEntry);
    if (!statement.prepared()) {
      failure = DB_ERROR(nullptr, "sqlite3_prepare(select) for %@ failed: %s", url_, sqlite3_errmsg(db_));
    } else if (!statement.bindText(1, identifier)) {
      failure = DB_ERROR(nullptr, "sqlite3_bind_text for code_signing_id_text=%@ at %@ failed: %s", identifier, url_,
                         sqlite3_errmsg(db_));
    } else {
      const int rc = sqlite3_step(statement.get());
      if (rc == SQLITE_ROW) {
        entry = S::entryFromStatementRow(statement.get(), &failure);
      } else if (rc != SQLITE_DONE) {
        failure = DB_ERROR(nullptr, "sqlite3_step for %@ failed: %s", url_, sqlite3_errmsg(db_));
      }
    }
  }
  if (!entry && !failure) {
    QRTSetError(error,
                QRT_ERROR(QRTErrorNotInDatabase, nullptr, false, "Identifier: \"%@\" Not Found in DB", identifier));
    return std::nullopt;
  }
  if (failure) {
    QRTLog(kLogError, "Error retrieving code signing entry: %@", failure);
    QRTSetError(error, failure);
    return std::nullopt;
  }
  QRTErrorRef childFailure;
  std::optional<std::vector<std::string>> children = childIdentifiersForParentIdentifier(identifier, &childFailure);
  if (!children && !isError(childFailure, QRTErrorNotInDatabase)) {
    QRTLog(kLogError, "Error retrieving childBundleIds: %@", childFailure);
    QRTSetError(error, childFailure);
    return std::nullopt;
  }
  entry->childBundleIdentifiers = std::move(children);
  return entry;
}

bool QRTSQLiteDB::invalidateCodeSigningWithIdentifier(const std::string& identifier, QRTErrorRef* error) {
  if (QRTErrorRef failed = S::performTwoParameterQuery(*statements_, kInvalidate, identifier, std::nullopt, -1)) {
    QRTSetError(error, DB_ERROR(failed, "failed to invalidate identifier %@", identifier));
    return false;
  }
  return true;
}

bool QRTSQLiteDB::invalidateCodeSigningForIdentifierAndAllChildren(const std::string& identifier, QRTErrorRef* error) {
  QRTErrorRef childFailure;
  std::optional<std::vector<std::string>> children = childIdentifiersForParentIdentifier(identifier, &childFailure);
  if (!children && !isError(childFailure, QRTErrorNotInDatabase)) {
    QRTSetError(error, DB_ERROR(childFailure, "Error retrieving child bundles ids from DB with identifier %@ : %@",
                                identifier, childFailure));
    return false;
  }
  std::vector<std::string> all{identifier};
  if (children) all.insert(all.end(), children->begin(), children->end());
  QRTErrorRef result = S::transaction(db_, [&]() -> QRTErrorRef {
    for (const std::string& item : all) {
      QRTErrorRef failed;
      if (invalidateCodeSigningWithIdentifier(item, &failed)) {
        QRTLog(kLogDebug, "Invalidating code signing info for %@ child: %@", identifier, item);
      } else {
        QRTLog(kLogError, "Failed to invalidate code signing info for %@ child %@ : %@", identifier, item, failed);
      }
    }
    return nullptr;
  });
  QRTSetError(error, result);
  return !result;
}

QRTErrorRef QRTSQLiteDB::enumerateIdentifiersAndCodeSigningInfoUsingBlock(
    const std::function<void(const std::string& identifier, QRTCodeSigningEntry&& entry)>& block) {
  // The children first, in one pass, rather than one look-up for each entry.
  std::unordered_map<std::string, std::vector<std::string>> children;
  {
    Statement statement(*statements_, kSelectAllChildren);
    if (!statement.prepared())
      return DB_ERROR(nullptr, "sqlite3_prepare(select) for %@ failed: %s", url_, sqlite3_errmsg(db_));
    for (;;) {
      const int rc = sqlite3_step(statement.get());
      if (rc == SQLITE_DONE) break;
      if (rc != SQLITE_ROW) return DB_ERROR(nullptr, "sqlite3_step for %@ failed: %s", url_, sqlite3_errmsg(db_));
      const unsigned char* parent = sqlite3_column_text(statement.get(), 0);
      const unsigned char* child = sqlite3_column_text(statement.get(), 1);
      if (parent && child)
        children[reinterpret_cast<const char*>(parent)].emplace_back(reinterpret_cast<const char*>(child));
    }
  }
  Statement statement(*statements_, kSelectAll);
  if (!statement.prepared())
    return DB_ERROR(nullptr, "sqlite3_prepare(select) for %@ failed: %s", url_, sqlite3_errmsg(db_));
  QRTErrorRef result;
  for (;;) {
    const int rc = sqlite3_step(statement.get());
    if (rc == SQLITE_DONE) break;
    if (rc != SQLITE_ROW) {
      result = DB_ERROR(nullptr, "sqlite3_step for %@ failed: %s", url_, sqlite3_errmsg(db_));
      break;
    }
    std::optional<QRTCodeSigningEntry> entry = S::entryFromStatementRow(statement.get(), nullptr);
    if (!entry) continue;
    const unsigned char* text = sqlite3_column_text(statement.get(), 5);
    if (!text) {
      DB_ERROR(nullptr, "Error retrieving code_signing_id_text from DB");
      continue;
    }
    const std::string identifier(reinterpret_cast<const char*>(text));
    if (auto found = children.find(identifier); found != children.end())
      entry->childBundleIdentifiers = std::move(found->second);
    block(identifier, std::move(*entry));
  }
  return result;
}

std::optional<std::vector<std::string>> QRTSQLiteDB::childIdentifiersForParentIdentifier(const std::string& identifier,
                                                                                         QRTErrorRef* error) {
  Statement statement(*statements_, kSelectChildren);
  if (!statement.prepared()) {
    QRTSetError(error, DB_ERROR(nullptr, "sqlite3_prepare(select) for %@ failed: %s", url_, sqlite3_errmsg(db_)));
    return std::nullopt;
  }
  if (!statement.bindText(1, identifier)) {
    QRTSetError(error, DB_ERROR(nullptr, "sqlite3_bind_text for code_signing_id_text=%@ at %@ failed: %s", identifier,
                                url_, sqlite3_errmsg(db_)));
    return std::nullopt;
  }
  std::vector<std::string> children;
  for (;;) {
    const int rc = sqlite3_step(statement.get());
    if (rc == SQLITE_DONE) break;
    if (rc != SQLITE_ROW) {
      QRTSetError(error, DB_ERROR(nullptr, "sqlite3_step for %@ failed: %s", url_, sqlite3_errmsg(db_)));
      return std::nullopt;
    }
    if (const unsigned char* text = sqlite3_column_text(statement.get(), 0)) {
      children.emplace_back(reinterpret_cast<const char*>(text));
    }
  }
  if (children.empty()) {
    QRTSetError(error, QRT_ERROR(QRTErrorNotInDatabase, nullptr, false,
                                 "Children for parent identifier: \"%@\" Not Found in DB", identifier));
    return std::nullopt;
  }
  return children;
}

std::vector<std::string> QRTSQLiteDB::integrityProblems() {
  std::vector<std::string> problems;
  auto collect = [&](const char* pragma, const char* prefix) {
    sqlite3_stmt* statement = nullptr;
    if (sqlite3_prepare_v2(db_, pragma, -1, &statement, nullptr) != SQLITE_OK) {
      problems.push_back(std::string(pragma) + " " + sqlite3_errmsg(db_));
      return;
    }
    int step;
    while ((step = sqlite3_step(statement)) == SQLITE_ROW) {
      std::string row;
      for (int column = 0; column < sqlite3_column_count(statement); ++column) {
        const unsigned char* text = sqlite3_column_text(statement, column);
        row += (row.empty() ? "" : " ") + std::string(text ? reinterpret_cast<const char*>(text) : "null");
      }
      if (row != "ok") problems.push_back(prefix + row);
    }
    if (step != SQLITE_DONE) problems.push_back(std::string(pragma) + " " + sqlite3_errmsg(db_));
    sqlite3_finalize(statement);
  };
  collect("PRAGMA integrity_check;", "");
  collect("PRAGMA foreign_key_check;", "foreign key: ");
  return problems;
}
