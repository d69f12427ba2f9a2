// Capture of the store items between real directories.
#include "FileLayerTestSupport.h"

using platform::Error;
using platform::URL;
using qstest::exists;

namespace {

class StoreData : public qstest::FileLayerTest {
 protected:
  void SetUp() override {
    ASSERT_TRUE(qstest::makeDirs(from_ + "/VendraArtwork"));
    ASSERT_TRUE(qstest::writeFile(from_ + "/VendraArtwork/icon.png", "png"));
    for (const char* item : {"Manifest.plist", "VendraMetadata.plist", "Unrelated.plist"}) {
      ASSERT_TRUE(qstest::writeFile(from_ + "/" + item, item));
    }
    ASSERT_TRUE(qstest::makeDirs(to_));
  }
  // A non-empty directory where the artwork would go: a rename cannot replace it.
  void blockArtworkAtTarget() {
    ASSERT_TRUE(qstest::makeDirs(to_ + "/VendraArtwork"));
    ASSERT_TRUE(qstest::writeFile(to_ + "/VendraArtwork/occupied", "x"));
  }
  bool capture(bool doCopy, bool fatal, Error* error = nullptr) {
    return fm.captureStoreDataFromDirectory(URL::fileURL(from_, true), URL::fileURL(to_, true), doCopy, fatal, error);
  }

  std::string from_ = dir / "container";
  std::string to_ = dir / "staging";
};

TEST_F(StoreData, CopyTakesTheItemsPresentAndLeavesThemAtTheSource) {
  Error error = qstest::untouchedSentinel();
  EXPECT_TRUE(capture(true, true, &error));
  EXPECT_TRUE(error.is("Sentinel", 99));
  for (const char* item : {"Manifest.plist", "VendraArtwork/icon.png", "VendraMetadata.plist"}) {
    EXPECT_EQ(qstest::readFile(to_ + "/" + item), qstest::readFile(from_ + "/" + item)) << item;
  }
  EXPECT_FALSE(exists(to_ + "/GeoJSON"));
  EXPECT_FALSE(exists(to_ + "/Unrelated.plist"));
  EXPECT_TRUE(log.systemLines().empty());
}

TEST_F(StoreData, NonFatalFailureIsLoggedAndTheRestIsCaptured) {
  ASSERT_NO_FATAL_FAILURE(blockArtworkAtTarget());
  Error error = qstest::untouchedSentinel();
  EXPECT_TRUE(capture(false, false, &error));
  EXPECT_TRUE(error.is("Sentinel", 99));
  EXPECT_TRUE(exists(to_ + "/Manifest.plist"));
  EXPECT_TRUE(exists(from_ + "/VendraArtwork/icon.png"));
  EXPECT_TRUE(exists(to_ + "/VendraArtwork/occupied"));
  EXPECT_TRUE(exists(to_ + "/VendraMetadata.plist"));
  EXPECT_FALSE(exists(from_ + "/VendraMetadata.plist"));
  auto lines = log.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].function,
            "-[QSFileManager captureStoreDataFromDirectory:toDirectory:doCopy:failureIsFatal:withError:]");
  EXPECT_EQ(lines[0].level, kQSLogLevelError);
  const std::string message = "Failed to move file://" + from_ + "/VendraArtwork to file://" + to_ + "/VendraArtwork";
  EXPECT_NE(lines[0].message.find(": " + message + " ("), std::string::npos) << lines[0].message;
}

TEST_F(StoreData, FatalFailureStopsAndReturnsTheKeyedError) {
  ASSERT_NO_FATAL_FAILURE(blockArtworkAtTarget());
  Error error;
  EXPECT_FALSE(capture(false, true, &error));
  qstest::expectInstallerError(
      error, kQSErrorCodeStoreDataCaptureFailed,
      "Failed to move file://" + from_ + "/VendraArtwork to file://" + to_ + "/VendraArtwork", ENOTEMPTY);
  EXPECT_EQ(error.userInfo().at(kQSLegacyErrorStringKey), platform::Value("VendraArtworkCaptureFailed"));
  // The first item went; the third was never touched.
  EXPECT_TRUE(exists(to_ + "/Manifest.plist"));
  EXPECT_FALSE(exists(from_ + "/Manifest.plist"));
  EXPECT_TRUE(exists(from_ + "/VendraMetadata.plist"));
  EXPECT_FALSE(exists(to_ + "/VendraMetadata.plist"));
  EXPECT_EQ(log.systemLines().size(), 1u);
}

}  // namespace
