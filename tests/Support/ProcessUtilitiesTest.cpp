// Resource-usage assertions, transactional tasks on work queues, and the
// crash report for an uncaught exception.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <future>
#include <thread>

#include <gtest/gtest.h>

#include "Platform/Process.h"
#include "Shared/Support/QSUtilities.h"

namespace {

// --- Resource usage --------------------------------------------------------------------

TEST(ResourceAssertion, NestedAssertionsSwitchTheMonitorOffOnceAndRestoreOnce) {
  ASSERT_EQ(QSHighResourceUsageAssertionCount(), 0);
  ASSERT_TRUE(platform::CPUUsageMonitorIsEnabledForCurrentProcess());
  uint64_t disables = platform::CPUUsageMonitorDisableCount();
  uint64_t restores = platform::CPUUsageMonitorRestoreCount();

  QSAssertHighResourceUsage();
  QSAssertHighResourceUsage();
  EXPECT_FALSE(platform::CPUUsageMonitorIsEnabledForCurrentProcess());
  QSClearResourceAssertion();
  EXPECT_FALSE(platform::CPUUsageMonitorIsEnabledForCurrentProcess());
  EXPECT_EQ(platform::CPUUsageMonitorRestoreCount(), restores);
  QSClearResourceAssertion();
  EXPECT_TRUE(platform::CPUUsageMonitorIsEnabledForCurrentProcess());

  EXPECT_EQ(platform::CPUUsageMonitorDisableCount(), disables + 1);
  EXPECT_EQ(platform::CPUUsageMonitorRestoreCount(), restores + 1);
  EXPECT_EQ(QSHighResourceUsageAssertionCount(), 0);
}

TEST(ResourceAssertion, AssertionsFromManyThreadsPairUp) {
  uint64_t disables = platform::CPUUsageMonitorDisableCount();
  uint64_t restores = platform::CPUUsageMonitorRestoreCount();
  QSAssertHighResourceUsage();  // held throughout, so the threads never reach 0 together
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([] {
      for (int i = 0; i < 1000; ++i) {
        QSAssertHighResourceUsage();
        QSClearResourceAssertion();
      }
    });
  }
  for (auto& t : threads) t.join();
  EXPECT_EQ(QSHighResourceUsageAssertionCount(), 1);
  EXPECT_FALSE(platform::CPUUsageMonitorIsEnabledForCurrentProcess());
  QSClearResourceAssertion();
  EXPECT_TRUE(platform::CPUUsageMonitorIsEnabledForCurrentProcess());
  EXPECT_EQ(platform::CPUUsageMonitorDisableCount(), disables + 1);
  EXPECT_EQ(platform::CPUUsageMonitorRestoreCount(), restores + 1);
}

// --- Work queues and transactional tasks ------------------------------------------------

// Waits until every job queued on `queue` so far has run: jobs run in order.
void drain(platform::WorkQueue& queue) {
  std::promise<void> done;
  queue.async([&done] { done.set_value(); });
  done.get_future().wait();
}

TEST(WorkQueue, RunsJobsOneAtATimeInOrderOnItsOwnThread) {
  platform::WorkQueue queue("test.order");
  std::vector<int> order;
  std::thread::id jobThread;
  queue.async([&jobThread] { jobThread = std::this_thread::get_id(); });
  std::atomic<int> running{0};
  std::atomic<bool> overlapped{false};
  for (int i = 0; i < 200; ++i) {
    queue.async([&, i] {
      if (running.fetch_add(1) != 0) overlapped = true;
      order.push_back(i);
      running.fetch_sub(1);
    });
  }
  drain(queue);
  ASSERT_EQ(order.size(), 200u);
  for (int i = 0; i < 200; ++i) EXPECT_EQ(order[i], i);
  EXPECT_FALSE(overlapped.load());
  EXPECT_NE(jobThread, std::this_thread::get_id());
}

TEST(WorkQueue, DestructionRunsWhatWasQueued) {
  std::atomic<int> ran{0};
  {
    platform::WorkQueue queue("test.drain");
    for (int i = 0; i < 50; ++i) queue.async([&ran] { ran.fetch_add(1); });
  }
  EXPECT_EQ(ran.load(), 50);
}

TEST(TransactionalTask, ReturnsAtOnceAndHoldsTheProcessUntilTheTaskEnds) {
  platform::WorkQueue queue("test.transaction");
  int64_t before = platform::ProcessKeepAliveTransactionCount();
  std::promise<void> gate;
  std::shared_future<void> opened = gate.get_future().share();
  std::atomic<bool> ran{false};

  QSRunTransactionalTask(queue, [opened, &ran] {
    opened.wait();
    ran = true;
  });
  // The call returned while the task still waits on the gate.
  EXPECT_FALSE(ran.load());
  EXPECT_EQ(platform::ProcessKeepAliveTransactionCount(), before + 1);

  gate.set_value();
  drain(queue);
  EXPECT_TRUE(ran.load());
  EXPECT_EQ(platform::ProcessKeepAliveTransactionCount(), before);
}

TEST(TransactionalTask, SharedQueueRunsTheTaskAndThenReleasesIt) {
  auto token = std::make_shared<int>(1);
  std::weak_ptr<int> watch = token;
  std::promise<std::string> label;
  QSRunTransactionalTask(platform::WorkQueue::shared(), [token, &label] { label.set_value("ran"); });
  token.reset();
  EXPECT_EQ(label.get_future().get(), "ran");
  drain(platform::WorkQueue::shared());
  EXPECT_TRUE(watch.expired());
}

// --- Crash report ------------------------------------------------------------------------

// The report as built on a fresh thread, named by `name` when given.
std::string reportOnThread(const QSException& exception, std::optional<std::string> name) {
  std::string report;
  std::thread([&] {
    if (name) platform::setCurrentThreadName(*name);
    report = QSCrashReportText(exception);
  }).join();
  return report;
}

TEST(CrashReport, ShowsThreadNameNameReasonAndStack) {
  const std::tuple<QSException, std::optional<std::string>, std::string> cases[] = {
      {{"NSInternalInconsistency", std::nullopt, {"0 frame", "1 frame"}}, std::nullopt,
       "Exception: NSInternalInconsistency: \nStack:\n0 frame\n1 frame"},
      {{std::nullopt, "it broke", {}}, std::string(), "Exception: <> it broke\nStack:\n"},
      {{"Bad", "very", {"only"}}, std::string("migration worker thread"),
       "Exception: <migration worker thread> Bad: very\nStack:\nonly"},
  };
  for (const auto& [exception, name, rest] : cases) {
    EXPECT_EQ(reportOnThread(exception, name), "** INTERNAL ERROR: Uncaught Exception **\n" + rest);
  }
}

TEST(CrashReport, ThreadNameIsPerThread) {
  QSException exception{"N", "R", {}};
  std::string outer;
  std::string inner;
  std::thread([&] {
    platform::setCurrentThreadName("outer");
    inner = reportOnThread(exception, std::nullopt);
    outer = QSCrashReportText(exception);
  }).join();
  EXPECT_EQ(inner.find("<"), std::string::npos);
  EXPECT_NE(outer.find("Exception: <outer> N: R"), std::string::npos);
}

// What the child's abort handler found in the crash annotation.
constexpr char kAnnotationMarker[] = "\n--annotation--\n";

void reportAnnotation(int) {
  char version = static_cast<char>('0' + platform::gCrashAnnotation.version);
  const char* message = reinterpret_cast<const char*>(platform::gCrashAnnotation.message);
  (void)!write(STDERR_FILENO, kAnnotationMarker, strlen(kAnnotationMarker));
  (void)!write(STDERR_FILENO, &version, 1);
  (void)!write(STDERR_FILENO, "\n", 1);
  if (message) (void)!write(STDERR_FILENO, message, strlen(message));
}

struct ChildOutcome {
  int status = 0;
  std::string standardError;
};

ChildOutcome crashInChild(const QSException& exception, std::optional<std::string> threadName) {
  int fds[2];
  if (pipe(fds) != 0) return {};
  pid_t pid = fork();
  if (pid == 0) {
    close(fds[0]);
    dup2(fds[1], STDERR_FILENO);
    struct sigaction action {};
    action.sa_handler = reportAnnotation;
    sigaction(SIGABRT, &action, nullptr);
    if (threadName) platform::setCurrentThreadName(*threadName);
    QSCrashOnException(exception);
  }
  close(fds[1]);
  ChildOutcome outcome;
  char buffer[4096];
  ssize_t n;
  while ((n = read(fds[0], buffer, sizeof buffer)) > 0) outcome.standardError.append(buffer, static_cast<size_t>(n));
  close(fds[0]);
  waitpid(pid, &outcome.status, 0);
  return outcome;
}

TEST(CrashOnException, WritesTheReportRecordsItAndAborts) {
  QSException exception{"QSBadThing", "the reason", {"0 libQS 0x1 f", "1 libQS 0x2 g"}};
  ChildOutcome outcome = crashInChild(exception, std::string("crasher"));
  ASSERT_TRUE(WIFSIGNALED(outcome.status));
  EXPECT_EQ(WTERMSIG(outcome.status), SIGABRT);

  std::string report =
      "** INTERNAL ERROR: Uncaught Exception **\nException: <crasher> QSBadThing: the reason\nStack:\n"
      "0 libQS 0x1 f\n1 libQS 0x2 g";
  size_t marker = outcome.standardError.find(kAnnotationMarker);
  ASSERT_NE(marker, std::string::npos) << outcome.standardError;
  EXPECT_EQ(outcome.standardError.substr(0, marker), report + "\n");
  EXPECT_EQ(outcome.standardError.substr(marker + strlen(kAnnotationMarker)), "5\n" + report);
}

TEST(CrashOnException, AnnotationStartsAtVersionFiveWithoutMessage) {
  EXPECT_EQ(platform::gCrashAnnotation.version, 5u);
  EXPECT_EQ(platform::gCrashAnnotation.message, 0u);
  for (uint64_t field : platform::gCrashAnnotation.reserved) EXPECT_EQ(field, 0u);
}

}  // namespace
