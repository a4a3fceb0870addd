#include "connectivity/ReportingSessionConnectivityHelper.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>

#include "support/TempDir.h"

namespace telvane {
namespace {

using Helper = ReportingSessionConnectivityHelper;

TEST(ReportingSessionConnectivityHelper, ModesAreFourForPostAndEightForGet) {
  EXPECT_EQ(Helper::POSTRequestMode(), 4);
  EXPECT_EQ(Helper::GETRequestMode(), 8);
}

TEST(ReportingSessionConnectivityHelper, UserInfoKeyLowerCasesBothNamesAndKeepsAbsentOnesEmpty) {
  EXPECT_EQ(Helper::userInfoKey(Value(Dictionary{{"_clientName", "MediaKit"}, {"_serviceName", "PlayBack"}})),
            "mediakit:playback");
  EXPECT_EQ(Helper::userInfoKey(Value(Dictionary{{"_clientName", "storebag"}, {"_serviceName", "shared"}})),
            "storebag:shared");
  EXPECT_EQ(Helper::userInfoKey(Value(Dictionary{{"_serviceName", "Only"}})), ":only");
  EXPECT_EQ(Helper::userInfoKey(Value(Dictionary{{"_clientName", "Only"}})), "only:");
  EXPECT_TRUE(Helper::isValidUserInfo(Value(Dictionary{{"_serviceName", "x"}})));
  EXPECT_TRUE(Helper::isValidUserInfo(Value(Dictionary{{"_clientName", "x"}})));
  EXPECT_FALSE(Helper::isValidUserInfo(Value(Dictionary{{"other", "x"}})));
  EXPECT_FALSE(Helper::isValidUserInfo(Value()));
}

class StorageFolderTest : public ::testing::Test {
 protected:
  void SetUp() override { ::setenv("TELVANED_STORAGE_DIR", folder.c_str(), 1); }
  void TearDown() override { ::unsetenv("TELVANED_STORAGE_DIR"); }
  test::TempDir dir;
  std::filesystem::path folder = dir / "nested" / "tvxstorage";
};

TEST_F(StorageFolderTest, ContainersAreUniqueTvxdiagFilesInTheStorageFolder) {
  EXPECT_EQ(Helper::storageRootFolder(), folder.string());
  std::filesystem::path a = Helper::composeUniqueContainerURL();
  std::filesystem::path b = Helper::composeUniqueContainerURL();
  EXPECT_NE(a, b);
  EXPECT_EQ(a.parent_path(), folder);
  EXPECT_EQ(a.extension(), ".tvxdiag");
  EXPECT_EQ(a.stem().string().size(), 36u);
  std::filesystem::create_directories(folder);
  test::writeFile(a, "x");
  Helper::deleteContainerAtURL(a.string());
  EXPECT_FALSE(std::filesystem::exists(a));
  Helper::deleteContainerAtURL(a.string());  // a missing file is no error
}

TEST_F(StorageFolderTest, CleanupWithThePostModeDoesNothing) {
  Helper::cleanupStorageRootFolder();
  EXPECT_FALSE(std::filesystem::exists(folder));
  std::filesystem::create_directories(folder);
  test::writeFile(folder / "old.tvxdiag", "x");
  Helper::cleanupStorageRootFolderForMode(Helper::kPOSTRequestMode);
  EXPECT_TRUE(std::filesystem::exists(folder / "old.tvxdiag"));
}

TEST_F(StorageFolderTest, CleanupInFileModeCreatesTheFolderAndRemovesOnlyContainerFiles) {
  Helper::cleanupStorageRootFolderForMode(Helper::kFileUploadRequestMode);
  EXPECT_TRUE(std::filesystem::is_directory(folder));
  test::writeFile(folder / "a.tvxdiag", "x");
  test::writeFile(folder / "B.TVXDIAG", "x");
  test::writeFile(folder / ".tvxdiag", "x");
  test::writeFile(folder / "keep.txt", "x");
  test::writeFile(folder / "keep.tvxdiag.bak", "x");
  test::writeFile(folder / "keeptvxdiag", "x");
  std::filesystem::create_directories(folder / "sub");
  test::writeFile(folder / "sub" / "c.TvxDiag", "x");
  test::writeFile(folder / "sub" / "keep", "x");
  Helper::cleanupStorageRootFolderForMode(Helper::kFileUploadRequestMode);
  EXPECT_FALSE(std::filesystem::exists(folder / "a.tvxdiag"));
  EXPECT_FALSE(std::filesystem::exists(folder / "B.TVXDIAG"));
  EXPECT_FALSE(std::filesystem::exists(folder / ".tvxdiag"));
  EXPECT_FALSE(std::filesystem::exists(folder / "sub" / "c.TvxDiag"));
  EXPECT_TRUE(std::filesystem::exists(folder / "keep.txt"));
  EXPECT_TRUE(std::filesystem::exists(folder / "keep.tvxdiag.bak"));
  EXPECT_TRUE(std::filesystem::exists(folder / "keeptvxdiag"));
  EXPECT_TRUE(std::filesystem::exists(folder / "sub" / "keep"));
}

}  // namespace
}  // namespace telvane
