// The quarterctl binary against the real daemon: what it prints for people
// and for scripts, and the exit status that scripts rely on.
#include <fcntl.h>
#include <limits.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "DaemonFixture.h"
#include "base/PlistCodec.h"

namespace {

struct CtlRun {
  int status = -1;  // exit status, or -1 when it did not exit normally
  std::string out;
  std::string err;
};

std::string readFile(const std::string& path) {
  std::ifstream in(path);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

// The value of a "Key: value" line of readable output.
std::string field(const std::string& out, const std::string& key) {
  size_t at = out.find(key + ": ");
  if (at == std::string::npos) return "";
  at += key.size() + 2;
  return out.substr(at, out.find('\n', at) - at);
}

class QuarterctlTest : public DaemonFixture {
 protected:
  void SetUp() override {
    DaemonFixture::SetUp();
    // The daemon knows callers by executable path, so a copy of its own
    // gets the master entitlement and the original none.
    ctl = root + "/bin/quarterctl";
    std::filesystem::create_directories(root + "/bin");
    std::filesystem::copy_file(QRT_QUARTERCTL_PATH, ctl);
    char resolved[PATH_MAX];
    ASSERT_NE(realpath(ctl.c_str(), resolved), nullptr);
    plist::Dictionary identity{
        {"Executable", std::string(resolved)},
        {"SigningIdentifier", std::string("com.norvane.quarterctl")},
        {"Entitlements", plist::Dictionary{{"com.norvane.private.QuarterKit.allowed", true}}}};
    plist::Data bytes = plist::writeBinary(identity);
    std::ofstream(root + "/etc/quarterd/identities/quarterctl.plist", std::ios::binary)
        .write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
  }

  CtlRun run(std::vector<std::string> args, const std::string& binary = "") {
    args.insert(args.begin(), {binary.empty() ? ctl : binary, "--root", root});
    std::string outPath = root + "/ctl.out", errPath = root + "/ctl.err";
    pid_t pid = fork();
    if (pid == 0) {
      int out = open(outPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
      int err = open(errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
      dup2(out, 1);
      dup2(err, 2);
      std::vector<char*> argv;
      for (std::string& a : args) argv.push_back(a.data());
      argv.push_back(nullptr);
      execv(argv[0], argv.data());
      _exit(127);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, readFile(outPath), readFile(errPath)};
  }

  // Creates a class 2 container and returns its internal UUID.
  std::string create(const std::string& identifier) {
    CtlRun r = run({"create", "--class", "2", "--identifier", identifier});
    EXPECT_EQ(r.status, 0) << r.err;
    return field(r.out, "ReplyUUID");
  }

  std::string ctl;
};

TEST_F(QuarterctlTest, CreateListInfoAndDelete) {
  CtlRun created = run({"create", "--class", "2", "--identifier", "com.example.ctl"});
  ASSERT_EQ(created.status, 0) << created.err;
  EXPECT_EQ(field(created.out, "ReplyIdentifier"), "com.example.ctl");
  EXPECT_EQ(field(created.out, "ReplyExisted"), "false");
  EXPECT_EQ(field(created.out, "ReplyPath").rfind(root + "/private/var/mobile/Containers/Data/Application/", 0), 0u)
      << created.out;
  const std::string uuid = field(created.out, "ReplyUUID");
  ASSERT_EQ(uuid.size(), 36u) << created.out;
  EXPECT_TRUE(std::filesystem::is_directory(field(created.out, "ReplyPath")));
  EXPECT_EQ(field(run({"lookup", "--class", "2", "--identifier", "com.example.ctl"}).out, "ReplyExisted"), "true");

  EXPECT_NE(run({"list", "--class", "2"}).out.find("com.example.ctl " + uuid + "\n"), std::string::npos);

  const std::vector<std::string> one = {"--class", "2", "--identifier", "com.example.ctl", "--uuid", uuid, "--key",
                                        "Colour"};
  auto with = [&](std::vector<std::string> head, std::vector<std::string> tail = {}) {
    head.insert(head.end(), one.begin(), one.end());
    head.insert(head.end(), tail.begin(), tail.end());
    return head;
  };
  EXPECT_EQ(run(with({"info", "set"}, {"--value", "str:deep blue"})).status, 0);
  CtlRun got = run(with({"info", "get"}));
  EXPECT_EQ(got.status, 0);
  EXPECT_EQ(got.out, "deep blue\n");
  EXPECT_EQ(run(with({"info", "set"}, {"--value", "u64:18446744073709551615"})).status, 0);
  EXPECT_EQ(run(with({"info", "get"})).out, "18446744073709551615\n");
  // No --value removes the key.
  EXPECT_EQ(run(with({"info", "set"})).status, 0);
  CtlRun gone = run(with({"info", "get"}));
  EXPECT_EQ(gone.status, 1);
  EXPECT_NE(gone.err.find("ReplyError 24"), std::string::npos) << gone.err;

  CtlRun deleted = run({"delete", "--class", "2", "--identifier", "com.example.ctl"});
  EXPECT_EQ(deleted.status, 0) << deleted.out << deleted.err;
  EXPECT_EQ(deleted.out, "ReplyError: 1\n");
  EXPECT_EQ(run({"deathrow"}).status, 0);
  EXPECT_EQ(run({"list", "--class", "2"}).out.find("com.example.ctl"), std::string::npos);
}

TEST_F(QuarterctlTest, JsonOutputCarriesTheWholeReply) {
  const std::string uuid = create("com.example.json");
  CtlRun r = run({"--json", "lookup", "--class", "2", "--identifier", "com.example.json"});
  ASSERT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(r.out.front(), '{');
  EXPECT_EQ(r.out.substr(r.out.size() - 2), "}\n");
  EXPECT_NE(r.out.find("\"ReplyError\":1"), std::string::npos) << r.out;
  EXPECT_NE(r.out.find("\"ReplyExisted\":true"), std::string::npos) << r.out;
  EXPECT_NE(r.out.find("\"ReplyUUID\":\"" + uuid + "\""), std::string::npos) << r.out;

  CtlRun list = run({"--json", "list", "--class", "2"});
  EXPECT_NE(list.out.find("\"ReplyIdsArray\":[\"com.example.json\"]"), std::string::npos) << list.out;
  EXPECT_NE(list.out.find("\"ReplyUUIDsArray\":[\"" + uuid + "\"]"), std::string::npos) << list.out;

  CtlRun usage = run({"--json", "du", "--class", "2", "--identifier", "com.example.json", "--uuid", uuid});
  EXPECT_EQ(usage.status, 0);
  EXPECT_NE(usage.out.find("\"ReplyDiskUsage\":"), std::string::npos) << usage.out;
}

TEST_F(QuarterctlTest, ExitStatusTellsDaemonErrorsFromUsageErrors) {
  // The daemon's refusal: exit 1 with its ReplyError.
  CtlRun missing = run({"delete", "--class", "2", "--identifier", "com.example.none"});
  EXPECT_EQ(missing.status, 1);
  EXPECT_EQ(missing.out, "ReplyError: 21\n");
  CtlRun lookup = run({"lookup", "--class", "2", "--identifier", "com.example.none"});
  EXPECT_EQ(lookup.status, 1);
  EXPECT_EQ(lookup.out, "");
  EXPECT_NE(lookup.err.find("ReplyError 21"), std::string::npos) << lookup.err;
  CtlRun badUser = run({"list", "--class", "1", "--user", "501"});
  EXPECT_EQ(badUser.status, 1);
  EXPECT_NE(badUser.err.find("ReplyError 38"), std::string::npos) << badUser.err;
  // The original binary has no identity, so no entitlement.
  EXPECT_EQ(run({"list", "--class", "2"}, QRT_QUARTERCTL_PATH).out, "");
  EXPECT_EQ(run({"deathrow"}, QRT_QUARTERCTL_PATH).out, "ReplyError: 55\n");

  // Usage and connection trouble: exit 2, nothing sent.
  EXPECT_EQ(run({"list"}).status, 2);
  EXPECT_EQ(run({"info", "get", "--class", "2", "--identifier", "a", "--key", "k"}).status, 2);
  EXPECT_EQ(run({"stage", "--entry", "501:2:not-a-uuid:a"}).status, 2);
  EXPECT_EQ(run({"create", "--class", "2", "--bogus"}).status, 2);
  CtlRun elsewhere = run({"--socket", root + "/run/nothing-here", "deathrow"});
  EXPECT_EQ(elsewhere.status, 2);
  EXPECT_NE(elsewhere.err, "");
}

TEST_F(QuarterctlTest, StageAndWipeAndSystemPath) {
  const std::string keep = create("com.example.keep");
  const std::string staged = create("com.example.staged");
  // One entry names no live container; staging skips it.
  CtlRun stage = run({"stage", "--entry", "501:2:" + staged + ":com.example.staged", "--entry",
                   "501:2:" + keep + ":com.example.other"});
  EXPECT_EQ(stage.status, 0) << stage.out;
  CtlRun list = run({"list", "--class", "2"});
  EXPECT_EQ(list.out.find("com.example.staged"), std::string::npos) << list.out;
  EXPECT_NE(list.out.find("com.example.keep " + keep), std::string::npos) << list.out;

  const std::string path =
      field(run({"lookup", "--class", "2", "--identifier", "com.example.keep"}).out, "ReplyPath");
  std::ofstream(path + "/Documents/file") << "data";
  ASSERT_TRUE(std::filesystem::exists(path + "/Documents/file"));
  EXPECT_EQ(run({"wipe", "--class", "2", "--identifier", "com.example.keep"}).status, 0);
  EXPECT_FALSE(std::filesystem::exists(path + "/Documents/file"));
  EXPECT_EQ(run({"wipe", "--addon", "--identifier", "com.example.keep"}).status, 1);

  CtlRun sys = run({"system-path", "--identifier", "com.example.daemon"});
  EXPECT_EQ(sys.status, 0) << sys.err;
  EXPECT_TRUE(std::filesystem::is_directory(field(sys.out, "ReplyPath"))) << sys.out;
}

}  // namespace
