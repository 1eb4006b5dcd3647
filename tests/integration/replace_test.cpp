// Replacing containers through the real daemon: the swap, its refusals, the
// wipe built on it, and what a daemon killed at each step of a replace finds
// when it starts again.
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <functional>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

#include "DaemonFixture.h"
#include "base/PlistCodec.h"
#include "base/QRTUUID.h"

namespace {

namespace fs = std::filesystem;

const char* kMarkerFile = "replace-marker";

struct Container {
  uint64_t error = 0;
  std::string path;
  std::optional<QRTUUID> uuid;
};

plist::Data uuidData(const QRTUUID& uuid) { return plist::Data(uuid.bytes().begin(), uuid.bytes().end()); }

std::string baseName(const std::string& path) { return path.substr(path.rfind('/') + 1); }

void writeFile(const std::string& path, const std::string& text) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << text;
}

std::string readFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

bool exists(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0;
}

std::vector<std::string> listDirectory(const std::string& path) {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto& entry : fs::directory_iterator(path, ec)) names.push_back(entry.path().filename().string());
  return names;
}

class ReplaceTest : public DaemonFixture {
 protected:
  void SetUp() override {
    DaemonFixture::SetUp();
    setOwnIdentity("com.example.installer", {{"com.norvane.private.QuarterKit.allowed", true}});
  }

  std::string classDir() const { return root + "/private/var/mobile/Containers/Data/Application"; }
  std::string daemonCaches() const { return root + "/private/var/root/Library/Caches/com.norvane.quarterd"; }
  std::string replaceDir() const { return root + "/private/var/root/Library/QuarterKit/Replace"; }
  std::string stagingDir() const { return daemonCaches() + "/Staging"; }

  // The reply, or nothing when the connection closed first.
  std::optional<plist::Dictionary> call(uint64_t command, plist::Dictionary keys) {
    auto connection = qk::Connection::connect(qk::requestSocketPath(root));
    if (!connection) return std::nullopt;
    return connection->call(request(command, std::move(keys)), std::chrono::seconds(30));
  }

  static uint64_t codeOf(const std::optional<plist::Dictionary>& reply) {
    const plist::Value* code = reply ? plist::find(*reply, "ReplyError") : nullptr;
    return code && code->isInteger() ? code->integer().asUnsigned() : 0;
  }

  Container lookup(const std::string& identifier, bool create = false, bool transient = false) {
    auto reply = call(0, {{"UserID", 501}, {"ContainerClass", 2}, {"Identifier", identifier},
                          {"CreateIfNecessary", create}, {"Transient", transient}});
    Container found;
    found.error = codeOf(reply);
    if (!reply) return found;
    if (auto* v = plist::find(*reply, "ReplyPath")) found.path = v->string();
    if (auto* v = plist::find(*reply, "ReplyUUID")) found.uuid = QRTUUID::fromBytes(v->data().data(), v->data().size());
    return found;
  }

  // A class 2 container of user 501 holding a marker file with the given text.
  Container make(const std::string& identifier, bool transient, const std::string& marker) {
    Container made = lookup(identifier, true, transient);
    EXPECT_EQ(made.error, 1u) << identifier;
    if (!made.path.empty()) writeFile(made.path + "/" + kMarkerFile, marker);
    return made;
  }

  static plist::Dictionary replaceKeys(const Container* old, const Container& fresh, const std::string& identifier) {
    plist::Dictionary keys{{"NewContainerUUID", uuidData(*fresh.uuid)},
                           {"NewContainerClass", 2},
                           {"NewContainerUserID", 501},
                           {"NewIdentifier", identifier}};
    if (old) {
      keys["OldContainerUUID"] = uuidData(*old->uuid);
      keys["OldContainerClass"] = 2;
      keys["OldContainerUserID"] = 501;
      keys["OldIdentifier"] = identifier;
    }
    return keys;
  }

  static plist::Dictionary wipeKeys(const std::string& identifier) {
    return {{"UserID", 501}, {"ContainerClass", 2}, {"Identifier", identifier}};
  }

  bool wipeServed() { return codeOf(call(12, wipeKeys("com.example.probe"))) != 49; }

  static std::string markerAt(const std::string& containerPath) {
    std::string path = containerPath + "/" + kMarkerFile;
    return exists(path) ? readFile(path) : std::string();
  }

  // Copies of the content with this marker anywhere under the device root
  // but on death row, which holds only what is already given up.
  int liveCopies(const std::string& marker) const {
    int count = 0;
    std::error_code ec;
    const fs::path deathRow = daemonCaches() + "/Dead";
    for (auto it = fs::recursive_directory_iterator(root, ec); it != fs::recursive_directory_iterator();
         it.increment(ec)) {
      if (it->path() == deathRow) {
        it.disable_recursion_pending();
        continue;
      }
      if (it->path().filename() == kMarkerFile && readFile(it->path().string()) == marker) ++count;
    }
    return count;
  }

  void arm(const std::string& point) { writeFile(root + "/run/quarterd.crashpoint", point + "\n"); }

  // Sends a request that must kill the daemon at the armed point, then
  // starts it again unarmed.
  void crashAndRestart(uint64_t command, const plist::Dictionary& keys, const std::string& point) {
    arm(point);
    EXPECT_FALSE(call(command, keys)) << "the daemon answered instead of dying at " << point;
    int status = 0;
    ASSERT_EQ(waitpid(daemon, &status, 0), daemon);
    EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) << "status " << status;
    daemon = -1;
    unlink((root + "/run/quarterd.crashpoint").c_str());
    startDaemon();
  }

  void expectNothingInFlight() {
    EXPECT_TRUE(listDirectory(replaceDir()).empty());
    EXPECT_TRUE(listDirectory(stagingDir()).empty());
  }
};

TEST_F(ReplaceTest, NewContentTakesOverAndSurvivesRestart) {
  Container old = make("com.example.app", false, "app-old");
  Container fresh = make("com.example.app", true, "app-new");
  ASSERT_EQ(codeOf(call(2, replaceKeys(&old, fresh, "com.example.app"))), 1u);

  const std::string destination = classDir() + "/" + baseName(fresh.path);
  EXPECT_EQ(markerAt(destination), "app-new");
  EXPECT_FALSE(exists(old.path));
  EXPECT_FALSE(exists(fresh.path));
  EXPECT_EQ(liveCopies("app-old"), 0);
  expectNothingInFlight();
  char target[4096] = {0};
  ssize_t n = readlink((root + "/run/sandbox/mappings/501/1/com.example.app").c_str(), target, sizeof target - 1);
  ASSERT_GT(n, 0);
  EXPECT_EQ(std::string(target, static_cast<size_t>(n)), destination);

  for (int run = 0; run < 2; ++run) {
    Container live = lookup("com.example.app");
    ASSERT_EQ(live.error, 1u) << "run " << run;
    EXPECT_EQ(live.path, destination);
    EXPECT_EQ(live.uuid, fresh.uuid);
    EXPECT_EQ(lookup("com.example.app", false, true).error, 21u) << "the transient entry stays behind";
    killDaemon();
    startDaemon();
  }
}

TEST_F(ReplaceTest, RefusalsChangeNothing) {
  struct Refusal {
    const char* name;
    std::function<void(plist::Dictionary&)> change;
    uint64_t code;
  };
  const Refusal refusals[] = {
      {"same container", [](plist::Dictionary& k) { k["NewContainerUUID"] = k["OldContainerUUID"]; }, 22},
      {"class mismatch", [](plist::Dictionary& k) { k["NewContainerClass"] = 4; }, 23},
      {"user mismatch", [](plist::Dictionary& k) { k["NewContainerUserID"] = 502; }, 56},
      {"no new UUID", [](plist::Dictionary& k) { k.erase("NewContainerUUID"); }, 11},
      {"unknown old UUID", [](plist::Dictionary& k) { k["OldContainerUUID"] = uuidData(QRTUUID::random()); }, 21},
      {"unknown new UUID", [](plist::Dictionary& k) { k["NewContainerUUID"] = uuidData(QRTUUID::random()); }, 21},
      {"old identifier differs", [](plist::Dictionary& k) { k["OldIdentifier"] = "com.example.other"; }, 21},
  };
  Container old = make("com.example.keep", false, "keep-old");
  Container fresh = make("com.example.keep", true, "keep-new");
  for (const Refusal& refusal : refusals) {
    SCOPED_TRACE(refusal.name);
    plist::Dictionary keys = replaceKeys(&old, fresh, "com.example.keep");
    refusal.change(keys);
    EXPECT_EQ(codeOf(call(2, keys)), refusal.code);
    EXPECT_EQ(markerAt(old.path), "keep-old");
    EXPECT_EQ(markerAt(fresh.path), "keep-new");
    Container live = lookup("com.example.keep");
    EXPECT_EQ(live.path, old.path);
    EXPECT_EQ(live.uuid, old.uuid);
    expectNothingInFlight();
  }
}

TEST_F(ReplaceTest, FailedMoveOfNewContainerPutsOldOneBack) {
  Container old = make("com.example.back", false, "back-old");
  Container fresh = make("com.example.back", true, "back-new");
  const std::string destination = classDir() + "/" + baseName(fresh.path);
  ASSERT_EQ(mkdir(destination.c_str(), 0755), 0);
  EXPECT_EQ(codeOf(call(2, replaceKeys(&old, fresh, "com.example.back"))), 27u);
  ASSERT_EQ(rmdir(destination.c_str()), 0);

  // An immutable directory cannot be renamed: the old container has already
  // been moved aside and dropped from the cache when the new one fails to move.
  if (system(("chattr +i " + fresh.path).c_str()) != 0) GTEST_SKIP() << "no immutable flag here";
  const uint64_t code = codeOf(call(2, replaceKeys(&old, fresh, "com.example.back")));
  ASSERT_EQ(system(("chattr -i " + fresh.path).c_str()), 0);
  EXPECT_EQ(code, 15u);
  Container live = lookup("com.example.back");
  EXPECT_EQ(live.path, old.path);
  EXPECT_EQ(live.uuid, old.uuid);
  EXPECT_EQ(markerAt(old.path), "back-old");
  EXPECT_EQ(markerAt(fresh.path), "back-new");
  expectNothingInFlight();

  EXPECT_EQ(codeOf(call(2, replaceKeys(&old, fresh, "com.example.back"))), 1u);
  EXPECT_EQ(markerAt(lookup("com.example.back").path), "back-new");
}

TEST_F(ReplaceTest, PromotionMakesTransientContainerPermanent) {
  Container transient = make("com.example.promoted", true, "promoted");
  ASSERT_EQ(codeOf(call(2, replaceKeys(nullptr, transient, "com.example.promoted"))), 1u);
  Container live = lookup("com.example.promoted");
  ASSERT_EQ(live.error, 1u);
  EXPECT_EQ(live.path, classDir() + "/" + baseName(transient.path));
  EXPECT_EQ(live.uuid, transient.uuid);
  EXPECT_EQ(markerAt(live.path), "promoted");
  EXPECT_FALSE(exists(transient.path));
  EXPECT_EQ(lookup("com.example.promoted", false, true).error, 21u);
  expectNothingInFlight();

  // A permanent container of the same identifier blocks a promotion.
  Container permanent = make("com.example.taken", false, "taken");
  Container candidate = make("com.example.taken", true, "candidate");
  EXPECT_EQ(codeOf(call(2, replaceKeys(nullptr, candidate, "com.example.taken"))), 27u);
  EXPECT_EQ(markerAt(candidate.path), "candidate");
  EXPECT_EQ(lookup("com.example.taken").path, permanent.path);
  EXPECT_EQ(markerAt(permanent.path), "taken");
}

TEST_F(ReplaceTest, WipeKeepsPathAndUUIDButNotContent) {
  if (!wipeServed()) GTEST_SKIP() << "command 12 (deleteDataContainerContent) is not served yet";
  Container old = make("com.example.wiped", false, "wiped-old");
  ASSERT_EQ(codeOf(call(12, wipeKeys("com.example.wiped"))), 1u);
  for (int run = 0; run < 2; ++run) {
    Container live = lookup("com.example.wiped");
    ASSERT_EQ(live.error, 1u) << "run " << run;
    EXPECT_EQ(live.path, old.path);
    EXPECT_EQ(live.uuid, old.uuid);
    EXPECT_EQ(markerAt(live.path), "");
    EXPECT_TRUE(exists(live.path + "/Documents"));
    EXPECT_EQ(liveCopies("wiped-old"), 0);
    expectNothingInFlight();
    killDaemon();
    startDaemon();
  }
}

// Each point with whether the new content has reached its place by then.
struct CrashPoint {
  const char* name;
  bool newInPlace;
};
const CrashPoint kCrashPoints[] = {
    {"replace-after-journal", false},  {"replace-after-stage", false},    {"replace-after-cache-remove", false},
    {"replace-after-move-new", true},  {"replace-before-cleanup", true}, {"replace-after-cleanup", true},
};

TEST_F(ReplaceTest, KilledReplaceLeavesExactlyOneContentLive) {
  for (const CrashPoint& point : kCrashPoints) {
    SCOPED_TRACE(point.name);
    const std::string id = std::string("com.example.") + point.name;
    const std::string oldMarker = id + "-old", newMarker = id + "-new";
    Container old = make(id, false, oldMarker);
    Container fresh = make(id, true, newMarker);
    crashAndRestart(2, replaceKeys(&old, fresh, id), point.name);

    Container live = lookup(id);
    ASSERT_EQ(live.error, 1u);
    const Container& expected = point.newInPlace ? fresh : old;
    EXPECT_EQ(live.path, point.newInPlace ? classDir() + "/" + baseName(fresh.path) : old.path);
    EXPECT_EQ(live.uuid, expected.uuid);
    EXPECT_EQ(markerAt(live.path), point.newInPlace ? newMarker : oldMarker);
    // The other content waits where it was, or is given up to death row.
    EXPECT_EQ(liveCopies(oldMarker), point.newInPlace ? 0 : 1);
    EXPECT_EQ(liveCopies(newMarker), 1);
    if (!point.newInPlace) { EXPECT_EQ(markerAt(fresh.path), newMarker); }
    expectNothingInFlight();
  }
  EXPECT_TRUE(logContains("Recovering from failed replace by moving: "));
}

TEST_F(ReplaceTest, KilledWipeLeavesExactlyOneContentLive) {
  if (!wipeServed()) GTEST_SKIP() << "command 12 (deleteDataContainerContent) is not served yet";
  for (const CrashPoint& point : kCrashPoints) {
    SCOPED_TRACE(point.name);
    const std::string id = std::string("com.example.wipe.") + point.name;
    const std::string oldMarker = id + "-old";
    Container old = make(id, false, oldMarker);
    crashAndRestart(12, wipeKeys(id), point.name);

    Container live = lookup(id);
    ASSERT_EQ(live.error, 1u);
    EXPECT_EQ(live.path, old.path);
    EXPECT_EQ(markerAt(live.path), point.newInPlace ? "" : oldMarker);
    EXPECT_TRUE(exists(live.path + "/Documents"));
    EXPECT_EQ(liveCopies(oldMarker), point.newInPlace ? 0 : 1);
    if (!point.newInPlace) { EXPECT_EQ(live.uuid, old.uuid); }
    expectNothingInFlight();
  }
}

TEST_F(ReplaceTest, StartUpRecoveryActsOnlyOnValidJournals) {
  struct Journal {
    const char* name;
    bool movesBack;
    // The journal's bytes for a container moved from old to staging.
    std::function<std::string(const std::string& old, const std::string& staging, const std::string& dest)> bytes;
  };
  auto binary = [](const plist::Value& value) {
    plist::Data data = plist::writeBinary(value);
    return std::string(data.begin(), data.end());
  };
  auto dictionary = [](const std::string& old, const std::string& staging, const std::string& dest) {
    return plist::Dictionary{{"QRTReplaceOperationOldURL", old},
                             {"QRTReplaceOperationNewURL", "/nonexistent/new"},
                             {"QRTReplaceOperationStagingURL", staging},
                             {"QRTReplaceOperationDestURL", dest}};
  };
  const std::string filled = root + "/filled-destination";
  ASSERT_EQ(mkdir(filled.c_str(), 0755), 0);
  const Journal journals[] = {
      {"binary", true, [&](auto& o, auto& s, auto& d) { return binary(dictionary(o, s, d)); }},
      {"xml", true,
       [](auto& o, auto& s, auto& d) {
         return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
                "<key>QRTReplaceOperationOldURL</key><string>" + o + "</string>"
                "<key>QRTReplaceOperationNewURL</key><string>/nonexistent/new</string>"
                "<key>QRTReplaceOperationStagingURL</key><string>" + s + "</string>"
                "<key>QRTReplaceOperationDestURL</key><string>" + d + "</string></dict></plist>\n";
       }},
      {"garbage", false, [](auto&, auto&, auto&) { return std::string("not a property list"); }},
      {"array", false, [&](auto& o, auto& s, auto& d) { return binary(plist::Array{o, "/x", s, d}); }},
      {"missing key", false,
       [&](auto& o, auto& s, auto& d) {
         plist::Dictionary journal = dictionary(o, s, d);
         journal.erase("QRTReplaceOperationDestURL");
         return binary(journal);
       }},
      {"number for a path", false,
       [&](auto& o, auto& s, auto& d) {
         plist::Dictionary journal = dictionary(o, s, d);
         journal["QRTReplaceOperationOldURL"] = 7;
         return binary(journal);
       }},
      {"new content already in place", false,
       [&](auto& o, auto& s, auto&) { return binary(dictionary(o, s, filled)); }},
  };
  std::vector<Container> containers;
  for (const Journal& journal : journals) containers.push_back(make(std::string("com.example.j.") + journal.name,
                                                                     false, std::string("journal-") + journal.name));
  ASSERT_EQ(stopDaemon(), 0);

  // The state a replace killed between moving the old container aside and
  // moving the new one in leaves behind.
  for (size_t i = 0; i < std::size(journals); ++i) {
    const std::string name = QRTUUID::random().UUIDString();
    const std::string staging = stagingDir() + "/" + name;
    ASSERT_EQ(rename(containers[i].path.c_str(), staging.c_str()), 0);
    writeFile(replaceDir() + "/" + name + ".plist",
              journals[i].bytes(containers[i].path, staging, classDir() + "/" + QRTUUID::random().UUIDString()));
  }
  startDaemon();

  for (size_t i = 0; i < std::size(journals); ++i) {
    SCOPED_TRACE(journals[i].name);
    Container live = lookup(std::string("com.example.j.") + journals[i].name);
    EXPECT_EQ(live.error, journals[i].movesBack ? 1u : 21u);
    if (journals[i].movesBack) { EXPECT_EQ(live.path, containers[i].path); }
    EXPECT_EQ(liveCopies(std::string("journal-") + journals[i].name), journals[i].movesBack ? 1 : 0);
  }
  expectNothingInFlight();
  EXPECT_TRUE(logContains("Failed to read replace file at URL"));
  EXPECT_TRUE(logContains("Invalid replace data: Old: 7, New: /nonexistent/new"));
}

}  // namespace
