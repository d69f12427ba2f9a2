// What every program of the project does the same way: --version, the plain
// program name in its usage line, options after subcommands, errors on
// standard error with nothing on standard output.
#include "ToolTestSupport.h"

namespace tooltest {
namespace {

TEST(Conventions, VersionUsageAndErrorsOfEveryProgram) {
  for (const std::string program : {"transvale", "devicegen", "appregistry"}) {
    SCOPED_TRACE(program);
    EXPECT_THAT(runTool(program, {"--version"}), exited(0, _, Eq(program + " (Quillset) 1.0.0\n")));
    EXPECT_THAT(runTool(program, {"--help"}),
                exited(0, _, AllOf(HasSubstr("Usage: " + program + " "), HasSubstr("--version"))));
    EXPECT_THAT(runTool(program, {"--no-such-option"}), exited(kUsageStatus, Not(IsEmpty()), IsEmpty()));
  }
}

}  // namespace
}  // namespace tooltest
