// Protection-class changes of data containers (command 21) against the real
// daemon: what the walk touches, the locked device, kills at each step of a
// change, the termination assertion, and that each request gets one reply.
#include <stdlib.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <filesystem>
#include <future>
#include <map>
#include <string>

#include "DaemonFixture.h"
#include "base/Frame.h"

namespace fs = std::filesystem;

namespace {

constexpr const char* kClassAttribute = "trusted.com.norvane.protection-class";
constexpr uint64_t kSetDataProtection = 21;

int32_t classOf(const std::string& path) {
  uint8_t b[4];
  if (lgetxattr(path.c_str(), kClassAttribute, b, sizeof b) != sizeof b) return 0;
  return static_cast<int32_t>(b[0] | b[1] << 8 | b[2] << 16 | static_cast<uint32_t>(b[3]) << 24);
}

void setClassOf(const std::string& path, int32_t cls) {
  const auto v = static_cast<uint32_t>(cls);
  const uint8_t b[4] = {uint8_t(v), uint8_t(v >> 8), uint8_t(v >> 16), uint8_t(v >> 24)};
  ASSERT_EQ(lsetxattr(path.c_str(), kClassAttribute, b, sizeof b, 0), 0) << path << ": " << strerror(errno);
}

// Count of items (files and directories, the top included) by class; links are not followed.
std::map<int32_t, int> classesUnder(const std::string& top) {
  std::map<int32_t, int> counts;
  if (!fs::is_directory(fs::symlink_status(top))) return counts;
  ++counts[classOf(top)];
  for (const auto& entry : fs::recursive_directory_iterator(top)) {
    if (!entry.is_symlink()) ++counts[classOf(entry.path().string())];
  }
  return counts;
}

// One framed request on a raw socket, then a second one: the next frame must
// answer the second, so the first got exactly one reply. The first reply's code.
uint64_t codeOfOnlyReply(const std::string& socketPath, const plist::Dictionary& first) {
  const int fd = rawConnect(socketPath);
  frame::Decoder decoder;
  auto exchange = [&](uint64_t id, const plist::Dictionary& message) {
    const std::vector<uint8_t> bytes = frame::encode(id, message);
    EXPECT_TRUE(frame::sendAll(fd, bytes.data(), bytes.size()));
    std::optional<frame::RawFrame> reply;
    uint8_t buffer[4096];
    for (ssize_t n; !(reply = decoder.next()) && (n = read(fd, buffer, sizeof buffer)) > 0;)
      decoder.append(buffer, static_cast<size_t>(n));
    EXPECT_EQ(reply ? reply->messageId : 0, id) << "a second reply to the first request";
    return reply ? frame::decodeMessage(reply->payload) : std::nullopt;
  };
  const uint64_t code = codeOf(exchange(1, first));
  exchange(2, request(QRTCommandCount));
  close(fd);
  return code;
}

class DataProtectionTest : public InstallerFixture {
 protected:
  void TearDown() override {
    setLocked(false);  // a held change would keep the daemon from stopping at once
    DaemonFixture::TearDown();
  }

  // Written atomically, as the platform's writers do.
  void setLocked(bool locked) {
    writeFile(root + "/run/device/lockstate.tmp", locked ? "1\n" : "0\n");
    ASSERT_EQ(rename((root + "/run/device/lockstate.tmp").c_str(), (root + "/run/device/lockstate").c_str()), 0);
  }

  std::string pendingDir() const { return root + "/private/var/root/Library/QuarterKit/PendingUpdates"; }
  std::string assertionFile(const std::string& id) const { return root + "/run/quarterd/assertions/" + id; }

  // A data container whose user data holds files in sub-directories (Documents
  // and Library), every item of the container given class `initial`.
  Container makeApp(const std::string& id, int files, int32_t initial = 3) {
    Container c = make(501, id, 2);
    for (int i = 0; i < files; ++i) {
      const std::string dir = c.path + (i % 2 ? "/Library/d" : "/Documents/d") + std::to_string(i % 20);
      fs::create_directories(dir);
      writeFile(dir + "/f" + std::to_string(i), "x");
    }
    writeFile(c.path + "/tmp/t", "x");
    for (const auto& entry : fs::recursive_directory_iterator(c.path)) setClassOf(entry.path().string(), initial);
    return c;
  }

  static plist::Dictionary protect(const std::string& id, int64_t cls, bool retry, bool thirdParty = false) {
    return {{QRTKeyUserID, 501},
            {QRTKeyContainerClass, 2},
            {QRTKeyIdentifier, id},
            {QRTKeyDataProtectionClass, cls},
            {QRTKeyIsThirdParty, thirdParty},
            {QRTKeyRetryIfLocked, retry}};
  }

  // The user data items of c by class.
  std::map<int32_t, int> userData(const Container& c) {
    std::map<int32_t, int> all;
    for (const char* item : {"/Documents", "/Library", "/tmp"})
      for (auto [cls, n] : classesUnder(c.path + item)) all[cls] += n;
    return all;
  }

  std::optional<uint64_t> recordedClass(const Container& c) {
    return u64At(call(QRTCommandInfoValueForKey,
                      with(selector(c), {{QRTKeyKey, "com.norvane.Emplacer.ContentProtectionClass"}})),
                 QRTReplyKeyInfoValue);
  }

  // Sends command 21 on a connection of its own and returns the reply to come.
  std::future<std::optional<plist::Dictionary>> protectLater(const plist::Dictionary& keys) {
    return std::async(std::launch::async, [this, keys] { return call(kSetDataProtection, keys); });
  }

  static std::string retrying(const std::string& id, int32_t cls) {
    return "Retrying container protection update to " + std::to_string(cls) +
           " on next unlock for user: 501, id: " + id;
  }
};

// Refusals, and a change to the class the container has, touch nothing.
TEST_F(DataProtectionTest, EveryRequestGetsOneReplyAndAChangeReachesEveryUserDataItemOnly) {
  Container c = makeApp("com.example.thousand", 1000);
  // Outside the user data items, and outside the container through planted links.
  writeFile(c.path + "/SystemData.txt", "x");
  setClassOf(c.path + "/SystemData.txt", 3);
  const std::string outside = root + "/outside";
  fs::create_directories(outside);
  writeFile(outside + "/secret", "x");
  setClassOf(outside + "/secret", 4);
  fs::create_symlink(outside + "/secret", c.path + "/Documents/d0/link");
  fs::create_symlink(outside, c.path + "/Purchases");
  const int items = userData(c)[3];
  ASSERT_GT(items, 1000);

  const struct {
    const char* what;
    plist::Dictionary keys;
    uint64_t code;
  } cases[] = {
      {"user check fails", with(protect(c.identifier, 1, false), {{QRTKeyContainerClass, 1}}), 38},
      {"bundle class", with(protect(c.identifier, 1, false), {{QRTKeyContainerClass, 1}, {QRTKeyUserID, 33}}), 11},
      {"no identifier", without(protect(c.identifier, 1, false), QRTKeyIdentifier), 11},
      {"no such container", protect("com.example.absent", 1, false), 21},
      {"class 2", protect(c.identifier, 2, false), 38},
      {"class 4 for a third party", protect(c.identifier, 4, false, true), 38},
      {"class out of range", protect(c.identifier, 1ll << 32 | 1, false), 38},
      {"the class it has", protect(c.identifier, 0, false), 1},
  };
  for (const auto& test : cases) {
    SCOPED_TRACE(test.what);
    EXPECT_EQ(codeOfOnlyReply(qk::requestSocketPath(root), request(kSetDataProtection, test.keys)), test.code);
  }
  EXPECT_EQ(userData(c), (std::map<int32_t, int>{{3, items}})) << "a refused request changed something";
  EXPECT_TRUE(listDirectory(pendingDir()).empty());

  EXPECT_EQ(codeOfOnlyReply(qk::requestSocketPath(root), request(kSetDataProtection, protect(c.identifier, 1, false))),
            1u);
  EXPECT_EQ(userData(c), (std::map<int32_t, int>{{1, items}}));
  EXPECT_EQ(classOf(c.path + "/SystemData.txt"), 3);
  EXPECT_EQ(classOf(outside + "/secret"), 4) << "a link was followed";
  EXPECT_EQ(classOf(outside), 0) << "a link was followed";
  EXPECT_EQ(recordedClass(c), 1u);
  EXPECT_TRUE(listDirectory(pendingDir()).empty());

  // Towards a higher class only directories change; files keep theirs.
  EXPECT_EQ(codeOf(call(kSetDataProtection, protect(c.identifier, 3, false))), 1u);
  EXPECT_EQ(classOf(c.path + "/Documents/d0"), 3);
  EXPECT_EQ(classOf(c.path + "/Documents/d0/f0"), 1);
  EXPECT_EQ(recordedClass(c), 3u);
}

TEST_F(DataProtectionTest, LockedDeviceHoldsOrRefusesTheChange) {
  const struct {
    const char* what;
    int32_t from, to;  // the recorded class before, the requested one
    bool retry;
    uint64_t code;
    int32_t files, dirs;  // the classes afterwards
  } cases[] = {
      {"to class 1, held", 3, 1, true, 1, 1, 1},
      {"from class 1, held", 1, 3, true, 1, 1, 3},
      {"to class 1, refused", 3, 1, false, 61, 3, 3},
  };
  for (const auto& test : cases) {
    SCOPED_TRACE(test.what);
    const std::string id = std::string("com.example.locked") + std::to_string(&test - cases);
    Container c = makeApp(id, 20, test.from);
    ASSERT_EQ(codeOf(call(QRTCommandSetInfoValue,
                          with(selector(c), {{QRTKeyKey, "com.norvane.Emplacer.ContentProtectionClass"},
                                             {QRTKeyValue, test.from}}))),
              1u);
    setLocked(true);
    auto reply = protectLater(protect(id, test.to, test.retry));
    if (test.retry) {
      EXPECT_TRUE(logContains(retrying(id, test.to)));
      EXPECT_EQ(reply.wait_for(std::chrono::milliseconds(200)), std::future_status::timeout) << "answered while locked";
      EXPECT_EQ(listDirectory(pendingDir()).size(), 1u);
      setLocked(false);
    }
    EXPECT_EQ(codeOf(reply.get()), test.code);
    setLocked(false);
    EXPECT_EQ(classOf(c.path + "/Documents/d0/f0"), test.files);
    EXPECT_EQ(classOf(c.path + "/Documents/d0"), test.dirs);
    EXPECT_EQ(classOf(c.path + "/Library"), test.dirs);
    EXPECT_EQ(recordedClass(c), static_cast<uint64_t>(test.code == 1 ? test.to : test.from));
    EXPECT_TRUE(listDirectory(pendingDir()).empty());
  }
}

TEST_F(DataProtectionTest, KilledChangeIsCompletedAtStart) {
#ifndef QRT_TEST_HOOKS
  GTEST_SKIP() << "crash points need a build with test hooks";
#endif
  // An unreadable pending-update file stays where it is; the others are still carried out.
  fs::create_directories(pendingDir());
  writeFile(pendingDir() + "/com.example.garbage-2-501.plist", "garbage");
  const std::vector<std::string> garbageOnly{"com.example.garbage-2-501.plist"};
  for (const char* point :
       {"protection-after-pending-write", "protection-mid-walk", "protection-before-pending-delete"}) {
    SCOPED_TRACE(point);
    const std::string id = std::string("com.example.") + point;
    Container c = makeApp(id, 40);
    ASSERT_NO_FATAL_FAILURE(expectKilledAt(point, kSetDataProtection, protect(id, 1, true)));
    EXPECT_EQ(listDirectory(pendingDir()).size(), 2u);
    startDaemon();
    EXPECT_EQ(listDirectory(pendingDir()), garbageOnly);
    EXPECT_EQ(userData(c).count(3), 0u) << "an item kept the old class";
    EXPECT_EQ(recordedClass(c), 1u);
  }
}

TEST_F(DataProtectionTest, ApplicationIsHeldWhileTheChangeRunsAfterUnlock) {
#ifndef QRT_TEST_HOOKS
  GTEST_SKIP() << "pause points need a build with test hooks";
#endif
  for (bool refuse : {false, true}) {
    SCOPED_TRACE(refuse ? "assertions refused" : "assertions granted");
    const std::string id = refuse ? "com.example.refused" : "com.example.held";
    Container c = makeApp(id, 20);
    writePlist(root + "/etc/device-properties.plist", {{"RefuseTerminationAssertions", refuse}});

    setLocked(true);
    auto reply = protectLater(protect(id, 1, true));
    ASSERT_TRUE(logContains(retrying(id, 1)));
    const std::string paused = "Pause point protection-walk reached";
    const size_t pausesBefore = logCount(paused);
    writeFile(root + "/run/quarterd.pausepoint", "protection-walk\n");
    setLocked(false);
    // The pause comes on the run after the unlock, with the assertion held.
    EXPECT_TRUE(eventually([&] { return logCount(paused) > pausesBefore; }));
    EXPECT_EQ(exists(assertionFile(id)), !refuse);
    unlink((root + "/run/quarterd.pausepoint").c_str());
    EXPECT_EQ(codeOf(reply.get()), 1u);
    EXPECT_TRUE(eventually([&] { return !exists(assertionFile(id)); })) << "the assertion outlived the change";
    EXPECT_EQ(userData(c).count(3), 0u);
    if (refuse) { EXPECT_TRUE(logContains("Failed to acquire termination assertion for " + id)); }
  }
}

TEST_F(DataProtectionTest, QuarterctlProtect) {
  Container c = makeApp("com.example.ctl", 4);
  const std::string command = entitledQuarterctl() + " --root " + root + " protect --identifier com.example.ctl ";
  EXPECT_EQ(WEXITSTATUS(system((command + "--protection-class 1 >/dev/null").c_str())), 0);
  EXPECT_EQ(classOf(c.path + "/Documents/d0/f0"), 1);
  EXPECT_EQ(WEXITSTATUS(system((command + "--protection-class 2 >/dev/null").c_str())), 1);
  EXPECT_EQ(WEXITSTATUS(system((command + ">/dev/null 2>&1").c_str())), 2);
}

}  // namespace
