// Container metadata files: what is written, what the reader accepts and in
// which order it checks; and the lists of well-known container names.
#include <gtest/gtest.h>

#include <tuple>

#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/store/QRTMetadata.h"
#include "Daemon/store/QRTWhitelist.h"
#include "TempDir.h"

namespace fs = std::filesystem;

namespace {

const char* const kUUID = "0A1B2C3D-4E5F-4071-8293-A4B5C6D7E8F9";

class MetadataTest : public ::testing::Test {
 protected:
  QRTURL container(const std::string& classPath, const std::string& name = kUUID) {
    QRTURL url = QRTURL::fileURL(root_ / classPath + "/" + name, true);
    fs::create_directories(url.path());
    return url;
  }
  static QRTURL metadataFile(const QRTURL& url) { return url.URLByAppendingPathComponent(QRTMetadataFileName); }
  void writeRaw(const QRTURL& url, const plist::Dictionary& dictionary) {
    ASSERT_TRUE(QRT_writeToURL(dictionary, metadataFile(url), QRTWriteAtomic, nullptr));
  }
  static plist::Dictionary validDictionary(uint64_t cls = 2) {
    return {{"QRTMetadataIdentifier", "com.example.app"},
            {"QRTMetadataUUID", kUUID},
            {"QRTMetadataContentClass", plist::Value(cls)},
            {"QRTMetadataPersona", 501}};
  }

  void expectFailure(const QRTURL& url, uint32_t forUser, int32_t code, const std::string& description) {
    QRTErrorRef error;
    EXPECT_EQ(QRTMetadata::readAndValidateMetadataAtUrl(url, forUser, true, &error), nullptr);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain(), QRTErrorDomain);
    EXPECT_EQ(error->code(), code);
    EXPECT_EQ(error->localizedDescription().value_or(""), description);
  }
  std::string urlMismatch(const QRTURL& url, const std::string& classPath) const {
    return "Invalid metadata-URLs should match: " + url.path() + " : " + root_ / classPath;
  }
  std::shared_ptr<QRTMetadata> expectSuccess(const QRTURL& url, uint32_t forUser, bool checkClassPath = true) {
    QRTErrorRef error;
    auto metadata = QRTMetadata::readAndValidateMetadataAtUrl(url, forUser, checkClassPath, &error);
    EXPECT_TRUE(metadata) << (error ? error->description() : "");
    return metadata;
  }

  TempDir root_{"/tmp/qrt-metadata"};
};

TEST_F(MetadataTest, WriteFailureIs34OverBudgetIs38AndUnreadableFileIs12) {
  QRTURL missing = QRTURL::fileURL(root_ / "missing/" + kUUID, true);
  QRTMetadata metadata(501, QRTUUID::random(), 2, "com.example.app", std::nullopt, missing, std::nullopt);
  QRTErrorRef error;
  EXPECT_FALSE(metadata.writeMetadataToDiskWithError(&error));
  ASSERT_TRUE(error && error->underlying());
  EXPECT_EQ(error->code(), 34);
  EXPECT_EQ(error->underlying()->domain(), QRTPOSIXErrorDomain);

  int n = 0;
  const char* array = "<?xml version=\"1.0\"?><plist version=\"1.0\"><array/></plist>";
  for (const char* content : {"", "not a property list", array}) {
    QRTURL url = container("Data/Application", std::to_string(++n));
    if (*content) std::ofstream(metadataFile(url).path()) << content;
    expectFailure(url, 501, 12, "Failed to read metadata at URL " + url.path());
  }

  // What the reader would refuse is never written: over 1 MiB, over 100,000
  // objects (a shared value counts at every use) or over 32 levels.
  QRTURL url = container("Data/Application");
  writeRaw(url, validDictionary());
  plist::Value deep = 1;
  for (int i = 0; i < 40; ++i) deep = plist::Array{deep};
  const std::pair<const char*, plist::Value> tooMuch[] = {
      {"bytes", plist::Data(QRTMetadataMaxEncodedBytes, 7)},
      {"objects", plist::Array(QRTMetadataMaxObjects, plist::Value(true))},
      {"depth", deep},
  };
  QRTMetadata base(501, *QRTUUID::fromString(kUUID), 2, "com.example.app", std::nullopt, url, std::nullopt);
  for (const auto& [what, value] : tooMuch) {
    QRTErrorRef error;
    EXPECT_FALSE(base.withInfo(plist::Dictionary{{"k", value}})->writeMetadataToDiskWithError(&error)) << what;
    ASSERT_TRUE(error) << what;
    EXPECT_EQ(error->code(), QRTErrorInvalidArgument) << what;
    EXPECT_EQ(QRT_dictionaryWithContentsOfURL(metadataFile(url), nullptr), validDictionary()) << what;
  }
  const plist::Dictionary fits{{"k", plist::Data(QRTMetadataMaxEncodedBytes / 2, 7)}};
  ASSERT_TRUE(base.withInfo(fits)->writeMetadataToDiskWithError(nullptr));
  EXPECT_EQ(expectSuccess(url, 501)->info(), fits);
}

// Starts with every value wrong and repairs one at a time, so each check is
// seen to run after the ones before it.
TEST_F(MetadataTest, ChecksRunInOrder) {
  QRTURL url = container("Data/Application");
  plist::Dictionary d{{"QRTMetadataUUID", 7},
                      {"QRTMetadataContentClass", "2"},
                      {"QRTMetadataPersona", 501},
                      {"QRTMetadataInfo", plist::Array{"x"}},
                      {"QRTMetadataUserManagedAssetsDirName", 9}};
  const std::string info = plist::describe(plist::Value(plist::Array{"x"}));
  // The failure expected, then the repair that gets past it.
  const std::vector<std::tuple<std::string, std::string, plist::Value>> steps = {
      {"Invalid metadata Identifier: (null)", "QRTMetadataIdentifier", 5},
      {"Invalid metadata Identifier: 5", "QRTMetadataIdentifier", "com.example.sys"},
      {"Invalid metadata UUID String: 7", "QRTMetadataUUID", "not-a-uuid"},
      {"Invalid metadata UUID: (null)", "QRTMetadataUUID", kUUID},
      {"Invalid metadata Class: 2", "QRTMetadataContentClass", 0},
      {"Invalid metadata Content Class: 0", "QRTMetadataContentClass", 14},
      {"Invalid metadata Content Class: 14", "QRTMetadataContentClass", 12},
      // Only a number equal to the user matches, not a string nor one equal in its low 32 bits.
      {"Incorrect UserId: 501, expecting: 499 for com.example.sys", "QRTMetadataPersona", "499"},
      {"Incorrect UserId: 499, expecting: 499 for com.example.sys", "QRTMetadataPersona",
       plist::Value(uint64_t{499} + (uint64_t{1} << 32))},
      {"Incorrect UserId: 4294967795, expecting: 499 for com.example.sys", "QRTMetadataPersona", 499},
      {"Invalid metadata Info: " + info, "QRTMetadataInfo", plist::Dictionary{}},
      {"Invalid metadata User Managed Dir Name String: 9", "QRTMetadataUserManagedAssetsDirName", "Assets"}};
  for (const auto& [failure, key, repair] : steps) {
    writeRaw(url, d);
    expectFailure(url, 499, 29, failure + " at " + url.path());
    d[key] = repair;
  }
  writeRaw(url, d);
  expectFailure(url, 499, 29, urlMismatch(url, "Data/System"));
  auto read = expectSuccess(url, 499, false);
  ASSERT_TRUE(read);
  EXPECT_EQ(read->info(), plist::Dictionary{});
}

// A missing persona is the user asked for; a wrong class directory is refused
// at the end of the checks above, and so is one level too deep.
TEST_F(MetadataTest, MissingPersonaIsTheExpectedUserAndClassPathMustBeTheParent) {
  plist::Dictionary d = validDictionary();
  d.erase("QRTMetadataPersona");
  QRTURL data = container("Data/Application");
  writeRaw(data, d);
  for (uint32_t user : {501u, 502u}) EXPECT_EQ(expectSuccess(data, user)->uid(), user);
  d["QRTMetadataContentClass"] = 12;
  QRTURL system = container("Data/System");
  writeRaw(system, d);
  EXPECT_EQ(expectSuccess(system, 499)->uid(), 499u);
  QRTURL nested = container("Data/Application/extra");
  writeRaw(nested, validDictionary(2));
  expectFailure(nested, 501, 29, urlMismatch(nested, "Data/Data/Application"));
}

// Each list answers only for its own class, and only for the exact name.
TEST(WhitelistTest, EachListAnswersOnlyForItsClassAndTheExactName) {
  QRTWhitelist lists({{"a.b", "dir.a"}}, {{"systemgroup.x", "dir.x"}});
  const std::tuple<const char*, uint64_t, const char*> cases[] = {
      {"a.b", 12, "dir.a"},
      {"a.b", 13, nullptr},
      {"systemgroup.x", 13, "dir.x"},
      {"systemgroup.x", 12, nullptr},
      {"A.b", 12, nullptr},
      {"", 12, nullptr},
      {"a.b", 2, nullptr},
      {"systemgroup.x", 14, nullptr},
      {"SystemGroup.x", 13, nullptr},
  };
  for (const auto& [identifier, cls, directory] : cases) {
    EXPECT_EQ(lists.containerIdIsWellknown(identifier, cls), directory != nullptr) << identifier << " " << cls;
    EXPECT_EQ(lists.wellknownContainerForId(identifier, cls),
              directory ? std::optional<std::string>(directory) : std::nullopt)
        << identifier << " " << cls;
  }
  EXPECT_FALSE(lists.systemContainerIdIsWellknown("systemgroup.x"));
  EXPECT_FALSE(lists.systemGroupContainerIdIsWellknown("a.b"));
  // The shared instance carries the shipped lists.
  EXPECT_TRUE(QRTWhitelist::sharedWhitelist().containerIdIsWellknown("com.norvane.mapsd", 12));
}

}  // namespace
