// quarter-exec against the real daemon: what a program it launches can and
// cannot reach, and whom it refuses.
#include <fcntl.h>
#include <limits.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "DaemonFixture.h"
#include "QuarterKit/Upcall.h"

namespace {

struct Launched {
  int status = -1;
  std::string out, err;
};

bool contains(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }

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
  }

  // The launcher with the arguments, as root or (uid given) as that user.
  Launched launch(const std::vector<std::string>& args, uid_t asUser = 0) {
    const std::string out = root + "/exec.out", err = root + "/exec.err";
    pid_t child = fork();
    if (child == 0) {
      int o = open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0666), e = open(err.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0666);
      if (o < 0 || e < 0 || dup2(o, 1) < 0 || dup2(e, 2) < 0) _exit(120);
      if (asUser && (setresgid(asUser, asUser, asUser) != 0 || setresuid(asUser, asUser, asUser) != 0)) _exit(121);
      std::vector<char*> argv{const_cast<char*>(launcher.c_str())};
      for (const std::string& a : args) argv.push_back(const_cast<char*>(a.c_str()));
      argv.push_back(nullptr);
      execv(launcher.c_str(), argv.data());
      _exit(122);
    }
    int status = -1;
    waitpid(child, &status, 0);
    return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, readFile(out), readFile(err)};
  }

  std::string probe, launcher;
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

  struct Case { std::string access, expected; } cases[] = {
      {"w:" + data + "/Documents/note", "ok"},
      {"w:" + data + "/tmp/scratch", "ok"},
      {"w:" + group + "/Library/note", "ok"},
      {"w:" + data + metadata, "EACCES"},          // the daemon's file inside the program's own container
      {"w:" + data + "/new-top-level-file", "EACCES"},
      {"w:" + otherProgram.path + "/Documents/x", "EACCES"},  // same user: only Landlock stands in the way
      {"r:" + otherProgram.path + metadata, "EACCES"},
      {"w:" + otherUser.path + "/Documents/x", "EACCES"},
      {"r:" + otherUser.path + metadata, "EACCES"},
      {"r:" + database, exists(database) ? "EACCES" : "ENOENT"},
      {"w:" + database, "EACCES"},
      {"r:" + root + "/etc/passwd", "EACCES"},  // world-readable, outside every container
      {"r:/proc/self/status", "ok"},
      {"r:/proc/1/status", "EACCES"},
  };
  std::vector<std::string> args{"--root", root, "--user", "501", "--identifier", "com.example.a", "--", probe};
  std::string expected;
  for (const Case& c : cases) {
    args.push_back(c.access);
    expected += c.expected + "\n";
  }
  Launched run = launch(args);
  ASSERT_EQ(run.status, 0) << run.err;
  EXPECT_EQ(run.out, expected);
  EXPECT_EQ(ownerAndMode(data + "/Documents/note").first, 501u) << "the program runs as the user";
  EXPECT_EQ(readFile(group + "/Library/note"), "probe\n");
}

TEST_F(ExecTest, RefusesWithClearMessages) {
  struct Case {
    std::vector<std::string> args;
    uid_t user;
    int status;
    std::string message;
  } cases[] = {
      {{"--root", root, "--user", "501", "--identifier", "com.example.a", "--", probe}, 501, 1, "must be run as root"},
      {{"--root", root, "--user", "501", "--identifier", "com.example.nobody", "--", probe}, 0, 1,
       "unknown identifier com.example.nobody: " + probe + " is registered as com.example.a"},
      {{"--root", root, "--user", "501", "--identifier", "com.example.a", "--", "/bin/true"}, 0, 1,
       "unknown identifier com.example.a: /usr/bin/true has no identity"},
      {{"--root", root, "--user", "777", "--identifier", "com.example.a", "--", probe}, 0, 1, "no account for user 777"},
      {{"--root", root, "--identifier", "com.example.a", "--", probe}, 0, 2, "--user is required"},
      {{"--root", root, "--user", "501", "--identifier", "com.example.a"}, 0, 2, "no program given"},
  };
  for (const Case& c : cases) {
    Launched run = launch(c.args, c.user);
    EXPECT_EQ(run.status, c.status) << c.message << ": " << run.err;
    EXPECT_TRUE(contains(run.err, "quarter-exec: " + c.message)) << run.err;
    EXPECT_EQ(run.out, "") << c.message;
  }
}

}  // namespace
