#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>

#include "Daemon/QRTFileManager.h"
#include "Daemon/QRTMetadata.h"

namespace fs = std::filesystem;

namespace {

const char* const kUUID = "0A1B2C3D-4E5F-4071-8293-A4B5C6D7E8F9";

class MetadataTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char templ[] = "/tmp/qrt-metadata-XXXXXX";
    ASSERT_NE(mkdtemp(templ), nullptr);
    root_ = templ;
  }
  void TearDown() override { fs::remove_all(root_); }

  // A container directory root/<classPath>/<uuid>, created.
  QRTURL container(const std::string& classPath, const std::string& name = kUUID) {
    QRTURL url = QRTURL::fileURL(root_ + "/" + classPath + "/" + name, true);
    fs::create_directories(url.path());
    return url;
  }

  void writeRaw(const QRTURL& url, const plist::Dictionary& dictionary) {
    ASSERT_TRUE(QRT_writeToURL(dictionary, url.URLByAppendingPathComponent(QRTMetadataFileName), QRTWriteAtomic,
                               nullptr));
  }

  static plist::Dictionary validDictionary(uint64_t cls = 2) {
    return {{"QRTMetadataIdentifier", "com.example.app"},
            {"QRTMetadataUUID", kUUID},
            {"QRTMetadataContentClass", plist::Value(cls)},
            {"QRTMetadataPersona", 501}};
  }

  // Reads and expects a failure with the code and the description.
  void expectFailure(const QRTURL& url, uint32_t forUser, bool checkClassPath, int32_t code,
                     const std::string& description) {
    QRTErrorRef error;
    EXPECT_EQ(QRTMetadata::readAndValidateMetadataAtUrl(url, forUser, checkClassPath, &error), nullptr);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain(), QRTErrorDomain);
    EXPECT_EQ(error->code(), code);
    EXPECT_EQ(error->localizedDescription().value_or(""), description);
  }

  std::shared_ptr<QRTMetadata> expectSuccess(const QRTURL& url, uint32_t forUser, bool checkClassPath = true) {
    QRTErrorRef error;
    auto metadata = QRTMetadata::readAndValidateMetadataAtUrl(url, forUser, checkClassPath, &error);
    EXPECT_TRUE(metadata) << (error ? error->description() : "");
    return metadata;
  }

  std::string root_;
};

TEST_F(MetadataTest, WriteWithoutOptionalsHasExactlyFourKeys) {
  QRTURL url = container("Data/Application");
  plist::Dictionary old = validDictionary();
  old["Unknown"] = "dropped";
  writeRaw(url, old);
  QRTMetadata metadata(501, *QRTUUID::fromString(kUUID), 2, "com.example.app", std::nullopt, url, std::nullopt);
  QRTErrorRef error;
  ASSERT_TRUE(metadata.writeMetadataToDiskWithError(&error));

  auto written = QRT_dictionaryWithContentsOfURL(url.URLByAppendingPathComponent(QRTMetadataFileName), nullptr);
  ASSERT_TRUE(written);
  EXPECT_EQ(written->size(), 4u);
  EXPECT_EQ(plist::find(*written, "QRTMetadataIdentifier")->string(), "com.example.app");
  EXPECT_EQ(plist::find(*written, "QRTMetadataUUID")->string(), kUUID);
  EXPECT_EQ(plist::find(*written, "QRTMetadataContentClass")->integer().asUnsigned(), 2u);
  EXPECT_EQ(plist::find(*written, "QRTMetadataPersona")->integer().asUnsigned(), 501u);
}

TEST_F(MetadataTest, RoundTripKeepsInfoAndAssetsDirectory) {
  QRTURL url = container("Data/Application");
  plist::Dictionary info{{"com.norvane.Emplacer.ContentProtectionClass", 3}, {"tags", plist::Array{"a", "b"}}};
  QRTMetadata metadata(502, QRTUUID::random(), 2, "com.example.app", info, url, std::string("Assets"));
  metadata.setTransient(true);
  metadata.setExisted(true);
  ASSERT_TRUE(metadata.writeMetadataToDiskWithError(nullptr));

  auto read = expectSuccess(url, 502);
  ASSERT_TRUE(read);
  EXPECT_EQ(read->identifier(), "com.example.app");
  EXPECT_EQ(read->uuid(), metadata.uuid());
  EXPECT_EQ(read->containerClass(), 2u);
  EXPECT_EQ(read->uid(), 502u);
  EXPECT_EQ(read->url(), url);
  EXPECT_EQ(read->info(), info);
  EXPECT_EQ(read->userManagedAssetsDirName(), "Assets");
  EXPECT_FALSE(read->transient());
  EXPECT_FALSE(read->existed());
  EXPECT_NE(read->description().find("com.example.app"), std::string::npos);
}

TEST_F(MetadataTest, WriteFailureIsError34WithTheCause) {
  QRTURL url = QRTURL::fileURL(root_ + "/missing/" + kUUID, true);
  QRTMetadata metadata(501, QRTUUID::random(), 2, "com.example.app", std::nullopt, url, std::nullopt);
  QRTErrorRef error;
  EXPECT_FALSE(metadata.writeMetadataToDiskWithError(&error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), 34);
  EXPECT_EQ(error->localizedDescription().value_or(""), "Failed to write metadata dictionary to URL " + url.path());
  ASSERT_TRUE(error->underlying());
  EXPECT_EQ(error->underlying()->domain(), QRTPOSIXErrorDomain);
}

TEST_F(MetadataTest, UnreadableFileIsError12) {
  QRTURL missing = container("Data/Application");
  expectFailure(missing, 501, true, 12, "Failed to read metadata at URL " + missing.path());

  QRTURL garbage = container("Data/Application", "0A1B2C3D-4E5F-4071-8293-A4B5C6D7E800");
  std::ofstream(garbage.path() + "/" + QRTMetadataFileName) << "not a property list";
  expectFailure(garbage, 501, true, 12, "Failed to read metadata at URL " + garbage.path());

  QRTURL array = container("Data/Application", "0A1B2C3D-4E5F-4071-8293-A4B5C6D7E801");
  std::ofstream(array.path() + "/" + QRTMetadataFileName)
      << "<?xml version=\"1.0\"?><plist version=\"1.0\"><array/></plist>";
  expectFailure(array, 501, true, 12, "Failed to read metadata at URL " + array.path());
}

// Repairs one key at a time, so each check is seen to run after the ones before it.
TEST_F(MetadataTest, ChecksRunInOrder) {
  QRTURL url = container("Data/Application");
  const std::string at = " at " + url.path();
  plist::Dictionary d{{"QRTMetadataUUID", 7},
                      {"QRTMetadataContentClass", "2"},
                      {"QRTMetadataPersona", 501},
                      {"QRTMetadataInfo", plist::Array{"x"}},
                      {"QRTMetadataUserManagedAssetsDirName", 9}};
  writeRaw(url, d);
  expectFailure(url, 499, true, 29, "Invalid metadata Identifier: (null)" + at);
  d["QRTMetadataIdentifier"] = 5;
  writeRaw(url, d);
  expectFailure(url, 499, true, 29, "Invalid metadata Identifier: 5" + at);
  d["QRTMetadataIdentifier"] = "com.example.sys";
  writeRaw(url, d);
  expectFailure(url, 499, true, 29, "Invalid metadata UUID String: 7" + at);
  d["QRTMetadataUUID"] = "not-a-uuid";
  writeRaw(url, d);
  expectFailure(url, 499, true, 29, "Invalid metadata UUID: (null)" + at);
  d["QRTMetadataUUID"] = kUUID;
  writeRaw(url, d);
  expectFailure(url, 499, true, 29, "Invalid metadata Class: 2" + at);
  d["QRTMetadataContentClass"] = 0;
  writeRaw(url, d);
  expectFailure(url, 499, true, 29, "Invalid metadata Content Class: 0" + at);
  d["QRTMetadataContentClass"] = 14;
  writeRaw(url, d);
  expectFailure(url, 499, true, 29, "Invalid metadata Content Class: 14" + at);
  d["QRTMetadataContentClass"] = 12;
  writeRaw(url, d);
  expectFailure(url, 499, true, 29, "Incorrect UserId: 501, expecting: 499 for com.example.sys" + at);
  d["QRTMetadataPersona"] = 499;
  writeRaw(url, d);
  expectFailure(url, 499, true, 29,
                "Invalid metadata Info: " + plist::describe(plist::Value(plist::Array{"x"})) + at);
  d["QRTMetadataInfo"] = plist::Dictionary{};
  writeRaw(url, d);
  expectFailure(url, 499, true, 29, "Invalid metadata User Managed Dir Name String: 9" + at);
  d["QRTMetadataUserManagedAssetsDirName"] = "Assets";
  writeRaw(url, d);
  expectFailure(url, 499, true, 29,
                "Invalid metadata-URLs should match: " + url.path() + " : " + root_ + "/Data/System");
  auto read = expectSuccess(url, 499, false);
  ASSERT_TRUE(read);
  EXPECT_EQ(read->info(), plist::Dictionary{});
}

// Only a number equal to the expected user matches, never a string or a
// value that merely agrees in its low 32 bits.
TEST_F(MetadataTest, PersonaMustBeExactlyTheUser) {
  QRTURL url = container("Data/Application");
  plist::Dictionary d = validDictionary();
  d["QRTMetadataPersona"] = "501";
  writeRaw(url, d);
  expectFailure(url, 501, true, 29, "Incorrect UserId: 501, expecting: 501 for com.example.app at " + url.path());
  d["QRTMetadataPersona"] = plist::Value(uint64_t{501} + (uint64_t{1} << 32));
  writeRaw(url, d);
  expectFailure(url, 501, true, 29,
                "Incorrect UserId: 4294967797, expecting: 501 for com.example.app at " + url.path());
}

TEST_F(MetadataTest, MissingPersonaIsAccepted) {
  plist::Dictionary d = validDictionary();
  d.erase("QRTMetadataPersona");
  QRTURL data = container("Data/Application");
  writeRaw(data, d);
  for (uint32_t user : {501u, 502u}) {
    auto read = expectSuccess(data, user);
    ASSERT_TRUE(read);
    EXPECT_EQ(read->uid(), user);
  }

  d["QRTMetadataContentClass"] = 12;
  QRTURL system = container("Data/System");
  writeRaw(system, d);
  auto read = expectSuccess(system, 499);
  ASSERT_TRUE(read);
  EXPECT_EQ(read->uid(), 499u);
  EXPECT_EQ(read->containerClass(), 12u);
}

TEST_F(MetadataTest, ClassPathMustMatchTheClass) {
  QRTURL url = container("Data/AddonPlugin");
  writeRaw(url, validDictionary(2));
  expectFailure(url, 501, true, 29,
                "Invalid metadata-URLs should match: " + url.path() + " : " + root_ + "/Data/Application");
  EXPECT_TRUE(expectSuccess(url, 501, false));

  QRTURL nested = container("Data/Application/extra");
  writeRaw(nested, validDictionary(2));
  expectFailure(nested, 501, true, 29,
                "Invalid metadata-URLs should match: " + nested.path() + " : " + root_ + "/Data/Data/Application");
}

}  // namespace
