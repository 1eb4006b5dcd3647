#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <thread>
#include <tuple>
#include <vector>

#include <gtest/gtest.h>

#include "TempDir.h"
#include "base/PlistCodec.h"
#include "base/QRTProtocol.h"
#include "platform/DeviceProperties.h"
#include "platform/DeviceRoot.h"
#include "platform/FirstBoot.h"
#include "platform/Identity.h"
#include "platform/LockState.h"
#include "platform/Log.h"
#include "platform/UserDatabase.h"

using namespace platform;
using namespace std::chrono_literals;
namespace fs = std::filesystem;

namespace {

// Replaces the file the way the daemon's writers do: temporary file, rename.
void writeFile(const fs::path& path, const std::string& content) {
  fs::create_directories(path.parent_path());
  fs::path temporary = path.parent_path() / (".tmp." + path.filename().string());
  std::ofstream(temporary, std::ios::binary) << content;
  fs::rename(temporary, path);
}

void writePlist(const fs::path& path, const plist::Value& value) {
  plist::Data bytes = plist::writeBinary(value);
  writeFile(path, std::string(bytes.begin(), bytes.end()));
}

// Each test runs on a fresh device root.
class DeviceRootTest : public ::testing::Test {
 protected:
  void SetUp() override { setDeviceRoot(root_.path()); }
  void TearDown() override {
    logClose();
    logSetStderr(false);
    logSetRotation(1, 0);
    setDeviceRoot("/");
  }

  TempDir root_{"/tmp/qrt-platform"};
};

// ---- log ----

class LogTest : public DeviceRootTest {
 protected:
  std::string logPath() const { return root_ / "quarterd.log"; }
  // True when the text is exactly these lines, each after its
  // "YYYY-MM-DD HH:MM:SS.uuuuuu program[pid] " prefix.
  static bool hasExactly(const std::string& text, const std::vector<std::string>& lines) {
    const std::string program = program_invocation_short_name + ("[" + std::to_string(getpid()) + "] ");
    // By hand: std::regex trips a false maybe-uninitialized warning under the sanitizers.
    const std::string stamp = "dddd-dd-dd dd:dd:dd.dddddd ";
    std::string expected, masked = text;  // a digit where the stamp has one reads as 'd'
    for (const std::string& line : lines) {
      for (size_t i = 0, at = expected.size(); i < stamp.size() && at + i < masked.size(); ++i)
        if (stamp[i] == 'd') masked[at + i] = isdigit(static_cast<unsigned char>(masked[at + i])) ? 'd' : '?';
      expected += stamp + program + line + "\n";
    }
    return masked == expected;
  }
};

// Only exactly these lines: the debug line written before the level was
// lowered must not be among them.
TEST_F(LogTest, LinesCarryTheirPrefixGoToStderrOnRequestAndRotate) {
  ASSERT_TRUE(logOpen(logPath(), "com.norvane.quarterd", kLogNotice));
  EXPECT_TRUE(logEnabled(kLogNotice));
  EXPECT_FALSE(logEnabled(kLogDebug));
  QRTLog(kLogDebug, "hidden");
  logSetLevel(kLogDebug);
  testing::internal::CaptureStderr();
  logWrite(kLogNotice, "firstFunction", "hello 100%");
  QRTLog(kLogError, "value %d of %@", 7, std::string("thing"));
  logSetStderr(true);
  logWrite(kLogDebug, "third", "two\nlines\x7f\x1b\t");
  logSetStderr(false);
  logWrite(4, "fourth", "odd level");
  std::string copy = testing::internal::GetCapturedStderr();
  std::string content = fileText(logPath());
  EXPECT_TRUE(hasExactly(content, {"<Notice> firstFunction: hello 100%", "<Error> TestBody: value 7 of thing",
                                   "<Debug> third: two\\x0alines\\x7f\\x1b\t", "<Level 4> fourth: odd level"}))
      << content;
  EXPECT_TRUE(hasExactly(copy, {"<Debug> third: two\\x0alines\\x7f\\x1b\t"})) << copy;

  logClose();
  logSetLevel(kLogNotice);
  EXPECT_TRUE(logEnabled(kLogDebug)) << "without a file every line goes to the system log";
  EXPECT_FALSE(logOpen(root_ / "missing/quarterd.log", "com.norvane.quarterd", kLogNotice));
  EXPECT_TRUE(logEnabled(kLogDebug));

  // quarterd.log is newest, then .0, .1, ...; files beyond the count (even
  // stale ones left by a larger count) are deleted.
  for (uint32_t count : {1u, 3u}) {
    SCOPED_TRACE(count);
    const std::string stale[] = {logPath() + "." + std::to_string(count), logPath() + "." + std::to_string(count + 1)};
    for (const std::string& path : stale) writeFile(path, "stale");
    ASSERT_TRUE(logOpen(logPath(), "com.norvane.quarterd", kLogNotice));
    logSetRotation(count, 300);
    for (int i = 0; i < 40; ++i) logWrite(kLogNotice, "f", "line " + std::to_string(1000 + i));
    int newer = 2000;
    for (int i = -1; i < static_cast<int>(count); ++i) {
      const std::string file = fileText(i < 0 ? logPath() : logPath() + "." + std::to_string(i));
      EXPECT_LE(file.size(), 300u) << i;
      size_t at = file.find("line ");
      ASSERT_NE(at, std::string::npos) << i;
      int first = std::stoi(file.substr(at + 5));
      EXPECT_LT(first, newer) << i;
      EXPECT_GT(first, 1000) << i << ": the oldest lines were deleted";
      newer = first;
    }
    for (const std::string& path : stale) EXPECT_FALSE(fs::exists(path)) << path;
    logClose();
  }
}

// ---- user database and identities ----

plist::Dictionary identityEntry(const std::string& executable, const std::string& signing, bool entitled) {
  plist::Dictionary entry{{"Executable", executable}, {"SigningIdentifier", signing}};
  if (entitled) entry["Entitlements"] = plist::Dictionary{{QRTEntitlementAllowed, true}};
  return entry;
}

TEST_F(DeviceRootTest, UserDatabaseAndIdentityRegistryAreReadOnEveryLookup) {
  writeFile(hostPath("/etc/passwd"),
            "# accounts\nbroken:x:12\nbadid:x:abc:1::/x:/bin/sh\n"
            "_installer:x:33:33::/private/var/emplacerd:/bin/false\n"
            "mobile:x:501:501::/private/var/mobile:/bin/sh\n");
  writeFile(hostPath("/etc/group"), "wheel:x:0:root\nsystemusers:x:498:\n");
  std::optional<UserAccount> mobile = userByName("mobile");
  ASSERT_TRUE(mobile);
  EXPECT_EQ(mobile->uid, 501u);
  EXPECT_EQ(mobile->gid, 501u);
  EXPECT_EQ(mobile->homeDirectory, root_ / "private/var/mobile");
  EXPECT_EQ(userById(33).value_or(UserAccount{}).name, "_installer");
  EXPECT_FALSE(userByName("broken") || userByName("badid") || userById(499));
  EXPECT_EQ(groupByName("systemusers").value_or(GroupAccount{}).gid, 498u);
  EXPECT_FALSE(groupByName("staff"));

  writeFile(hostPath("/etc/passwd"), "mobile:x:502:502::/private/var/mobile2:/bin/sh\n");
  EXPECT_EQ(userByName("mobile").value_or(UserAccount{}).uid, 502u);
  EXPECT_FALSE(userById(33));
  fs::remove(hostPath("/etc/passwd"));
  EXPECT_FALSE(userByName("mobile"));

  // The identity registry: the last file in sorted order wins.
  fs::path registry = hostPath("/etc/quarterd/identities");
  writePlist(registry / "10-a.plist", identityEntry("/usr/bin/tool", "com.example.a", false));
  writePlist(registry / "20-b.plist", identityEntry("/usr/bin/tool", "com.example.b", true));
  writeFile(registry / "15-garbled.plist", "not a property list");
  writePlist(registry / "30-plain.plist", identityEntry("/usr/bin/plain", "com.example.plain", false));
  writePlist(registry / "40-noexec.plist", plist::Dictionary{{"SigningIdentifier", "com.example.none"}});

  CodeIdentity tool = *identityForExecutable("/usr/bin/tool");
  EXPECT_EQ(tool.signingIdentifier, "com.example.b");
  ASSERT_TRUE(tool.entitlements);
  EXPECT_TRUE(plist::find(*tool.entitlements, QRTEntitlementAllowed));
  CodeIdentity plain = *identityForExecutable("/usr/bin/plain");
  EXPECT_EQ(plain.signingIdentifier, "com.example.plain");
  EXPECT_FALSE(plain.entitlements);
  EXPECT_FALSE(identityForExecutable("/usr/bin/other")->signingIdentifier);

  // Readers racing a change see the old or the new entry, never anything else.
  std::atomic<int> strange{0};
  auto read = [&] {
    for (int i = 0; i < 200; ++i) {
      std::optional<std::string> id = identityForExecutable("/usr/bin/tool")->signingIdentifier;
      strange += id != "com.example.b" && id != "com.example.c";
    }
  };
  std::thread reader1(read), reader2(read);
  writePlist(registry / "50-c.plist", identityEntry("/usr/bin/tool", "com.example.c", false));
  reader1.join();
  reader2.join();
  EXPECT_EQ(strange, 0);
  EXPECT_EQ(identityForExecutable("/usr/bin/tool")->signingIdentifier, "com.example.c");
  fs::remove(registry / "50-c.plist");
  EXPECT_EQ(identityForExecutable("/usr/bin/tool")->signingIdentifier, "com.example.b");
  // Its parent moved aside and made anew: the new registry is the one read.
  fs::rename(hostPath("/etc/quarterd"), hostPath("/etc/quarterd.old"));
  writePlist(registry / "10-a.plist", identityEntry("/usr/bin/tool", "com.example.a", false));
  EXPECT_EQ(identityForExecutable("/usr/bin/tool")->signingIdentifier, "com.example.a");
  fs::remove_all(registry);
  EXPECT_FALSE(identityForExecutable("/usr/bin/tool")->signingIdentifier);
  setDeviceRoot("/");  // the system's own database
  EXPECT_EQ(userById(0).value_or(UserAccount{}).name, "root");
  EXPECT_TRUE(groupByName("root"));
}

// The entry is the file the peer runs; system-level entitlements go only to
// the uids in Users (root when absent). Expected: -1 none, 0 groups only, 1 all.
TEST_F(DeviceRootTest, PeerIdentityIsTheFileAndTheUid) {
  writeFile(hostPath("/etc/passwd"), "mobile:x:501:501::/private/var/mobile:/bin/sh\nsvc:x:120:120::/:/bin/false\n");
  const fs::path registry = hostPath("/etc/quarterd/identities"), file = registry / "tool.plist";
  struct stat real {};
  ASSERT_EQ(stat("/usr/bin/true", &real), 0);
  const plist::Dictionary groups{{"com.norvane.security.application-groups", plist::Array{"group.a"}}};
  const plist::Dictionary all{*groups.begin(), {QRTEntitlementAllowed, true}};
  const plist::Array none;
  const std::tuple<plist::Array, plist::Dictionary, uid_t, int, int, ino_t, int> rows[] = {
      {none, all, 0, 0644, 0755, 0, 1},
      {none, all, 501, 0644, 0755, 0, 0},
      {none, all, 120, 0644, 0755, 0, 0},
      {{"svc"}, all, 120, 0644, 0755, 0, 1},
      {{120}, all, 0, 0644, 0755, 0, 0},
      {{"mobile"}, all, 0, 0644, 0755, 0, -1},
      {{501}, groups, 501, 0644, 0755, 0, 0},
      {none, all, 0, 0664, 0755, 0, -1},
      {none, all, 0, 0644, 0777, 0, -1},
      {none, all, 0, 0644, 0755, 1, -1},  // another file at the path (a mount in the peer's namespace)
  };
  for (const auto& [users, entitlements, uid, fileMode, dirMode, otherFile, expected] : rows) {
    plist::Dictionary entry{
        {"Executable", "/usr/bin/true"}, {"SigningIdentifier", "t"}, {"Entitlements", entitlements}};
    if (!users.empty()) entry["Users"] = users;
    writePlist(file, entry);
    fs::permissions(file, static_cast<fs::perms>(fileMode));
    fs::permissions(registry, static_cast<fs::perms>(dirMode));
    auto identity = identityForPeer({getpid(), uid, uid, "/usr/bin/true", true, real.st_dev, real.st_ino + otherFile});
    const int got = !identity->signingIdentifier ? -1 : identity->systemLevel ? 1 : 0;
    EXPECT_EQ(got, expected) << "uid " << uid << " modes " << std::oct << fileMode << " " << dirMode;
    if (got == 0) { EXPECT_EQ(*identity->entitlements, groups); }
    fs::permissions(registry, static_cast<fs::perms>(0755));
  }
}

// A live peer's executable picks its identity in every integration test that
// sets the test's own; a peer that is gone must not be taken for anyone.
TEST_F(DeviceRootTest, PeerCredentialsOfAnExitedPeerAreNotVerified) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  snprintf(address.sun_path, sizeof address.sun_path, "%s", (root_ / "sock").c_str());
  int listener = socket(AF_UNIX, SOCK_STREAM, 0);
  ASSERT_EQ(bind(listener, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  ASSERT_EQ(listen(listener, 1), 0);
  pid_t child = fork();
  if (child == 0) {
    int fd = socket(AF_UNIX, SOCK_STREAM, 0);
    _exit(connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0 ? 0 : 1);
  }
  int status = -1;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_EQ(status, 0);
  int connection = accept(listener, nullptr, nullptr);
  std::optional<PeerCredentials> exited = peerCredentials(connection);
  ASSERT_TRUE(exited);
  EXPECT_EQ(exited->pid, child);
  EXPECT_EQ(exited->executable, "");
  EXPECT_FALSE(exited->verified);
  close(connection);
  close(listener);
}

// ---- device state ----

TEST_F(DeviceRootTest, FirstBootMarkerHoldsThisBootsId) {
  ASSERT_TRUE(createFirstBootMarker()) << strerror(errno);
  EXPECT_TRUE(firstBootMarkerExists());
  EXPECT_EQ(fs::status(firstBootMarkerPath()).permissions(), fs::perms::owner_read);
  ASSERT_TRUE(createFirstBootMarker()) << "re-creating replaces the marker";
  EXPECT_EQ(std::distance(fs::directory_iterator(hostPath("/run")), {}), 1) << "no temporary file left behind";
  writeFile(firstBootMarkerPath(), "00000000-0000-0000-0000-000000000000\n");
  EXPECT_FALSE(firstBootMarkerExists()) << "a marker from another boot does not count";
}

}  // namespace
