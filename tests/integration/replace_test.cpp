// Replacing containers through the real daemon: the swap, its refusals, the
// wipe built on it, and what a daemon killed at each step of a replace finds
// when it starts again.
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <optional>
#include <string>
#include <vector>

#include "DaemonFixture.h"
#include "base/PlistCodec.h"

namespace {

namespace fs = std::filesystem;

const char* kMarkerFile = "replace-marker";

std::string markerAt(const std::string& containerPath) { return readFile(containerPath + "/" + kMarkerFile); }

// The keys with one of them set to the value, or erased when there is none.
plist::Dictionary changed(plist::Dictionary keys, const char* key, const std::optional<plist::Value>& value) {
  keys.erase(key);
  if (value) keys.emplace(key, *value);
  return keys;
}

class ReplaceTest : public InstallerFixture {
 protected:
  std::string replaceDir() const { return root + "/private/var/root/Library/QuarterKit/Replace"; }
  std::string stagingDir() const { return daemonCaches() + "/Staging"; }
  std::string movedIn(const Container& fresh) const { return appClassDir() + "/" + baseName(fresh.path); }

  Container lookup(const std::string& identifier, bool transient = false) {
    return createOrLookup(501, identifier, 2, false, transient);
  }

  // A class 2 container of user 501 holding a marker file with the given text.
  Container make(const std::string& identifier, bool transient, const std::string& marker) {
    Container made = DaemonFixture::make(501, identifier, 2, transient);
    if (!made.path.empty()) writeFile(made.path + "/" + kMarkerFile, marker);
    return made;
  }

  std::string base() const { return root + "/private/var/mobile/Containers"; }

  // Copies of the content with this marker anywhere under the device root
  // but on death row, which holds only what is already given up.
  int liveCopies(const std::string& marker) const {
    int count = 0;
    std::error_code ec;
    for (auto it = fs::recursive_directory_iterator(root, ec); it != fs::recursive_directory_iterator();
         it.increment(ec)) {
      if (it->path() == deadDirectory() || it->path() == base() + "/.deathrow") {
        it.disable_recursion_pending();
      } else if (it->path().filename() == kMarkerFile && readFile(it->path().string()) == marker) {
        ++count;
      }
    }
    return count;
  }

  // A replace that did not happen: old is still its identifier's container,
  // both contents (marked marker-old and marker-new) where they were.
  void expectUnchanged(const Container& old, const Container& fresh, const std::string& marker) {
    Container live = lookup(old.identifier);
    EXPECT_EQ(live.path, old.path);
    EXPECT_EQ(live.uuid, old.uuid);
    EXPECT_EQ(markerAt(old.path), marker + "-old");
    EXPECT_EQ(markerAt(fresh.path), marker + "-new");
    expectNothingInFlight();
  }

  void expectNothingInFlight() {
    EXPECT_TRUE(listDirectory(replaceDir()).empty());
    EXPECT_TRUE(listDirectory(stagingDir()).empty());
    EXPECT_TRUE(listDirectory(base() + "/.staging").empty());
  }

  // The container of the identifier at path with uuid and marker, now and after a kill and restart.
  // A wipe killed before its swap leaves its fresh transient container behind.
  void expectLiveAcrossRestart(const std::string& id, const std::string& path, const QRTUUID& uuid,
                               const std::string& marker, bool transientGone = true) {
    for (int run = 0; run < 2; ++run) {
      SCOPED_TRACE(run == 0 ? "before restart" : "after restart");
      Container live = lookup(id);
      ASSERT_EQ(live.error, 1u);
      EXPECT_EQ(live.path, path);
      EXPECT_EQ(live.uuid, uuid);
      EXPECT_EQ(markerAt(live.path), marker);
      EXPECT_TRUE(exists(live.path + "/Documents"));
      if (transientGone) { EXPECT_EQ(lookup(id, true).error, 21u) << "no transient entry stays behind"; }
      expectNothingInFlight();
      killDaemon();
      startDaemon();
    }
  }
};

TEST_F(ReplaceTest, ReplaceAndWipeTakeOverAndSurviveRestart) {
  Container old = make("com.example.app", false, "app-old");
  Container fresh = make("com.example.app", true, "app-new");
  ASSERT_EQ(codeOf(call(QRTCommandReplaceContainer, replaceKeys(&old, fresh))), 1u);
  EXPECT_FALSE(exists(old.path));
  EXPECT_FALSE(exists(fresh.path));
  EXPECT_EQ(liveCopies("app-old"), 0);
  EXPECT_EQ(readLink(root + "/run/sandbox/mappings/501/1/com.example.app"), movedIn(fresh));
  expectLiveAcrossRestart("com.example.app", movedIn(fresh), fresh.uuid, "app-new");

  Container wiped = make("com.example.wiped", false, "wiped-old");
  ASSERT_EQ(codeOf(call(QRTCommandDeleteDataContainerContent, byName(501, 2, "com.example.wiped"))), 1u);
  EXPECT_EQ(liveCopies("wiped-old"), 0);
  expectLiveAcrossRestart("com.example.wiped", wiped.path, wiped.uuid, "");
}

TEST_F(ReplaceTest, RefusalsChangeNothing) {
  Container old = make("com.example.keep", false, "keep-old");
  Container fresh = make("com.example.keep", true, "keep-new");
  // Each refusal changes one key of a valid request.
  struct Refusal {
    const char* name;
    const char* key;
    std::optional<plist::Value> value;
    uint64_t code;
  };
  const Refusal refusals[] = {
      {"same container", QRTKeyNewContainerUUID, uuidData(old.uuid), 22},
      {"class mismatch", QRTKeyNewContainerClass, 4, 23},
      {"user mismatch", QRTKeyNewContainerUserID, 502, 56},
      {"no new UUID", QRTKeyNewContainerUUID, std::nullopt, 11},
      {"unknown old UUID", QRTKeyOldContainerUUID, uuidData(QRTUUID::random()), 21},
      {"unknown new UUID", QRTKeyNewContainerUUID, uuidData(QRTUUID::random()), 21},
      {"old identifier differs", QRTKeyOldIdentifier, "com.example.other", 21},
  };
  for (const Refusal& refusal : refusals) {
    SCOPED_TRACE(refusal.name);
    EXPECT_EQ(codeOf(call(QRTCommandReplaceContainer, changed(replaceKeys(&old, fresh), refusal.key, refusal.value))),
              refusal.code);
    expectUnchanged(old, fresh, "keep");
  }
}

TEST_F(ReplaceTest, FailedMoveOfNewContainerPutsOldOneBack) {
  Container old = make("com.example.back", false, "back-old");
  Container fresh = make("com.example.back", true, "back-new");
  ASSERT_EQ(mkdir(movedIn(fresh).c_str(), 0755), 0);
  EXPECT_EQ(codeOf(call(QRTCommandReplaceContainer, replaceKeys(&old, fresh))), 27u);
  ASSERT_EQ(rmdir(movedIn(fresh).c_str()), 0);

  // An immutable directory cannot be renamed: the old container has already
  // been moved aside and dropped from the cache when the new one fails to move.
  ASSERT_EQ(system(("chattr +i " + fresh.path).c_str()), 0);
  const uint64_t code = codeOf(call(QRTCommandReplaceContainer, replaceKeys(&old, fresh)));
  ASSERT_EQ(system(("chattr -i " + fresh.path).c_str()), 0);
  EXPECT_EQ(code, 15u);
  expectUnchanged(old, fresh, "back");

  EXPECT_EQ(codeOf(call(QRTCommandReplaceContainer, replaceKeys(&old, fresh))), 1u);
  EXPECT_EQ(markerAt(lookup("com.example.back").path), "back-new");
}

TEST_F(ReplaceTest, PromotionMakesTransientContainerPermanent) {
  Container transient = make("com.example.promoted", true, "promoted");
  ASSERT_EQ(codeOf(call(QRTCommandReplaceContainer, replaceKeys(nullptr, transient))), 1u);
  EXPECT_FALSE(exists(transient.path));
  expectLiveAcrossRestart("com.example.promoted", movedIn(transient), transient.uuid, "promoted");

  // A permanent container of the same identifier blocks a promotion.
  Container permanent = make("com.example.taken", false, "taken");
  Container candidate = make("com.example.taken", true, "candidate");
  EXPECT_EQ(codeOf(call(QRTCommandReplaceContainer, replaceKeys(nullptr, candidate))), 27u);
  EXPECT_EQ(markerAt(candidate.path), "candidate");
  EXPECT_EQ(lookup("com.example.taken").path, permanent.path);
  EXPECT_EQ(markerAt(permanent.path), "taken");
}

// With the home on the daemon's file system, or on a second one (a tmpfs),
// where staging and death row are the user base's own.
class ReplaceCrashTest : public ReplaceTest, public ::testing::WithParamInterface<bool> {};

TEST_P(ReplaceCrashTest, KilledCreateDeleteReplaceOrWipeLosesNothing) {
#ifndef QRT_TEST_HOOKS
  GTEST_SKIP() << "crash points need a build with test hooks";
#endif
  if (GetParam() && !mountHomeOnTmpfs()) GTEST_SKIP() << "cannot mount a tmpfs for the home";
  // What a run left in another user's staging and death row is gone after the next start.
  const std::string other = root + "/private/var/mobile/other/Containers";
  std::ofstream(root + "/etc/passwd", std::ios::app) << "other:x:502:502::/private/var/mobile/other:/bin/sh\n";
  ASSERT_EQ(system(("mkdir -p " + other + "/.staging/left " + other + "/.deathrow/dead && chmod 700 " + other +
                    "/.staging " + other + "/.deathrow && chown 502:502 " + other + " " + other + "/..")
                       .c_str()),
            0);
  killDaemon();
  startDaemon();
  ASSERT_TRUE(call(QRTCommandContainersForUser,
                   {{QRTKeyContainerClass, 2}, {QRTKeyUserID, 501}}));  // served once start-up is over
  EXPECT_TRUE(listDirectory(other + "/.staging").empty());
  EXPECT_TRUE(eventually([&] { return listDirectory(other + "/.deathrow").empty(); }));
  // A creation is whole or absent; a deletion leaves the content on death row only.
  for (auto [point, command, code] :
       {std::tuple{"create-after-build", 0, 21u}, {"create-after-move", 0, 1u}, {"delete-after-stage", 10, 21u}}) {
    SCOPED_TRACE(point);
    const std::string id = std::string("com.example.") + point;
    if (command == 10) make(id, false, id);
    expectKilledAt(point, command, with(byName(501, 2, id), {{QRTKeyCreateIfNecessary, true}}));
    startDaemon();
    Container live = lookup(id);
    EXPECT_EQ(live.error, code);
    if (live.error == 1) { EXPECT_TRUE(exists(live.path + "/Library/Caches")) << live.path; }
    EXPECT_EQ(liveCopies(id), 0);
    expectNothingInFlight();
  }
  // Each point with whether the new content has reached its place by then.
  const std::pair<const char*, bool> points[] = {
      {"replace-after-journal", false}, {"replace-after-stage", false},    {"replace-after-cache-remove", false},
      {"replace-after-move-new", true}, {"replace-after-keep-uuid", true}, {"replace-before-cleanup", true},
      {"replace-after-cleanup", true},
  };
  for (const auto& [point, newInPlace] : points) {
    SCOPED_TRACE(point);
    const std::string id = std::string("com.example.") + point;
    Container old = make(id, false, id + "-old");
    Container fresh = make(id, true, id + "-new");
    expectKilledAt(point, QRTCommandReplaceContainer, replaceKeys(&old, fresh));
    startDaemon();
    Container live = lookup(id);
    ASSERT_EQ(live.error, 1u);
    EXPECT_EQ(live.path, newInPlace ? movedIn(fresh) : old.path);
    EXPECT_EQ(live.uuid, newInPlace ? fresh.uuid : old.uuid);
    EXPECT_EQ(markerAt(live.path), id + (newInPlace ? "-new" : "-old"));
    // The other content waits where it was, or is given up to death row.
    EXPECT_EQ(liveCopies(id + "-old"), newInPlace ? 0 : 1);
    EXPECT_EQ(liveCopies(id + "-new"), 1);
    if (!newInPlace) { EXPECT_EQ(markerAt(fresh.path), id + "-new"); }
    expectNothingInFlight();

    // A wipe keeps the container's own UUID whichever content survives, in
    // memory and in its metadata file.
    const std::string wipeId = id + ".wipe";
    Container wiped = make(wipeId, false, wipeId + "-old");
    expectKilledAt(point, QRTCommandDeleteDataContainerContent, byName(501, 2, wipeId));
    startDaemon();
    expectLiveAcrossRestart(wipeId, wiped.path, wiped.uuid, newInPlace ? "" : wipeId + "-old", newInPlace);
    EXPECT_EQ(liveCopies(wipeId + "-old"), newInPlace ? 0 : 1);
  }
}

INSTANTIATE_TEST_SUITE_P(Home, ReplaceCrashTest, ::testing::Bool(),
                         [](const auto& info) { return info.param ? "OnSecondFileSystem" : "OnDaemonsFileSystem"; });

TEST_F(ReplaceTest, StartUpRecoveryActsOnlyOnValidJournals) {
  const std::string filled = root + "/filled-destination";
  ASSERT_EQ(mkdir(filled.c_str(), 0755), 0);
  // raw: bytes written instead of the valid journal; key: one of its keys set to `to`, or erased.
  struct Journal {
    const char* name;
    bool movesBack;
    const char* raw;
    const char* key;
    std::optional<plist::Value> to;
  };
  const Journal journals[] = {
      {"valid", true, nullptr, nullptr, std::nullopt},
      {"garbage", false, "not a property list", nullptr, std::nullopt},
      {"missing key", false, nullptr, "QRTReplaceOperationDestURL", std::nullopt},
      {"number for a path", false, nullptr, "QRTReplaceOperationOldURL", 7},
      {"new content already in place", false, nullptr, "QRTReplaceOperationDestURL", filled},
  };
  std::vector<Container> containers;
  for (const Journal& journal : journals) {
    containers.push_back(make(std::string("com.example.j.") + journal.name, false, std::string("j-") + journal.name));
  }
  ASSERT_EQ(stopDaemon(), 0);

  // What a replace killed between moving the old container aside and moving
  // the new one in leaves behind; old URL and destination are both free.
  for (size_t i = 0; i < std::size(journals); ++i) {
    const Journal& j = journals[i];
    const std::string name = QRTUUID::random().UUIDString();
    const std::string staging = stagingDir() + "/" + name;
    ASSERT_EQ(rename(containers[i].path.c_str(), staging.c_str()), 0);
    plist::Dictionary journal{{"QRTReplaceOperationOldURL", containers[i].path},
                              {"QRTReplaceOperationNewURL", "/nonexistent/new"},
                              {"QRTReplaceOperationStagingURL", staging},
                              {"QRTReplaceOperationDestURL", appClassDir() + "/" + QRTUUID::random().UUIDString()}};
    plist::Data bytes = plist::writeBinary(j.key ? changed(journal, j.key, j.to) : journal);
    writeFile(replaceDir() + "/" + name + ".plist", j.raw ? j.raw : std::string(bytes.begin(), bytes.end()));
  }
  startDaemon();

  for (size_t i = 0; i < std::size(journals); ++i) {
    SCOPED_TRACE(journals[i].name);
    Container live = lookup(std::string("com.example.j.") + journals[i].name);
    EXPECT_EQ(live.error, journals[i].movesBack ? 1u : 21u);
    if (journals[i].movesBack) { EXPECT_EQ(live.path, containers[i].path); }
    EXPECT_EQ(liveCopies(std::string("j-") + journals[i].name), journals[i].movesBack ? 1 : 0);
  }
  expectNothingInFlight();
}

}  // namespace
