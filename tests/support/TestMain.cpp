// The main of every test binary: a private system root exported as
// QS_SYSTEM_ROOT before anything can create the shared configuration, and a
// check that no format string met an argument of the wrong kind.
#include <stdlib.h>
#include <unistd.h>

#include <cstdio>
#include <string>

#include <gtest/gtest.h>

#include "Platform/Foundation/Format.h"
#include "TestSupport.h"

namespace {

class FormatMismatchListener : public testing::EmptyTestEventListener {
  uint64_t before_ = 0;
  void OnTestStart(const testing::TestInfo&) override { before_ = platform::formatMismatchCount(); }
  void OnTestEnd(const testing::TestInfo& info) override {
    if (platform::formatMismatchCount() != before_ && std::string(info.test_suite_name()) != "FormatMismatch") {
      ADD_FAILURE() << "a format string met an argument of the wrong kind";
    }
  }
};

}  // namespace

int main(int argc, char** argv) {
  const char* tmp = getenv("TMPDIR");
  std::string tmpl = std::string(tmp && *tmp ? tmp : "/tmp") + "/qs-test-root.XXXXXX";
  std::string buf = tmpl;
  if (!mkdtemp(buf.data())) {
    perror("mkdtemp");
    return 2;
  }
  chmod(buf.c_str(), 0755);
  setenv("QS_SYSTEM_ROOT", buf.c_str(), 1);

  testing::InitGoogleTest(&argc, argv);
  testing::UnitTest::GetInstance()->listeners().Append(new FormatMismatchListener);
  int rc = RUN_ALL_TESTS();

  if (!getenv("QS_KEEP_TEST_ROOT")) (void)qstest::removeTree(buf);  // what a test left is its own failure
  return rc;
}
