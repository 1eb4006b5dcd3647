#include <gtest/gtest.h>
#include <sqlite3.h>

#include "base/PlistCodec.h"
#include "Daemon/codesign/QRTSQLiteDB.h"
#include "TempDir.h"

namespace {

QRTCodeSigningEntry entryWith(const std::string& marker, std::optional<std::vector<std::string>> children = {}) {
  QRTCodeSigningEntry entry(
      plist::Dictionary{{"com.norvane.QuarterKit.Entitlements", plist::Dictionary{{"m", marker}}}});
  entry.childBundleIdentifiers = std::move(children);
  return entry;
}

class CodeSigningDBTest : public ::testing::Test {
 protected:
  void SetUp() override {
    db = QRTSQLiteDB::initWithParentDirectoryURL(QRTURL::fileURL(dir.path(), true));
    ASSERT_TRUE(db);
  }
  // Runs the statements on the file through a second connection, after the
  // daemon's is closed; the first column of the last row, or -1.
  int64_t sql(const std::string& statements) {
    db.reset();
    sqlite3* raw = nullptr;
    int64_t last = -1;
    sqlite3_open((dir / "containers.sqlite3").c_str(), &raw);
    EXPECT_EQ(sqlite3_exec(raw, statements.c_str(), lastFirstColumn, &last, nullptr), SQLITE_OK);
    sqlite3_close(raw);
    return last;
  }
  static int lastFirstColumn(void* out, int, char** values, char**) {
    *static_cast<int64_t*>(out) = atoll(values[0]);
    return 0;
  }
  bool add(const std::string& id, const QRTCodeSigningEntry& entry) {
    return db->addCodeSigningEntry(&entry, id, nullptr);
  }
  std::optional<QRTCodeSigningEntry> get(const std::string& id, int32_t* code = nullptr) {
    QRTErrorRef error;
    auto entry = db->codeSigningEntryWithIdentifier(id, &error);
    if (code) *code = error ? error->code() : 1;
    return entry;
  }

  TempDir dir;
  std::unique_ptr<QRTSQLiteDB> db;
};

TEST_F(CodeSigningDBTest, AddKeepsRowIdReplacesDataAndNeverDropsChildren) {
  ASSERT_TRUE(add("parent", entryWith("one", std::vector<std::string>{"a", "b"})));
  ASSERT_TRUE(add("other", entryWith("x", std::vector<std::string>{"c"})));
  // Again with new data, child "b" no longer listed and "c" taken from "other".
  QRTCodeSigningEntry second = entryWith("two", std::vector<std::string>{"a", "c"});
  second.invalid = true;
  second.dataContainerClass = 4;
  ASSERT_TRUE(add("parent", second));
  auto stored = get("parent");
  ASSERT_TRUE(stored);
  EXPECT_EQ(stored->codeSigningInfo, second.codeSigningInfo);
  EXPECT_TRUE(stored->invalid);
  EXPECT_EQ(stored->dataContainerClass, 4u);
  std::vector<std::string> children = *stored->childBundleIdentifiers;
  std::sort(children.begin(), children.end());
  EXPECT_EQ(children, (std::vector<std::string>{"a", "b", "c"}));
  int32_t code = 0;
  EXPECT_FALSE(get("other")->childBundleIdentifiers);
  EXPECT_FALSE(get("a", &code));  // a child without an entry of its own
  EXPECT_EQ(code, QRTErrorNotInDatabase);
  EXPECT_EQ(sql("SELECT id FROM code_signing_info WHERE code_signing_id_text='parent'"), 1);
  EXPECT_EQ(sql("SELECT count(*) FROM code_signing_data"), 2);
}

TEST_F(CodeSigningDBTest, UndecodableRowsFailLookupAndVanishFromEnumeration) {
  ASSERT_TRUE(add("good", entryWith("g")));
  ASSERT_TRUE(add("array", entryWith("a")));
  ASSERT_TRUE(add("garbage", entryWith("x")));
  ASSERT_TRUE(add("nodata", entryWith("n")));
  const plist::Data array = plist::writeBinary(plist::Array{"not", "a", "dictionary"});
  std::string hex;
  for (uint8_t b : array) hex += "0123456789abcdef"[b >> 4], hex += "0123456789abcdef"[b & 15];
  const std::string row = " WHERE cs_info_id=(SELECT id FROM code_signing_info WHERE code_signing_id_text=";
  sql("UPDATE code_signing_data SET data=x'" + hex + "'" + row + "'array'); UPDATE code_signing_data SET data=x'00ff'" +
      row + "'garbage'); DELETE FROM code_signing_data" + row + "'nodata');");
  db = QRTSQLiteDB::initWithParentDirectoryURL(QRTURL::fileURL(dir.path(), true));
  ASSERT_TRUE(db);
  for (auto [id, code] : std::vector<std::pair<const char*, int32_t>>{
           {"array", QRTErrorDatabase}, {"garbage", QRTErrorDatabase}, {"nodata", QRTErrorNotInDatabase}}) {
    int32_t got = 0;
    EXPECT_FALSE(get(id, &got)) << id;
    EXPECT_EQ(got, code) << id;
  }
  std::vector<std::string> seen;
  EXPECT_FALSE(db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
      [&](const std::string& id, const QRTCodeSigningEntry&) { seen.push_back(id); }));
  EXPECT_EQ(seen, std::vector<std::string>{"good"});
}

// Equality decides whether a registration is written again: children in
// order, the whole 64-bit class; the stored form keeps both.
TEST(CodeSigningEntryTest, EqualityAndDictionaryForm) {
  QRTCodeSigningEntry a = entryWith("m", std::vector<std::string>{"x", "y"});
  EXPECT_FALSE(a == entryWith("m", std::vector<std::string>{"y", "x"}));
  QRTCodeSigningEntry small = entryWith("m"), wide = entryWith("m");
  small.dataContainerClass = 5;
  wide.dataContainerClass = 5 + (1ull << 32);
  EXPECT_FALSE(small == wide);
  EXPECT_EQ(QRTCodeSigningEntry::fromSerializedDictionary(a.serialize()), a);
  EXPECT_EQ(QRTCodeSigningEntry::fromSerializedDictionary(wide.serialize()), wide);
  EXPECT_EQ(QRTCodeSigningEntry::fromSerializedDictionary({{"CodeSigningInfo", plist::Dictionary{}}}),
            QRTCodeSigningEntry(plist::Dictionary{}));
}

}  // namespace
