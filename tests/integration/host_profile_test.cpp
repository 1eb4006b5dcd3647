// The daemon without --root, on this machine's paths and accounts, inside a
// private mount namespace: tmpfs over /run and /var/lib, a copy of /etc that
// holds the quarterd accounts and two users. Nothing of the real /etc, /run
// or /var is touched.
#include <fcntl.h>
#include <grp.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>

#include "DaemonFixture.h"
#include "base/PlistCodec.h"

namespace {

constexpr uid_t kInstaller = 990, kAlice = 1500, kBob = 1501, kCarol = 1502, kWebServer = 33;
constexpr gid_t kSystemUsers = 992;

// Starts quarterd in a mount namespace of its own and talks to it from
// children that enter that namespace as a given uid.
class HostProfile {
 public:
  explicit HostProfile(const std::string& dir) {
    daemon_ = fork();
    if (daemon_ != 0) {
      proc_ = "/proc/" + std::to_string(daemon_);
      return;
    }
    if (unshare(CLONE_NEWNS) != 0 || mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
        mount("tmpfs", "/run", "tmpfs", 0, "mode=0755") != 0 ||
        mount("tmpfs", "/var/lib", "tmpfs", 0, "mode=0755") != 0 ||
        mount((dir + "/etc").c_str(), "/etc", nullptr, MS_BIND, nullptr) != 0)
      _exit(126);
    execl(QRT_DAEMON_PATH, QRT_DAEMON_PATH, "--log-file", "--log-level", "7", nullptr);
    _exit(127);
  }
  ~HostProfile() {
    kill(daemon_, SIGTERM);
    waitpid(daemon_, nullptr, 0);
  }
  // A path as the daemon sees it.
  std::string inside(const std::string& path) const { return proc_ + "/root" + path; }
  // One request from a process of uid.
  std::optional<plist::Dictionary> call(uid_t uid, const plist::Dictionary& message) const {
    int out[2];
    if (pipe(out) != 0) return std::nullopt;
    pid_t child = fork();
    if (child == 0) {
      close(out[0]);
      // The socket's directory through the namespace's root, opened while
      // still root: a sanitizer's runtime thread keeps a child from joining
      // the namespace itself.
      int run = open(inside("/run/quarterd").c_str(), O_PATH | O_DIRECTORY);
      if (run < 0 || setgroups(0, nullptr) != 0 || setresgid(uid, uid, uid) != 0 || setresuid(uid, uid, uid) != 0)
        _exit(1);
      auto connection = qk::Connection::connect("/proc/self/fd/" + std::to_string(run) + "/request.sock");
      auto reply = connection ? connection->call(message, std::chrono::seconds(30)) : std::nullopt;
      if (!reply) _exit(2);
      plist::Data bytes = plist::writeBinary(*reply);
      _exit(write(out[1], bytes.data(), bytes.size()) == static_cast<ssize_t>(bytes.size()) ? 0 : 3);
    }
    close(out[1]);
    std::string bytes;
    char buffer[4096];
    for (ssize_t n; (n = read(out[0], buffer, sizeof buffer)) > 0;) bytes.append(buffer, static_cast<size_t>(n));
    close(out[0]);
    waitpid(child, nullptr, 0);
    auto value = plist::parse(bytes.data(), bytes.size());
    if (!value || !value->isDictionary()) return std::nullopt;
    return value->dictionary();
  }

 private:
  pid_t daemon_ = -1;
  std::string proc_;
};

TEST(HostProfileTest, PathsAndOwnersAreTheHostsRepliesAndMetadataTheProtocols) {
  char tmpl[] = "/tmp/quarterd-host.XXXXXX";
  ASSERT_NE(mkdtemp(tmpl), nullptr);
  const std::string dir = tmpl;
  ASSERT_EQ(chmod(dir.c_str(), 0755), 0);
  ASSERT_EQ(
      system(("cp -a /etc " + dir + "/etc && mkdir -p " + dir + "/etc/quarterd/identities " + dir + "/victim").c_str()),
      0);
  // www-data keeps uid 33, as on Debian: it must never own a container.
  std::string passwd = readFile("/etc/passwd") +
                       "quarterd-installer:x:990:990::/var/lib/quarterd/installer:/usr/sbin/nologin\n"
                       "quarterd-system:x:991:991::/nonexistent:/usr/sbin/nologin\n";
  for (auto [name, uid] : {std::pair{"alice", kAlice}, {"bob", kBob}, {"carol", kCarol}}) {
    const std::string home = dir + "/home/" + name;
    std::filesystem::create_directories(home);
    ASSERT_EQ(chown(home.c_str(), uid, static_cast<gid_t>(-1)), 0);
    passwd += std::string(name) + ":x:" + std::to_string(uid) + ":" + std::to_string(uid) + "::" + home + ":/bin/sh\n";
  }
  writeFile(dir + "/etc/passwd", passwd);
  ASSERT_EQ(symlink((dir + "/victim").c_str(), (dir + "/home/carol/.local").c_str()), 0);
  writeFile(dir + "/etc/group", readFile("/etc/group") +
                                    "quarterd-installer:x:990:\nquarterd-system:x:991:\nquarterd-systemusers:x:992:\n"
                                    "alice:x:1500:\nbob:x:1501:\n");
  writeFile(dir + "/etc/quarterd/quarterd.conf",
            "# test\n[Daemon]\nDefaultUser=alice\nMaxContainersPerClass=lots\nColour=blue\n");
  plist::Dictionary identity{{"Executable", readLink("/proc/self/exe")},
                             {"SigningIdentifier", "com.example.installer"},
                             {"Entitlements", plist::Dictionary{{QRTEntitlementAllowed, true}}}};
  writePlist(dir + "/etc/quarterd/identities/installer.plist", identity);

  HostProfile host(dir);
  ASSERT_TRUE(eventually([&] { return exists(host.inside("/run/quarterd/request.sock")); }));
  const std::string store = "/var/lib/quarterd/containers/";
  const std::string aliceData = dir + "/home/alice/.local/share/quarterd/Containers/";
  const std::string bobData = dir + "/home/bob/.local/share/quarterd/Containers/";
  struct Row {
    const char* what;
    uid_t caller;
    uint64_t user, cls;
    bool made;               // else any error
    std::string pathPrefix;  // of ReplyPath, a host path
    uid_t owner;             // on disk; UINT32_MAX: not checked
    uint64_t persona;        // in the metadata file; 0: not checked
  };
  const Row rows[] = {
      {"bundle: quarterd-installer's, 33 in metadata", 0, 33, 1, true, store + "Bundle/", kInstaller, 33},
      {"system container: quarterd-system's group in the ACL", 0, 499, 12, true, store, UINT32_MAX, 499},
      {"default user 1 is DefaultUser=alice", 0, 1, 2, true, aliceData, kAlice, kAlice},
      {"alice's own data", kAlice, kAlice, 2, true, aliceData, kAlice, kAlice},
      {"bob's user 1 is bob", kBob, 1, 2, true, bobData, kBob, kBob},
      {"the web server's uid 33 is nobody here", kWebServer, 1, 2, false, "", UINT32_MAX, 0},
      {"carol's ~/.local is a link elsewhere", kCarol, 1, 2, false, "", UINT32_MAX, 0},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.what);
    auto reply = host.call(row.caller, request(QRTCommandCreateOrLookupContainer,
                                               {{QRTKeyUserID, row.user},
                                                {QRTKeyContainerClass, row.cls},
                                                {QRTKeyIdentifier, std::string("com.example.") + row.what},
                                                {QRTKeyCreateIfNecessary, true}}));
    ASSERT_TRUE(reply);
    EXPECT_EQ(codeOf(reply) == 1, row.made) << codeOf(reply);
    if (!row.made) continue;
    const std::string path = stringAt(reply, QRTReplyKeyPath);
    ASSERT_EQ(path.rfind(row.pathPrefix, 0), 0u) << path;
    const std::string seen = path.starts_with("/var/") ? host.inside(path) : path;
    if (row.owner != UINT32_MAX) { EXPECT_EQ(ownerAndMode(seen).first, row.owner); }
    auto metadata = readPlist(seen + "/" + kMetadataFile);
    EXPECT_EQ(u64At(metadata, "QRTMetadataPersona"), row.persona);
  }
  // The data migration hands the bundle class to the installer's account, not to uid 33.
  EXPECT_EQ(codeOf(host.call(0, request(QRTCommandPerformDataMigration, {}))), 1u);
  EXPECT_EQ(ownerAndMode(host.inside(store + "Bundle/Application")).first, kInstaller);
  // The home's own .local stays its user's.
  EXPECT_EQ(ownerAndMode(dir + "/home/bob/.local").first, kBob);
  EXPECT_TRUE(listDirectory(dir + "/victim").empty());
  EXPECT_EQ(system(("getfacl -n " + host.inside(store) +
                    "Data/System/* 2>/dev/null | grep -q '^group:" + std::to_string(kSystemUsers) + ":'")
                       .c_str()),
            0);

  const std::string log = readFile(host.inside("/var/lib/quarterd/daemon/Library/Logs/QuarterKit/quarterd.log"));
  for (const char* line : {"line 5: unknown key Colour=", "line 4: bad value 'lots' for MaxContainersPerClass=",
                           "Default user is alice (uid 1500)"})
    EXPECT_NE(log.find(line), std::string::npos) << line << "\n" << log;
  EXPECT_EQ(log.find("Failed to get mobile uid"), std::string::npos);
  if (!::testing::Test::HasFailure()) system(("rm -rf " + dir).c_str());
}

}  // namespace
