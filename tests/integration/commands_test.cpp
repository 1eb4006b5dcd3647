// The container commands through the real daemon: what each one answers,
// what it changes on disk, and the codes a client can provoke.
#include <dirent.h>
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <fstream>
#include <map>
#include <set>
#include <sstream>
#include <tuple>
#include <vector>

#include "DaemonFixture.h"
#include "base/PlistCodec.h"
#include "base/QRTUUID.h"

namespace {

const char* kAllowed = "com.norvane.private.QuarterKit.allowed";
const char* kWipe = "com.norvane.private.QuarterKit.wipeContainer";
const char* kMetadataFile = ".com.norvane.quarter_kit.metadata.plist";
const std::set<std::string> kFreshDataContainer{kMetadataFile,    "Documents",           "Library",
                                                "Library/Caches", "Library/Preferences", "tmp"};

struct Container {
  uint64_t error = 0;
  uint64_t user = 0;
  uint64_t cls = 0;
  std::string identifier;
  std::string path;
  QRTUUID uuid;
};

plist::Data uuidData(const QRTUUID& uuid) { return plist::Data(uuid.bytes().begin(), uuid.bytes().end()); }

uint64_t codeOf(const plist::Dictionary& reply) {
  const plist::Value* v = plist::find(reply, "ReplyError");
  return v && v->isInteger() ? v->integer().asUnsigned() : 0;
}

void writeFile(const std::string& path, const std::string& text) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << text;
}

bool exists(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0;
}

std::vector<std::string> listDirectory(const std::string& path) {
  std::vector<std::string> names;
  if (DIR* dir = opendir(path.c_str())) {
    while (dirent* entry = readdir(dir)) {
      std::string name = entry->d_name;
      if (name != "." && name != "..") names.push_back(name);
    }
    closedir(dir);
  }
  return names;
}

// Every entry below base, as paths relative to it.
void collectTree(const std::string& base, const std::string& relative, std::set<std::string>* out) {
  for (const std::string& name : listDirectory(relative.empty() ? base : base + "/" + relative)) {
    std::string child = relative.empty() ? name : relative + "/" + name;
    out->insert(child);
    struct stat st;
    if (lstat((base + "/" + child).c_str(), &st) == 0 && S_ISDIR(st.st_mode)) collectTree(base, child, out);
  }
}

std::set<std::string> tree(const std::string& base) {
  std::set<std::string> entries;
  collectTree(base, "", &entries);
  return entries;
}

// Allocated bytes of every non-directory below base, each inode once.
uint64_t allocatedBytes(const std::string& base) {
  uint64_t total = 0;
  std::set<std::pair<dev_t, ino_t>> seen;
  for (const std::string& entry : tree(base)) {
    struct stat st;
    if (lstat((base + "/" + entry).c_str(), &st) != 0 || S_ISDIR(st.st_mode)) continue;
    if (seen.insert({st.st_dev, st.st_ino}).second) total += static_cast<uint64_t>(st.st_blocks) * 512;
  }
  return total;
}

std::string baseName(const std::string& path) { return path.substr(path.rfind('/') + 1); }
std::string parentOf(const std::string& path) { return path.substr(0, path.rfind('/')); }

std::string readLink(const std::string& path) {
  char target[4096];
  ssize_t n = readlink(path.c_str(), target, sizeof target);
  return n > 0 ? std::string(target, static_cast<size_t>(n)) : std::string();
}

std::optional<plist::Dictionary> readPlist(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream bytes;
  bytes << in.rdbuf();
  std::string data = bytes.str();
  auto value = plist::parse(data.data(), data.size());
  if (!value || !value->isDictionary()) return std::nullopt;
  return value->dictionary();
}

bool setImmutable(const std::string& path, bool on) {
  int fd = open(path.c_str(), O_RDONLY | O_DIRECTORY);
  if (fd < 0) return false;
  int flags = 0;
  bool ok = ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0;
  flags = on ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
  ok = ok && ioctl(fd, FS_IOC_SETFLAGS, &flags) == 0;
  close(fd);
  return ok;
}

struct CodeCase {
  const char* what;
  uint64_t command;
  plist::Dictionary keys;
  uint64_t expected;
};

// Lenient readers of a reply: a missing or mistyped key fails the check that
// uses it instead of crashing the test run.
std::string stringAt(const plist::Dictionary& reply, const char* key) {
  const plist::Value* v = plist::find(reply, key);
  return v && v->isString() ? v->string() : std::string("<no ") + key + ">";
}

std::optional<uint64_t> u64At(const plist::Dictionary& reply, const char* key) {
  const plist::Value* v = plist::find(reply, key);
  return v && v->isInteger() ? std::optional<uint64_t>(v->integer().asUnsigned()) : std::nullopt;
}

std::optional<bool> boolAt(const plist::Dictionary& reply, const char* key) {
  const plist::Value* v = plist::find(reply, key);
  return v && v->isBoolean() ? std::optional<bool>(v->boolean()) : std::nullopt;
}

const plist::Array* arrayAt(const plist::Dictionary& reply, const char* key) {
  const plist::Value* v = plist::find(reply, key);
  return v ? v->arrayIf() : nullptr;
}

class CommandTest : public DaemonFixture {
 protected:
  void SetUp() override {
    DaemonFixture::SetUp();
    if (!HasFatalFailure()) setOwnIdentity("com.example.installer", {{kAllowed, true}});
  }

  plist::Dictionary call(uint64_t command, plist::Dictionary keys = {}) {
    auto connection = connect();
    if (!connection) return {};
    auto reply = connection->call(request(command, std::move(keys)), std::chrono::seconds(30));
    EXPECT_TRUE(reply) << "no reply to command " << command;
    return reply.value_or(plist::Dictionary{});
  }

  // Command 0; the UUID is only meaningful when error is 1.
  Container lookup(uint64_t user, const std::string& identifier, uint64_t cls, bool create = false,
                   bool transient = false) {
    plist::Dictionary reply = call(0, {{"UserID", user}, {"ContainerClass", cls}, {"Identifier", identifier},
                                       {"CreateIfNecessary", create}, {"Transient", transient}});
    Container c{codeOf(reply), user, cls, identifier, "", QRTUUID()};
    if (auto* v = plist::find(reply, "ReplyPath"); v && v->isString()) c.path = v->string();
    if (auto* v = plist::find(reply, "ReplyUUID"); v && v->isData()) {
      c.uuid = QRTUUID::fromBytes(v->data().data(), v->data().size()).value_or(QRTUUID());
    }
    return c;
  }

  Container make(uint64_t user, const std::string& identifier, uint64_t cls, bool transient = false) {
    Container c = lookup(user, identifier, cls, true, transient);
    EXPECT_EQ(c.error, 1u) << identifier;
    return c;
  }

  // The keys that name one container to commands 5 to 9 and 23.
  static plist::Dictionary selector(const Container& c) {
    return {{"UserID", c.user}, {"ContainerClass", c.cls}, {"Identifier", c.identifier}, {"UUID", uuidData(c.uuid)}};
  }

  static plist::Dictionary with(plist::Dictionary keys, const plist::Dictionary& more) {
    for (const auto& [key, value] : more) keys[key] = value;
    return keys;
  }

  static plist::Dictionary without(plist::Dictionary keys, const std::string& key) {
    keys.erase(key);
    return keys;
  }

  void expectCodes(const std::vector<CodeCase>& cases) {
    for (const CodeCase& c : cases) EXPECT_EQ(codeOf(call(c.command, c.keys)), c.expected) << c.what;
  }

  // A death-row pass queued earlier (the start-up clean-up's) has ended once
  // this one answers: passes run one after the other.
  void settleDeathRow() { EXPECT_EQ(codeOf(call(4)), 1u); }

  std::string deadDirectory() const { return root + "/private/var/root/Library/Caches/com.norvane.quarterd/Dead"; }
  std::string mapping(const std::string& identifier) const {
    return root + "/run/sandbox/mappings/501/1/" + identifier;
  }
};

TEST_F(CommandTest, CallersWithoutTheMasterEntitlementAreRefused) {
  setOwnIdentity("com.example.lookup", {{"com.norvane.private.QuarterKit.otherIdLookup", true}});
  for (uint64_t command : {1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 12, 22, 23}) {
    EXPECT_EQ(codeOf(call(command, {{"UserID", 501u}, {"ContainerClass", 2u}})), 55u) << command;
  }
}

TEST_F(CommandTest, ContainersForUserListsIdentifiersAndUUIDsInStep) {
  std::map<std::string, QRTUUID> made;
  for (const char* id : {"com.example.a", "com.example.b", "com.example.c"}) made[id] = make(501, id, 2).uuid;
  Container temporary = make(501, "com.example.temp", 2, true);

  plist::Dictionary reply = call(1, {{"UserID", 501u}, {"ContainerClass", 2u}});
  ASSERT_EQ(codeOf(reply), 1u);
  ASSERT_TRUE(arrayAt(reply, "ReplyIdsArray") && arrayAt(reply, "ReplyUUIDsArray"));
  const plist::Array& ids = *arrayAt(reply, "ReplyIdsArray");
  const plist::Array& uuids = *arrayAt(reply, "ReplyUUIDsArray");
  ASSERT_EQ(ids.size(), 3u);
  ASSERT_EQ(uuids.size(), 3u);
  for (size_t i = 0; i < ids.size(); ++i) {
    ASSERT_TRUE(made.count(ids[i].string())) << ids[i].string();
    EXPECT_EQ(uuids[i].data(), uuidData(made[ids[i].string()])) << ids[i].string();
    made.erase(ids[i].string());
  }

  reply = call(1, {{"UserID", 501u}, {"ContainerClass", 2u}, {"Transient", true}});
  ASSERT_EQ(codeOf(reply), 1u);
  ASSERT_TRUE(arrayAt(reply, "ReplyIdsArray") && arrayAt(reply, "ReplyUUIDsArray"));
  EXPECT_EQ(*arrayAt(reply, "ReplyIdsArray"), plist::Array{"com.example.temp"});
  EXPECT_EQ(*arrayAt(reply, "ReplyUUIDsArray"), plist::Array{uuidData(temporary.uuid)});

  reply = call(1, {{"UserID", 501u}, {"ContainerClass", 6u}});
  EXPECT_EQ(codeOf(reply), 1u);
  ASSERT_TRUE(arrayAt(reply, "ReplyIdsArray") && arrayAt(reply, "ReplyUUIDsArray"));
  EXPECT_TRUE(arrayAt(reply, "ReplyIdsArray")->empty());
  EXPECT_TRUE(arrayAt(reply, "ReplyUUIDsArray")->empty());

  expectCodes({
      // User 1 passes the user check for any class, so the class itself is refused.
      {"class 14", 1, {{"UserID", 1u}, {"ContainerClass", 14u}}, 11},
      {"bundle class for user 501", 1, {{"UserID", 501u}, {"ContainerClass", 1u}}, 38},
  });
  reply = call(1, {{"UserID", 501u}, {"ContainerClass", 1u}});
  EXPECT_EQ(plist::find(reply, "ReplyIdsArray"), nullptr);
}

TEST_F(CommandTest, InfoValuesRoundTripAndSurviveARestart) {
  Container app = make(501, "com.example.app", 2);
  const std::vector<std::pair<std::string, plist::Value>> values{
      {"text", "hello"},
      {"number", -7},
      {"big", uint64_t{1} << 40},
      {"bytes", plist::Data{0, 1, 2, 255}},
      {"nested", plist::Dictionary{{"list", plist::Array{"x", true, 3}}, {"inner", plist::Dictionary{{"k", "v"}}}}},
  };
  for (const auto& [key, value] : values) {
    ASSERT_EQ(codeOf(call(5, with(selector(app), {{"Key", key}, {"Value", value}}))), 1u) << key;
  }
  auto expectValues = [&] {
    for (const auto& [key, value] : values) {
      plist::Dictionary reply = call(6, with(selector(app), {{"Key", key}}));
      EXPECT_EQ(codeOf(reply), 1u) << key;
      const plist::Value* got = plist::find(reply, "ReplyInfoValue");
      ASSERT_TRUE(got) << key;
      EXPECT_EQ(*got, value) << key;
    }
  };
  expectValues();
  auto onDisk = readPlist(app.path + "/" + kMetadataFile);
  ASSERT_TRUE(onDisk);
  EXPECT_EQ(onDisk->size(), 5u) << "the info dictionary joins the four identity keys";

  int status = stopDaemon();
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  startDaemon();
  expectValues();

  // A request without "Value" removes the key.
  ASSERT_EQ(codeOf(call(5, with(selector(app), {{"Key", "text"}}))), 1u);
  plist::Dictionary reply = call(6, with(selector(app), {{"Key", "text"}}));
  EXPECT_EQ(codeOf(reply), 24u);
  EXPECT_EQ(plist::find(reply, "ReplyInfoValue"), nullptr);

  Container stranger = app;
  stranger.uuid = QRTUUID::random();
  expectCodes({
      {"set without key", 5, with(selector(app), {{"Value", "v"}}), 38},
      {"get without key", 6, selector(app), 38},
      {"key never set", 6, with(selector(app), {{"Key", "never"}}), 24},
      {"set on unknown UUID", 5, with(selector(stranger), {{"Key", "k"}, {"Value", "v"}}), 21},
      {"get on unknown UUID", 6, with(selector(stranger), {{"Key", "number"}}), 21},
      {"set without UUID", 5, without(with(selector(app), {{"Key", "k"}, {"Value", "v"}}), "UUID"), 11},
      {"get without UUID", 6, without(with(selector(app), {{"Key", "number"}}), "UUID"), 11},
      {"user check", 6, with(selector(app), {{"Key", "number"}, {"ContainerClass", 1u}}), 38},
  });
}

TEST_F(CommandTest, MetadataRepliesPathTransienceAndInfoOnRequest) {
  Container app = make(501, "com.example.app", 2);
  Container temporary = make(501, "com.example.temp", 2, true);

  plist::Dictionary reply = call(7, with(selector(app), {{"InfoDictRequested", true}}));
  ASSERT_EQ(codeOf(reply), 1u);
  EXPECT_EQ(stringAt(reply, "ReplyPath"), app.path);
  EXPECT_EQ(boolAt(reply, "ReplyTransient"), false);
  EXPECT_EQ(plist::find(reply, "ReplyInfoDictionary"), nullptr) << "no info yet";

  ASSERT_EQ(codeOf(call(5, with(selector(app), {{"Key", "k"}, {"Value", "v"}}))), 1u);
  reply = call(7, selector(app));
  EXPECT_EQ(plist::find(reply, "ReplyInfoDictionary"), nullptr) << "not requested";
  reply = call(7, with(selector(app), {{"InfoDictRequested", true}}));
  ASSERT_TRUE(plist::find(reply, "ReplyInfoDictionary"));
  EXPECT_EQ(*plist::find(reply, "ReplyInfoDictionary"), plist::Value(plist::Dictionary{{"k", "v"}}));

  reply = call(7, selector(temporary));
  ASSERT_EQ(codeOf(reply), 1u);
  EXPECT_EQ(stringAt(reply, "ReplyPath"), temporary.path);
  EXPECT_EQ(boolAt(reply, "ReplyTransient"), true);

  Container stranger = app;
  stranger.uuid = QRTUUID::random();
  reply = call(7, selector(stranger));
  EXPECT_EQ(codeOf(reply), 21u);
  EXPECT_EQ(plist::find(reply, "ReplyPath"), nullptr);
  EXPECT_EQ(codeOf(call(7, without(selector(app), "UUID"))), 11u);
}

TEST_F(CommandTest, RecreateBringsBackRemovedDefaultDirectories) {
  Container app = make(501, "com.example.app", 2);
  writeFile(app.path + "/Documents/keep.txt", "mine");
  for (uint64_t command : {8, 22}) {
    ASSERT_EQ(system(("rm -rf " + app.path + "/Library/Caches " + app.path + "/tmp").c_str()), 0);
    ASSERT_EQ(codeOf(call(command, selector(app))), 1u) << command;
    for (const char* sub : {"/Library/Caches", "/tmp"}) {
      struct stat st {};
      ASSERT_EQ(stat((app.path + sub).c_str(), &st), 0) << command << sub;
      EXPECT_EQ(st.st_uid, 501u) << command << sub;
      EXPECT_EQ(st.st_mode & 07777, 0755u) << command << sub;
    }
    EXPECT_TRUE(exists(app.path + "/Documents/keep.txt")) << command;
  }

  // A system container gets its sealed sub-directories back.
  ASSERT_EQ(codeOf(call(15, {{"Identifier", "com.norvane.mapsd"}})), 1u);
  Container system = lookup(499, "com.norvane.mapsd", 12);
  ASSERT_EQ(system.error, 1u);
  ASSERT_EQ(rmdir((system.path + "/Library/Caches").c_str()), 0);
  ASSERT_EQ(codeOf(call(8, selector(system))), 1u);
  struct stat st {};
  ASSERT_EQ(stat((system.path + "/Library/Caches").c_str(), &st), 0);
  // The group bits show the ACL mask, which leaves the systemusers entry whole.
  EXPECT_EQ(st.st_mode & 0707, 0u);
  EXPECT_EQ(st.st_uid, 4294967294u);
  EXPECT_GT(getxattr((system.path + "/Library/Caches").c_str(), "system.posix_acl_access", nullptr, 0), 0);
  EXPECT_GT(getxattr((system.path + "/Library/Caches").c_str(), "system.posix_acl_default", nullptr, 0), 0);

  Container stranger = app;
  stranger.uuid = QRTUUID::random();
  expectCodes({
      {"unknown UUID", 8, selector(stranger), 21},
      {"unknown UUID", 22, selector(stranger), 21},
      {"no UUID", 22, without(selector(app), "UUID"), 11},
  });
}

TEST_F(CommandTest, RegenerateDirectoryUUIDMovesTheContainerOnly) {
  Container app = make(501, "com.example.app", 2);
  writeFile(app.path + "/Documents/note.txt", "moves along");
  ASSERT_EQ(codeOf(call(9, selector(app))), 1u);

  Container after = lookup(501, "com.example.app", 2);
  ASSERT_EQ(after.error, 1u);
  EXPECT_EQ(after.uuid, app.uuid);
  EXPECT_NE(after.path, app.path);
  std::string parent = parentOf(app.path);
  ASSERT_EQ(after.path.rfind(parent + "/", 0), 0u) << after.path;
  std::string name = after.path.substr(parent.size() + 1);
  auto directoryUUID = QRTUUID::fromString(name);
  ASSERT_TRUE(directoryUUID) << name;
  EXPECT_EQ(directoryUUID->UUIDString(), name);
  EXPECT_NE(*directoryUUID, app.uuid);
  EXPECT_FALSE(exists(app.path));
  EXPECT_TRUE(exists(after.path + "/Documents/note.txt"));
  auto onDisk = readPlist(after.path + "/" + kMetadataFile);
  ASSERT_TRUE(onDisk);
  EXPECT_EQ(stringAt(*onDisk, "QRTMetadataUUID"), app.uuid.UUIDString());
  EXPECT_EQ(readLink(mapping("com.example.app")), after.path);
  EXPECT_EQ(stringAt(call(7, selector(app)), "ReplyPath"), after.path);

  // A container under its well-known name keeps it.
  plist::Dictionary reply = call(15, {{"Identifier", "com.norvane.mapsd"}});
  ASSERT_EQ(codeOf(reply), 1u);
  std::string wellKnownPath = stringAt(reply, "ReplyPath");
  Container system = lookup(499, "com.norvane.mapsd", 12);
  ASSERT_EQ(system.error, 1u);
  EXPECT_EQ(codeOf(call(9, selector(system))), 11u);
  EXPECT_TRUE(logContains("Non-UUID last path component: com.norvane.mapsd"));
  EXPECT_TRUE(exists(wellKnownPath + "/" + kMetadataFile));
  EXPECT_EQ(lookup(499, "com.norvane.mapsd", 12).path, wellKnownPath);

  Container stranger = app;
  stranger.uuid = QRTUUID::random();
  expectCodes({
      {"unknown UUID", 9, selector(stranger), 21},
      {"no UUID", 9, without(selector(app), "UUID"), 11},
  });
}

TEST_F(CommandTest, DeleteStagesOnDeathRowUntilAPassRuns) {
  settleDeathRow();
  Container app = make(501, "com.example.app", 2);
  writeFile(app.path + "/Documents/data.txt", "doomed");
  plist::Dictionary keys{{"UserID", 501u}, {"ContainerClass", 2u}, {"Identifier", "com.example.app"}};

  // "Transient" is passed on: no transient container of the identifier exists.
  EXPECT_EQ(codeOf(call(10, with(keys, {{"Transient", true}}))), 21u);
  EXPECT_EQ(lookup(501, "com.example.app", 2).error, 1u);
  EXPECT_EQ(codeOf(call(10, with(keys, {{"ContainerClass", 1u}}))), 38u);

  ASSERT_EQ(codeOf(call(10, keys)), 1u);
  EXPECT_EQ(lookup(501, "com.example.app", 2).error, 21u);
  EXPECT_FALSE(exists(app.path));
  EXPECT_FALSE(exists(mapping("com.example.app")));
  EXPECT_TRUE(exists(deadDirectory() + "/" + baseName(app.path) + "/Documents/data.txt"));

  EXPECT_EQ(codeOf(call(4)), 1u);
  EXPECT_TRUE(listDirectory(deadDirectory()).empty());

  EXPECT_EQ(codeOf(call(10, keys)), 21u);
  EXPECT_TRUE(logContains("Failed to lookup existing container to delete-identifier: com.example.app"));
}

TEST_F(CommandTest, StageForDeleteTakesParallelArrays) {
  settleDeathRow();
  Container a = make(501, "com.example.a", 2);
  Container b = make(501, "com.example.b", 4);
  Container c = make(501, "com.example.c", 2);
  Container d = make(501, "com.example.d", 2);

  // Valid entries around invalid ones: a class out of range, a non-string
  // identifier, a container that does not exist.
  plist::Dictionary reply = call(3, {
      {"ContainerClassesArray", plist::Array{2u, 14u, 2u, 2u, 4u}},
      {"UserIDsArray", plist::Array{501u, 1u, 501u, 501u, 501u}},
      {"UUIDsArray", plist::Array{uuidData(a.uuid), uuidData(c.uuid), uuidData(c.uuid), uuidData(QRTUUID::random()),
                                  uuidData(b.uuid)}},
      {"IdentifiersArray", plist::Array{"com.example.a", "com.example.c", 42, "com.example.none", "com.example.b"}},
  });
  EXPECT_EQ(codeOf(reply), 1u);
  EXPECT_EQ(lookup(501, "com.example.a", 2).error, 21u);
  EXPECT_EQ(lookup(501, "com.example.b", 4).error, 21u);
  EXPECT_EQ(lookup(501, "com.example.c", 2).error, 1u);
  std::vector<std::string> dead = listDirectory(deadDirectory());
  EXPECT_EQ(std::set<std::string>(dead.begin(), dead.end()),
            (std::set<std::string>{baseName(a.path), baseName(b.path)}));

  const plist::Dictionary one{{"ContainerClassesArray", plist::Array{2u}},
                              {"UserIDsArray", plist::Array{501u}},
                              {"UUIDsArray", plist::Array{uuidData(c.uuid)}},
                              {"IdentifiersArray", plist::Array{"com.example.c"}}};
  expectCodes({
      {"more classes than UUIDs", 3, with(one, {{"ContainerClassesArray", plist::Array{2u, 2u}}}), 11},
      {"more identifiers than UUIDs", 3, with(one, {{"IdentifiersArray", plist::Array{"x", "y"}}}), 11},
      {"fewer user ids than classes", 3, with(one, {{"UserIDsArray", plist::Array{}}}), 40},
      {"user check", 3, with(one, {{"ContainerClassesArray", plist::Array{1u}}}), 38},
  });
  EXPECT_EQ(lookup(501, "com.example.c", 2).error, 1u) << "refused requests stage nothing";

  EXPECT_EQ(codeOf(call(3, with(one, {{"IdentifiersArray", "com.example.c"}}))), 11u);
  EXPECT_TRUE(logContains("Got non-Array input for the identifiers array"));
  EXPECT_EQ(lookup(501, "com.example.c", 2).error, 1u);

  // Extra user ids have no class to be checked against; the daemon survives them.
  reply = call(3, with(one, {{"UUIDsArray", plist::Array{uuidData(d.uuid)}},
                             {"IdentifiersArray", plist::Array{"com.example.d"}},
                             {"UserIDsArray", plist::Array{501u, 7u, "x", 501u}}}));
  EXPECT_NE(codeOf(reply), 0u);
  EXPECT_EQ(lookup(501, "com.example.c", 2).error, 1u);

  EXPECT_EQ(codeOf(call(3)), 1u) << "nothing to stage";
}

TEST_F(CommandTest, DeathRowMovesWhatItCannotRemoveToTmp) {
  settleDeathRow();
  std::string dead = deadDirectory();
  for (const std::string& dir : {root + "/tmp", dead + "/temp.ABC123/gone", dead + "/stuck/locked", dead + "/.hidden"}) {
    ASSERT_EQ(system(("mkdir -p " + dir).c_str()), 0) << dir;
  }
  writeFile(dead + "/temp.ABC123/gone/file", "x");
  writeFile(dead + "/stuck/locked/file", "x");
  writeFile(dead + "/stuck/loose", "x");
  // Nothing can be unlinked inside an immutable directory, nor the directory itself.
  ASSERT_TRUE(setImmutable(dead + "/stuck/locked", true));

  EXPECT_EQ(codeOf(call(4)), 1u);
  bool movedAside = exists(root + "/tmp/stuck/locked/file");
  setImmutable(root + "/tmp/stuck/locked", false);
  setImmutable(dead + "/stuck/locked", false);
  EXPECT_TRUE(movedAside);
  EXPECT_EQ(listDirectory(dead), std::vector<std::string>{".hidden"});
  EXPECT_TRUE(logContains("Couldn't remove, so moving item to /tmp"));

  // A second pass finds nothing to do.
  EXPECT_EQ(codeOf(call(4)), 1u);
}

TEST_F(CommandTest, WipeAddonDataFollowsTheEntitledList) {
  Container addon = make(501, "com.example.addon", 4);
  Container other = make(501, "com.example.other", 4);
  writeFile(addon.path + "/Documents/old.txt", "old");
  writeFile(other.path + "/Documents/old.txt", "old");

  setOwnIdentity("com.example.wiper", {{kWipe, plist::Array{"com.example.addon", 7, "com.example.absent"}}});
  // The class of the request does not matter: the wipe is always of class 4.
  plist::Dictionary reply = call(11, {{"UserID", 501u}, {"ContainerClass", 2u}, {"Identifier", "com.example.addon"}});
  EXPECT_EQ(codeOf(reply), 1u);
  Container after = lookup(501, "com.example.addon", 4);
  ASSERT_EQ(after.error, 1u);
  EXPECT_EQ(after.path, addon.path);
  EXPECT_EQ(after.uuid, addon.uuid);
  EXPECT_EQ(tree(after.path), kFreshDataContainer);

  expectCodes({
      {"not in the list", 11, {{"UserID", 501u}, {"ContainerClass", 4u}, {"Identifier", "com.example.other"}}, 55},
      {"listed but missing", 11, {{"UserID", 501u}, {"ContainerClass", 4u}, {"Identifier", "com.example.absent"}}, 21},
      {"no identifier", 11, {{"UserID", 501u}, {"ContainerClass", 4u}}, 18},
  });
  EXPECT_TRUE(logContains("Not entitled to wipe container with identifier: com.example.other"));
  EXPECT_TRUE(exists(other.path + "/Documents/old.txt"));

  // The master entitlement without a list wipes nothing through this command.
  setOwnIdentity("com.example.installer", {{kAllowed, true}});
  EXPECT_EQ(codeOf(call(11, {{"UserID", 501u}, {"Identifier", "com.example.other"}})), 55u);
  EXPECT_TRUE(exists(other.path + "/Documents/old.txt"));
}

TEST_F(CommandTest, WipeDataContainerKeepsIdentityAndPath) {
  Container app = make(501, "com.example.app", 2);
  writeFile(app.path + "/Documents/old.txt", "old");
  writeFile(app.path + "/Library/Preferences/prefs.plist", "old");

  ASSERT_EQ(codeOf(call(12, {{"UserID", 501u}, {"ContainerClass", 2u}, {"Identifier", "com.example.app"}})), 1u);
  Container after = lookup(501, "com.example.app", 2);
  ASSERT_EQ(after.error, 1u);
  EXPECT_EQ(after.path, app.path);
  EXPECT_EQ(after.uuid, app.uuid);
  EXPECT_EQ(tree(after.path), kFreshDataContainer);
  auto onDisk = readPlist(after.path + "/" + kMetadataFile);
  ASSERT_TRUE(onDisk);
  EXPECT_EQ(stringAt(*onDisk, "QRTMetadataUUID"), app.uuid.UUIDString()) << "the UUID must survive a restart";
  EXPECT_EQ(listDirectory(parentOf(app.path)).size(), 1u);
  EXPECT_EQ(readLink(mapping("com.example.app")), app.path);

  ASSERT_EQ(codeOf(call(15, {{"Identifier", "com.norvane.mapsd"}})), 1u);
  make(33, "com.example.bundle", 1);
  expectCodes({
      {"system class", 12, {{"UserID", 499u}, {"ContainerClass", 12u}, {"Identifier", "com.norvane.mapsd"}}, 11},
      {"bundle class", 12, {{"UserID", 33u}, {"ContainerClass", 1u}, {"Identifier", "com.example.bundle"}}, 11},
      {"missing", 12, {{"UserID", 501u}, {"ContainerClass", 2u}, {"Identifier", "com.example.none"}}, 21},
      {"no identifier", 12, {{"UserID", 501u}, {"ContainerClass", 2u}}, 18},
      {"user check", 12, {{"UserID", 501u}, {"ContainerClass", 1u}, {"Identifier", "com.example.app"}}, 38},
  });
}

TEST_F(CommandTest, DiskUsageCountsAllocatedBytesOnce) {
  Container app = make(501, "com.example.app", 2);
  writeFile(app.path + "/Documents/big", std::string(20000, 'a'));
  writeFile(app.path + "/tmp/small", "b");
  ASSERT_EQ(link((app.path + "/Documents/big").c_str(), (app.path + "/Library/big-link").c_str()), 0);
  ASSERT_EQ(symlink("Documents/big", (app.path + "/shortcut").c_str()), 0);
  uint64_t expected = allocatedBytes(app.path);
  ASSERT_GE(expected, 20000u);

  plist::Dictionary reply = call(23, selector(app));
  ASSERT_EQ(codeOf(reply), 1u);
  EXPECT_EQ(u64At(reply, "ReplyDiskUsage"), expected);

  // A bundle is measured once; later answers come from its metadata.
  Container bundle = make(33, "com.example.bundle", 1);
  writeFile(bundle.path + "/binary", std::string(9000, 'c'));
  uint64_t bundleBytes = allocatedBytes(bundle.path);
  reply = call(23, selector(bundle));
  ASSERT_EQ(codeOf(reply), 1u);
  EXPECT_EQ(u64At(reply, "ReplyDiskUsage"), bundleBytes);
  writeFile(bundle.path + "/resource", std::string(50000, 'd'));
  reply = call(23, selector(bundle));
  EXPECT_EQ(u64At(reply, "ReplyDiskUsage"), bundleBytes);
  reply = call(6, with(selector(bundle), {{"Key", "com.norvane.Emplacer.StaticDiskUsage"}}));
  EXPECT_EQ(u64At(reply, "ReplyInfoValue"), bundleBytes);

  Container stranger = app;
  stranger.uuid = QRTUUID::random();
  for (const auto& [what, keys, code] : std::vector<std::tuple<const char*, plist::Dictionary, uint64_t>>{
           {"missing container", selector(stranger), 21}, {"no UUID", without(selector(app), "UUID"), 11}}) {
    reply = call(23, keys);
    EXPECT_EQ(codeOf(reply), code) << what;
    EXPECT_EQ(u64At(reply, "ReplyDiskUsage"), 0u) << what;
  }
}

}  // namespace
