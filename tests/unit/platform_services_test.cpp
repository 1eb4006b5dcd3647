#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>
#include <thread>

#include <gtest/gtest.h>

#include "base/PlistCodec.h"
#include "platform/DeviceProperties.h"
#include "platform/DeviceRoot.h"
#include "platform/FirstBoot.h"
#include "platform/Identity.h"
#include "platform/LockState.h"
#include "platform/Log.h"
#include "platform/Queue.h"
#include "platform/UserDatabase.h"

using namespace platform;
using namespace std::chrono_literals;
namespace fs = std::filesystem;

namespace {

std::string readFile(const fs::path& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream content;
  content << in.rdbuf();
  return content.str();
}

void writeFile(const fs::path& path, const std::string& content) {
  fs::create_directories(path.parent_path());
  std::ofstream(path, std::ios::binary | std::ios::trunc) << content;
}

// Replaces the file the way the daemon's writers do: temporary file, rename.
void replaceFile(const fs::path& path, const std::string& content) {
  fs::path temporary = path.parent_path() / (".tmp." + path.filename().string());
  writeFile(temporary, content);
  fs::rename(temporary, path);
}

void writePlist(const fs::path& path, const plist::Value& value) {
  plist::Data bytes = plist::writeBinary(value);
  writeFile(path, std::string(bytes.begin(), bytes.end()));
}

// Each test runs on a fresh device root.
class DeviceRootTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/qrt-platform-XXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    root_ = pattern;
    setDeviceRoot(root_);
  }
  void TearDown() override {
    logClose();
    logSetStderr(false);
    logSetRotation(1, 0);
    setDeviceRoot("/");
    fs::remove_all(root_);
  }
  fs::path at(const std::string& devicePath) const { return hostPath(devicePath); }

  fs::path root_;
};

// ---- device root ----

TEST(DeviceRootPaths, HostPathPrefixesTheRoot) {
  setDeviceRoot("/tmp/r/");
  EXPECT_EQ(deviceRoot(), "/tmp/r");
  EXPECT_EQ(hostPath("/private/var/root/"), "/tmp/r/private/var/root/");
  setDeviceRoot("/");
  EXPECT_EQ(hostPath("/private/var/root/"), "/private/var/root/");
}

// ---- log ----

class LogTest : public DeviceRootTest {
 protected:
  fs::path logPath() const { return root_ / "quarterd.log"; }
  // Takes one line "YYYY-MM-DD HH:MM:SS.uuuuuu program[pid] <tag> text\n"
  // off the front of the log.
  static bool takeLine(std::string_view& log, const std::string& tagAndText) {
    const std::string_view shape = "dddd-dd-dd dd:dd:dd.dddddd ";
    if (log.size() < shape.size()) return false;
    for (size_t i = 0; i < shape.size(); ++i)
      if (shape[i] == 'd' ? !isdigit(static_cast<unsigned char>(log[i])) : log[i] != shape[i]) return false;
    std::string rest = std::string(program_invocation_short_name) + "[" + std::to_string(getpid()) + "] " +
                       tagAndText + "\n";
    if (log.substr(shape.size(), rest.size()) != rest) return false;
    log.remove_prefix(shape.size() + rest.size());
    return true;
  }
};

TEST_F(LogTest, LinesCarryTimeProgramPidLevelAndFunction) {
  ASSERT_TRUE(logOpen(logPath(), "com.norvane.quarterd", kLogDebug));
  logWrite(kLogNotice, "firstFunction", "hello 100%");
  QRTLog(kLogError, "value %d of %@", 7, std::string("thing"));
  logWrite(kLogDebug, "third", "two\nlines");
  logWrite(4, "fourth", "odd level");
  std::string content = readFile(logPath());
  std::string_view log = content;
  EXPECT_TRUE(takeLine(log, "<Notice> firstFunction: hello 100%")) << content;
  EXPECT_TRUE(takeLine(log, "<Error> TestBody: value 7 of thing")) << content;
  EXPECT_TRUE(takeLine(log, "<Debug> third: two\nlines")) << content;
  EXPECT_TRUE(takeLine(log, "<Level 4> fourth: odd level")) << content;
  EXPECT_TRUE(log.empty()) << content;
}

TEST_F(LogTest, LevelFiltersLinesWhileAFileIsOpen) {
  ASSERT_TRUE(logOpen(logPath(), "com.norvane.quarterd", kLogNotice));
  EXPECT_EQ(logLevel(), kLogNotice);
  EXPECT_TRUE(logEnabled(kLogError));
  EXPECT_TRUE(logEnabled(kLogNotice));
  EXPECT_FALSE(logEnabled(kLogDebug));
  QRTLog(kLogDebug, "hidden");
  QRTLog(kLogNotice, "shown");
  logSetLevel(kLogDebug);
  QRTLog(kLogDebug, "now shown");
  std::string content = readFile(logPath());
  EXPECT_EQ(content.find("hidden"), std::string::npos);
  EXPECT_NE(content.find("shown"), std::string::npos);
  EXPECT_NE(content.find("now shown"), std::string::npos);
  logSetLevel(kLogNotice);

  logClose();
  EXPECT_TRUE(logEnabled(kLogDebug)) << "without a file every line goes to the system log";
  EXPECT_FALSE(logOpen((root_ / "missing" / "quarterd.log").string(), "com.norvane.quarterd", kLogNotice));
  EXPECT_TRUE(logEnabled(kLogDebug));
}

// Writes numbered lines until several rotations have happened; returns the
// number of each file's first line, newest file first.
std::vector<int> fillAndRotate(const fs::path& path, uint32_t count) {
  logSetRotation(count, 300);
  for (int i = 0; i < 40; ++i) logWrite(kLogNotice, "f", "line " + std::to_string(1000 + i));
  std::vector<int> firsts;
  for (int i = -1; i < static_cast<int>(count); ++i) {
    fs::path file = i < 0 ? path : fs::path(path.string() + "." + std::to_string(i));
    std::string content = readFile(file);
    EXPECT_LE(content.size(), 300u) << file;
    size_t at = content.find("line ");
    firsts.push_back(at == std::string::npos ? -1 : std::stoi(content.substr(at + 5)));
  }
  return firsts;
}

TEST_F(LogTest, RotationKeepsOneFile) {
  ASSERT_TRUE(logOpen(logPath(), "com.norvane.quarterd", kLogNotice));
  std::vector<int> firsts = fillAndRotate(logPath(), 1);
  EXPECT_GT(firsts[0], firsts[1]);
  EXPECT_GT(firsts[1], 1000);
  EXPECT_FALSE(fs::exists(logPath().string() + ".1"));
}

TEST_F(LogTest, RotationShiftsOlderFilesUp) {
  writeFile(logPath().string() + ".3", "stale");  // left by a larger file count
  writeFile(logPath().string() + ".4", "stale");
  ASSERT_TRUE(logOpen(logPath(), "com.norvane.quarterd", kLogNotice));
  std::vector<int> firsts = fillAndRotate(logPath(), 3);
  EXPECT_GT(firsts[0], firsts[1]);
  EXPECT_GT(firsts[1], firsts[2]);
  EXPECT_GT(firsts[2], firsts[3]);
  EXPECT_GT(firsts[3], 1000) << "the oldest lines were deleted";
  EXPECT_FALSE(fs::exists(logPath().string() + ".3"));
  EXPECT_FALSE(fs::exists(logPath().string() + ".4"));
}

TEST_F(LogTest, StderrGetsACopyOfEveryLine) {
  fs::path captured = root_ / "stderr";
  int saved = dup(STDERR_FILENO);
  int capture = open(captured.c_str(), O_CREAT | O_WRONLY | O_TRUNC, 0644);
  ASSERT_GE(capture, 0);
  dup2(capture, STDERR_FILENO);
  ASSERT_TRUE(logOpen(logPath(), "com.norvane.quarterd", kLogNotice));
  logSetStderr(true);
  logWrite(kLogError, "copied", "to both");
  logSetStderr(false);
  logWrite(kLogError, "notCopied", "file only");
  dup2(saved, STDERR_FILENO);
  close(saved);
  close(capture);
  std::string copy = readFile(captured);
  std::string_view copied = copy;
  EXPECT_TRUE(takeLine(copied, "<Error> copied: to both") && copied.empty()) << copy;
  EXPECT_NE(readFile(logPath()).find("file only"), std::string::npos);
}

// ---- user database ----

TEST_F(DeviceRootTest, UserDatabaseReadsTheRootsFilesOnEveryLookup) {
  fs::path passwd = at("/etc/passwd");
  writeFile(passwd,
            "# accounts\n"
            "root:x:0:0::/private/var/root:/bin/sh\n"
            "broken:x:12\n"
            "badid:x:abc:1::/x:/bin/sh\n"
            "_installer:x:33:33::/private/var/emplacerd:/bin/false\n"
            "mobile:x:501:501::/private/var/mobile:/bin/sh\n");
  writeFile(at("/etc/group"), "wheel:x:0:root\nsystemusers:x:498:\n");

  std::optional<UserAccount> mobile = userByName("mobile");
  ASSERT_TRUE(mobile);
  EXPECT_EQ(mobile->uid, 501u);
  EXPECT_EQ(mobile->gid, 501u);
  EXPECT_EQ(mobile->homeDirectory, (root_ / "private/var/mobile").string());
  std::optional<UserAccount> installer = userById(33);
  ASSERT_TRUE(installer);
  EXPECT_EQ(installer->name, "_installer");
  EXPECT_FALSE(userByName("broken"));
  EXPECT_FALSE(userByName("badid"));
  EXPECT_FALSE(userById(499));
  std::optional<GroupAccount> group = groupByName("systemusers");
  ASSERT_TRUE(group);
  EXPECT_EQ(group->gid, 498u);
  EXPECT_FALSE(groupByName("staff"));

  writeFile(passwd, "mobile:x:502:502::/private/var/mobile2:/bin/sh\n");
  ASSERT_TRUE(userByName("mobile"));
  EXPECT_EQ(userByName("mobile")->uid, 502u);
  EXPECT_FALSE(userById(33));
  fs::remove(passwd);
  EXPECT_FALSE(userByName("mobile"));
}

TEST(SystemUserDatabase, AsksTheSystemWhenTheRootIsSlash) {
  setDeviceRoot("/");
  std::optional<UserAccount> root = userById(0);
  ASSERT_TRUE(root);
  EXPECT_EQ(root->name, "root");
  EXPECT_EQ(userByName("root")->uid, 0u);
  EXPECT_TRUE(groupByName("root"));
  EXPECT_FALSE(userByName("no-such-account-here"));
}

// ---- identities ----

plist::Dictionary identityEntry(const std::string& executable, const std::string& signing, bool entitled) {
  plist::Dictionary entry{{"Executable", executable}, {"SigningIdentifier", signing}};
  if (entitled) entry["Entitlements"] = plist::Dictionary{{"com.norvane.private.QuarterKit.allowed", true}};
  return entry;
}

TEST_F(DeviceRootTest, IdentityRegistryLastSortedFileWinsAndChangesAreSeen) {
  fs::path registry = at("/etc/quarterd/identities");
  writePlist(registry / "10-a.plist", identityEntry("/usr/bin/tool", "com.example.a", false));
  writePlist(registry / "20-b.plist", identityEntry("/usr/bin/tool", "com.example.b", true));
  writeFile(registry / "15-garbled.plist", "not a property list");
  writePlist(registry / "30-plain.plist", identityEntry("/usr/bin/plain", "com.example.plain", false));
  writePlist(registry / "40-noexec.plist", plist::Dictionary{{"SigningIdentifier", "com.example.none"}});

  CodeIdentity tool = identityForExecutable("/usr/bin/tool");
  EXPECT_EQ(tool.signingIdentifier, "com.example.b");
  ASSERT_TRUE(tool.entitlements);
  EXPECT_TRUE(plist::find(*tool.entitlements, "com.norvane.private.QuarterKit.allowed"));
  CodeIdentity plain = identityForExecutable("/usr/bin/plain");
  EXPECT_EQ(plain.signingIdentifier, "com.example.plain");
  EXPECT_FALSE(plain.entitlements);
  CodeIdentity unknown = identityForExecutable("/usr/bin/other");
  EXPECT_FALSE(unknown.signingIdentifier);
  EXPECT_FALSE(unknown.entitlements);

  std::atomic<bool> consistent{true};
  std::vector<std::thread> readers;
  for (int t = 0; t < 4; ++t) {
    readers.emplace_back([&] {
      for (int i = 0; i < 200; ++i) {
        std::optional<std::string> id = identityForExecutable("/usr/bin/tool").signingIdentifier;
        if (id != "com.example.b" && id != "com.example.c") consistent = false;
      }
    });
  }
  writePlist(registry / "50-c.plist", identityEntry("/usr/bin/tool", "com.example.c", false));
  for (auto& reader : readers) reader.join();
  EXPECT_TRUE(consistent);
  EXPECT_EQ(identityForExecutable("/usr/bin/tool").signingIdentifier, "com.example.c");
  fs::remove(registry / "50-c.plist");
  EXPECT_EQ(identityForExecutable("/usr/bin/tool").signingIdentifier, "com.example.b");
  fs::remove_all(registry);
  EXPECT_FALSE(identityForExecutable("/usr/bin/tool").signingIdentifier);
}

TEST(PeerCredentials, ALivePeerIsVerified) {
  int pair[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, pair), 0);
  std::optional<PeerCredentials> peer = peerCredentials(pair[0]);
  ASSERT_TRUE(peer);
  EXPECT_EQ(peer->pid, getpid());
  EXPECT_EQ(peer->uid, getuid());
  EXPECT_EQ(peer->gid, getgid());
  EXPECT_EQ(peer->executable, fs::read_symlink("/proc/self/exe").string());
  EXPECT_TRUE(peer->verified);
  close(pair[0]);
  close(pair[1]);
  EXPECT_FALSE(peerCredentials(-1));
}

TEST_F(DeviceRootTest, AnExitedPeerHasNoExecutable) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::string path = (root_ / "sock").string();
  ASSERT_LT(path.size(), sizeof address.sun_path);
  strcpy(address.sun_path, path.c_str());
  int listener = socket(AF_UNIX, SOCK_STREAM, 0);
  ASSERT_EQ(bind(listener, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  ASSERT_EQ(listen(listener, 1), 0);
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    int fd = socket(AF_UNIX, SOCK_STREAM, 0);
    _exit(connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0 ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_EQ(status, 0);
  int connection = accept(listener, nullptr, nullptr);
  ASSERT_GE(connection, 0);
  std::optional<PeerCredentials> peer = peerCredentials(connection);
  ASSERT_TRUE(peer);
  EXPECT_EQ(peer->pid, child);
  EXPECT_EQ(peer->executable, "");
  EXPECT_FALSE(peer->verified);
  close(connection);
  close(listener);
}

// ---- device properties ----

TEST_F(DeviceRootTest, DevicePropertiesDefaultAndRead) {
  EXPECT_FALSE(deviceIsInternalBuild());
  EXPECT_EQ(deviceMultiUserFlags(), 0u);
  EXPECT_FALSE(deviceRefusesTerminationAssertions());
  EXPECT_FALSE(systemVersionRecord());

  fs::path properties = at("/etc/device-properties.plist");
  writePlist(properties, plist::Dictionary{{"InternalBuild", true},
                                           {"MultiUserFlags", 0x80000000ull},
                                           {"RefuseTerminationAssertions", true}});
  EXPECT_TRUE(deviceIsInternalBuild());
  EXPECT_EQ(deviceMultiUserFlags(), 0x80000000u);
  EXPECT_TRUE(deviceRefusesTerminationAssertions());

  writePlist(properties, plist::Dictionary{{"InternalBuild", "yes"}, {"MultiUserFlags", true}});
  EXPECT_FALSE(deviceIsInternalBuild()) << "a value of another type is the default";
  EXPECT_EQ(deviceMultiUserFlags(), 0u);
  writeFile(properties, "garbage");
  EXPECT_FALSE(deviceIsInternalBuild());

  writePlist(at("/etc/system-version.plist"),
             plist::Dictionary{{"BuildVersion", "21A100"}, {"ReleaseType", "Internal"}});
  std::optional<plist::Dictionary> version = systemVersionRecord();
  ASSERT_TRUE(version);
  EXPECT_EQ(plist::find(*version, "BuildVersion")->string(), "21A100");
  writePlist(at("/etc/system-version.plist"), plist::Array{"not", "a", "dictionary"});
  EXPECT_FALSE(systemVersionRecord());
}

// ---- first-boot marker ----

TEST_F(DeviceRootTest, FirstBootMarkerHoldsThisBootsId) {
  EXPECT_EQ(firstBootMarkerPath(), (root_ / "run/quarterd.fb_check").string());
  EXPECT_FALSE(firstBootMarkerExists());
  ASSERT_TRUE(createFirstBootMarker()) << strerror(errno);
  EXPECT_TRUE(firstBootMarkerExists());
  struct stat st;
  ASSERT_EQ(stat(firstBootMarkerPath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0400u);
  ASSERT_TRUE(createFirstBootMarker()) << "re-creating replaces the marker";
  EXPECT_EQ(std::distance(fs::directory_iterator(at("/run")), fs::directory_iterator()), 1)
      << "no temporary file left behind";

  fs::remove(firstBootMarkerPath());
  EXPECT_FALSE(firstBootMarkerExists()) << "a deleted marker simulates a reboot";
  writeFile(firstBootMarkerPath(), "00000000-0000-0000-0000-000000000000\n");
  EXPECT_FALSE(firstBootMarkerExists()) << "a marker from another boot does not count";
}

// ---- lock state ----

TEST_F(DeviceRootTest, LockStateReadsTheStateFile) {
  EXPECT_EQ(deviceLockState(), 0);
  fs::path state = at("/run/device/lockstate");
  writeFile(state, "1\n");
  EXPECT_EQ(deviceLockState(), 1);
  writeFile(state, "3");
  EXPECT_EQ(deviceLockState(), 3);
  writeFile(state, "locked");
  EXPECT_NE(deviceLockState(), 0);
  EXPECT_NE(deviceLockState(), 1);
}

TEST_F(DeviceRootTest, LockStateWatcherCallsBackOnTheMainQueue) {
  // Shared: the watcher outlives the test and may still post a callback.
  struct Seen {
    std::vector<int> states;
    std::thread::id thread;
  };
  auto seen = std::make_shared<Seen>();
  fs::path state = at("/run/device/lockstate");
  ASSERT_EQ(watchLockState([seen, state] {
              seen->thread = std::this_thread::get_id();
              seen->states.push_back(deviceLockState());
              if (seen->states.back() == 1) replaceFile(state, "0\n");
              if (seen->states.back() == 0) stopMainLoop();
            }),
            0);
  ASSERT_TRUE(fs::is_directory(at("/run/device")));
  replaceFile(state, "1\n");

  std::mutex mutex;
  std::condition_variable finished;
  bool done = false, timedOut = false;
  std::thread stopper([&] {
    std::unique_lock lock(mutex);
    if (!finished.wait_for(lock, 30s, [&] { return done; })) {
      timedOut = true;
      stopMainLoop();
    }
  });
  EXPECT_EQ(runMainLoop(), 0);
  {
    std::lock_guard lock(mutex);
    done = true;
  }
  finished.notify_all();
  stopper.join();
  ASSERT_FALSE(timedOut);
  ASSERT_GE(seen->states.size(), 2u);
  EXPECT_EQ(seen->states.front(), 1);
  EXPECT_EQ(seen->states.back(), 0);
  EXPECT_EQ(seen->thread, std::this_thread::get_id());
}

}  // namespace
