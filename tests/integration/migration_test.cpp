// Migrations and start-up through the real daemon: the code-signing imports
// of older stores (command 24), the build-upgrade migration, the first start
// after a reboot, and a SIGKILL inside each of them.
#include <sqlite3.h>

#include <array>
#include <filesystem>
#include <functional>
#include <map>

#include "DaemonFixture.h"
#include "base/PlistCodec.h"

namespace {

constexpr const char* kGroupIDs = "com.norvane.Emplacer.GroupContainerIDs";
constexpr const char* kCachedInfo = "com.norvane.Emplacer.CachedCodeSigningInfo";
constexpr const char* kAppGroups = "com.norvane.security.application-groups";
constexpr const char* kEntitlementsKey = "com.norvane.QuarterKit.Entitlements";
constexpr const char* kPrefix = "org.legacy.";

// Class directories by path name, global and per-user.
const char* const kGlobalClassDirs[] = {"Bundle/Application", "Bundle/AddonPlugin", "Bundle/VPNPlugin",
                                        "Bundle/Framework",   "Data/System",        "Shared/SystemGroup"};
const char* const kUserClassDirs[] = {"Data/Application",  "Data/AddonPlugin",    "Data/VPNPlugin", "Shared/AppGroup",
                                      "Data/RelayService", "Data/InternalDaemon", "Data/TempDir"};

plist::Dictionary ents(const char* group) { return {{kAppGroups, strings({group})}}; }

// invalid, placeholder, registered by caller, data container class.
using Row = std::array<int64_t, 4>;

std::string text(sqlite3_stmt* s, int column) { return reinterpret_cast<const char*>(sqlite3_column_text(s, column)); }

std::string crashPointName(const ::testing::TestParamInfo<const char*>& info) {
  std::string name = *info.param ? info.param : "uninterrupted";
  for (char& c : name) c = isalnum(static_cast<unsigned char>(c)) ? c : '_';
  return name;
}

class MigrationTest : public InstallerFixture {
 protected:
  std::string containers() const { return root + "/private/var/containers"; }
  std::string mobile() const { return root + "/private/var/mobile"; }
  std::string library() const { return root + "/private/var/root/Library/QuarterKit"; }
  std::string statusFile() const { return library() + "/qrt_migration_status.plist"; }

  // Every container's metadata file by path, and its bytes.
  std::map<std::string, std::string> snapshot() const {
    std::map<std::string, std::string> files;
    auto scan = [&](const std::string& dir) {
      for (const std::string& name : listDirectory(dir)) {
        const std::string file = dir + "/" + name + "/" + kMetadataFile;
        if (exists(file)) files[file] = readFile(file);
      }
    };
    for (const char* d : kGlobalClassDirs) scan(containers() + "/" + d);
    for (const char* d : kUserClassDirs) scan(mobile() + "/Containers/" + d);
    return files;
  }
  // The container directory holding the identifier's metadata, or "".
  std::string pathOf(const std::string& identifier) const {
    for (const auto& [file, bytes] : snapshot()) {
      auto metadata = plist::parse(bytes.data(), bytes.size());
      const plist::Value* id =
          metadata && metadata->isDictionary() ? plist::find(metadata->dictionary(), "QRTMetadataIdentifier") : nullptr;
      if (id && id->isString() && id->string() == identifier) return parentOf(file);
    }
    return "";
  }
  std::optional<plist::Dictionary> infoOf(const std::string& identifier) const {
    auto metadata = readPlist(pathOf(identifier) + "/" + kMetadataFile);
    const plist::Value* info = metadata ? plist::find(*metadata, "QRTMetadataInfo") : nullptr;
    return info && info->isDictionary() ? std::optional(info->dictionary()) : std::nullopt;
  }
  // Changes a container's info dictionary on disk; the daemon must be stopped.
  void setInfo(const std::string& identifier, const std::string& key, plist::Value value) {
    const std::string file = pathOf(identifier) + "/" + kMetadataFile;
    auto metadata = readPlist(file);
    ASSERT_TRUE(metadata) << identifier;
    plist::Dictionary info = infoOf(identifier).value_or(plist::Dictionary{});
    info[key] = std::move(value);
    (*metadata)["QRTMetadataInfo"] = info;
    writePlist(file, *metadata);
  }

  // Runs sql on the store, with `bound` (when given) as its parameter.
  void query(const char* sql, const std::string& bound, const std::function<void(sqlite3_stmt*)>& body) const {
    sqlite3* db = nullptr;
    EXPECT_EQ(sqlite3_open_v2((library() + "/containers.sqlite3").c_str(), &db, SQLITE_OPEN_READONLY, nullptr),
              SQLITE_OK);
    sqlite3_stmt* statement = nullptr;
    EXPECT_EQ(sqlite3_prepare_v2(db, sql, -1, &statement, nullptr), SQLITE_OK) << sqlite3_errmsg(db);
    if (!bound.empty()) sqlite3_bind_text(statement, 1, bound.c_str(), -1, SQLITE_TRANSIENT);
    while (statement && sqlite3_step(statement) == SQLITE_ROW) body(statement);
    sqlite3_finalize(statement);
    sqlite3_close(db);
  }
  // The entries of the test's programs, and parent of each child.
  std::map<std::string, Row> rows(std::map<std::string, std::string>* children = nullptr) const {
    std::map<std::string, Row> result;
    query(
        "SELECT code_signing_id_text, invalid, placeholder, registered_by_caller, data_container_class "
        "FROM code_signing_info;",
        "", [&](sqlite3_stmt* s) {
          if (std::string id = text(s, 0); id.rfind(kPrefix, 0) == 0)
            result[id] = {sqlite3_column_int64(s, 1), sqlite3_column_int64(s, 2), sqlite3_column_int64(s, 3),
                          sqlite3_column_int64(s, 4)};
        });
    if (children) {
      query(
          "SELECT child_code_signing_id_text, code_signing_id_text FROM child_bundles JOIN code_signing_info "
          "ON parent_id = code_signing_info.id;",
          "", [&](sqlite3_stmt* s) { (*children)[text(s, 0)] = text(s, 1); });
    }
    return result;
  }
  std::optional<plist::Dictionary> storedInfo(const std::string& identifier) const {
    std::optional<plist::Dictionary> result;
    query(
        "SELECT data FROM code_signing_data JOIN code_signing_info ON cs_info_id = code_signing_info.id "
        "WHERE code_signing_id_text = ? LIMIT 1;",
        identifier, [&](sqlite3_stmt* s) {
          auto v = plist::parse(sqlite3_column_blob(s, 0), static_cast<size_t>(sqlite3_column_bytes(s, 0)));
          if (v && v->isDictionary()) result = v->dictionary();
        });
    return result;
  }

  // Containers carrying info keys and both legacy files; leaves the daemon stopped.
  void prepareLegacyStore() {
    for (const char* id : {"groups1", "groups2", "plain"}) make(501, std::string(kPrefix) + id, 2);
    make(501, "org.legacy.plugin", 4);
    for (auto [id, cls] : {std::pair{"app", 1}, {"addon", 3}, {"fw", 8}}) make(33, std::string(kPrefix) + id, cls);
    ASSERT_EQ(stopDaemon(), 0);
    setInfo("org.legacy.groups1", kGroupIDs, strings({"group.one"}));
    setInfo("org.legacy.groups2", kGroupIDs, strings({"group.two"}));
    setInfo("org.legacy.plugin", kGroupIDs, strings({"group.p"}));
    for (const char* id : {"app", "addon", "fw"})
      setInfo(std::string(kPrefix) + id, kCachedInfo, plist::Dictionary{{"Entitlements", ents(id)}, {"Team", id}});
    writePlist(library() + "/qrt_code_signing_info.plist",
               {{"org.legacy.groups2",
                 plist::Dictionary{{"CodeSigningInfo", plist::Dictionary{{kEntitlementsKey, ents("group.two")}}},
                                   {"DataContainerClass", 2}}},
                {"org.legacy.mapped",
                 plist::Dictionary{{"CodeSigningInfo", plist::Dictionary{{kEntitlementsKey, ents("group.m")}}},
                                   {"Placeholder", true},
                                   {"DataContainerClass", 4},
                                   {"ChildBundleIds", strings({"org.legacy.mapped.child"})}}},
                {"org.legacy.broken", plist::Dictionary{{"DataContainerClass", 2}}}});
    writePlist(library() + "/qrt_entitlements.plist",
               {{"org.legacy.legacy", ents("group.l")},
                {"org.legacy.selfreg", ents("group.s")},
                {"org.legacy.app", ents("group.old")},
                {"com.norvane.QuarterKit.ChildPluginBundleIDs",
                 plist::Dictionary{{"org.legacy.legacy", strings({"org.legacy.legacy.child"})}}},
                {"com.norvane.QuarterKit.EntitlementsRegisteredByCaller",
                 plist::Dictionary{{"org.legacy.selfreg", true}, {"org.legacy.legacy", false}}},
                {"com.norvane.QuarterKit.PlaceholderEntitlements", plist::Dictionary{{"org.legacy.legacy", true}}}});
  }
};

class DataMigrationTest : public MigrationTest, public ::testing::WithParamInterface<const char*> {};

TEST_P(DataMigrationTest, ImportsEveryOlderStoreOnce) {
  ASSERT_NO_FATAL_FAILURE(prepareLegacyStore());
  const std::string point = GetParam();
  if (!point.empty()) { ASSERT_NO_FATAL_FAILURE(expectKilledAt(point, QRTCommandPerformDataMigration)); }
  startDaemon();
  ASSERT_EQ(codeOf(call(QRTCommandPerformDataMigration)), 1u);

  // A second run finds both container migrations recorded and visits nothing.
  ASSERT_EQ(codeOf(call(QRTCommandPerformDataMigration)), 1u);
  ASSERT_TRUE(logContains("Legacy entitlement migration completed"));
  const std::string log = logText();
  const size_t last = log.rfind("Performing Data Migration on");
  ASSERT_NE(last, std::string::npos);
  const std::string second = log.substr(last);
  EXPECT_EQ(second.find("Performing group ID migration"), std::string::npos);
  EXPECT_EQ(second.find("Performing code signing migration"), std::string::npos);
  ASSERT_EQ(stopDaemon(), 0);

  std::map<std::string, std::string> children;
  const std::map<std::string, Row> expected{
      {"org.legacy.groups2", {0, 0, 0, 2}},  // from the mapping file; its group key only dropped
      {"org.legacy.mapped", {0, 1, 0, 4}},
      {"org.legacy.groups1", {1, 0, 0, 2}},
      {"org.legacy.plugin", {1, 0, 0, 4}},
      {"org.legacy.legacy", {1, 1, 0, 0}},
      {"org.legacy.selfreg", {0, 0, 1, 0}},
      {"org.legacy.app", {0, 0, 0, 2}},  // the bundle's valid information replaces the invalid legacy one
      {"org.legacy.addon", {0, 0, 0, 4}},
      {"org.legacy.fw", {0, 0, 0, 0}}};
  EXPECT_EQ(rows(&children), expected);
  EXPECT_EQ(children, (std::map<std::string, std::string>{{"org.legacy.mapped.child", "org.legacy.mapped"},
                                                          {"org.legacy.legacy.child", "org.legacy.legacy"}}));
  EXPECT_EQ(storedInfo("org.legacy.groups1"),
            (plist::Dictionary{{kEntitlementsKey, plist::Dictionary{{kAppGroups, strings({"group.one"})}}}}));
  EXPECT_EQ(storedInfo("org.legacy.addon"),
            (plist::Dictionary{{"Entitlements", ents("addon")}, {kEntitlementsKey, ents("addon")}, {"Team", "addon"}}));

  EXPECT_FALSE(exists(library() + "/qrt_code_signing_info.plist"));
  EXPECT_FALSE(exists(library() + "/qrt_entitlements.plist"));
  for (const char* id : {"groups1", "groups2", "plugin", "app", "addon", "fw", "plain"}) {
    auto info = infoOf(std::string(kPrefix) + id).value_or(plist::Dictionary{});
    EXPECT_FALSE(plist::find(info, kGroupIDs) || plist::find(info, kCachedInfo)) << id;
  }
  auto status = readPlist(statusFile());
  ASSERT_TRUE(status);
  EXPECT_TRUE(plist::find(*status, "GroupIdMigration"));
  EXPECT_TRUE(plist::find(*status, "CodeSigningMigration"));
  startDaemon();
}

INSTANTIATE_TEST_SUITE_P(CrashPoints, DataMigrationTest,
                         ::testing::Values("", "codesign-mapping-file-imported", "codesign-groupid-entry-added",
                                           "codesign-legacy-entitlements-imported", "codesign-cached-info-entry-added",
                                           "migrator-data-migration-owned"),
                         crashPointName);

TEST_F(MigrationTest, MappingFileWhoseEveryEntryFailsStays) {
  ASSERT_EQ(stopDaemon(), 0);
  const std::string file = library() + "/qrt_code_signing_info.plist";
  writePlist(file, {{"org.legacy.broken", plist::Dictionary{{"Invalid", true}}}});
  startDaemon();
  EXPECT_EQ(codeOf(call(QRTCommandPerformDataMigration)), 1u);
  EXPECT_TRUE(logContains("Successfully migrated 0 entries, failed to migrate 1"));
  EXPECT_TRUE(exists(file));
}

using BuildUpgradeTest = DataMigrationTest;

TEST_P(BuildUpgradeTest, RunsOncePerNewBuild) {
  Container bundle = make(33, "org.legacy.moved", 1);
  ASSERT_EQ(stopDaemon(), 0);
  auto status = readPlist(statusFile());
  ASSERT_TRUE(status && plist::find(*status, "LastBuildInfo"));
  EXPECT_EQ(plist::find(*status, "LastBuildInfo")->dictionary(),
            (plist::Dictionary{{"BuildVersion", "24A100"}, {"ReleaseType", "Internal"}}));

  // What an older system left: bundles in the user's tree, the daemon's old library and logs.
  ASSERT_EQ(rename((containers() + "/Bundle").c_str(), (mobile() + "/Containers/Bundle").c_str()), 0);
  const std::string oldLogs = mobile() + "/Library/Logs/QuarterKit";
  ASSERT_EQ(system(("mkdir -p " + oldLogs + " " + mobile() + "/Library/QuarterKit").c_str()), 0);
  for (const char* name : {"old.log", "old.log.0", "old.log.3"}) writeFile(oldLogs + "/" + name, name);
  writePlist(root + "/etc/system-version.plist", {{"BuildVersion", "24B200"}, {"ReleaseType", "Internal"}});
  reboot();
  if (*GetParam()) { ASSERT_NO_FATAL_FAILURE(expectKilledAt(GetParam(), std::nullopt)); }
  startDaemon();

  EXPECT_TRUE(logContains("Detected upgrade from 24A100 (Internal) to 24B200 (Internal)"));
  Container found = createOrLookup(33, "org.legacy.moved", 1, false);
  EXPECT_EQ(found.error, 1u);
  EXPECT_EQ(found.uuid, bundle.uuid);
  EXPECT_EQ(found.path, bundle.path);
  EXPECT_FALSE(exists(mobile() + "/Containers/Bundle"));
  const std::string logs = root + "/private/var/root/Library/Logs/QuarterKit";
  EXPECT_EQ(readFile(logs + "/old.log.1"), "old.log.0");
  EXPECT_EQ(readFile(logs + "/old.1"), "old.log");
  EXPECT_FALSE(exists(logs + "/old.log.4"));
  EXPECT_FALSE(exists(oldLogs));
  EXPECT_FALSE(exists(mobile() + "/Library/QuarterKit"));

  // The same build again, after a reboot and after a plain restart: no upgrade.
  const size_t upgrades = logCount("Detected upgrade from");
  reboot();
  restartDaemon();
  restartDaemon();
  EXPECT_TRUE(
      logContains("Current build version (24B200 / Internal) equal to last version recorded (24B200 / Internal); "
                  "skipping upgrade"));
  EXPECT_EQ(logCount("Detected upgrade from"), upgrades);
  EXPECT_EQ(plist::find(*readPlist(statusFile()), "LastBuildInfo")->dictionary().at("BuildVersion"),
            plist::Value("24B200"));
}

INSTANTIATE_TEST_SUITE_P(CrashPoints, BuildUpgradeTest,
                         ::testing::Values("", "migrator-build-upgrade-bundles-moved",
                                           "startup-build-upgrade-migrated"),
                         crashPointName);

TEST_F(MigrationTest, RebootClearsLeftoversAndInstallsBackup) {
  make(501, "org.legacy.keep", 2);
  make(501, "org.legacy.temp", 2, true);
  Container wellKnown = createOrLookup(0, "com.norvane.mapsd", 12, true, false, QRTCommandSystemContainerPath);
  ASSERT_EQ(wellKnown.error, 1u);
  ASSERT_EQ(stopDaemon(), 0);
  const auto before = snapshot();

  const std::string caches = daemonCaches();
  const std::string userTemp = mobile() + "/Library/Caches/com.norvane.quarterd/Temp";
  const std::string sysDir = containers() + "/Data/System";
  const std::string orphans[] = {appClassDir() + "/not-a-uuid", appClassDir() + "/" + QRTUUID::random().UUIDString(),
                                 sysDir + "/" + QRTUUID::random().UUIDString(), sysDir + "/com.norvane.lazyloadd"};
  const std::string backup = mobile() + "/Library/Backup/SystemContainers";
  for (const std::string& dir :
       {caches + "/Staging/left", caches + "/Temp/junk", userTemp + "/junk",
        backup + "/Data/org.legacy.restored/Library", backup + "/Shared/systemgroup.org.legacy.restored"})
    ASSERT_TRUE(std::filesystem::create_directories(dir)) << dir;
  for (const std::string& dir : orphans) ASSERT_TRUE(std::filesystem::create_directories(dir)) << dir;
  for (const std::string& dir : orphans) writeFile(dir + "/data", "x");
  writeFile(backup + "/Data/org.legacy.restored/Library/prefs", "restored");
  writeFile(backup + "/Data/org.legacy.restored/" + kMetadataFile, "hidden: not restored");
  writeFile(backup + "/Shared/systemgroup.org.legacy.restored/shared.txt", "shared");
  reboot();
  startDaemon();
  // Waits for the death-row pass that start-up queued.
  ASSERT_EQ(codeOf(call(QRTCommandDeleteContainersOnDeathRow)), 1u);

  EXPECT_TRUE(listDirectory(caches + "/Staging").empty());
  EXPECT_TRUE(listDirectory(caches + "/Temp").empty());
  EXPECT_TRUE(listDirectory(userTemp).empty());
  EXPECT_TRUE(listDirectory(deadDirectory()).empty());
  for (const std::string& dir : orphans) EXPECT_FALSE(exists(dir)) << dir;
  EXPECT_NE(createOrLookup(501, "org.legacy.temp", 2, false, true).error, 1u);
  EXPECT_FALSE(exists(backup));

  const std::string restored = pathOf("org.legacy.restored");
  ASSERT_FALSE(restored.empty());
  EXPECT_EQ(readFile(restored + "/Library/prefs"), "restored");
  EXPECT_NE(readFile(restored + "/" + kMetadataFile), "hidden: not restored");
  const std::string group = pathOf("systemgroup.org.legacy.restored");
  ASSERT_FALSE(group.empty());
  EXPECT_EQ(readFile(group + "/shared.txt"), "shared");

  // Apart from the two installed containers, the store is as it was.
  auto after = snapshot();
  after.erase(restored + "/" + kMetadataFile);
  after.erase(group + "/" + kMetadataFile);
  EXPECT_EQ(after, before);

  // A restart without a reboot leaves a bad name alone.
  ASSERT_TRUE(std::filesystem::create_directories(appClassDir() + "/bad-name"));
  restartDaemon();
  EXPECT_TRUE(exists(appClassDir() + "/bad-name"));
}

TEST_F(MigrationTest, StoreSurvivesStartUpUnchanged) {
  const std::pair<uint64_t, uint64_t> kinds[] = {{501, 2}, {501, 4}, {501, 6}, {501, 9}, {501, 10},
                                                 {33, 1},  {33, 3},  {33, 5},  {33, 8}};
  for (int i = 0; i < 30; ++i)
    for (auto [user, cls] : kinds) make(user, "org.legacy.c" + std::to_string(i), cls);
  ASSERT_EQ(stopDaemon(), 0);
  const auto before = snapshot();
  ASSERT_EQ(before.size(), 30 * std::size(kinds));
  for (bool rebooted : {true, false}) {
    if (rebooted) reboot();
    startDaemon();
    ASSERT_EQ(codeOf(call(QRTCommandDeleteContainersOnDeathRow)), 1u);
    ASSERT_EQ(stopDaemon(), 0);
    EXPECT_EQ(snapshot(), before) << (rebooted ? "after a reboot" : "after a restart");
  }
  startDaemon();
}

}  // namespace
