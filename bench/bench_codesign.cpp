// The code-signing database in process, against a floor that runs the same
// SELECT and the same read-then-UPDATE/INSERT OR REPLACE transaction straight
// on SQLite with statements prepared once. quarter-bench --op cs-get|cs-set
// measures the same work over the socket; divide its time per operation by
// the floor's.
// The reference counts of group containers are counted afresh from every
// stored program on each change of a program's groups; BM_GroupCounting
// times one such count over 10,000 programs in 50 groups each.
// Usage: bench_codesign [--benchmark_filter=...] (files under /var/tmp)
#include <benchmark/benchmark.h>
#include <sqlite3.h>
#include <stdlib.h>

#include <filesystem>
#include <map>
#include <string>

#include "base/PlistCodec.h"
#include "Daemon/codesign/QRTCodeSigningMapping.h"
#include "Daemon/codesign/QRTSQLiteDB.h"
#include "platform/DeviceRoot.h"
#include "platform/Log.h"

namespace {

constexpr int kPrograms = 10'000;

std::string identifier(int i) { return "com.norvane.bench.program." + std::to_string(i); }

plist::Dictionary info(int64_t sequence) {
  return {{"com.norvane.QuarterKit.Entitlements",
           plist::Dictionary{{"com.norvane.bench.sequence", plist::Value(static_cast<long long>(sequence))},
                             {"com.norvane.security.application-groups", plist::Array{"group.a", "group.b"}}}}};
}

struct Scratch {
  Scratch() {
    char dir[] = "/var/tmp/bench-codesign-XXXXXX";
    if (!mkdtemp(dir)) abort();
    path = dir;
  }
  ~Scratch() { std::filesystem::remove_all(path); }
  std::string path;
};

std::unique_ptr<QRTSQLiteDB> filledDatabase(const Scratch& scratch) {
  auto db = QRTSQLiteDB::initWithParentDirectoryURL(QRTURL::fileURL(scratch.path, true));
  for (int i = 0; i < kPrograms; ++i) {
    QRTCodeSigningEntry entry(info(0), 2);
    db->addCodeSigningEntry(&entry, identifier(i), nullptr);
  }
  return db;
}

void BM_DatabaseLookup(benchmark::State& state) {
  Scratch scratch;
  auto db = filledDatabase(scratch);
  int i = 0;
  for (auto _ : state)
    benchmark::DoNotOptimize(db->codeSigningEntryWithIdentifier(identifier(i++ % kPrograms), nullptr));
}
BENCHMARK(BM_DatabaseLookup);

void BM_DatabaseRegister(benchmark::State& state) {
  Scratch scratch;
  auto db = filledDatabase(scratch);
  int64_t sequence = 1;
  for (auto _ : state) {
    const std::string id = identifier(static_cast<int>(sequence % kPrograms));
    benchmark::DoNotOptimize(db->codeSigningEntryWithIdentifier(id, nullptr));
    QRTCodeSigningEntry entry(info(sequence++), 2);
    db->addCodeSigningEntry(&entry, id, nullptr);
  }
}
BENCHMARK(BM_DatabaseRegister);

// The floor: the same file layout through one connection, every statement
// prepared once.
class Floor {
 public:
  explicit Floor(const Scratch& scratch) {
    filledDatabase(scratch).reset();
    sqlite3_open((scratch.path + "/containers.sqlite3").c_str(), &db_);
    sqlite3_exec(db_, "PRAGMA foreign_keys = ON;PRAGMA locking_mode = EXCLUSIVE;", nullptr, nullptr, nullptr);
    prepare(&select_,
            "SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
            "code_signing_info.registered_by_caller, code_signing_info.data_container_class FROM code_signing_info, "
            "code_signing_data WHERE code_signing_info.id = code_signing_data.cs_info_id AND "
            "code_signing_info.code_signing_id_text = ?;");
    prepare(&update_,
            "UPDATE code_signing_info SET invalid=?, placeholder=?, registered_by_caller=?, data_container_class=? "
            "WHERE code_signing_id_text=?;");
    prepare(&data_,
            "INSERT OR REPLACE INTO code_signing_data (cs_info_id, data) SELECT id, ? FROM code_signing_info WHERE "
            "code_signing_id_text = ?;");
  }
  ~Floor() {
    for (sqlite3_stmt* s : {select_, update_, data_}) sqlite3_finalize(s);
    sqlite3_close(db_);
  }
  // Reads and decodes the row, as a look-up does.
  void select(const std::string& id) {
    sqlite3_bind_text(select_, 1, id.c_str(), -1, SQLITE_TRANSIENT);
    if (sqlite3_step(select_) == SQLITE_ROW) {
      benchmark::DoNotOptimize(
          plist::parse(sqlite3_column_blob(select_, 0), static_cast<size_t>(sqlite3_column_bytes(select_, 0))));
    }
    sqlite3_reset(select_);
  }
  void upsert(const std::string& id, const plist::Data& bytes) {
    sqlite3_exec(db_, "BEGIN;", nullptr, nullptr, nullptr);
    for (int column = 1; column <= 3; ++column) sqlite3_bind_int(update_, column, 0);
    sqlite3_bind_int(update_, 4, 2);
    sqlite3_bind_text(update_, 5, id.c_str(), -1, SQLITE_TRANSIENT);
    sqlite3_step(update_);
    sqlite3_reset(update_);
    sqlite3_bind_blob64(data_, 1, bytes.data(), bytes.size(), SQLITE_TRANSIENT);
    sqlite3_bind_text(data_, 2, id.c_str(), -1, SQLITE_TRANSIENT);
    sqlite3_step(data_);
    sqlite3_reset(data_);
    sqlite3_exec(db_, "COMMIT;", nullptr, nullptr, nullptr);
  }

 private:
  void prepare(sqlite3_stmt** statement, const char* sql) { sqlite3_prepare_v2(db_, sql, -1, statement, nullptr); }
  sqlite3* db_ = nullptr;
  sqlite3_stmt* select_ = nullptr;
  sqlite3_stmt* update_ = nullptr;
  sqlite3_stmt* data_ = nullptr;
};

void BM_FloorLookup(benchmark::State& state) {
  Scratch scratch;
  Floor floor(scratch);
  int i = 0;
  for (auto _ : state) floor.select(identifier(i++ % kPrograms));
}
BENCHMARK(BM_FloorLookup);

void BM_FloorRegister(benchmark::State& state) {
  Scratch scratch;
  Floor floor(scratch);
  int64_t sequence = 1;
  for (auto _ : state) {
    const std::string id = identifier(static_cast<int>(sequence % kPrograms));
    floor.select(id);
    floor.upsert(id, plist::writeBinary(plist::Value(info(sequence++))));
  }
}
BENCHMARK(BM_FloorRegister);

plist::Array groupsOf(int program, int shift = 0) {
  plist::Array groups;
  for (int g = 0; g < 50; ++g) groups.emplace_back("group.bench." + std::to_string((program + g * 7 + shift) % 500));
  return groups;
}

plist::Dictionary groupInfo(plist::Array groups) {
  return {{"com.norvane.QuarterKit.Entitlements",
           plist::Dictionary{{"com.norvane.security.application-groups", std::move(groups)}}}};
}

// 10,000 programs, each in 50 of 500 groups, in the mapping of a fresh
// device root (the mapping is the process's one instance).
QRTCodeSigningMapping* groupMapping() {
  static Scratch root;
  static QRTCodeSigningMapping* mapping = [] {
    const std::string library = root.path + "/private/var/root/Library/QuarterKit";
    std::filesystem::create_directories(library);
    auto db = QRTSQLiteDB::initWithParentDirectoryURL(QRTURL::fileURL(library, true));
    for (int i = 0; i < kPrograms; ++i) {
      QRTCodeSigningEntry entry(groupInfo(groupsOf(i)));
      db->addCodeSigningEntry(&entry, identifier(i), nullptr);
    }
    db.reset();
    platform::setDeviceRoot(root.path);
    return QRTCodeSigningMapping::sharedInstance();
  }();
  return mapping;
}

// One fresh count over all stored programs, what every change of a
// program's groups cost before the counts were kept.
void BM_GroupCounting(benchmark::State& state) {
  QRTCodeSigningMapping* mapping = groupMapping();
  for (auto _ : state) {
    std::map<std::string, int64_t> counts;
    mapping->iterateGroupIdsWithKey(QRTApplicationGroupsEntitlement, std::nullopt,
                                    [&](const std::string&, const QRTGroupList& groups) {
                                      for (const std::string& g : groups.value_or(std::vector<std::string>{}))
                                        ++counts[g];
                                    });
    benchmark::DoNotOptimize(counts);
  }
}
BENCHMARK(BM_GroupCounting)->Unit(benchmark::kMillisecond);

// A program moves to other groups: the counts decide which of its old groups
// lose their last program (none here, so nothing is deleted).
void BM_GroupChange(benchmark::State& state) {
  QRTCodeSigningMapping* mapping = groupMapping();
  int shift = 0;
  for (auto _ : state) {
    const plist::Dictionary info = groupInfo(groupsOf(0, ++shift % 2));
    benchmark::DoNotOptimize(mapping->processCodeSigningInfo(&info, identifier(0), nullptr));
  }
}
BENCHMARK(BM_GroupChange)->Unit(benchmark::kMillisecond);

// The look-ups each program start and the look-up command make, on the
// mapping of 10,000 programs: the data class (the upcall's) and the whole
// code-signing dictionary (command 19's; 50 groups against the floor's 2).
void BM_MappingDataClass(benchmark::State& state) {
  QRTCodeSigningMapping* mapping = groupMapping();
  int i = 0;
  for (auto _ : state) benchmark::DoNotOptimize(mapping->dataContainerTypeForIdentifier(identifier(i++ % kPrograms)));
}
BENCHMARK(BM_MappingDataClass)->ThreadRange(1, 8)->UseRealTime();

void BM_MappingLookup(benchmark::State& state) {
  QRTCodeSigningMapping* mapping = groupMapping();
  int i = 0;
  for (auto _ : state) benchmark::DoNotOptimize(mapping->getCodeSigningInfoForIdentifier(identifier(i++ % kPrograms)));
}
BENCHMARK(BM_MappingLookup)->ThreadRange(1, 8)->UseRealTime();

}  // namespace

int main(int argc, char** argv) {
  platform::logSetLevel(platform::kLogNotice);
  benchmark::Initialize(&argc, argv);
  benchmark::RunSpecifiedBenchmarks();
  return 0;
}
