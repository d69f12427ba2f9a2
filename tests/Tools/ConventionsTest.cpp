// What every program of the project does the same way: --version, the plain
// program name in its usage line, options after subcommands, errors on
// standard error with nothing on standard output.
#include "ToolTestSupport.h"

namespace tooltest {
namespace {

TEST(Conventions, VersionUsageAndErrorsOfEveryProgram) {
  for (const std::string program : {"transvale", "devicegen", "appregistry"}) {
    SCOPED_TRACE(program);
    const RunResult version = runTool(program, {"--version"});
    EXPECT_EQ(version.status, 0);
    EXPECT_EQ(version.out, program + " (Quillset) 1.0.0\n");
    const RunResult help = runTool(program, {"--help"});
    EXPECT_EQ(help.status, 0);
    EXPECT_NE(help.out.find("Usage: " + program + " "), std::string::npos) << help.out;
    EXPECT_NE(help.out.find("--version"), std::string::npos);
    const RunResult bad = runTool(program, {"--no-such-option"});
    EXPECT_EQ(bad.status, kUsageStatus);
    EXPECT_EQ(bad.out, "");
    EXPECT_NE(bad.err, "");
  }
}

// devicegen verify --json: the same verdict as the text, as one document; an
// image not migrated yet has its containers left behind.
TEST(Conventions, DevicegenVerifyWritesJson) {
  qstest::TempDir dir("verify");
  ASSERT_EQ(createImage(dir / "image", {"--apps", "2", "--files-per-app", "1"}).status, 0);
  const RunResult json = runTool("devicegen", {"verify", "--json", "--root", dir / "image"});
  EXPECT_EQ(json.status, 1);
  EXPECT_EQ(json.out.rfind("{\"root\":\"", 0), 0u) << json.out;
  EXPECT_NE(json.out.find("\"ok\":false,\"fatal\":null,\"summary\":{\"applications\":2,"), std::string::npos) << json.out;
  EXPECT_EQ(json.out.find("\"left behind\":0"), std::string::npos) << json.out;
  EXPECT_EQ(json.out.back(), '\n');
}

}  // namespace
}  // namespace tooltest
