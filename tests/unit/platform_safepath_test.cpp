// The safe path primitive against the arrangements a user can make in a
// directory they own. A marker tree outside the device root stands for
// everything the user may not change; no case may touch it. The sandbox
// mappings, links under the same root, are checked here too.
#include <fcntl.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <functional>

#include "TempDir.h"
#include "platform/DeviceRoot.h"
#include "platform/Dir.h"
#include "platform/FileIO.h"
#include "platform/SafePath.h"
#include "platform/SandboxMappings.h"

namespace fs = std::filesystem;
using namespace platform;

namespace {

class SafePathTest : public ::testing::Test {
 protected:
  void SetUp() override {
    makeMarkerTree(marker_);
    fs::create_directories(user_);
    ASSERT_EQ(chown(user_.c_str(), 501, 501), 0);
    setDeviceRoot(root_);
    before_ = treeSnapshot(marker_);
  }
  void TearDown() override {
    EXPECT_EQ(treeSnapshot(marker_), before_) << "the marker tree changed";
    setDeviceRoot("/");
  }
  std::string in(const std::string& rel) const { return user_ + "/" + rel; }
  void link(const std::string& target, const std::string& rel) {
    ASSERT_EQ(symlink(target.c_str(), in(rel).c_str()), 0) << rel;
  }
  std::string linkPath(uint32_t user, uint64_t type, const std::string& identifier) const {
    return root_ + "/run/sandbox/mappings/" + std::to_string(user) + "/" + std::to_string(type) + "/" + identifier;
  }

  TempDir tmp_{"/var/tmp/qrt-safepath"};
  std::string root_ = tmp_ / "root", marker_ = tmp_ / "marker", user_ = root_ + "/home/user";
  std::map<std::string, std::string> before_;
};

TEST_F(SafePathTest, HostileArrangementsAreRefusedWithTheirCode) {
  UniqueFd fd;
  std::string text;
  struct Case {
    const char* what;
    std::function<void()> arrange;
    std::function<int()> act;
    int expected;
  };
  const std::vector<Case> cases = {
      {"link at an intermediate component", [&] { link(marker_, "mid"); },
       [&] { return safeReplaceFile(in("mid/file"), "x", 0644); }, ELOOP},
      {"link at an intermediate component, create with parents", [&] { link(marker_, "mid2"); },
       [&] { return safeMakeDirectory(in("mid2/dir/new"), 0755, true, kAnyOwner, &fd); }, ELOOP},
      {"link at the final component, read", [&] { link(marker_ + "/file", "final"); },
       [&] { return safeReadFile(in("final"), &text, 1024); }, ELOOP},
      {"link where a directory is expected", [&] { link(marker_ + "/dir", "dirlink"); },
       [&] { return safeMakeDirectory(in("dirlink"), 0755, false, 501, &fd); }, ELOOP},
      {"path with ..", [] {}, [&] { return safeReplaceFile(user_ + "/../../../marker/file", "x", 0644); }, EXDEV},
      {"absolute path outside the root", [] {}, [&] { return safeReadFile(marker_ + "/file", &text, 1024); }, EXDEV},
      {"root's sibling sharing its name as a prefix", [] {}, [&] { return safeOpen(root_ + "x/file", O_RDONLY, &fd); },
       EXDEV},
      {"non-directory where a directory is expected", [&] { std::ofstream(in("plain")) << "p"; },
       [&] { return safeMakeDirectory(in("plain"), 0755, true, kAnyOwner, &fd); }, ENOTDIR},
      {"directory of another user", [&] { fs::create_directory(in("other")), chown(in("other").c_str(), 502, 502); },
       [&] { return safeMakeDirectory(in("other"), 0755, false, 501, &fd); }, EPERM},
      {"link at an intermediate component, stat beneath a held directory", [&] { link(marker_, "mid3"); },
       [&] {
         Dir held;
         struct stat st;
         return Dir::open(user_, &held) ? -1 : held.lstat("mid3/file", &st);
       },
       ELOOP},
      {"FIFO read as a file", [&] { mkfifo(in("fifo").c_str(), 0600); },
       [&] { return safeReadFile(in("fifo"), &text, 1024); }, EINVAL},
  };
  for (const Case& c : cases) {
    c.arrange();
    EXPECT_EQ(c.act(), c.expected) << c.what;
  }
  EXPECT_EQ(lstatOf(in("other")).st_uid, 502u) << "a refused directory keeps its owner";
}

TEST_F(SafePathTest, PlantedLinksAreSwappedNotWrittenThroughAndHeldDirectoriesStay) {
  link(marker_ + "/file", "meta");
  ASSERT_EQ(::link((marker_ + "/dir/inner").c_str(), in("hard").c_str()), 0);
  for (const char* rel : {"meta", "hard"}) {
    ASSERT_EQ(safeReplaceFile(in(rel), "new", 0644), 0) << rel;
    const struct stat st = lstatOf(in(rel));
    EXPECT_TRUE(S_ISREG(st.st_mode) && st.st_nlink == 1) << rel;
    EXPECT_EQ(fileText(in(rel)), "new");
  }
  EXPECT_EQ(std::distance(fs::directory_iterator(user_), {}), 2) << "no temporary left behind";

  // A directory swapped for a link after resolution.
  fs::create_directories(in("box"));
  SafeParent parent;
  ASSERT_EQ(safeOpenParent(in("box/f"), &parent), 0);
  fs::rename(in("box"), in("box.moved"));
  link(marker_, "box");
  // The held descriptor still means the directory that was checked.
  ASSERT_EQ(replaceFileAt(parent.fd.get(), parent.name, "v", 1, 0600), 0);
  EXPECT_EQ(fileText(in("box.moved/f")), "v");
  EXPECT_EQ(safeOpenParent(in("box/f"), &parent), ELOOP);
}

TEST_F(SafePathTest, CreationAcceptsOwnOrRootDirectoriesAndGivesThemToTheOwner) {
  UniqueFd fd;
  bool created = false;
  ASSERT_EQ(safeMakeDirectory(in("a/b/c"), 0750, true, 501, &fd, &created), 0);
  EXPECT_TRUE(created);
  struct stat st {};
  ASSERT_EQ(fstat(fd.get(), &st), 0);
  EXPECT_EQ(st.st_uid, 501u);
  EXPECT_EQ(st.st_mode & 0777, 0750u);
  EXPECT_EQ(lstatOf(in("a")).st_uid, 0u) << "levels made on the way stay root's";
  ASSERT_EQ(safeMakeDirectory(in("a"), 0700, false, 501, &fd, &created), 0);  // root's: handed over
  EXPECT_FALSE(created);
  EXPECT_EQ(lstatOf(in("a")).st_uid, 501u);
  EXPECT_EQ(lstatOf(in("a")).st_mode & 0777, 0750u) << "an existing directory keeps its mode";
  EXPECT_EQ(safeMakeDirectory(root_, 0755, false, kAnyOwner, &fd), 0);  // the root itself
  std::string relative;
  EXPECT_EQ(pathBelowDeviceRoot(root_ + "//home/./user/", &relative), 0);
  EXPECT_EQ(relative, "home/user");
}

// The sandbox mappings' links live under the device root too.
using SandboxMappingsTest = SafePathTest;

TEST_F(SandboxMappingsTest, BadIdentifiersAndADirectoryInTheWayFailCleanly) {
  for (const std::string& bad : {std::string(), std::string("."), std::string(".."), std::string("a/b"),
                                 std::string("/abs"), std::string("nul\0byte", 8)}) {
    EXPECT_EQ(sandboxSetStateItem(501, 1, bad, "/data/x"), EINVAL) << bad;
    EXPECT_EQ(sandboxSetStateItem(501, 1, bad, nullptr), EINVAL) << bad;
    EXPECT_FALSE(sandboxStateItem(501, 1, bad));
  }
  EXPECT_FALSE(fs::exists(root_ + "/run/sandbox"));
  fs::create_directories(linkPath(501, 1, "com.example.app") + "/inner");
  EXPECT_NE(sandboxSetStateItem(501, 1, "com.example.app", "/data/one"), 0);
  EXPECT_NE(sandboxSetStateItem(501, 1, "com.example.app", nullptr), 0);
  EXPECT_EQ(std::distance(fs::directory_iterator(linkPath(501, 1, "")), {}), 1);
}

}  // namespace
