// Judging where paths the system does not control lead.
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
using qstest::makeDirs;
using qstest::TempDir;
using qstest::writeFile;

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
  path::ResolvedDirectories kept;
  for (const auto& c : kCases) {
    EXPECT_EQ(path::placementOf(c.candidate, base), c.placement) << c.candidate;
    EXPECT_EQ(path::placementOfResolved(path::resolvedAsFarAsExists(c.candidate), kept(base)), c.placement)
        << c.candidate;
    EXPECT_EQ(kept.holdsInside(c.candidate, base), c.placement == Placement::Inside) << c.candidate;
  }
  // The candidate is resolved at each check, so a link made since is judged
  // by where it leads now; a kept directory keeps its first resolution, so
  // one swapped for a link since holds nothing (the check fails closed).
  const std::string moved = dir / "moved";
  ASSERT_TRUE(makeDirs(moved) && kept(dir / "later"));
  ASSERT_EQ(symlink(moved.c_str(), (dir / "later").c_str()), 0);
  ASSERT_EQ(symlink("../outside", (base + "/inner/new").c_str()), 0);
  EXPECT_FALSE(kept.holdsInside(base + "/inner/new/file", base));
  for (const std::string& candidate : {dir / "later/x", moved + "/x"}) {
    EXPECT_FALSE(kept.holdsInside(candidate, dir / "later")) << candidate;
  }
}

}  // namespace
