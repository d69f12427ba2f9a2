// QSCreateSHA256Digest and the chunked reader beneath it.
#include <unistd.h>

#include <cstdio>

#include <gtest/gtest.h>

#include "Shared/Support/QSUtilities.h"
#include "Support/SupportFixtures.h"

namespace {

class Digest : public ::testing::Test {
 protected:
  std::string file(const std::string& name, size_t size) {
    std::string bytes(size, '\0');
    for (size_t i = 0; i < size; ++i) bytes[i] = static_cast<char>((i * 2654435761u) >> 13);
    EXPECT_TRUE(qstest::writeFile(dir_ / name, bytes));
    return dir_ / name;
  }
  supporttest::ScopedLogHandle noHandle_{std::nullopt};
  qstest::TempDir dir_{"digest"};
  qstest::LogCapture log_;
};

// What coreutils says about the file; the reader hands it over in order in chunks of at most 65536 bytes.
TEST_F(Digest, MatchesCoreutilsAroundTheChunkSize) {
  for (size_t size : {0, 65536, 65537, 200000}) {
    const std::string path = file("f" + std::to_string(size), size);
    char expected[65] = {};
    FILE* pipe = popen(("sha256sum '" + path + "'").c_str(), "r");
    ASSERT_TRUE(pipe && fread(expected, 1, 64, pipe) == 64);
    pclose(pipe);
    EXPECT_EQ(QSCreateSHA256Digest(platform::URL::fileURL(path)), std::optional<std::string>(expected)) << size;
    std::vector<size_t> chunks;
    std::string seen;
    EXPECT_TRUE(_ReadFile(path.c_str(), [&](const uint8_t* bytes, size_t length) {
      chunks.push_back(length);
      seen.append(reinterpret_cast<const char*>(bytes), length);
      return true;
    }));
    EXPECT_EQ(seen, qstest::readFile(path));
    for (size_t chunk : chunks) EXPECT_LE(chunk, 65536u);
  }
  EXPECT_TRUE(log_.systemLines().empty());
}

// The digest's line reports the reader's errno even when writing the reader's line changes it, as syslog may.
TEST_F(Digest, MissingFileWritesTheReaderLineThenTheDigestLine) {
  std::vector<platform::SystemLogLine> lines;
  platform::SystemLogSink previous = platform::setSystemLogSink([&lines](const platform::SystemLogLine& line) {
    lines.push_back(line);
    errno = EBADF;
  });
  EXPECT_EQ(QSCreateSHA256Digest(dir_ / "missing"), std::nullopt);
  platform::setSystemLogSink(previous);
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(lines[0].function, "_ReadFile");
  EXPECT_EQ(lines[0].message, "failed to open " + dir_ / "missing" + " : No such file or directory");
  EXPECT_EQ(lines[1].function, "QSCreateSHA256Digest");
  EXPECT_EQ(lines[1].message, "Failed to read file://" + dir_ / "missing" + " : No such file or directory");
}

TEST_F(Digest, ReaderStopsWhenTheConsumerRefusesAndAtTheSizeTakenAtOpening) {
  const std::string path = file("f", 150000);
  int calls = 0;
  EXPECT_FALSE(_ReadFile(path.c_str(), [&calls](const uint8_t*, size_t) { return ++calls > 1; }));
  EXPECT_EQ(calls, 1);
  EXPECT_TRUE(log_.systemLines().empty());
  size_t total = 0;
  EXPECT_TRUE(_ReadFile(path.c_str(), [&](const uint8_t*, size_t length) {
    if (total == 0) qstest::writeFile(path, std::string(200000, 'x'));
    return (total += length) > 0;
  }));
  EXPECT_EQ(total, 150000u);
  // A file cut short while read ends in a zero-byte read.
  EXPECT_FALSE(_ReadFile(path.c_str(), [&path](const uint8_t*, size_t) { return truncate(path.c_str(), 65536) == 0; }));
  EXPECT_EQ(log_.systemMessages(), std::vector<std::string>{"read failed for " + path + ", got 0 bytes"});
  ASSERT_TRUE(qstest::makeDirs(dir_ / "sub") && qstest::writeFile(dir_ / "sub/x", "x"));
  EXPECT_EQ(QSCreateSHA256Digest(dir_ / "sub"), std::nullopt);
}

}  // namespace
