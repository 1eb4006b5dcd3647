// quarter-exec against the real daemon: what a program it launches can and
// cannot reach, and whom it refuses.
#include <fcntl.h>
#include <limits.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "DaemonFixture.h"
#include "QuarterKit/Upcall.h"

namespace {

class ExecTest : public DaemonFixture {
 protected:
  void SetUp() override {
    DaemonFixture::SetUp();
    // A second user, with a container of the same program.
    writeFile(root + "/etc/passwd", readFile(root + "/etc/passwd") + "other:x:502:502::/private/var/other:/bin/sh\n");
    writeFile(root + "/etc/group", readFile(root + "/etc/group") + "other:x:502:\n");
    std::filesystem::create_directories(root + "/private/var/other");
    // Copies under the root, where every user can run them; the probe is
    // registered as com.example.a with one application group.
    std::filesystem::create_directories(root + "/bin");
    probe = root + "/bin/probe";
    launcher = root + "/bin/quarter-exec";
    std::filesystem::copy_file(QRT_EXEC_PROBE_PATH, probe);
    std::filesystem::copy_file(QRT_EXEC_PATH, launcher);
    char resolved[PATH_MAX];
    ASSERT_NE(realpath(probe.c_str(), resolved), nullptr);
    setIdentity("probe", resolved, "com.example.a",
                {{"com.norvane.security.application-groups", plist::Array{"group.com.example.shared"}}});
    // An entitled program where the system keeps its programs.
    entitled = "/usr/local/bin/qrt-exec-test-entitled-" + std::to_string(getpid());
    std::filesystem::copy_file(QRT_QUARTERCTL_PATH, entitled, std::filesystem::copy_options::overwrite_existing);
    setIdentity("entitled", entitled, "com.example.entitled", {{QRTEntitlementAllowed, true}});
  }
  void TearDown() override {
    unlink(entitled.c_str());
    DaemonFixture::TearDown();
  }

  // The launcher with the arguments (behind a wrapper command), as root or
  // (uid given) as that user, on a terminal of its own, with an inherited
  // descriptor 99 and variables that must not reach the program.
  ProgramRun launch(const std::vector<std::string>& args, uid_t asUser = 0, std::vector<std::string> command = {},
                    const std::string& input = "/dev/null") {
    const std::string out = root + "/exec.out", err = root + "/exec.err";
    // The terminal's master stays here: its last close would hang the program up.
    int pty = posix_openpt(O_RDWR | O_NOCTTY | O_CLOEXEC);
    EXPECT_TRUE(pty >= 0 && grantpt(pty) == 0 && unlockpt(pty) == 0);
    pid_t child = fork();
    if (child == 0) {
      int o = open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0666),
          e = open(err.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0666);
      int i = open(input.c_str(), O_RDONLY);
      if (o < 0 || e < 0 || i < 0 || dup2(o, 1) < 0 || dup2(e, 2) < 0 || dup2(i, 0) < 0 || dup2(i, 99) < 0) _exit(120);
      if (setsid() < 0 || open(ptsname(pty), O_RDWR | O_CLOEXEC) < 0) _exit(123);
      setenv("LD_LIBRARY_PATH", "/nowhere", 1);
      setenv("TERM", "xterm-test", 1);
      if (asUser && (setresgid(asUser, asUser, asUser) != 0 || setresuid(asUser, asUser, asUser) != 0)) _exit(121);
      command.push_back(launcher);
      command.insert(command.end(), args.begin(), args.end());
      std::vector<char*> argv;
      for (const std::string& a : command) argv.push_back(const_cast<char*>(a.c_str()));
      argv.push_back(nullptr);
      execv(argv[0], argv.data());
      _exit(122);
    }
    int status = -1;
    waitpid(child, &status, 0);
    close(pty);
    return {WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status), readFile(out), readFile(err)};
  }

  std::string probe, launcher, entitled;
};

TEST_F(ExecTest, ProgramReachesItsContainersAndNothingElse) {
  const Container otherProgram = make(501, "com.example.b", 2);
  const Container otherUser = make(502, "com.example.a", 2);
  // The launcher's own question, asked first to learn the paths.
  qk::UpcallRequest question;
  question.codeSignatureId = "com.example.a";
  question.personaId = 501;
  question.containerType = 0;
  question.appGroupIds = {"group.com.example.shared"};
  auto client = qk::UpcallClient::connect(qk::upcallSocketPath(root));
  ASSERT_TRUE(client);
  auto answer = client->call(question);
  ASSERT_TRUE(answer && answer->dataContainer && answer->groups.size() == 1u);
  const std::string data = *answer->dataContainer, group = answer->groups[0].second;
  const std::string database = root + "/private/var/root/Library/QuarterKit/containers.sqlite3";
  const std::string metadata = std::string("/") + kMetadataFile;

  struct Case {
    std::string access, expected;
  } cases[] = {
      {"w:" + data + "/Documents/note", "ok"},
      {"w:" + data + "/tmp/scratch", "ok"},
      {"w:" + group + "/Library/note", "ok"},
      {"w:" + data + metadata, "EACCES"},  // the daemon's file inside the program's own container
      {"w:" + data + "/.dotfile", "ok"},   // made at the top, where nothing may be removed
      {"u:" + data + metadata, "EACCES"},
      {"w:" + otherProgram.path + "/Documents/x", "EACCES"},  // same user: only Landlock stands in the way
      {"r:" + otherProgram.path + metadata, "EACCES"},
      {"w:" + otherUser.path + "/Documents/x", "EACCES"},
      {"r:" + otherUser.path + metadata, "EACCES"},
      {"r:" + database, exists(database) ? "EACCES" : "ENOENT"},
      {"w:" + database, "EACCES"},
      {"r:" + root + "/etc/passwd", "EACCES"},  // world-readable, outside every container
      {"r:/proc/self/status", "ok"},
      {"c:/proc/self/status", "ok"},  // a child's own entry
      {"r:/proc/1/environ", "EACCES"},
      {"c:/dev/tty", "ok"},
      {"f:99", "EBADF"},  // inherited by the launcher
      {"e:LD_LIBRARY_PATH", "unset"},
      {"e:TERM", "xterm-test"},
      {"e:PATH", "/usr/local/bin:/usr/bin:/bin"},
      {"e:HOME", data},
      {"e:XDG_CONFIG_HOME", data + "/Library/Preferences"},
      // The confined program stores a library and preloads it into a
      // registered program, to act under that program's identity.
      {"x:" + data + "/Library/l.so", "exec EACCES\nfailed"},
  };
  std::vector<std::string> args{"--root", root, "--user", "501", "--identifier", "com.example.a", "--", probe};
  std::string expected;
  for (const Case& c : cases) {
    args.push_back(c.access);
    expected += c.expected + "\n";
  }
  args.insert(args.end(),
              {entitled, "--root", root, "create", "--class", "2", "--user", "502", "--identifier", "stolen"});
  ProgramRun run = launch(args, 0, {}, QRT_EXEC_PRELOAD_PATH);
  ASSERT_EQ(run.status, 0) << run.err;
  EXPECT_EQ(run.out, expected);
  EXPECT_EQ(ownerAndMode(data + "/Documents/note").first, 501u) << "the program runs as the user";
  EXPECT_EQ(readFile(group + "/Library/note"), "probe\n");

  // The next launch takes the program directories' verdicts from the first;
  // a program registered since in one of them is refused all the same.
  setIdentity("env", "/usr/bin/env", "com.example.env", {});
  run = launch({"--root", root, "--user", "501", "--identifier", "com.example.a", "--", probe,
                "x:" + data + "/Library/l.so", "/usr/bin/env"},
               0, {}, QRT_EXEC_PRELOAD_PATH);
  EXPECT_EQ(run.out, "exec EACCES\nfailed\n") << run.err;
}

TEST_F(ExecTest, RefusesWithClearMessages) {
  const std::vector<std::string> noLandlock{QRT_SECCOMP_RUN_PATH, "--deny", "landlock_create_ruleset", "--"};
  // The options, then the run's user, identifier and program ("" leaves one out), then what follows.
  auto with = [&](std::vector<std::string> options, std::vector<std::string> after = {},
                  const std::string& user = "501", const std::string& identifier = "com.example.a",
                  const std::string& program = "probe") {
    options.insert(options.begin(), {"--root", root});
    if (!user.empty()) options.insert(options.end(), {"--user", user});
    options.insert(options.end(), {"--identifier", identifier});
    if (!program.empty()) options.insert(options.end(), {"--", program == "probe" ? probe : program});
    options.insert(options.end(), after.begin(), after.end());
    return options;
  };
  struct Case {
    std::vector<std::string> args;
    int status;
    std::string message;
    uid_t user = 0;
    std::string out = "";
    std::vector<std::string> command = {};
  } cases[] = {
      {with({}), 1, "must be run as root", 501},
      {with({}, {}, "501", "com.example.nobody"), 1,
       "unknown identifier com.example.nobody: " + probe + " is registered as com.example.a"},
      {with({}, {}, "501", "com.example.a", "/bin/true"), 1,
       "unknown identifier com.example.a: /usr/bin/true has no identity"},
      {with({}, {}, "777"), 1, "no account for user 777"},
      {with({}, {}, "0"), 2, "--user 0: root cannot be"},
      {with({}, {}, ""), 2, "--user is required"},
      {with({}, {}, "501", "com.example.a", ""), 2, "no program given"},
      {with({}, {}, "501", "com.example.a", "/no/such"), 127, "cannot find"},
      {with({}), 1, "the kernel offers no Landlock", 0, "", noLandlock},
      {with({"--allow-unconfined"}), 0, "warning: " + probe + " runs without any confinement", 0, "", noLandlock},
      {with({}, {"n:1"}), 0, "", 0, "ECONNREFUSED\n"},
      {with({"--no-network"}, {"n:1"}), 0, "", 0, "EACCES\n"},
  };
  for (const Case& c : cases) {
    ProgramRun launched = launch(c.args, c.user, c.command);
    EXPECT_EQ(launched.status, c.status) << c.message << ": " << launched.err;
    EXPECT_TRUE(contains(launched.err, c.message.empty() ? "" : "quarter-exec: " + c.message)) << launched.err;
    EXPECT_EQ(launched.out, c.out) << c.message;
  }
}

}  // namespace
