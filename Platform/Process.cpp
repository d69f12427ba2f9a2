#include "Platform/Process.h"

#include <pthread.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>

namespace platform {

// --- Work queues ----------------------------------------------------------

namespace {
constexpr char kSharedWorkQueueLabel[] = "com.vantrel.quillset.shared";
}  // namespace

WorkQueue::WorkQueue(std::string label) : label_(std::move(label)) {}

WorkQueue::~WorkQueue() {
  std::thread worker;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    stopping_ = true;
    worker = std::move(worker_);
  }
  wake_.notify_all();
  if (worker.joinable()) worker.join();
}

void WorkQueue::async(Job job) {
  {
    std::lock_guard<std::mutex> lock(mutex_);
    jobs_.push_back(std::move(job));
    // Started lazily so that a queue nobody uses costs no thread.
    if (!worker_.joinable()) worker_ = std::thread([this] { run(); });
  }
  wake_.notify_one();
}

void WorkQueue::run() {
  std::unique_lock<std::mutex> lock(mutex_);
  for (;;) {
    wake_.wait(lock, [this] { return stopping_ || !jobs_.empty(); });
    if (jobs_.empty()) return;  // stopping and drained
    Job job = std::move(jobs_.front());
    jobs_.pop_front();
    lock.unlock();
    job();
    job = nullptr;  // release what the job captured before taking the lock again
    lock.lock();
  }
}

WorkQueue& WorkQueue::shared() {
  static auto* queue = new WorkQueue(kSharedWorkQueueLabel);
  return *queue;
}

// --- Keep-alive transactions -----------------------------------------------

namespace {
std::atomic<int64_t> gKeepAliveTransactions{0};
}  // namespace

void ProcessKeepAliveTransactionOpen() { gKeepAliveTransactions.fetch_add(1); }
void ProcessKeepAliveTransactionClose() { gKeepAliveTransactions.fetch_sub(1); }
int64_t ProcessKeepAliveTransactionCount() { return gKeepAliveTransactions.load(); }

// --- CPU-usage monitor -----------------------------------------------------

namespace {
std::atomic<bool> gCPUMonitorEnabled{true};
std::atomic<uint64_t> gCPUMonitorDisableCalls{0};
std::atomic<uint64_t> gCPUMonitorRestoreCalls{0};
}  // namespace

void CPUUsageMonitorDisableForCurrentProcess() {
  gCPUMonitorDisableCalls.fetch_add(1);
  gCPUMonitorEnabled.store(false);
}

void CPUUsageMonitorRestoreDefaultsForCurrentProcess() {
  gCPUMonitorRestoreCalls.fetch_add(1);
  gCPUMonitorEnabled.store(true);
}

bool CPUUsageMonitorIsEnabledForCurrentProcess() { return gCPUMonitorEnabled.load(); }
uint64_t CPUUsageMonitorDisableCount() { return gCPUMonitorDisableCalls.load(); }
uint64_t CPUUsageMonitorRestoreCount() { return gCPUMonitorRestoreCalls.load(); }

// --- Thread names ----------------------------------------------------------

namespace {
// The kernel keeps 15 bytes of a thread's name plus the terminator.
constexpr size_t kKernelThreadNameLength = 15;

// Kept per thread because the kernel cannot tell a thread that was never
// named from one that inherited the program's name.
thread_local std::optional<std::string> tThreadName;
}  // namespace

void setCurrentThreadName(const std::string& name) {
  tThreadName = name;
  // The kernel's copy only helps debuggers; failure to set it changes nothing here.
  (void)pthread_setname_np(pthread_self(), name.substr(0, kKernelThreadNameLength).c_str());
}

std::optional<std::string> currentThreadName() { return tThreadName; }

// --- Crash annotation -------------------------------------------------------

constinit CrashAnnotation gCrashAnnotation{kCrashAnnotationVersion, 0, {}};
constinit std::mutex gCrashAnnotationMutex;

void writeToStandardError(const std::string& text) {
  const char* p = text.data();
  size_t left = text.size();
  while (left > 0) {
    ssize_t n = ::write(STDERR_FILENO, p, left);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return;  // nowhere left to report to
    p += n;
    left -= static_cast<size_t>(n);
  }
}

void abortProcess() { std::abort(); }

}  // namespace platform
