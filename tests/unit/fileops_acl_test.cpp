#include <acl/libacl.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <fstream>
#include <string>

#include "Daemon/QRTFileManager.h"
#include "platform/DeviceRoot.h"

namespace {

constexpr gid_t kSystemUsersGid = 4242;
constexpr uid_t kNobody = 4294967294u;
constexpr const char* kMetadataName = ".com.norvane.quarter_kit.metadata.plist";
// The lists every stamped item carries (ids numeric, canonical order).
const std::string kFullList = "user::---,group::---,group:4242:rwx,mask::rwx,other::---";

void writeFile(const std::string& path, const std::string& content, mode_t mode = 0644) {
  std::ofstream(path) << content;
  ASSERT_EQ(chmod(path.c_str(), mode), 0) << path;
}

void makeDir(const std::string& path, mode_t mode = 0755) { ASSERT_EQ(mkdir(path.c_str(), mode), 0) << path; }

// The item's list as text, or "none" when it has none of that type.
std::string aclText(const std::string& path, acl_type_t type = ACL_TYPE_ACCESS) {
  acl_t acl = acl_get_file(path.c_str(), type);
  if (!acl) return "error " + std::to_string(errno);
  std::string result = "none";
  if (acl_entries(acl) > 0) {
    char* text = acl_to_any_text(acl, nullptr, ',', TEXT_NUMERIC_IDS);
    result = text ? text : "error";
    acl_free(text);
  }
  acl_free(acl);
  return result;
}

struct stat lstatOf(const std::string& path) {
  struct stat st {};
  EXPECT_EQ(lstat(path.c_str(), &st), 0) << path;
  return st;
}

class FileManagerACLTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    char pattern[] = "/tmp/qrt_acl_test.XXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    deviceRoot_ = pattern;
    makeDir(deviceRoot_ + "/etc");
    writeFile(deviceRoot_ + "/etc/passwd",
              "root:x:0:0::/private/var/root:/bin/sh\n_system:x:499:499::/private/var/empty:/bin/false\n");
    writeGroups(true);
    platform::setDeviceRoot(deviceRoot_);
  }

  static void TearDownTestSuite() {
    platform::setDeviceRoot("/");
    std::string command = "rm -rf '" + deviceRoot_ + "'";
    EXPECT_EQ(std::system(command.c_str()), 0);
  }

  static void writeGroups(bool withSystemUsers) {
    writeFile(deviceRoot_ + "/etc/group",
              std::string("wheel:x:0:\n") + (withSystemUsers ? "systemusers:x:4242:_system\n" : ""));
  }

  void SetUp() override {
    const auto* info = ::testing::UnitTest::GetInstance()->current_test_info();
    base_ = deviceRoot_ + "/" + info->name();
    makeDir(base_);
  }

  void TearDown() override { writeGroups(true); }

  // root/{meta, a/{b/{file}, tool}} and a plain file outside the tree that
  // root/link points at.
  std::string makeTree() {
    std::string root = base_ + "/tree";
    makeDir(root);
    makeDir(root + "/a");
    makeDir(root + "/a/b");
    writeFile(root + "/a/b/file", "data");
    writeFile(root + "/a/tool", "#!/bin/sh\n", 0754);
    writeFile(root + "/" + kMetadataName, "meta", 0600);
    writeFile(base_ + "/outside", "outside");
    EXPECT_EQ(symlink((base_ + "/outside").c_str(), (root + "/link").c_str()), 0);
    return root;
  }

  QRTFileManager& fm = QRTFileManager::defaultManager();
  std::string base_;
  static inline std::string deviceRoot_;
};

TEST_F(FileManagerACLTest, StampedTreeGivesTheGroupEverythingAndOthersNothing) {
  std::string root = makeTree();
  QRTErrorRef error;
  ASSERT_TRUE(fm.standardizeACLsAtURL(QRTURL::fileURL(root, true), false, &error));
  EXPECT_FALSE(error);

  for (const char* dir : {"", "/a", "/a/b"}) {
    std::string path = root + dir;
    EXPECT_EQ(aclText(path), kFullList) << path;
    EXPECT_EQ(aclText(path, ACL_TYPE_DEFAULT), kFullList) << path;
  }
  for (const char* file : {"/a/b/file", "/a/tool"}) {
    std::string path = root + file;
    EXPECT_EQ(aclText(path), kFullList) << path;
  }
  for (const char* item : {"", "/a", "/a/b", "/a/b/file", "/a/tool"}) {
    struct stat st = lstatOf(root + item);
    EXPECT_EQ(st.st_uid, kNobody) << item;
    EXPECT_EQ(st.st_gid, kNobody) << item;
    // Only the mask shows in the mode; owner and other have no rights.
    EXPECT_EQ(st.st_mode & 07777, 0070u) << item;
  }

  // Items made later inherit the group's entry without the daemon.
  std::string later = root + "/a/b/later";
  int fd = open(later.c_str(), O_CREAT | O_WRONLY, 0600);
  ASSERT_GE(fd, 0);
  close(fd);
  EXPECT_NE(aclText(later).find("group:4242:rwx"), std::string::npos) << aclText(later);
  ASSERT_EQ(mkdir((root + "/a/newdir").c_str(), 0777), 0);
  EXPECT_EQ(aclText(root + "/a/newdir", ACL_TYPE_DEFAULT), kFullList);
}

TEST_F(FileManagerACLTest, StampingLeavesMetadataAndLinksAlone) {
  std::string root = makeTree();
  std::string meta = root + "/" + kMetadataName;
  std::string metaACL = aclText(meta);
  ASSERT_TRUE(fm.standardizeACLsForSystemContainerAtURL(QRTURL::fileURL(root, true), nullptr));

  struct stat st = lstatOf(meta);
  EXPECT_EQ(st.st_uid, 0u);
  EXPECT_EQ(st.st_mode & 07777, 0600u);
  EXPECT_EQ(aclText(meta), metaACL);

  st = lstatOf(root + "/link");
  EXPECT_TRUE(S_ISLNK(st.st_mode));
  EXPECT_EQ(st.st_uid, 0u);
  st = lstatOf(base_ + "/outside");
  EXPECT_EQ(st.st_uid, 0u);
  EXPECT_EQ(st.st_mode & 07777, 0644u);
  EXPECT_EQ(aclText(base_ + "/outside"), "user::rw-,group::r--,other::r--");
}

TEST_F(FileManagerACLTest, SystemContainerTopKeepsOwnerAndModeAndLetsTheGroupOnlyAdd) {
  std::string root = makeTree();
  ASSERT_EQ(chown(root.c_str(), 499, 499), 0);
  ASSERT_EQ(chmod(root.c_str(), 0750), 0);
  QRTErrorRef error;
  ASSERT_TRUE(fm.standardizeACLsForSystemContainerAtURL(QRTURL::fileURL(root, true), &error));

  struct stat st = lstatOf(root);
  EXPECT_EQ(st.st_uid, 499u);
  EXPECT_EQ(st.st_gid, 499u);
  EXPECT_EQ(aclText(root), "user::rwx,group::r-x,group:4242:-wx,mask::rwx,other::---");
  EXPECT_EQ(aclText(root, ACL_TYPE_DEFAULT), kFullList);
  EXPECT_EQ(aclText(root + "/a"), kFullList);
  EXPECT_EQ(lstatOf(root + "/a/b/file").st_uid, kNobody);
}

TEST_F(FileManagerACLTest, TopLevelACLAlone) {
  std::string dir = base_ + "/top";
  makeDir(dir, 0700);
  ASSERT_TRUE(fm.setTopLevelSystemContainerACLAtURL(QRTURL::fileURL(dir, true), nullptr));
  EXPECT_EQ(aclText(dir), "user::rwx,group::---,group:4242:-wx,mask::-wx,other::---");
  EXPECT_EQ(aclText(dir, ACL_TYPE_DEFAULT), kFullList);

  // A link is refused, its target untouched.
  std::string link = base_ + "/toplink";
  makeDir(base_ + "/target");
  ASSERT_EQ(symlink((base_ + "/target").c_str(), link.c_str()), 0);
  QRTErrorRef error;
  EXPECT_FALSE(fm.setTopLevelSystemContainerACLAtURL(QRTURL::fileURL(link, true), &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), 63);
  EXPECT_EQ(aclText(base_ + "/target", ACL_TYPE_DEFAULT), "none");

  EXPECT_FALSE(fm.setTopLevelSystemContainerACLAtURL(QRTURL::fileURL(base_ + "/missing", true), &error));
  EXPECT_EQ(error->code(), 63);
}

TEST_F(FileManagerACLTest, StampingEveryContainerOfAClass) {
  std::string classDir = base_ + "/Data/System";
  ASSERT_EQ(system(("mkdir -p '" + classDir + "/one/sub' '" + classDir + "/two'").c_str()), 0);
  QRTErrorRef error;
  ASSERT_TRUE(fm.standardizeAllSystemContainerACLsAtURL(QRTURL::fileURL(classDir, true), &error));
  for (const char* container : {"/one", "/two"})
    EXPECT_NE(aclText(classDir + container).find("group:4242:-wx"), std::string::npos) << container;
  EXPECT_EQ(aclText(classDir + "/one/sub"), kFullList);

  EXPECT_TRUE(fm.standardizeAllSystemContainerACLsAtURL(QRTURL::fileURL(base_ + "/nothing", true), &error));
  makeDir(base_ + "/empty");
  EXPECT_TRUE(fm.standardizeAllSystemContainerACLsAtURL(QRTURL::fileURL(base_ + "/empty", true), &error));
}

TEST_F(FileManagerACLTest, WithoutTheGroupNothingIsChanged) {
  std::string root = makeTree();
  writeGroups(false);
  std::string before = aclText(root + "/a/b/file");
  struct stat old = lstatOf(root + "/a/b/file");

  QRTErrorRef error;
  EXPECT_FALSE(fm.standardizeACLsAtURL(QRTURL::fileURL(root, true), false, &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain(), QRTErrorDomain);
  EXPECT_EQ(error->code(), 63);
  EXPECT_EQ(error->localizedDescription(), "resolve_group_guid() failed: No such file or directory");

  error.reset();
  EXPECT_FALSE(fm.setTopLevelSystemContainerACLAtURL(QRTURL::fileURL(root, true), &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), 63);
  ASSERT_TRUE(error->underlying());
  EXPECT_EQ(error->underlying()->code(), 63);

  EXPECT_FALSE(fm.standardizeAllSystemContainerACLsAtURL(QRTURL::fileURL(base_, true), &error));
  EXPECT_EQ(error->code(), 63);

  EXPECT_EQ(aclText(root + "/a/b/file"), before);
  EXPECT_EQ(aclText(root, ACL_TYPE_DEFAULT), "none");
  struct stat now = lstatOf(root + "/a/b/file");
  EXPECT_EQ(now.st_mode, old.st_mode);
  EXPECT_EQ(now.st_uid, old.st_uid);
}

TEST_F(FileManagerACLTest, OwnershipResetChangesLinksThemselvesAndSetsModesByKind) {
  std::string root = makeTree();
  ASSERT_EQ(chmod((root + "/a/b").c_str(), 0700), 0);
  ASSERT_EQ(chmod((root + "/a/b/file").c_str(), 0666), 0);
  QRTErrorRef error;
  ASSERT_TRUE(fm.standardizeOwnershipAtURL(QRTURL::fileURL(root, true), 501, 502, &error));

  for (const char* item : {"", "/a", "/a/b", "/a/b/file", "/a/tool", "/link"}) {
    struct stat st = lstatOf(root + item);
    EXPECT_EQ(st.st_uid, 501u) << item;
    EXPECT_EQ(st.st_gid, 502u) << item;
  }
  EXPECT_EQ(lstatOf(root + "/a/b").st_mode & 07777, 0755u);
  EXPECT_EQ(lstatOf(root + "/a/tool").st_mode & 07777, 0755u);
  EXPECT_EQ(lstatOf(root + "/a/b/file").st_mode & 07777, 0644u);

  struct stat st = lstatOf(base_ + "/outside");
  EXPECT_EQ(st.st_uid, 0u);
  EXPECT_EQ(st.st_mode & 07777, 0644u);
  st = lstatOf(root + "/" + kMetadataName);
  EXPECT_EQ(st.st_uid, 0u);
  EXPECT_EQ(st.st_mode & 07777, 0600u);
}

TEST_F(FileManagerACLTest, OwnershipResetOfAMissingTreeFails) {
  QRTErrorRef error;
  EXPECT_FALSE(fm.standardizeOwnershipAtURL(QRTURL::fileURL(base_ + "/missing", true), 501, 501, &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain(), QRTPOSIXErrorDomain);
  EXPECT_EQ(error->code(), ENOENT);
}

}  // namespace
