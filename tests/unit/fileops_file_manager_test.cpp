// QRTFileManager against a real ext4 scratch directory (and tmpfs mounts where
// the machine allows them): removal with its immutable-flag repair, creation,
// copy, move, temporary directories, listing, traversal and plist files.
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/acl.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "Daemon/QRTFileManager.h"
#include "base/PlistCodec.h"
#include "platform/DeviceRoot.h"
#include "platform/Log.h"

namespace {

class FileManagerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char tmpl[] = "/var/tmp/qrt-fm-test.XXXXXX";
    ASSERT_NE(mkdtemp(tmpl), nullptr);
    base_ = tmpl;
    root_ = base_ + "/t";
    ASSERT_EQ(mkdir(root_.c_str(), 0755), 0);
    platform::logOpen(base_ + "/quarterd.log", "fileops-test", 5);
    umask(022);
    oldRoot_ = platform::deviceRoot();
  }
  void TearDown() override {
    platform::logClose();
    platform::setDeviceRoot(oldRoot_);
    for (const std::string& p : mounts_) umount2(p.c_str(), MNT_DETACH);
    std::error_code ec;
    std::filesystem::remove_all(base_, ec);
  }

  std::string path(const std::string& rel) const { return root_ + "/" + rel; }
  QRTURL url(const std::string& rel) const { return QRTURL::fileURL(path(rel)); }
  void makeDirs(const std::string& rel) { std::filesystem::create_directories(path(rel)); }
  void makeFile(const std::string& rel, const std::string& content = "data") {
    std::filesystem::create_directories(std::filesystem::path(path(rel)).parent_path());
    std::ofstream(path(rel)) << content;
  }
  bool exists(const std::string& rel) const {
    struct stat st;
    return lstat(path(rel).c_str(), &st) == 0;
  }
  static std::string readFile(const std::string& p) {
    std::ifstream in(p);
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
  }
  std::string logText() const { return readFile(base_ + "/quarterd.log"); }
  static void setImmutable(const std::string& p, bool on) {
    int fd = open(p.c_str(), O_RDONLY | O_NONBLOCK);
    ASSERT_GE(fd, 0) << p;
    int flags = 0;
    ASSERT_EQ(ioctl(fd, FS_IOC_GETFLAGS, &flags), 0);
    flags = on ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
    ASSERT_EQ(ioctl(fd, FS_IOC_SETFLAGS, &flags), 0);
    close(fd);
  }
  // A 16 MiB tmpfs at rel, or false where mounting is refused.
  bool mountTmpfs(const std::string& rel) {
    makeDirs(rel);
    if (mount("tmpfs", path(rel).c_str(), "tmpfs", 0, "size=16m") != 0) return false;
    mounts_.push_back(path(rel));
    return true;
  }
  static std::string xattr(const std::string& p, const char* name) {
    char buf[4096];
    ssize_t n = lgetxattr(p.c_str(), name, buf, sizeof buf);
    return n < 0 ? "<none>" : std::string(buf, n);
  }

  QRTFileManager& fm_ = QRTFileManager::defaultManager();
  std::string base_, root_, oldRoot_;
  std::vector<std::string> mounts_;
  QRTErrorRef error_;
};

// --- removal ---------------------------------------------------------------

TEST_F(FileManagerTest, RemovalRepairsImmutableFilesAndLeavesNothing) {
  makeFile("a/one");
  for (int i = 0; i < 100; ++i) makeFile("a/b/f" + std::to_string(i));  // enough for several threads
  makeFile("a/b/locked");
  makeFile("a/b/c/two");
  setImmutable(path("a/b/locked"), true);
  EXPECT_TRUE(fm_.removeItemAtURL(url("a"), &error_)) << error_->description();
  EXPECT_FALSE(exists("a"));
  if (exists("a/b/locked")) setImmutable(path("a/b/locked"), false);  // so that clean-up works
  EXPECT_NE(logText().find("Unset UF_IMMUTABLE on " + path("a/b/locked")), std::string::npos);
}

TEST_F(FileManagerTest, ImmutableDirectoryFailsWithEPERMAfterTheRestIsGone) {
  makeFile("a/first");
  for (int i = 0; i < 100; ++i) makeFile("a/held/child" + std::to_string(i));
  makeFile("a/z/last");
  setImmutable(path("a/held"), true);
  EXPECT_FALSE(fm_.removeItemAtURL(url("a"), &error_));
  setImmutable(path("a/held"), false);
  ASSERT_TRUE(error_);
  EXPECT_EQ(error_->domain(), QRTPOSIXErrorDomain);
  EXPECT_EQ(error_->code(), EPERM);
  EXPECT_EQ(error_->localizedDescription(), "prunetree of " + path("a") + " failed: Operation not permitted");
  EXPECT_TRUE(exists("a/held/child0"));
  EXPECT_TRUE(exists("a/held/child99"));
  EXPECT_FALSE(exists("a/first"));
  EXPECT_FALSE(exists("a/z"));
  EXPECT_NE(logText().find("prunetree hit error for " + path("a/held/child7") + " : "), std::string::npos);
}

TEST_F(FileManagerTest, RemovalStopsAtOtherFileSystemsAndReportsTheirErrno) {
  makeFile("a/before");
  makeFile("a/after/x");
  if (!mountTmpfs("a/mnt")) GTEST_SKIP() << "mounting tmpfs refused: " << strerror(errno);
  std::ofstream(path("a/mnt/keep")) << "k";
  EXPECT_FALSE(fm_.removeItemAtURL(url("a"), &error_));
  ASSERT_TRUE(error_);
  EXPECT_EQ(error_->code(), EBUSY);
  EXPECT_TRUE(exists("a/mnt/keep"));
  EXPECT_FALSE(exists("a/before"));
  EXPECT_FALSE(exists("a/after"));
}

TEST_F(FileManagerTest, RemovalOfMissingPathsLinksAndDeepTrees) {
  EXPECT_TRUE(fm_.removeItemAtURL(url("missing/deeper"), &error_));
  EXPECT_FALSE(fm_.removeItemAtURL(QRTURL(), &error_));
  ASSERT_TRUE(error_);
  EXPECT_EQ(error_->code(), EFAULT);
  EXPECT_EQ(error_->localizedDescription(), "nil url passed to -removeItemAtURL:error:");

  makeFile("outside/precious");
  makeDirs("tree");
  ASSERT_EQ(symlink(path("outside").c_str(), path("tree/link").c_str()), 0);
  ASSERT_EQ(symlink(path("outside").c_str(), path("toplink").c_str()), 0);
  EXPECT_TRUE(fm_.removeItemAtURL(url("tree"), nullptr));
  EXPECT_TRUE(fm_.removeItemAtURL(url("toplink"), nullptr));
  EXPECT_FALSE(exists("tree"));
  EXPECT_FALSE(exists("toplink"));
  EXPECT_TRUE(exists("outside/precious"));

  // Deeper than the walk keeps directories open at once.
  std::string rel = "deep";
  for (int i = 0; i < 150; ++i) rel += "/d";
  makeFile(rel + "/leaf");
  EXPECT_TRUE(fm_.removeItemAtURL(url("deep"), &error_));
  EXPECT_FALSE(exists("deep"));
}

// --- creation and protection classes ---------------------------------------

int32_t protectionClassOf(const std::string& p) {
  int fd = open(p.c_str(), O_RDONLY);
  int32_t cls = -100;
  EXPECT_EQ(QRTGetProtectionClass(fd, &cls), 0);
  close(fd);
  return cls;
}

TEST_F(FileManagerTest, CreateWithAndWithoutParents) {
  EXPECT_TRUE(fm_.createDirectoryAtURL(url("a/b/c"), true, 0750, &error_));
  struct stat st;
  ASSERT_EQ(stat(path("a/b/c").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0750u);
  ASSERT_EQ(stat(path("a").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0750u);

  EXPECT_FALSE(fm_.createDirectoryAtURL(url("x/y"), false, 0755, &error_));
  ASSERT_TRUE(error_);
  EXPECT_EQ(error_->code(), ENOENT);
  EXPECT_EQ(error_->localizedDescription(), "mkdir of " + path("x/y") + " failed: No such file or directory");
  makeFile("file");
  EXPECT_FALSE(fm_.createDirectoryAtURL(url("file/sub"), true, 0755, &error_));
  EXPECT_EQ(error_->code(), ENOTDIR);
}

TEST_F(FileManagerTest, ExistingDirectoryGetsOwnerAndClassUnlessLeftAlone) {
  makeDirs("d");
  chmod(path("d").c_str(), 0711);
  EXPECT_TRUE(fm_.createDirectoryAtURL(url("d"), false, 0700, 501u, 3, &error_));
  struct stat st;
  ASSERT_EQ(stat(path("d").c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, 501u);
  EXPECT_EQ(st.st_gid, 501u);
  EXPECT_EQ(st.st_mode & 07777, 0711u);  // the mode is only for creation
  EXPECT_EQ(protectionClassOf(path("d")), 3);

  EXPECT_TRUE(fm_.createDirectoryAtURL(url("d"), true, 0700, 0u, -1, &error_));
  ASSERT_EQ(stat(path("d").c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, 501u);
  EXPECT_EQ(protectionClassOf(path("d")), 3);

  EXPECT_TRUE(fm_.createDirectoryAtURL(url("d"), true, 0700, int32_t{2}, &error_));
  EXPECT_TRUE(fm_.createDirectoryAtURL(url("d"), true, 0700, uint32_t{502}, &error_));
  ASSERT_EQ(stat(path("d").c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, 502u);
  EXPECT_EQ(protectionClassOf(path("d")), 2);
  makeDirs("fresh");
  EXPECT_EQ(protectionClassOf(path("fresh")), 0);
}

TEST_F(FileManagerTest, ProtectionClassRefusesClassOneWhileLocked) {
  platform::setDeviceRoot(base_);
  std::filesystem::create_directories(base_ + "/run/device");
  std::ofstream(base_ + "/run/device/lockstate") << "0\n";
  makeDirs("was-one");
  EXPECT_TRUE(fm_.createDirectoryAtURL(url("was-one"), false, 0755, 1, &error_));
  std::ofstream(base_ + "/run/device/lockstate") << "1\n";

  EXPECT_FALSE(fm_.createDirectoryAtURL(url("d"), false, 0755, 1, &error_));
  ASSERT_TRUE(error_);
  EXPECT_EQ(error_->code(), EPERM);
  EXPECT_EQ(error_->localizedDescription(),
            "Failed to setclass(1) on directory " + path("d") + ": Operation not permitted");
  EXPECT_TRUE(exists("d"));  // the directory stays
  EXPECT_TRUE(fm_.createDirectoryAtURL(url("d"), false, 0755, 3, &error_));
  EXPECT_FALSE(fm_.createDirectoryAtURL(url("was-one"), false, 0755, 3, &error_));
  EXPECT_EQ(protectionClassOf(path("was-one")), 1);
}

// --- copy and move -----------------------------------------------------------

TEST_F(FileManagerTest, CopyKeepsDataModeOwnerXattrsAclsAndLinks) {
  makeFile("src/sub/file", "payload");
  makeFile("src/setuid", "s");
  ASSERT_EQ(chmod(path("src/sub/file").c_str(), 0640), 0);
  ASSERT_EQ(chown(path("src/sub/file").c_str(), 502, 503), 0);
  ASSERT_EQ(chmod(path("src/setuid").c_str(), 04755), 0);
  ASSERT_EQ(chmod(path("src/sub").c_str(), 0750), 0);
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
  EXPECT_EQ(readFile(path("dst/sub/file")), "payload");
  struct stat s, d;
  for (const char* rel : {"sub", "sub/file", "setuid", "dangling", "sub/link"}) {
    ASSERT_EQ(lstat(path(std::string("src/") + rel).c_str(), &s), 0);
    ASSERT_EQ(lstat(path(std::string("dst/") + rel).c_str(), &d), 0) << rel;
    EXPECT_EQ(s.st_mode, d.st_mode) << rel;
    EXPECT_EQ(s.st_uid, d.st_uid) << rel;
    EXPECT_EQ(s.st_gid, d.st_gid) << rel;
    EXPECT_EQ(s.st_mtim.tv_sec, d.st_mtim.tv_sec) << rel;
  }
  for (const char* name : {"user.note", "trusted.com.norvane.protection-class", "system.posix_acl_access"})
    EXPECT_EQ(xattr(path("dst/sub/file"), name), xattr(path("src/sub/file"), name)) << name;
  EXPECT_EQ(xattr(path("dst/sub"), "system.posix_acl_default"), xattr(path("src/sub"), "system.posix_acl_default"));
  EXPECT_EQ(std::filesystem::read_symlink(path("dst/dangling")), "/nowhere");
  EXPECT_EQ(std::filesystem::read_symlink(path("dst/sub/link")), "file");

  EXPECT_FALSE(fm_.copyItemAtURL(url("src"), url("src/sub/inside"), &error_));
  EXPECT_EQ(error_->localizedDescription(), "clonetree of " + path("src") + " to " + path("src/sub/inside") +
                                                " failed: Invalid argument");
}

TEST_F(FileManagerTest, MissingSourceDependsOnFailIfSrcMissing) {
  EXPECT_TRUE(fm_.copyItemIfExistsAtURL(url("nothing"), url("c"), &error_));
  EXPECT_TRUE(fm_.moveItemIfExistsAtURL(url("nothing"), url("m"), &error_));
  EXPECT_FALSE(error_);
  EXPECT_FALSE(exists("c"));
  EXPECT_FALSE(exists("m"));
  EXPECT_FALSE(fm_.copyItemAtURL(url("nothing"), url("c"), &error_));
  EXPECT_EQ(error_->code(), ENOENT);
  EXPECT_FALSE(fm_.moveItemAtURL(url("nothing"), url("m"), &error_));
  EXPECT_EQ(error_->code(), ENOENT);
  EXPECT_EQ(error_->localizedDescription(),
            "rename of " + path("nothing") + " to " + path("m") + " failed: No such file or directory");
  EXPECT_FALSE(exists("c"));
  EXPECT_FALSE(exists("m"));
}

TEST_F(FileManagerTest, MoveAcrossFileSystemsCopiesThenRemovesTheSource) {
  makeFile("src/a/one", "1");
  makeFile("src/two", "2");
  ASSERT_EQ(setxattr(path("src/two").c_str(), "trusted.k", "v", 1, 0), 0);
  ASSERT_EQ(symlink("a/one", path("src/link").c_str()), 0);
  if (!mountTmpfs("mnt")) GTEST_SKIP() << "mounting tmpfs refused: " << strerror(errno);
  ASSERT_TRUE(fm_.moveItemAtURL(url("src"), url("mnt/moved"), &error_)) << error_->description();
  EXPECT_FALSE(exists("src"));
  EXPECT_EQ(readFile(path("mnt/moved/a/one")), "1");
  EXPECT_EQ(readFile(path("mnt/moved/two")), "2");
  EXPECT_EQ(xattr(path("mnt/moved/two"), "trusted.k"), "v");
  EXPECT_EQ(std::filesystem::read_symlink(path("mnt/moved/link")), "a/one");

  ASSERT_TRUE(fm_.moveItemAtURL(url("mnt/moved"), url("back"), &error_));
  EXPECT_EQ(readFile(path("back/two")), "2");
  EXPECT_FALSE(exists("mnt/moved"));
}

// --- temporary directories, listing, existence -------------------------------

TEST_F(FileManagerTest, TemporaryDirectoriesAreUniqueAndPrivate) {
  error_ = QRT_POSIX_ERROR(1, "stale");
  auto a = fm_.createTemporaryDirectoryInDirectoryURL(url(""), "job.", &error_);
  EXPECT_FALSE(error_);  // cleared up front
  auto b = fm_.createTemporaryDirectoryInDirectoryURL(url(""), "job.", &error_);
  auto c = fm_.createTemporaryDirectoryInDirectoryURL(url(""), &error_);
  ASSERT_TRUE(a && b && c);
  EXPECT_NE(a->path(), b->path());
  EXPECT_EQ(a->lastPathComponent().rfind("job.", 0), 0u);
  EXPECT_EQ(c->lastPathComponent().size(), 11u);
  EXPECT_EQ(c->lastPathComponent().rfind("temp.", 0), 0u);
  EXPECT_TRUE(a->isDirectory());
  struct stat st;
  ASSERT_EQ(stat(a->fileSystemRepresentation(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0700u);

  EXPECT_FALSE(fm_.createTemporaryDirectoryInDirectoryURL(url("missing"), &error_));
  ASSERT_TRUE(error_);
  EXPECT_EQ(error_->code(), ENOENT);
}

TEST_F(FileManagerTest, ListingSkipsHiddenNamesAndMarksDirectories) {
  makeFile("d/file");
  makeDirs("d/sub");
  makeFile("d/.hidden");
  makeFile("d/.com.norvane.quarter_kit.metadata.plist");
  auto urls = fm_.urlsForItemsInDirectoryAtURL(url("d"), &error_);
  ASSERT_TRUE(urls);
  ASSERT_EQ(urls->size(), 2u);
  for (const QRTURL& u : *urls) EXPECT_EQ(u.isDirectory(), u.lastPathComponent() == "sub") << u.path();

  makeFile("h/.only");
  auto empty = fm_.urlsForItemsInDirectoryAtURL(url("h"), &error_);
  ASSERT_TRUE(empty);
  EXPECT_TRUE(empty->empty());

  EXPECT_FALSE(fm_.urlsForItemsInDirectoryAtURL(url("missing"), &error_));
  EXPECT_EQ(error_->code(), ENOENT);
  EXPECT_EQ(error_->localizedDescription(),
            "_IterateDirectory for " + path("missing") + " returned No such file or directory");
  EXPECT_EQ(logText().find("opendir of"), std::string::npos);
}

TEST_F(FileManagerTest, ExistenceChecksAnswerFalseWhenUnsure) {
  ASSERT_EQ(symlink("/nowhere/at/all", path("dangling").c_str()), 0);
  EXPECT_TRUE(fm_.itemExistsAtURL(url("dangling")));
  EXPECT_FALSE(fm_.itemDoesNotExistAtURL(url("dangling")));
  EXPECT_FALSE(fm_.itemExistsAtURL(url("missing")));
  EXPECT_TRUE(fm_.itemDoesNotExistAtURL(url("missing")));
  makeFile("file");
  EXPECT_FALSE(fm_.itemExistsAtURL(url("file/below")));  // ENOTDIR: cannot be settled
  EXPECT_FALSE(fm_.itemDoesNotExistAtURL(url("file/below")));
  EXPECT_NE(logText().find("Failed to determine if " + path("file/below") + " exists: Not a directory"),
            std::string::npos);
}

// --- traversal ----------------------------------------------------------------

TEST_F(FileManagerTest, TraversalSeesDirectoriesTwiceAndCanSkipOrStop) {
  makeFile("r/f");
  makeFile("r/skip/hidden");
  ASSERT_EQ(symlink("f", path("r/l").c_str()), 0);
  std::vector<std::string> seen;
  auto record = [&](QRTTraversalEntry& e, QRTErrorRef*) {
    static const char* kinds[] = {"pre", "post", "file", "link", "other"};
    std::string rel = std::string(e.path).substr(root_.size() + 1);
    seen.push_back(std::string(kinds[static_cast<int>(e.kind)]) + ":" + rel + ":" + std::to_string(e.level));
    e.skipDescendants = rel == "r/skip";
    return true;
  };
  ASSERT_TRUE(fm_._traverseDirectory(url("r"), &error_, record));
  std::sort(seen.begin() + 1, seen.end() - 1);
  EXPECT_EQ(seen, (std::vector<std::string>{"pre:r:0", "file:r/f:1", "link:r/l:1", "post:r/skip:1",
                                            "pre:r/skip:1", "post:r:0"}));

  int calls = 0;
  auto stopWithError = [&](QRTTraversalEntry&, QRTErrorRef* e) {
    *e = QRT_POSIX_ERROR(EIO, "visitor gave up");
    return ++calls < 2;
  };
  EXPECT_FALSE(fm_._traverseDirectory(url("r"), &error_, stopWithError));
  EXPECT_EQ(calls, 2);
  EXPECT_EQ(error_->localizedDescription(), "visitor gave up");
  error_ = nullptr;
  EXPECT_FALSE(fm_._traverseDirectory(url("r"), &error_, [](QRTTraversalEntry&, QRTErrorRef*) { return false; }));
  EXPECT_FALSE(error_);
  EXPECT_FALSE(fm_._traverseDirectory(url("missing"), &error_, record));
  EXPECT_EQ(error_->code(), ENOENT);
}

// --- property-list files and strings -------------------------------------------

TEST_F(FileManagerTest, PropertyListFilesRoundTripAndRejectOtherShapes) {
  plist::Dictionary dict{{"Identifier", "com.example.app"}, {"Class", 2}};
  ASSERT_EQ(symlink(path("victim").c_str(), path("meta.plist").c_str()), 0);
  ASSERT_TRUE(QRT_writeToURL(dict, url("meta.plist"), QRTWriteAtomic | QRTWriteFileProtectionNone, &error_));
  EXPECT_FALSE(exists("victim"));  // the planted link was replaced, not followed
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(root_), {}), 1);
  auto back = QRT_dictionaryWithContentsOfURL(url("meta.plist"), &error_);
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, dict);
  ASSERT_TRUE(QRT_writeToURL({{"k", true}}, url("plain.plist"), QRTWriteOptionsNone, &error_));
  EXPECT_EQ(QRT_dictionaryWithContentsOfURL(url("plain.plist"), &error_)->size(), 1u);

  plist::Data array = plist::writeBinary(plist::Value(plist::Array{1, 2}));
  std::ofstream(path("array.plist")) << std::string(array.begin(), array.end());
  EXPECT_FALSE(QRT_dictionaryWithContentsOfURL(url("array.plist"), &error_));
  EXPECT_EQ(error_->domain(), QRTCocoaErrorDomain);
  EXPECT_EQ(error_->code(), 2048);
  std::ofstream(path("garbage.plist")) << "bplist00 not really";
  EXPECT_FALSE(QRT_dictionaryWithContentsOfURL(url("garbage.plist"), &error_));
  EXPECT_EQ(error_->domain(), QRTCocoaErrorDomain);
  EXPECT_EQ(error_->code(), 3840);
  EXPECT_FALSE(QRT_dictionaryWithContentsOfURL(url("missing.plist"), &error_));
  EXPECT_EQ(error_->domain(), QRTPOSIXErrorDomain);
  EXPECT_EQ(error_->code(), ENOENT);
  ASSERT_EQ(mkfifo(path("fifo.plist").c_str(), 0600), 0);
  EXPECT_FALSE(QRT_dictionaryWithContentsOfURL(url("fifo.plist"), &error_));  // refused, not waited on
}

TEST(FileManagerStrings, DotDotComponentsAndFileSystemRepresentation) {
  EXPECT_TRUE(containsDotDotPathComponents("a/../b"));
  EXPECT_TRUE(containsDotDotPathComponents(".."));
  EXPECT_TRUE(containsDotDotPathComponents("/a/b/.."));
  EXPECT_FALSE(containsDotDotPathComponents("a/..b"));
  EXPECT_FALSE(containsDotDotPathComponents("a/b../c/..."));
  EXPECT_FALSE(containsDotDotPathComponents(""));
  EXPECT_EQ(stringWithFileSystemRepresentation("/a/bc", 4), "/a/b");
  EXPECT_EQ(stringWithFileSystemRepresentation("/a/bc"), "/a/bc");
  EXPECT_EQ(stringWithFileSystemRepresentation(nullptr), "");
}

}  // namespace
