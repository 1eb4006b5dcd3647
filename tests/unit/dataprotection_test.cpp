// The protection walk's rules per item kind and class, through a tree deeper
// than the walk keeps open, and the checks of pending-update files.
#include <sys/xattr.h>

#include <filesystem>
#include <fstream>

#include <gtest/gtest.h>

#include "Daemon/dataprotection/QRTDataProtectionChangeOperation.h"
#include "base/PlistCodec.h"
#include "TempDir.h"

namespace {

using Op = QRTDataProtectionChangeOperation;
constexpr const char* kAttribute = "trusted.com.norvane.protection-class";

void setClassOf(const std::string& path, int32_t cls) {
  if (cls == 0) {
    lremovexattr(path.c_str(), kAttribute);
    return;
  }
  const auto v = static_cast<uint32_t>(cls);
  const uint8_t b[4] = {uint8_t(v), uint8_t(v >> 8), uint8_t(v >> 16), uint8_t(v >> 24)};
  ASSERT_EQ(lsetxattr(path.c_str(), kAttribute, b, sizeof b, 0), 0) << path;
}

TEST(DataProtectionWalk, ClassRulesPerKindThroughADeepTree) {
  TempDir dir;
  const std::string top = dir / "Documents";
  std::filesystem::create_directories(top + "/kept");
  for (int cls = 0; cls <= 4; ++cls) std::ofstream(top + "/file" + std::to_string(cls)) << "x";
  // Deeper than the walk keeps descriptors open for: parents are reopened on the way up.
  std::string deep = top;
  for (int level = 0; level < 150; ++level) deep += "/d";
  std::filesystem::create_directories(deep);
  std::ofstream(deep + "/file") << "x";

  const struct {
    const char* what;
    int32_t target;
    uint32_t changeType;
    int32_t files[5];  // file0..file4 afterwards (each starts with its own number)
    int32_t directories, deepFile;
  } cases[] = {
      {"lower, files only downwards", 1, 7, {0, 1, 2, 1, 1}, 1, 1},
      {"higher, directories only", 4, 1, {0, 1, 2, 3, 4}, 4, 3},
      {"none, files get the default", 0, 2, {3, 3, 2, 3, 3}, 3, 3},
  };
  for (const auto& test : cases) {
    SCOPED_TRACE(test.what);
    for (auto& entry : std::filesystem::recursive_directory_iterator(top)) setClassOf(entry.path(), 3);
    setClassOf(top, 3);
    for (int cls = 0; cls <= 4; ++cls) setClassOf(top + "/file" + std::to_string(cls), cls);
    setClassOf(top + "/kept", 2);

    bool locked = true;
    QRTErrorRef error;
    ASSERT_TRUE(
        Op::setProtectionClassOfTreeAtURL(QRTURL::fileURL(top, true), test.target, test.changeType, &locked, &error))
        << (error ? error->description() : "");
    EXPECT_FALSE(locked);
    for (int cls = 0; cls <= 4; ++cls)
      EXPECT_EQ(protectionClassOf(top + "/file" + std::to_string(cls)), test.files[cls]) << cls;
    EXPECT_EQ(protectionClassOf(top + "/kept"), 2) << "class 2 is never changed";
    EXPECT_EQ(protectionClassOf(top), test.directories);
    EXPECT_EQ(protectionClassOf(deep), test.directories);
    EXPECT_EQ(protectionClassOf(top + "/d/d"), test.directories);
    EXPECT_EQ(protectionClassOf(deep + "/file"), test.deepFile);
  }
}

TEST(DataProtectionPendingFile, OnlyCompleteFilesAreAccepted) {
  TempDir dir;
  const plist::Dictionary valid{{"QRTDataOperationIdentifier", "com.example.app"},
                                {"QRTDataOperationContainerClass", 2},
                                {"QRTDataOperationUserId", 501},
                                {"QRTDataOperationProtectionClass", 1},
                                {"QRTDataOperationChangeType", 7},
                                {"QRTDataOperationRetryIfLocked", true},
                                {"QRTDataOperationInternalID", "0F2C4B7E-5A61-4C0B-9D7E-3B1A2C4D5E6F"}};
  auto changed = [&](const char* key, std::optional<plist::Value> value) {
    plist::Dictionary d = valid;
    if (value)
      d[key] = *value;
    else
      d.erase(key);
    return d;
  };
  const struct {
    const char* what;
    std::optional<plist::Dictionary> content;  // nothing: no file at all
    uint64_t code;
    const char* message;
  } cases[] = {
      {"complete", valid, 1, ""},
      {"missing", std::nullopt, 12, "Failed to read update info at URL"},
      {"class 0", changed("QRTDataOperationContainerClass", 0), 29, "Invalid update info container class: 0 at"},
      {"class a string", changed("QRTDataOperationContainerClass", "2"), 29, "Invalid update info container class: 0"},
      {"no user", changed("QRTDataOperationUserId", std::nullopt), 29, "Invalid update info user id: (null)"},
      {"retry a string", changed("QRTDataOperationRetryIfLocked", "yes"), 29, "Invalid update info retry: yes"},
      {"id not a UUID", changed("QRTDataOperationInternalID", "nope"), 29, "Invalid update info UUID: nope"},
      {"id a number", changed("QRTDataOperationInternalID", 5), 29, "Invalid update info UUID String: 5"},
  };
  for (const auto& test : cases) {
    SCOPED_TRACE(test.what);
    const std::string path = dir / (std::string(test.what) + ".plist");
    if (test.content) {
      plist::Data bytes = plist::writeBinary(plist::Value(*test.content));
      std::ofstream(path, std::ios::binary)
          .write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
    }
    QRTErrorRef error;
    auto read = Op::_readAndValidateDataProtectionUpdateAtURL(QRTURL::fileURL(path), &error);
    EXPECT_EQ(read.has_value(), test.code == 1);
    EXPECT_EQ(error ? error->resultCode() : 1u, test.code);
    if (error) { EXPECT_NE(error->description().find(test.message), std::string::npos) << error->description(); }
  }
  QRTErrorRef error;
  EXPECT_FALSE(Op::_readAndValidateDataProtectionUpdateAtURL(std::nullopt, &error));
  EXPECT_EQ(error ? error->resultCode() : 0u, 38u);
}

}  // namespace
