// The quarterctl binary against the real daemon: what it prints for people
// and for scripts, and the exit status that scripts rely on.
#include <limits.h>
#include <stdlib.h>
#include <sys/wait.h>

#include <filesystem>
#include <string>

#include "DaemonFixture.h"
#include "base/PlistCodec.h"

namespace {

// The exit status (-1 when it did not exit normally) and what was printed.
struct CtlRun { int status = -1; std::string out, err; };

// The value of a "Key: value" line of readable output.
std::string field(const std::string& out, const std::string& key) {
  size_t at = out.find(key + ": ");
  if (at == std::string::npos) return "";
  at += key.size() + 2;
  return out.substr(at, out.find('\n', at) - at);
}

bool contains(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }

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
    setIdentity("quarterctl", resolved, "com.norvane.quarterctl", {{"com.norvane.private.QuarterKit.allowed", true}});
  }

  // Runs the binary with --root and the arguments, as a shell splits them.
  CtlRun run(const std::string& args, const std::string& binary = "") {
    return shell((binary.empty() ? ctl : binary) + " --root " + root + " " + args);
  }
  CtlRun shell(const std::string& command) {
    const std::string out = root + "/ctl.out", err = root + "/ctl.err";
    int status = system((command + " >" + out + " 2>" + err).c_str());
    return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, readFile(out), readFile(err)};
  }

  std::string ctl;
};

TEST_F(QuarterctlTest, CreateListInfoJsonAndDelete) {
  CtlRun created = run("create --class 2 --identifier com.example.ctl");
  ASSERT_EQ(created.status, 0) << created.err;
  EXPECT_EQ(field(created.out, "ReplyIdentifier"), "com.example.ctl");
  EXPECT_EQ(field(created.out, "ReplyExisted"), "false");
  const std::string path = field(created.out, "ReplyPath");
  EXPECT_EQ(path.rfind(root + "/private/var/mobile/Containers/Data/Application/", 0), 0u) << created.out;
  EXPECT_TRUE(std::filesystem::is_directory(path));
  const std::string uuid = field(created.out, "ReplyUUID");
  ASSERT_EQ(uuid.size(), 36u) << created.out;
  EXPECT_EQ(field(run("lookup --class 2 --identifier com.example.ctl").out, "ReplyExisted"), "true");
  EXPECT_TRUE(contains(run("list --class 2").out, "com.example.ctl " + uuid + "\n"));

  const std::string info = " --class 2 --identifier com.example.ctl --uuid " + uuid + " --key Colour";
  for (const std::string value : {"str:deep blue", "u64:18446744073709551615"}) {
    EXPECT_EQ(run("info set" + info + " --value '" + value + "'").status, 0) << value;
    CtlRun got = run("info get" + info);
    EXPECT_EQ(got.status, 0);
    EXPECT_EQ(got.out, value.substr(4) + "\n");
  }
  EXPECT_EQ(run("info set" + info).status, 0) << "no --value removes the key";
  CtlRun gone = run("info get" + info);
  EXPECT_EQ(gone.status, 1);
  EXPECT_EQ(gone.err, "quarterctl: error 24 (no such info value)\n");

  // --json prints the whole reply as one object.
  CtlRun json = run("--json lookup --class 2 --identifier com.example.ctl");
  ASSERT_EQ(json.status, 0) << json.err;
  EXPECT_EQ(json.out.front(), '{');
  EXPECT_EQ(json.out.substr(json.out.size() - 2), "}\n");
  for (const std::string& part : {std::string("\"ReplyError\":1"), std::string("\"ReplyExisted\":true"),
                                 "\"ReplyUUID\":\"" + uuid + "\""})
    EXPECT_TRUE(contains(json.out, part)) << json.out;
  json = run("--json list --class 2");
  EXPECT_TRUE(contains(json.out, "\"ReplyIdsArray\":[\"com.example.ctl\"]")) << json.out;
  EXPECT_TRUE(contains(json.out, "\"ReplyUUIDsArray\":[\"" + uuid + "\"]")) << json.out;
  json = run("--json du --class 2 --identifier com.example.ctl --uuid " + uuid);
  EXPECT_EQ(json.status, 0);
  EXPECT_TRUE(contains(json.out, "\"ReplyDiskUsage\":")) << json.out;

  CtlRun deleted = run("delete --class 2 --identifier com.example.ctl");
  EXPECT_EQ(deleted.status, 0) << deleted.err;
  EXPECT_EQ(deleted.out, "ok\n");
  EXPECT_EQ(run("deathrow").status, 0);
  EXPECT_FALSE(contains(run("list --class 2").out, "com.example.ctl"));
}

TEST_F(QuarterctlTest, ExitStatusTellsDaemonErrorsFromUsageErrors) {
  // The daemon's refusal: exit 1 with the code named on standard error,
  // whichever way the options and the device root are given.
  struct { std::string command, err; } refusals[] = {
      {ctl + " --root " + root + " delete --class 2 --identifier com.example.none", "error 21 (no such container)"},
      {ctl + " --root=" + root + " lookup --class=2 --identifier=com.example.none", "error 21 (no such container)"},
      {"QUARTERD_ROOT=" + root + " " + ctl + " info get --class 2 --identifier com.example.none --uuid "
       "00000000-0000-0000-0000-000000000000 --key k", "error 21 (no such container)"},
      // The original binary has no identity, so no entitlement.
      {std::string(QRT_QUARTERCTL_PATH) + " --root " + root + " deathrow", "error 55 (not entitled)"},
  };
  for (const auto& [command, err] : refusals) {
    CtlRun r = shell(command);
    EXPECT_EQ(r.status, 1) << command;
    EXPECT_EQ(r.out, "") << command;
    EXPECT_EQ(r.err, "quarterctl: " + err + "\n") << command;
  }

  // Usage and connection trouble: exit 2.
  for (const std::string args : {"list", "info get --class 2 --identifier a --key k", "create --class 2 --bogus", "create --class", "raw --file",
                                 "stage --entry 501:2:not-a-uuid:a", "--socket /nonexistent/socket deathrow"}) {
    CtlRun r = run(args);
    EXPECT_EQ(r.status, 2) << args;
    EXPECT_NE(r.err, "") << args;
  }
}

TEST_F(QuarterctlTest, StageWipeSystemPathAndAssets) {
  const std::string staged = field(run("create --class 2 --identifier com.example.staged").out, "ReplyUUID");
  EXPECT_EQ(run("stage --entry 501:2:" + staged + ":com.example.staged").status, 0);
  EXPECT_FALSE(contains(run("list --class 2").out, "com.example.staged"));

  const std::string path = field(run("create --class 2 --identifier com.example.keep").out, "ReplyPath");
  writeFile(path + "/Documents/file", "data");
  EXPECT_EQ(run("wipe --class 2 --identifier com.example.keep").status, 0);
  EXPECT_FALSE(exists(path + "/Documents/file"));
  EXPECT_EQ(run("wipe --addon --identifier com.example.keep").status, 1);

  CtlRun sys = run("system-path --identifier com.example.daemon");
  EXPECT_EQ(sys.status, 0) << sys.err;
  EXPECT_TRUE(std::filesystem::is_directory(field(sys.out, "ReplyPath"))) << sys.out;

  ASSERT_EQ(run("create --class 2 --identifier com.example.assets").status, 0);
  CtlRun assets = run("assets-path --identifier com.example.assets --relative");
  EXPECT_TRUE(field(assets.out, "ReplyPath").starts_with("Library/com.norvane.UserManagedAssets.")) << assets.err;
  EXPECT_EQ(run("assets-delete --identifier com.example.assets --source ../x").status, 1);
}

TEST_F(QuarterctlTest, CodeSigningAndGroups) {
  const plist::Data entitlements = plist::writeBinary(plist::Dictionary{
      {"com.norvane.security.application-groups", plist::Array{"group.one", "group.two"}},
      {"com.norvane.security.system-groups", "systemgroup.com.example.shared"}});
  writeFile(root + "/ents.plist", std::string(entitlements.begin(), entitlements.end()));
  EXPECT_EQ(run("codesign set --identifier com.example.app --entitlements " + root + "/ents.plist --data-class 2").status, 0);
  EXPECT_TRUE(contains(run("codesign get --identifier com.example.app").out, "group.two"));
  const std::string ids = run("groups ids --identifier com.example.app").out;
  EXPECT_TRUE(contains(ids, "group.one\n") && contains(ids, "group.two\n") && ids.size() == 20) << ids;
  CtlRun paths = run("groups paths --identifier com.example.app");
  ASSERT_EQ(paths.status, 0) << paths.err;
  const std::string two = paths.out.substr(paths.out.find("group.two ") + 10);
  EXPECT_TRUE(std::filesystem::is_directory(two.substr(0, two.find('\n')))) << paths.out;
  // quarterctl itself is not entitled to the system group.
  EXPECT_EQ(run("system-group-path --group systemgroup.com.example.shared").status, 1);
  EXPECT_TRUE(contains(run("groups paths --system --identifier com.example.app").out, "systemgroup.com.example.shared "));

  EXPECT_EQ(run("codesign set --identifier com.example.app --remove").status, 0);
  CtlRun gone = run("codesign get --identifier com.example.app");
  EXPECT_EQ(gone.status, 1);
  EXPECT_EQ(gone.err, "quarterctl: error 21 (no such container)\n");
  EXPECT_EQ(run("codesign invalidate-missing").status, 0);
  EXPECT_EQ(run("codesign set --identifier com.example.app").status, 2) << "one of the three is required";
}

}  // namespace
