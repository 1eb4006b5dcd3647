// QRTFileManager against a real ext4 scratch directory (and tmpfs mounts where
// the machine allows them): removal, creation, copies, listings, traversal,
// property-list files, disk usage, protection classes and the tree dump; and
// the error values it reports.
#include <fcntl.h>
#include <sys/acl.h>
#include <sys/mount.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdlib>
#include <stdexcept>
#include <tuple>
#include <vector>

#include "Daemon/QRTError.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "TempDir.h"
#include "base/PlistCodec.h"
#include "platform/DeviceRoot.h"
#include "platform/Log.h"

namespace fs = std::filesystem;

namespace {

std::string xattr(const std::string& p, const char* name) {
  char buf[4096];
  ssize_t n = lgetxattr(p.c_str(), name, buf, sizeof buf);
  return n < 0 ? "<none>" : std::string(buf, n);
}

void chattr(const char* flag, const std::string& p) {
  ASSERT_EQ(std::system(("chattr " + std::string(flag) + " '" + p + "'").c_str()), 0) << p;
}

class FileManagerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(mkdir(root_.c_str(), 0755), 0);
    platform::logOpen(tmp_ / "quarterd.log", "fileops-test", 5);
    umask(022);
  }
  void TearDown() override {
    platform::logClose();
    platform::setDeviceRoot(oldRoot_);
    for (const std::string& p : mounts_) umount2(p.c_str(), MNT_DETACH);
  }

  std::string path(const std::string& rel) const { return root_ + "/" + rel; }
  QRTURL url(const std::string& rel) const { return QRTURL::fileURL(path(rel)); }
  void makeFile(const std::string& rel, const std::string& content = "data") {
    fs::create_directories(fs::path(path(rel)).parent_path());
    std::ofstream(path(rel)) << content;
  }
  bool exists(const std::string& rel) const { return fs::exists(fs::symlink_status(path(rel))); }
  uint64_t allocated(const std::string& rel) const { return static_cast<uint64_t>(lstatOf(path(rel)).st_blocks) * 512; }
  int32_t classOf(const std::string& rel) {
    int32_t cls = -100;
    EXPECT_TRUE(fm_.dataProtectionClassOfItemAtURL(url(rel), &cls, &error_)) << rel;
    return cls;
  }
  // The errno of a call that must fail: 0 when it succeeded, -1 for an error of another domain.
  int errnoOf(bool succeeded) const {
    return succeeded ? 0 : error_ && error_->domain() == QRTPOSIXErrorDomain ? error_->code() : -1;
  }

  TempDir tmp_{"/var/tmp/qrt-fm-test"};
  std::string root_ = tmp_ / "t", oldRoot_ = platform::deviceRoot();
  std::vector<std::string> mounts_;
  QRTFileManager& fm_ = QRTFileManager::defaultManager();
  QRTErrorRef error_;
};

// An immutable file is repaired; an immutable directory is not, and its EPERM
// wins over the ENOTEMPTY of its parent once the rest is gone.
TEST_F(FileManagerTest, RemovalRepairsImmutableFilesAndLeavesNothing) {
  for (int i = 0; i < 100; ++i) makeFile("a/b/f" + std::to_string(i));  // enough for several threads
  makeFile("a/b/c/two");
  makeFile("a/b/locked");
  chattr("+i", path("a/b/locked"));
  EXPECT_TRUE(fm_.removeItemAtURL(url("a"), &error_)) << error_->description();
  EXPECT_FALSE(exists("a"));
  if (exists("a/b/locked")) chattr("-i", path("a/b/locked"));  // so that clean-up works

  makeFile("d/first");
  for (int i = 0; i < 100; ++i) makeFile("d/held/child" + std::to_string(i));
  makeFile("d/z/last");
  chattr("+i", path("d/held"));
  EXPECT_EQ(errnoOf(fm_.removeItemAtURL(url("d"), &error_)), EPERM);
  chattr("-i", path("d/held"));
  EXPECT_TRUE(exists("d/held/child0") && exists("d/held/child99"));
  EXPECT_FALSE(exists("d/first") || exists("d/z"));
}

TEST_F(FileManagerTest, RemovalStopsAtOtherFileSystemsAndReportsTheFirstErrno) {
  makeFile("a/before");
  makeFile("a/after/x");
  fs::create_directories(path("a/mnt"));
  if (mount("tmpfs", path("a/mnt").c_str(), "tmpfs", 0, "size=16m") != 0)
    GTEST_SKIP() << "no tmpfs: " << strerror(errno);
  mounts_.push_back(path("a/mnt"));
  std::ofstream(path("a/mnt/keep")) << "k";
  EXPECT_EQ(errnoOf(fm_.removeItemAtURL(url("a"), &error_)), EBUSY);
  EXPECT_TRUE(exists("a/mnt/keep"));
  EXPECT_FALSE(exists("a/before") || exists("a/after"));
}

TEST_F(FileManagerTest, RemovalNeverFollowsLinksAndCopesWithMissingAndDeepTrees) {
  EXPECT_TRUE(fm_.removeItemAtURL(url("missing/deeper"), &error_));
  EXPECT_EQ(errnoOf(fm_.removeItemAtURL(QRTURL(), &error_)), EFAULT);
  makeFile("outside/precious");
  makeFile("tree/file");
  ASSERT_EQ(symlink(path("outside").c_str(), path("tree/link").c_str()), 0);
  EXPECT_TRUE(fm_.removeItemAtURL(url("tree"), nullptr));  // a link at the top: hostile suite
  EXPECT_FALSE(exists("tree"));
  EXPECT_TRUE(exists("outside/precious"));

  std::string deep = "deep";  // 150 levels: deeper than a walk keeps directories open at once
  for (int i = 0; i < 150; ++i) deep += "/d";
  makeFile(deep + "/leaf");
  EXPECT_TRUE(fm_.removeItemAtURL(url("deep"), &error_));
  EXPECT_FALSE(exists("deep"));
}

TEST_F(FileManagerTest, CreationSetsModeOwnerAndClassAsAskedButNotClassOneWhileLocked) {
  EXPECT_TRUE(fm_.createDirectoryAtURL(url("a/b"), true, 0750, &error_));
  EXPECT_EQ(fs::status(path("a")).permissions(), fs::perms(0750));
  EXPECT_EQ(fs::status(path("a/b")).permissions(), fs::perms(0750));
  EXPECT_EQ(errnoOf(fm_.createDirectoryAtURL(url("x/y"), false, 0755, &error_)), ENOENT);

  ASSERT_EQ(chmod(path("a").c_str(), 0711), 0);
  EXPECT_TRUE(fm_.createDirectoryAtURL(url("a"), false, 0700, 501u, &error_));
  EXPECT_TRUE(fm_.createDirectoryAtURL(url("a"), true, 0700, 3, &error_));
  EXPECT_TRUE(fm_.createDirectoryAtURL(url("a"), true, 0700, 0u, -1, &error_));  // leaves both alone
  const struct stat st = lstatOf(path("a"));
  EXPECT_EQ(st.st_uid, 501u);
  EXPECT_EQ(st.st_gid, 501u);
  EXPECT_EQ(st.st_mode & 07777, 0711u);
  EXPECT_EQ(protectionClassOf(path("a")), 3);
  EXPECT_EQ(protectionClassOf(path("a/b")), 0);

  // While locked, class 1 can neither be set nor left.
  platform::setDeviceRoot(tmp_.path());
  fs::create_directories(tmp_ / "run/device");
  EXPECT_TRUE(fm_.createDirectoryAtURL(url("was-one"), false, 0755, 1, &error_));
  std::ofstream(tmp_ / "run/device/lockstate") << "1\n";
  EXPECT_EQ(errnoOf(fm_.createDirectoryAtURL(url("d"), false, 0755, 1, &error_)), EPERM);
  EXPECT_TRUE(fm_.createDirectoryAtURL(url("d"), false, 0755, 3, &error_));  // the directory stayed
  EXPECT_EQ(errnoOf(fm_.createDirectoryAtURL(url("was-one"), false, 0755, 3, &error_)), EPERM);
  EXPECT_EQ(protectionClassOf(path("was-one")), 1);
}

// Set-id bits and device nodes are the hostile suite's.
TEST_F(FileManagerTest, CopyKeepsDataModeOwnerXattrsAclsAndLinks) {
  makeFile("src/sub/file", "payload");
  ASSERT_EQ(chown(path("src/sub/file").c_str(), 502, 503), 0);
  ASSERT_EQ(chown(path("src/sub").c_str(), 501, 20), 0);
  ASSERT_EQ(setxattr(path("src/sub/file").c_str(), "user.note", "v1", 2, 0), 0);
  ASSERT_EQ(setxattr(path("src/sub/file").c_str(), "trusted.com.norvane.protection-class", "\3\0\0\0", 4, 0), 0);
  acl_t acl = acl_from_text("u::rw-,g::r--,g:100:rw-,m::rw-,o::---");
  ASSERT_EQ(acl_set_file(path("src/sub/file").c_str(), ACL_TYPE_ACCESS, acl), 0);
  ASSERT_EQ(acl_set_file(path("src/sub").c_str(), ACL_TYPE_DEFAULT, acl), 0);
  acl_free(acl);
  ASSERT_EQ(symlink("file", path("src/sub/link").c_str()), 0);
  ASSERT_EQ(symlink("/nowhere", path("src/dangling").c_str()), 0);
  ASSERT_EQ(lchown(path("src/dangling").c_str(), 504, 505), 0);
  struct timespec old[2] = {{1000000, 0}, {1000000, 0}};
  ASSERT_EQ(utimensat(AT_FDCWD, path("src/sub/file").c_str(), old, 0), 0);

  ASSERT_TRUE(fm_.copyItemAtURL(url("src"), url("dst"), &error_)) << error_->description();
  EXPECT_EQ(fileText(path("dst/sub/file")), "payload");
  auto meta = [](const std::string& p) {
    const struct stat st = lstatOf(p);
    return std::tuple(st.st_mode, st.st_uid, st.st_gid, st.st_mtim.tv_sec);
  };
  for (std::string rel : {"sub", "sub/file", "dangling", "sub/link"})
    EXPECT_EQ(meta(path("dst/" + rel)), meta(path("src/" + rel))) << rel;
  for (const char* name : {"user.note", "trusted.com.norvane.protection-class", "system.posix_acl_access"})
    EXPECT_EQ(xattr(path("dst/sub/file"), name), xattr(path("src/sub/file"), name)) << name;
  EXPECT_EQ(xattr(path("dst/sub"), "system.posix_acl_default"), xattr(path("src/sub"), "system.posix_acl_default"));
  EXPECT_EQ(fs::read_symlink(path("dst/dangling")), "/nowhere");
  EXPECT_EQ(fs::read_symlink(path("dst/sub/link")), "file");

  EXPECT_EQ(errnoOf(fm_.copyItemAtURL(url("src"), url("src/sub/inside"), &error_)), EINVAL);
}

TEST_F(FileManagerTest, TemporaryDirectoriesArePrivateListingsSkipHiddenNamesExistenceAnswersFalseWhenUnsure) {
  error_ = QRT_POSIX_ERROR(1, "stale");
  auto a = fm_.createTemporaryDirectoryInDirectoryURL(url(""), "job.", &error_);
  EXPECT_FALSE(error_);  // cleared up front
  auto b = fm_.createTemporaryDirectoryInDirectoryURL(url(""), "job.", &error_);
  auto c = fm_.createTemporaryDirectoryInDirectoryURL(url(""), &error_);
  ASSERT_TRUE(a && b && c);
  EXPECT_NE(a->path(), b->path());
  EXPECT_EQ(a->lastPathComponent().rfind("job.", 0), 0u);
  EXPECT_EQ(fs::status(a->path()).permissions(), fs::perms::owner_all);
  EXPECT_EQ(errnoOf(fm_.createTemporaryDirectoryInDirectoryURL(url("missing"), &error_).has_value()), ENOENT);

  makeFile("d/file");
  makeFile("d/sub/.hidden");
  makeFile("d/.com.norvane.quarter_kit.metadata.plist");
  auto urls = fm_.urlsForItemsInDirectoryAtURL(url("d"), &error_);
  ASSERT_TRUE(urls);
  ASSERT_EQ(urls->size(), 2u);
  for (const QRTURL& u : *urls) EXPECT_EQ(u.isDirectory(), u.lastPathComponent() == "sub") << u.path();
  EXPECT_EQ(errnoOf(fm_.urlsForItemsInDirectoryAtURL(url("missing"), &error_).has_value()), ENOENT);

  ASSERT_EQ(symlink("/nowhere/at/all", path("dangling").c_str()), 0);
  EXPECT_TRUE(fm_.itemExistsAtURL(url("dangling")));
  EXPECT_FALSE(fm_.itemDoesNotExistAtURL(url("dangling")));
  EXPECT_TRUE(fm_.itemDoesNotExistAtURL(url("missing")));
  EXPECT_FALSE(fm_.itemExistsAtURL(url("missing")));
  // ENOTDIR settles neither question.
  EXPECT_FALSE(fm_.itemExistsAtURL(url("d/file/below")) || fm_.itemDoesNotExistAtURL(url("d/file/below")));
}

// Planted links and FIFOs in place of the file: the adversarial suite.
TEST_F(FileManagerTest, PropertyListFilesRoundTripAndRejectOtherShapes) {
  plist::Dictionary dict{{"Identifier", "com.example.app"}, {"Class", 2}};
  ASSERT_TRUE(QRT_writeToURL(dict, url("meta.plist"), QRTWriteAtomic | QRTWriteFileProtectionNone, &error_));
  EXPECT_EQ(std::distance(fs::directory_iterator(root_), {}), 1);  // no temporary left behind
  EXPECT_EQ(QRT_dictionaryWithContentsOfURL(url("meta.plist"), &error_), dict);

  plist::Data array = plist::writeBinary(plist::Value(plist::Array{1, 2}));
  std::ofstream(path("array.plist")) << std::string(array.begin(), array.end());
  std::ofstream(path("garbage.plist")) << "bplist00 not really";
  const std::vector<std::tuple<const char*, std::string, int>> failures = {
      {"array.plist", QRTPropertyListErrorDomain, 2048},
      {"garbage.plist", QRTPropertyListErrorDomain, 3840},
      {"missing.plist", QRTPOSIXErrorDomain, ENOENT}};
  for (const auto& [rel, domain, code] : failures) {
    EXPECT_FALSE(QRT_dictionaryWithContentsOfURL(url(rel), &error_)) << rel;
    EXPECT_EQ(error_->domain(), domain) << rel;
    EXPECT_EQ(error_->code(), code) << rel;
  }
}

// ---- disk usage, protection classes and the tree dump ----

using UsageTest = FileManagerTest;

// Hard links in every directory, so that the walk's two threads both meet
// the same inode; one twin lies outside the tree.
TEST_F(UsageTest, CountsAllocatedBytesOfEverythingButDirectoriesAndEachInodeOnce) {
  makeFile("c/empty", "");
  makeFile("c/a/large", std::string(300000, 'x'));
  makeFile("shared", std::string(20000, 'x'));
  ASSERT_EQ(symlink(std::string(200, 'y').c_str(), path("c/a/link").c_str()), 0);  // a link with its own block
  ASSERT_EQ(link(path("shared").c_str(), path("c/a/inside").c_str()), 0);
  fs::create_directories(path("c/a/b/hollow/hollower"));
  auto wide = [](int i) { return "c/wide/d" + std::to_string(i % 40) + "/f" + std::to_string(i); };
  for (int i = 0; i < 300; ++i) makeFile(wide(i), std::string(50 * i, 'x'));
  for (int i = 0; i < 40; ++i)
    ASSERT_EQ(link(path("c/a/large").c_str(), path("c/wide/d" + std::to_string(i) + "/twin").c_str()), 0);
  sync();
  uint64_t expected = allocated("c/a/large") + allocated("c/a/link") + allocated("shared");
  for (int i = 0; i < 300; ++i) expected += allocated(wide(i));
  ASSERT_GT(allocated("c/a/link"), 0u);
  EXPECT_EQ(fm_.diskUsageForURL(url("c")), expected);
  EXPECT_EQ(fm_.diskUsageForURL(url("c")), expected);  // nothing remembered between walks
  EXPECT_EQ(fm_.diskUsageForURL(url("c/a/b/hollow")), 0u);
  // A root that is no directory measures zero (links: hostile suite).
  for (const QRTURL& u : {url("c/a/large"), url("missing"), QRTURL()})
    EXPECT_EQ(fm_.diskUsageForURL(u), 0u) << u.path();
}

// An app can nest directories deeper than any path the kernel takes.
TEST_F(UsageTest, ChildDirectoryBeyondPathMaxIsLeftOut) {
  makeFile("c/counted", std::string(4000, 'x'));
  const std::string name(200, 'n');
  int fd = open(path("c").c_str(), O_RDONLY | O_DIRECTORY);
  for (int depth = 0; depth < 25 && fd >= 0; ++depth) {
    ASSERT_EQ(mkdirat(fd, name.c_str(), 0755), 0);
    int next = openat(fd, name.c_str(), O_RDONLY | O_DIRECTORY);
    close(fd);
    fd = next;
  }
  ASSERT_GE(fd, 0);
  int file = openat(fd, "deep", O_WRONLY | O_CREAT, 0644);
  ASSERT_EQ(write(file, "deep", 4), 4);
  close(file);
  close(fd);
  sync();
  EXPECT_EQ(fm_.diskUsageForURL(url("c")), allocated("c/counted"));
  fs::remove_all(path("c"));  // the TempDir's removal would stop at the long path
}

TEST_F(UsageTest, ClassIsSetAndReadOnFilesAndDirectoriesUnlessThePredicateDeclines) {
  makeFile("f", std::string(10, 'x'));
  fs::create_directories(path("d"));
  EXPECT_EQ(classOf("f"), 0);  // no attribute yet
  for (const char* rel : {"f", "d"}) {
    ASSERT_TRUE(fm_.setDataProtectionClassOfItemAtURL(url(rel), -7, {}, &error_)) << error_->description();
    EXPECT_EQ(classOf(rel), -7) << rel;
    ASSERT_TRUE(fm_.setDataProtectionClassOfItemAtURL(url(rel), 4, {}, &error_));
    EXPECT_EQ(classOf(rel), 4) << rel;
  }
  int32_t seen = -1;
  EXPECT_TRUE(fm_.setDataProtectionClassOfItemAtURL(
      url("f"), 2, [&](int32_t current) { return seen = current, false; }, &error_));
  EXPECT_EQ(seen, 4);
  EXPECT_EQ(classOf("f"), 4);
  EXPECT_TRUE(fm_.setDataProtectionClassOfItemAtURL(
      url("f"), 2, [](int32_t current) { return current == 4; }, &error_));
  EXPECT_EQ(classOf("f"), 2);
  EXPECT_FALSE(error_);
  // Links are refused with the others in the hostile suite.
  EXPECT_EQ(errnoOf(fm_.setDataProtectionClassOfItemAtURL(url("missing"), 3, {}, &error_)), ENOENT);
}

// ---- error values: what they carry and the exception guard ----

// The text a log line shows; without a format there is none, and negative codes widen by sign.
TEST(QRTErrorTest, CarriesDescriptionOriginAndCauseAndGuardsExceptions) {
  QRTErrorRef cause = QRT_POSIX_ERROR(2, "stat of %@ failed: %s", std::string("/a"), "No such file");
  EXPECT_EQ(cause->description(), "QRTPOSIXErrorDomain 2: stat of /a failed: No such file");
  QRTErrorRef error = QRTCreateError("f", 1, QRTErrorDomain, -1, cause, nullptr, true, nullptr);
  EXPECT_EQ(error->localizedDescription(), std::nullopt);
  EXPECT_EQ(error->description(), "QRTErrorDomain -1");
  EXPECT_EQ(error->resultCode(), UINT64_MAX);

  EXPECT_EQ(QRT_GUARD([] {}), nullptr);
  error = QRT_GUARD([] { throw std::runtime_error("boom"); });
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), 40);
  EXPECT_NE(error->localizedDescription()->find("Got exception: "), std::string::npos);
  EXPECT_NE(error->localizedDescription()->find(" : boom"), std::string::npos);
  EXPECT_EQ(QRT_GUARD([] { throw 7; })->code(), 40);
}

}  // namespace
