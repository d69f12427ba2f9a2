// Capture of the store items between real directories.

#include <vector>

#include "FileLayerTestSupport.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSLog.h"

using platform::Error;
using platform::URL;

namespace {

constexpr char kCaptureFn[] =
    "-[QSFileManager captureStoreDataFromDirectory:toDirectory:doCopy:failureIsFatal:withError:]";
const std::vector<std::string> kItems = {"Manifest.plist", "VendraArtwork", "VendraMetadata.plist", "GeoJSON"};

using qstest::exists;

class StoreData : public testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(qstest::makeDirs(from_));
    ASSERT_TRUE(qstest::makeDirs(to_));
  }

  // All four items: the artwork is a directory, the rest are files whose
  // contents name them.
  void populate() {
    for (const auto& item : kItems) {
      if (item == "VendraArtwork") {
        ASSERT_TRUE(qstest::makeDirs(from_ + "/" + item));
        ASSERT_TRUE(qstest::writeFile(from_ + "/" + item + "/icon.png", "png"));
      } else {
        ASSERT_TRUE(qstest::writeFile(from_ + "/" + item, item));
      }
    }
  }

  // A non-empty directory where the artwork would go: a rename cannot
  // replace it.
  void blockArtworkAtTarget() {
    ASSERT_TRUE(qstest::makeDirs(to_ + "/VendraArtwork"));
    ASSERT_TRUE(qstest::writeFile(to_ + "/VendraArtwork/occupied", "x"));
  }

  bool capture(bool doCopy, bool fatal, Error* error = nullptr) {
    return fm_.captureStoreDataFromDirectory(URL::fileURL(from_, true), URL::fileURL(to_, true), doCopy, fatal, error);
  }

  QSFileManager& fm_ = QSFileManager::defaultManager();
  qstest::TempDir tmp_{"storedata"};
  qstest::LogCapture log_;
  std::string from_ = tmp_ / "container";
  std::string to_ = tmp_ / "staging";
};

TEST_F(StoreData, NothingToCaptureSucceedsQuietly) {
  ASSERT_TRUE(qstest::writeFile(from_ + "/Unrelated.plist", "x"));
  Error error("Untouched", 1);
  EXPECT_TRUE(capture(false, true, &error));
  EXPECT_TRUE(error.is("Untouched", 1));
  for (const auto& item : kItems) EXPECT_FALSE(exists(to_ + "/" + item)) << item;
  EXPECT_FALSE(exists(to_ + "/Unrelated.plist"));
  EXPECT_TRUE(exists(from_ + "/Unrelated.plist"));
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(StoreData, CopyingLeavesEveryItemAtTheSource) {
  populate();
  EXPECT_TRUE(capture(true, true));
  for (const auto& item : kItems) {
    EXPECT_TRUE(exists(from_ + "/" + item)) << item;
    EXPECT_TRUE(exists(to_ + "/" + item)) << item;
  }
  EXPECT_EQ(qstest::readFile(to_ + "/VendraArtwork/icon.png"), "png");
  EXPECT_EQ(qstest::readFile(to_ + "/GeoJSON"), "GeoJSON");
}

TEST_F(StoreData, NonFatalFailureIsLoggedAndTheRestIsCaptured) {
  populate();
  blockArtworkAtTarget();
  Error error("Untouched", 1);
  EXPECT_TRUE(capture(false, false, &error));
  EXPECT_TRUE(error.is("Untouched", 1));

  EXPECT_TRUE(exists(to_ + "/Manifest.plist"));
  EXPECT_TRUE(exists(from_ + "/VendraArtwork/icon.png"));
  EXPECT_TRUE(exists(to_ + "/VendraArtwork/occupied"));
  EXPECT_TRUE(exists(to_ + "/VendraMetadata.plist"));
  EXPECT_TRUE(exists(to_ + "/GeoJSON"));
  EXPECT_FALSE(exists(from_ + "/GeoJSON"));

  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].function, kCaptureFn);
  EXPECT_EQ(lines[0].level, kQSLogLevelError);
  std::string message = "Failed to move file://" + from_ + "/VendraArtwork to file://" + to_ + "/VendraArtwork";
  EXPECT_NE(lines[0].message.find(": " + message + " ("), std::string::npos) << lines[0].message;
}

TEST_F(StoreData, FatalFailureStopsAndReturnsTheKeyedError) {
  populate();
  blockArtworkAtTarget();
  Error error;
  EXPECT_FALSE(capture(false, true, &error));
  EXPECT_TRUE(error.is(QSInstallerErrorDomain, kQSErrorCodeStoreDataCaptureFailed));
  EXPECT_EQ(error.userInfo().at(kQSLegacyErrorStringKey), platform::Value("VendraArtworkCaptureFailed"));
  EXPECT_EQ(error.localizedDescription(),
            "Failed to move file://" + from_ + "/VendraArtwork to file://" + to_ + "/VendraArtwork");
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(ENOTEMPTY)) << error.underlyingError()->description();

  // The first item went; the third and fourth were never touched.
  EXPECT_TRUE(exists(to_ + "/Manifest.plist"));
  EXPECT_FALSE(exists(from_ + "/Manifest.plist"));
  EXPECT_TRUE(exists(from_ + "/VendraMetadata.plist"));
  EXPECT_TRUE(exists(from_ + "/GeoJSON"));
  EXPECT_FALSE(exists(to_ + "/VendraMetadata.plist"));
  EXPECT_FALSE(exists(to_ + "/GeoJSON"));
  EXPECT_EQ(log_.systemLines().size(), 1u);
}

TEST_F(StoreData, CopyIntoAnImmutableTargetFailsOnTheFirstItem) {
  populate();
  ASSERT_TRUE(qstest::setImmutable(to_, true));
  Error error;
  bool ok = capture(true, true, &error);
  ASSERT_TRUE(qstest::setImmutable(to_, false));
  EXPECT_FALSE(ok);
  EXPECT_TRUE(error.is(QSInstallerErrorDomain, kQSErrorCodeStoreDataCaptureFailed));
  EXPECT_EQ(error.userInfo().at(kQSLegacyErrorStringKey), platform::Value("ManifestCaptureFailed"));
  EXPECT_EQ(error.localizedDescription(),
            "Failed to copy file://" + from_ + "/Manifest.plist to file://" + to_ + "/Manifest.plist");
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(EPERM)) << error.underlyingError()->description();
  for (const auto& item : kItems) EXPECT_TRUE(exists(from_ + "/" + item)) << item;
  EXPECT_EQ(log_.systemLines().size(), 1u);
}

TEST_F(StoreData, MovingOutOfAnImmutableContainerFailsEveryItemWhenNotFatal) {
  populate();
  ASSERT_TRUE(qstest::setImmutable(from_, true));
  bool ok = capture(false, false);
  ASSERT_TRUE(qstest::setImmutable(from_, false));
  EXPECT_TRUE(ok);
  for (const auto& item : kItems) {
    EXPECT_TRUE(exists(from_ + "/" + item)) << item;
    EXPECT_FALSE(exists(to_ + "/" + item)) << item;
  }
  EXPECT_EQ(log_.count("Failed to move"), 4u);
}

}  // namespace
