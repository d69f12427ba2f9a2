// Reading files the system does not control, and judging where their paths
// lead.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <functional>

#include <gtest/gtest.h>

#include "Platform/Foundation/PathContainment.h"
#include "Platform/Foundation/PropertyList.h"
#include "support/TestSupport.h"

namespace {

using namespace platform;
using qstest::TempDir;
using qstest::makeDirs;
using qstest::writeFile;

// Each case makes the file at `path` in its own way; the read must end at once
// with a 256 record saying why, having allocated nothing near the claimed size.
TEST(UntrustedRead, RefusesWhatWouldExhaustMemoryOrBlock) {
  TempDir dir;
  const std::string plist = "<plist><dict/></plist>";
  const struct {
    const char* name;
    std::function<bool(const std::string&)> make;
    plist::ReadOptions options;
    const char* reason;
  } kCases[] = {
      {"sparse 40 GiB", [](const std::string& p) { return writeFile(p, "") && truncate(p.c_str(), 40LL << 30) == 0; },
       {}, "more than the 33554432 this reader takes"},
      {"one byte over a small limit", [&](const std::string& p) { return writeFile(p, plist); },
       {.sizeLimit = plist.size() - 1}, "more than the 21 this reader takes"},
      {"fifo", [](const std::string& p) { return mkfifo(p.c_str(), 0644) == 0; }, {}, "not a regular file"},
      {"link to a fifo", [&](const std::string& p) {
         return mkfifo((p + ".fifo").c_str(), 0644) == 0 && symlink((p + ".fifo").c_str(), p.c_str()) == 0;
       }, {}, "not a regular file"},
      {"character device", [](const std::string& p) { return symlink("/dev/zero", p.c_str()) == 0; }, {},
       "not a regular file"},
      {"refused link", [&](const std::string& p) {
         return writeFile(p + ".real", plist) && symlink((p + ".real").c_str(), p.c_str()) == 0;
       }, {.finalLink = plist::FinalLink::Refuse}, "a symbolic link, which this reader does not follow"},
  };
  int n = 0;
  for (const auto& c : kCases) {
    SCOPED_TRACE(c.name);
    const std::string path = dir / ("case" + std::to_string(++n));
    ASSERT_TRUE(c.make(path));
    Error error;
    EXPECT_FALSE(plist::readDictionary(URL::fileURL(path), c.options, &error));
    EXPECT_EQ(error.code(), kFileReadUnknownError);
    EXPECT_NE(error.description().find(c.reason), std::string::npos) << error.description();
  }
  // The same files within their limits, links followed, read as before.
  ASSERT_TRUE(writeFile(dir / "fits", plist) && symlink((dir / "fits").c_str(), (dir / "linked").c_str()) == 0);
  EXPECT_TRUE(plist::readDictionary(URL::fileURL(dir / "fits"), {.sizeLimit = plist.size()}));
  EXPECT_TRUE(plist::readDictionary(URL::fileURL(dir / "linked")));
}

TEST(PathContainment, JudgesWhereEveryExistingPartLeads) {
  TempDir dir;
  const std::string base = dir / "base";
  ASSERT_TRUE(makeDirs(base + "/inner") && makeDirs(dir / "outside"));
  ASSERT_EQ(symlink("../outside", (base + "/out").c_str()), 0);
  ASSERT_EQ(symlink("inner", (base + "/in").c_str()), 0);
  ASSERT_EQ(symlink((dir / "nowhere").c_str(), (base + "/dangling").c_str()), 0);
  ASSERT_EQ(symlink(base.c_str(), (dir / "alias").c_str()), 0);
  using path::Placement;
  const struct {
    std::string candidate;
    Placement placement;
  } kCases[] = {
      {base + "/inner/new/file", Placement::Inside},  // missing tail
      {base + "/in/x", Placement::Inside},            // a link that stays inside
      {base + "//inner/./", Placement::Inside},
      {base, Placement::Same},
      {base + "/", Placement::Same},
      {dir / "alias/inner", Placement::Inside},  // judged by where it leads
      {base + "/out", Placement::Outside},
      {base + "/out/new", Placement::Outside},
      {base + "x", Placement::Outside},  // a prefix of the text is not a parent
      {dir.path(), Placement::Outside},
      {"/", Placement::Outside},
      {base + "/inner/../inner", Placement::Unusable},
      {"inner", Placement::Unusable},
      {"", Placement::Unusable},
      {base + "/dangling/x", Placement::Unusable},
  };
  for (const auto& c : kCases) EXPECT_EQ(path::placementOf(c.candidate, base), c.placement) << c.candidate;
}

}  // namespace
