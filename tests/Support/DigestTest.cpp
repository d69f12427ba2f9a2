// QSCreateSHA256Digest and the chunked reader beneath it.
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <random>

#include <gtest/gtest.h>

#include "Shared/Support/QSUtilities.h"
#include "Support/SupportFixtures.h"
#include "support/TestSupport.h"

namespace {

std::string randomBytes(size_t size, unsigned seed) {
  std::mt19937 generator(seed);
  std::string bytes(size, '\0');
  for (char& c : bytes) c = static_cast<char>(generator() & 0xff);
  return bytes;
}

// What coreutils says about the file.
std::string sha256sumOf(const std::string& path) {
  std::string command = "sha256sum '" + path + "'";
  FILE* pipe = popen(command.c_str(), "r");
  if (!pipe) return "";
  char buffer[65] = {};
  size_t n = fread(buffer, 1, 64, pipe);
  pclose(pipe);
  return std::string(buffer, n);
}

class Digest : public ::testing::Test {
 protected:
  supporttest::ScopedLogHandle noHandle_{std::nullopt};
  qstest::TempDir dir_{"digest"};
  qstest::LogCapture log_;
};

class DigestOfSize : public Digest, public ::testing::WithParamInterface<size_t> {};

TEST_P(DigestOfSize, MatchesCoreutils) {
  std::string path = dir_ / "file.bin";
  ASSERT_TRUE(qstest::writeFile(path, randomBytes(GetParam(), static_cast<unsigned>(GetParam()))));
  std::optional<std::string> digest = QSCreateSHA256Digest(platform::URL::fileURL(path));
  ASSERT_TRUE(digest.has_value());
  EXPECT_EQ(digest->size(), 64u);
  EXPECT_EQ(*digest, sha256sumOf(path));
  EXPECT_TRUE(log_.systemLines().empty());
}

INSTANTIATE_TEST_SUITE_P(AroundTheChunkSize, DigestOfSize,
                         ::testing::Values(size_t{0}, size_t{1}, size_t{65535}, size_t{65536}, size_t{65537},
                                           size_t{200000}));

TEST_F(Digest, MissingFileWritesTheReaderLineThenTheDigestLine) {
  std::string path = dir_ / "missing";
  platform::URL url = platform::URL::fileURL(path);
  EXPECT_EQ(QSCreateSHA256Digest(url), std::nullopt);
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(lines[0].level, 3);
  EXPECT_EQ(lines[0].function, "_ReadFile");
  EXPECT_EQ(lines[0].message, "failed to open " + path + " : No such file or directory");
  EXPECT_EQ(lines[1].level, 3);
  EXPECT_EQ(lines[1].function, "QSCreateSHA256Digest");
  EXPECT_EQ(lines[1].message, "Failed to read " + url.description() + " : No such file or directory");
}

TEST_F(Digest, DigestLineKeepsTheReadersErrnoWhenTheLogChangesIt) {
  std::vector<std::string> messages;
  // A sink that disturbs errno, as syslog may.
  platform::SystemLogSink previous = platform::setSystemLogSink([&messages](const platform::SystemLogLine& line) {
    messages.push_back(line.message);
    errno = EBADF;
  });
  std::string path = dir_ / "missing";
  EXPECT_EQ(QSCreateSHA256Digest(path), std::nullopt);
  platform::setSystemLogSink(previous);
  ASSERT_EQ(messages.size(), 2u);
  EXPECT_EQ(messages[1], "Failed to read file://" + path + " : No such file or directory");
}

TEST_F(Digest, DirectoryFailsAtTheFirstRead) {
  std::string path = dir_ / "sub";
  ASSERT_TRUE(qstest::makeDirs(path));
  ASSERT_TRUE(qstest::writeFile(path + "/x", "x"));
  struct stat status {};
  ASSERT_EQ(stat(path.c_str(), &status), 0);
  if (status.st_size == 0) GTEST_SKIP() << "this file system reports directories as empty";
  EXPECT_EQ(QSCreateSHA256Digest(path), std::nullopt);
  auto messages = log_.systemMessages();
  ASSERT_EQ(messages.size(), 2u);
  EXPECT_EQ(messages[0], "read failed for " + path + " : Is a directory");
  EXPECT_EQ(messages[1].rfind("Failed to read file://" + path, 0), 0u);
}

TEST_F(Digest, UnreadableFileFailsToOpen) {
  std::string path = dir_ / "secret";
  ASSERT_TRUE(qstest::writeFile(path, "secret"));
  ASSERT_EQ(chmod(path.c_str(), 0600), 0);
  int status = qstest::runAsNobody([&] {
    qstest::LogCapture log;
    bool failed = !QSCreateSHA256Digest(path).has_value();
    auto messages = log.systemMessages();
    bool linesRight = messages.size() == 2 && messages[0] == "failed to open " + path + " : Permission denied";
    return failed && linesRight ? 0 : 1;
  });
  EXPECT_EQ(status, 0);
}

// --- The chunked reader -----------------------------------------------------------------

class ReadFileChunks : public Digest {};

TEST_F(ReadFileChunks, FileComesInOrderInChunksOf65536) {
  const std::pair<size_t, std::vector<size_t>> cases[] = {
      {200000, {65536, 65536, 65536, 3392}}, {5, {5}}, {0, {}}};
  for (const auto& [size, chunks] : cases) {
    std::string path = dir_ / "file";
    std::string contents = randomBytes(size, 7);
    ASSERT_TRUE(qstest::writeFile(path, contents));
    std::vector<size_t> sizes;
    std::string seen;
    EXPECT_TRUE(_ReadFile(path.c_str(), [&](const uint8_t* bytes, size_t length) {
      sizes.push_back(length);
      seen.append(reinterpret_cast<const char*>(bytes), length);
      return true;
    }));
    EXPECT_EQ(sizes, chunks);
    EXPECT_EQ(seen, contents);
  }
}

TEST_F(ReadFileChunks, ConsumerRefusalStopsWithoutALine) {
  std::string path = dir_ / "refused";
  ASSERT_TRUE(qstest::writeFile(path, randomBytes(100000, 2)));
  int calls = 0;
  EXPECT_FALSE(_ReadFile(path.c_str(), [&calls](const uint8_t*, size_t) {
    ++calls;
    return false;
  }));
  EXPECT_EQ(calls, 1);
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(ReadFileChunks, FileThatShrinksWhileReadFailsWithShortRead) {
  std::string path = dir_ / "shrinking";
  ASSERT_TRUE(qstest::writeFile(path, randomBytes(150000, 3)));
  // The size taken at opening stays in force: a file cut short mid-read ends in a zero-byte read.
  EXPECT_FALSE(_ReadFile(path.c_str(), [&path](const uint8_t*, size_t) {
    return truncate(path.c_str(), 65536) == 0;
  }));
  EXPECT_EQ(log_.systemMessages(), std::vector<std::string>{"read failed for " + path + ", got 0 bytes"});
  EXPECT_EQ(log_.systemLines()[0].function, "_ReadFile");
}

TEST_F(ReadFileChunks, FileThatGrowsWhileReadStopsAtTheOriginalSize) {
  std::string path = dir_ / "growing";
  ASSERT_TRUE(qstest::writeFile(path, randomBytes(70000, 4)));
  size_t total = 0;
  EXPECT_TRUE(_ReadFile(path.c_str(), [&](const uint8_t*, size_t length) {
    if (total == 0) {
      FILE* f = fopen(path.c_str(), "ab");
      if (f) {
        fputs("more bytes at the end", f);
        fclose(f);
      }
    }
    total += length;
    return true;
  }));
  EXPECT_EQ(total, 70000u);
}

}  // namespace
