#include <atomic>
#include <cstring>

#include "Shared/Support/QSUtilities.h"

namespace {

// Assertions of high resource usage in force; changed only atomically, with
// full barriers, so that assertions from different threads pair up.
std::atomic<int32_t> gHighResourceUsageAssertions{0};

constexpr char kCrashBanner[] = "** INTERNAL ERROR: Uncaught Exception **\n";
constexpr char kCrashExceptionLabel[] = "Exception: ";
constexpr char kCrashThreadNameOpen[] = "<";
constexpr char kCrashThreadNameClose[] = "> ";
constexpr char kCrashNameSeparator[] = ": ";
constexpr char kCrashStackLabel[] = "\nStack:\n";
constexpr char kCrashStackSeparator[] = "\n";
// Ends the report on the standard error stream, where the next output would follow it.
constexpr char kCrashReportTerminator[] = "\n";

}  // namespace

void QSAssertHighResourceUsage() {
  if (gHighResourceUsageAssertions.fetch_add(1, std::memory_order_seq_cst) + 1 == 1) {
    platform::CPUUsageMonitorDisableForCurrentProcess();
  }
}

void QSClearResourceAssertion() {
  if (gHighResourceUsageAssertions.fetch_sub(1, std::memory_order_seq_cst) - 1 == 0) {
    platform::CPUUsageMonitorRestoreDefaultsForCurrentProcess();
  }
}

int32_t QSHighResourceUsageAssertionCount() { return gHighResourceUsageAssertions.load(); }

void QSRunTransactionalTask(platform::WorkQueue& queue, std::function<void()> task) {
  platform::ProcessKeepAliveTransactionOpen();
  queue.async([task = std::move(task)] {
    task();
    platform::ProcessKeepAliveTransactionClose();
  });
}

std::string QSCrashReportText(const QSException& exception) {
  std::string report = kCrashBanner;
  report += kCrashExceptionLabel;
  if (std::optional<std::string> threadName = platform::currentThreadName()) {
    report += kCrashThreadNameOpen;
    report += *threadName;
    report += kCrashThreadNameClose;
  }
  if (exception.name) {
    report += *exception.name;
    report += kCrashNameSeparator;
  }
  if (exception.reason) report += *exception.reason;
  report += kCrashStackLabel;
  for (size_t i = 0; i < exception.callStackSymbols.size(); ++i) {
    if (i > 0) report += kCrashStackSeparator;
    report += exception.callStackSymbols[i];
  }
  return report;
}

void QSCrashOnException(const QSException& exception) {
  std::string report = QSCrashReportText(exception);
  // Taken for good: a second crashing thread waits here until the process is gone.
  platform::gCrashAnnotationMutex.lock();
  // The crash reporter reads the text after the process has stopped, so the copy is never freed.
  char* message = new char[report.size() + 1];
  std::memcpy(message, report.c_str(), report.size() + 1);
  platform::gCrashAnnotation.message = reinterpret_cast<uintptr_t>(message);
  platform::writeToStandardError(report + kCrashReportTerminator);
  platform::abortProcess();
}
