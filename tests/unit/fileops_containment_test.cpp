// realPathForURL:ifChildOfURL: against paths and links that the container's
// owner (uid 501, not root) plants to lead the daemon out of the container.
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "Daemon/fileops/QRTFileManager.h"
#include "TempDir.h"
#include "platform/DeviceRoot.h"
#include "platform/Log.h"

namespace fs = std::filesystem;

namespace {

// Runs fn as uid/gid 501 in a child; true when it returned true there.
bool asUser501(const std::function<bool()>& fn) {
  pid_t pid = fork();
  if (pid == 0) {
    if (setresgid(501, 501, 501) != 0 || setresuid(501, 501, 501) != 0) _exit(2);
    _exit(fn() ? 0 : 1);
  }
  int status = 0;
  return waitpid(pid, &status, 0) == pid && WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

TEST(Containment, ClientPathsStayInsideTheBase) {
  TempDir tmp("/var/tmp/qrt-contain");
  const std::string root = tmp / "root", base = root + "/private/var/mobile/c", outside = tmp / "outside";
  ASSERT_EQ(chmod(tmp.path().c_str(), 0755), 0);  // 501 must reach the base
  fs::create_directories(base + "/sub");
  fs::create_directories(base + "2");  // a sibling whose name extends the base's
  fs::create_directories(outside);
  std::ofstream(outside + "/file") << "not yours";
  std::ofstream(base + "/file") << "mine";
  ASSERT_EQ(chown(base.c_str(), 501, 501), 0);
  ASSERT_EQ(chown((base + "/sub").c_str(), 501, 501), 0);
  // ln -s target name, relative to the base.
  const std::vector<std::pair<std::string, std::string>> links = {{outside, "out_dir"},
                                                                  {outside + "/file", "out_file"},
                                                                  {base + "/file", "abs_in"},
                                                                  {"../../../../../outside", "rel_out"},
                                                                  {"sub", "mid"},
                                                                  {"../file", "sub/rel_in"},
                                                                  {"../../c2/x", "sub/rel_up2"},
                                                                  {"sub/rel_in", "chain"},
                                                                  {"loop_b", "loop_a"},
                                                                  {"loop_a", "loop_b"}};
  ASSERT_TRUE(asUser501([&] {
    for (const auto& [target, name] : links)
      if (symlink(target.c_str(), (base + "/" + name).c_str()) != 0) return false;
    return true;
  }));
  platform::setDeviceRoot(root);
  platform::logOpen(tmp / "quarterd.log", "containment-test", 5);

  // Suspicious path (relative to the base unless it starts with "/") and the
  // expected answer relative to the base, or "-" for none.
  struct Case {
    const char* path;
    const char* expected;
  };
  const Case cases[] = {
      {"", ""},
      {"file", "file"},
      {"sub/new/deeper", "sub/new/deeper"},  // missing components are appended
      {"sub/rel_in", "file"},                // a relative link that stays inside is followed
      {"chain", "file"},
      {"sub/../file", "-"},
      {"sub/..", "-"},
      {"/private/var/mobile/c2/x", "-"},  // sibling: passes the string prefix test only
      {"/etc/passwd", "-"},
      {"out_dir", "-"},
      {"out_dir/file", "-"},
      {"out_file", "-"},
      {"abs_in", "-"},  // absolute links are refused even inside
      {"rel_out", "-"},
      {"sub/rel_up2", "-"},
      {"mid/file", "-"},  // a link in an intermediate component
      {"mid/new", "-"},
      {"loop_a", "-"},
      {"/var/mobile/c/file", "file"},  // /var and /private/var are one place
  };
  QRTFileManager& fm = QRTFileManager::defaultManager();
  for (const Case& c : cases) {
    std::string p = c.path;
    std::string full = p.starts_with("/") ? root + p : (p.empty() ? base : base + "/" + p);
    std::optional<QRTURL> got = fm.realPathForURL(QRTURL::fileURL(full), QRTURL::fileURL(base));
    if (std::string(c.expected) == "-") {
      EXPECT_FALSE(got) << c.path << " -> " << got->path();
    } else {
      std::string want = *c.expected ? base + "/" + c.expected : base;
      EXPECT_EQ(got ? got->path() : "(none)", want) << c.path;
    }
  }
  EXPECT_FALSE(fm.realPathForURL(std::nullopt, QRTURL::fileURL(base)));
  // Base given as /var too.
  EXPECT_TRUE(fm.realPathForURL(QRTURL::fileURL(base + "/file"), QRTURL::fileURL(root + "/var/mobile/c")));

  struct DepthCase {
    const char* path;
    int32_t start;
    bool ok;
    int32_t end;
  };
  for (DepthCase d : {DepthCase{"/a/b", 0, true, 2}, DepthCase{"../x", 3, false, 0}, DepthCase{"/sub/../x", 2, true, 3},
                      DepthCase{"/sub/../../x", 2, false, 0}, DepthCase{"./a//.", 1, true, 2}}) {
    int32_t end = -1;
    EXPECT_EQ(fm._validateSymlink(std::string(d.path), d.start, &end), d.ok) << d.path;
    if (d.ok) { EXPECT_EQ(end, d.end) << d.path; }
  }
  EXPECT_FALSE(fm._validateSymlink(std::nullopt, 0, nullptr));
  platform::logClose();
  platform::setDeviceRoot("/");
}

}  // namespace
