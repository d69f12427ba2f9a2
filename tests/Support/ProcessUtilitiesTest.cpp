// Resource-usage assertions, transactional tasks on work queues, and the
// crash report for an uncaught exception.
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <future>
#include <thread>

#include <gtest/gtest.h>

#include "Platform/Process.h"
#include "Shared/Support/QSUtilities.h"

namespace {

// Nested assertions, also from many threads, switch the monitor off once and restore it once.
TEST(ResourceAssertion, AssertionsPairUpAndSwitchTheMonitorOffAndOnOnce) {
  ASSERT_EQ(QSHighResourceUsageAssertionCount(), 0);
  const uint64_t disables = platform::CPUUsageMonitorDisableCount();
  const uint64_t restores = platform::CPUUsageMonitorRestoreCount();
  QSAssertHighResourceUsage();
  QSAssertHighResourceUsage();
  auto pairs = [] {
    for (int i = 0; i < 1000; ++i) QSAssertHighResourceUsage(), QSClearResourceAssertion();
  };
  std::thread a(pairs), b(pairs), c(pairs), d(pairs);
  a.join(), b.join(), c.join(), d.join();
  QSClearResourceAssertion();
  EXPECT_FALSE(platform::CPUUsageMonitorIsEnabledForCurrentProcess());
  EXPECT_EQ(platform::CPUUsageMonitorRestoreCount(), restores);
  QSClearResourceAssertion();
  EXPECT_TRUE(platform::CPUUsageMonitorIsEnabledForCurrentProcess());
  EXPECT_EQ(platform::CPUUsageMonitorDisableCount(), disables + 1);
  EXPECT_EQ(platform::CPUUsageMonitorRestoreCount(), restores + 1);
  EXPECT_EQ(QSHighResourceUsageAssertionCount(), 0);
}

// The task runs on the queue's own thread, in order with the queue's other jobs.
TEST(TransactionalTask, ReturnsAtOnceAndHoldsTheProcessUntilTheTaskEnds) {
  const int64_t before = platform::ProcessKeepAliveTransactionCount();
  std::promise<void> gate;
  std::thread::id taskThread;
  std::vector<int> order;
  {
    platform::WorkQueue queue("test.transaction");
    QSRunTransactionalTask(queue, [opened = gate.get_future().share(), &taskThread, &order] {
      opened.wait();
      taskThread = std::this_thread::get_id();
      order.push_back(-1);
    });
    for (int i = 0; i < 200; ++i) queue.async([&order, i] { order.push_back(i); });
    EXPECT_TRUE(order.empty());
    EXPECT_EQ(platform::ProcessKeepAliveTransactionCount(), before + 1);
    gate.set_value();
  }  // the queue runs what was queued before it goes
  EXPECT_EQ(platform::ProcessKeepAliveTransactionCount(), before);
  EXPECT_EQ(order.size(), 201u);
  EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
  EXPECT_NE(taskThread, std::this_thread::get_id());
  std::promise<void> ran;
  QSRunTransactionalTask(platform::WorkQueue::shared(), [&ran] { ran.set_value(); });
  ran.get_future().wait();
}

// The report as built on a fresh thread, named by `name` when given; the full report is checked with the
// crash below. The thread name is per thread: the unnamed case comes after a named one.
TEST(CrashReport, LeavesOutWhatIsMissing) {
  const std::tuple<QSException, std::optional<std::string>, std::string> cases[] = {
      {{std::nullopt, "it broke", {}}, std::string(), "Exception: <> it broke\nStack:\n"},
      {{"N", std::nullopt, {"0 f", "1 f"}}, std::nullopt, "Exception: N: \nStack:\n0 f\n1 f"},
  };
  for (const auto& [exception, name, rest] : cases) {
    std::string report;
    std::thread([&] {
      if (name) platform::setCurrentThreadName(*name);
      report = QSCrashReportText(exception);
    }).join();
    EXPECT_EQ(report, "** INTERNAL ERROR: Uncaught Exception **\n" + rest);
  }
}

// The abort handler of the crashing child: writes what it finds in the crash annotation.
constexpr char kAnnotationMarker[] = "\n--annotation--\n";

void reportAnnotation(int) {
  const char version = static_cast<char>('0' + platform::gCrashAnnotation.version);
  const char* message = reinterpret_cast<const char*>(platform::gCrashAnnotation.message);
  (void)!write(STDERR_FILENO, kAnnotationMarker, strlen(kAnnotationMarker));
  (void)!write(STDERR_FILENO, &version, 1);
  if (message) (void)!write(STDERR_FILENO, message, strlen(message));
}

// The standard error stream must be the report, then what the abort handler found in the annotation.
TEST(CrashOnException, WritesTheReportRecordsItInTheAnnotationAndAborts) {
  const std::string report =
      "\\*\\* INTERNAL ERROR: Uncaught Exception \\*\\*\nException: <crasher> QSBadThing: the reason\nStack:\n"
      "0 libQS 0x1 f\n1 libQS 0x2 g";
  auto crash = [] {
    struct sigaction action {};
    action.sa_handler = reportAnnotation;
    sigaction(SIGABRT, &action, nullptr);
    platform::setCurrentThreadName("crasher");
    QSCrashOnException({"QSBadThing", "the reason", {"0 libQS 0x1 f", "1 libQS 0x2 g"}});
  };
  EXPECT_EXIT(crash(), testing::KilledBySignal(SIGABRT), "^" + report + "\n" + kAnnotationMarker + "5" + report + "$");
}

}  // namespace
