// Every operation of QRTFileManager against links, swaps and hard links a
// user can plant in a container they own. A marker tree outside the device
// root stands for what the user may not change: no case may touch it. Then
// realPathForURL:ifChildOfURL: against the paths and links that the
// container's owner (uid 501, not root) plants to lead the daemon out.
#include <sys/mount.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <functional>

#include "Daemon/fileops/QRTFileManager.h"
#include "TempDir.h"
#include "platform/DeviceRoot.h"
#include "platform/Log.h"

namespace fs = std::filesystem;

namespace {

class HostileTest : public ::testing::Test {
 protected:
  void SetUp() override {
    makeMarkerTree(marker_);
    fs::create_directories(root_ + "/etc");
    std::ofstream(root_ + "/etc/group") << "systemusers:x:4242:\n";
    fs::create_directories(c_ + "/own");
    std::ofstream(c_ + "/own/file") << "mine";
    ASSERT_EQ(symlink(marker_.c_str(), (c_ + "/link").c_str()), 0);
    ASSERT_EQ(symlink((marker_ + "/file").c_str(), (c_ + "/filelink").c_str()), 0);
    ASSERT_EQ(link((marker_ + "/file").c_str(), (c_ + "/own/hard").c_str()), 0);
    platform::setDeviceRoot(root_);
    platform::logOpen(tmp_ / "quarterd.log", "hostile-test", 5);
    // Link counts left out: the planted hard link goes when its container moves.
    before_ = treeSnapshot(marker_, false);
  }
  void TearDown() override {
    EXPECT_EQ(treeSnapshot(marker_, false), before_) << "the marker tree changed";
    platform::logClose();
    for (const std::string& m : mounts_) umount2(m.c_str(), MNT_DETACH);
    platform::setDeviceRoot("/");
  }
  QRTURL url(const std::string& rel) const { return QRTURL::fileURL(c_ + "/" + rel); }
  int64_t code() const { return error_ ? error_->code() : 0; }

  TempDir tmp_{"/var/tmp/qrt-hostile"};
  std::string root_ = tmp_ / "root", marker_ = tmp_ / "marker", c_ = root_ + "/c";
  std::map<std::string, std::string> before_;
  std::vector<std::string> mounts_;
  QRTFileManager& fm_ = QRTFileManager::defaultManager();
  QRTErrorRef error_;
};

TEST_F(HostileTest, NoOperationReachesThroughALink) {
  plist::Dictionary dict{{"k", "v"}};
  int32_t cls = 0;
  const std::vector<std::pair<const char*, std::function<bool()>>> cases = {
      {"remove below a link", [&] { return fm_.removeItemAtURL(url("link/file"), &error_); }},
      {"create below a link", [&] { return fm_.createDirectoryAtURL(url("link/new"), true, 0755, &error_); }},
      {"create at a link", [&] { return fm_.createDirectoryAtURL(url("link"), false, 0755, 501u, &error_); }},
      {"copy from below a link", [&] { return fm_.copyItemAtURL(url("link/file"), url("copied"), &error_); }},
      {"copy to below a link", [&] { return fm_.copyItemAtURL(url("own"), url("link/own"), &error_); }},
      {"move from below a link", [&] { return fm_.moveItemAtURL(url("link/file"), url("moved"), &error_); }},
      {"move to below a link", [&] { return fm_.moveItemAtURL(url("own"), url("link/own"), &error_); }},
      {"temporary directory below a link",
       [&] { return fm_.createTemporaryDirectoryInDirectoryURL(url("link"), &error_).has_value(); }},
      {"list a link", [&] { return fm_.urlsForItemsInDirectoryAtURL(url("link"), &error_).has_value(); }},
      {"write below a link", [&] { return QRT_writeToURL(dict, url("link/file"), QRTWriteAtomic, &error_); }},
      {"write in place at a link", [&] { return QRT_writeToURL(dict, url("filelink"), QRTWriteOptionsNone, &error_); }},
      {"read through a link", [&] { return QRT_dictionaryWithContentsOfURL(url("filelink"), &error_).has_value(); }},
      {"class of a link", [&] { return fm_.setDataProtectionClassOfItemAtURL(url("filelink"), 3, {}, &error_); }},
      {"class below a link", [&] { return fm_.dataProtectionClassOfItemAtURL(url("link/file"), &cls, &error_); }},
      {"class read of a link", [&] { return fm_.dataProtectionClassOfItemAtURL(url("filelink"), &cls, &error_); }},
      {"ownership below a link", [&] { return fm_.standardizeOwnershipAtURL(url("link/dir"), 501, 501, &error_); }},
      {"top ACL of a link", [&] { return fm_.setTopLevelSystemContainerACLAtURL(url("link"), &error_); }},
  };
  for (const auto& [what, act] : cases) {
    error_.reset();
    EXPECT_FALSE(act()) << what;
    EXPECT_EQ(code(), what == std::string("top ACL of a link") ? 63 : ELOOP) << what;
  }
  EXPECT_FALSE(fm_.itemExistsAtURL(url("link/file")) || fm_.itemDoesNotExistAtURL(url("link/file")));
  EXPECT_EQ(fm_.diskUsageForURL(url("link")), 0u);
  EXPECT_TRUE(fm_.removeItemAtURL(url("link"), &error_));  // the link itself goes
  EXPECT_TRUE(fs::exists(marker_ + "/dir/inner"));
}

TEST_F(HostileTest, OwnershipWalksLeaveForeignHardLinksAlone) {
  ASSERT_TRUE(fm_.standardizeOwnershipAtURL(QRTURL::fileURL(c_, true), 501, 501, &error_));
  EXPECT_EQ(lstatOf(c_ + "/own/file").st_uid, 501u);
  EXPECT_EQ(lstatOf(c_ + "/link").st_uid, 501u);  // the link itself
  ASSERT_TRUE(fm_.standardizeACLsAtURL(QRTURL::fileURL(c_, true), false, &error_));
  EXPECT_EQ(lstatOf(c_ + "/own/file").st_uid, static_cast<uid_t>(-2));
  // A directory swapped for a link between the listing and the change.
  fs::rename(c_ + "/own", c_ + "/own.old");
  ASSERT_EQ(symlink((marker_ + "/dir").c_str(), (c_ + "/own").c_str()), 0);
  EXPECT_TRUE(fm_.standardizeOwnershipAtURL(QRTURL::fileURL(c_, true), 502, 502, &error_));
}

TEST_F(HostileTest, CopyDropsSetIdBitsAndDeviceNodes) {
  std::ofstream(c_ + "/own/tool") << "#!";
  ASSERT_EQ(chmod((c_ + "/own/tool").c_str(), 06755), 0);
  ASSERT_EQ(mknod((c_ + "/own/null").c_str(), S_IFCHR | 0666, makedev(1, 3)), 0);
  ASSERT_EQ(mkfifo((c_ + "/own/fifo").c_str(), 0640), 0);
  ASSERT_TRUE(fm_.copyItemAtURL(url("own"), url("copy"), &error_)) << error_->description();
  EXPECT_EQ(lstatOf(c_ + "/copy/tool").st_mode & 07777, 0755u);
  EXPECT_FALSE(fs::exists(fs::symlink_status(c_ + "/copy/null")));
  EXPECT_TRUE(S_ISFIFO(lstatOf(c_ + "/copy/fifo").st_mode));
  EXPECT_EQ(lstatOf(c_ + "/copy/fifo").st_mode & 07777, 0640u);
  EXPECT_EQ(lstatOf(c_ + "/copy/hard").st_nlink, 1u);  // a copy, not another name of the marker
}

// A copy would split hard links and fill sparse files, as root.
TEST_F(HostileTest, CrossDeviceMoveIsRefusedNeverCopied) {
  fs::create_directories(root_ + "/mnt");
  if (mount("tmpfs", (root_ + "/mnt").c_str(), "tmpfs", 0, "size=256k") != 0) GTEST_SKIP() << "no tmpfs";
  mounts_.push_back(root_ + "/mnt");
  EXPECT_EQ(fm_.moveItemAtURL(url("own"), QRTURL::fileURL(root_ + "/mnt/own"), &error_) ? 0 : code(), EXDEV);
  EXPECT_EQ(std::distance(fs::directory_iterator(root_ + "/mnt"), {}), 0);
  EXPECT_EQ(fileText(c_ + "/own/file"), "mine");
}

TEST(Containment, ClientPathsStayInsideTheBase) {
  TempDir tmp("/var/tmp/qrt-contain");
  const std::string root = tmp / "root", base = root + "/private/var/mobile/c", outside = tmp / "outside";
  fs::create_directories(base + "/sub");
  fs::create_directories(base + "2");  // a sibling whose name extends the base's
  fs::create_directories(outside);
  std::ofstream(outside + "/file") << "not yours";
  std::ofstream(base + "/file") << "mine";
  ASSERT_EQ(chown(base.c_str(), 501, 501), 0);
  ASSERT_EQ(chown((base + "/sub").c_str(), 501, 501), 0);
  // ln -s target name, relative to the base; the owner's links.
  const std::pair<std::string, std::string> links[] = {{outside, "out_dir"},
                                                       {outside + "/file", "out_file"},
                                                       {base + "/file", "abs_in"},
                                                       {"../../../../../outside", "rel_out"},
                                                       {"sub", "mid"},
                                                       {"../file", "sub/rel_in"},
                                                       {"../../c2/x", "sub/rel_up2"},
                                                       {"sub/rel_in", "chain"},
                                                       {"loop_b", "loop_a"},
                                                       {"loop_a", "loop_b"}};
  for (const auto& [target, name] : links) {
    ASSERT_EQ(symlink(target.c_str(), (base + "/" + name).c_str()), 0) << name;
    ASSERT_EQ(lchown((base + "/" + name).c_str(), 501, 501), 0) << name;
  }
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
