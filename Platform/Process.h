// Process services: asynchronous work queues, keep-alive transactions, the
// CPU-usage monitor, thread names and the crash-annotation record.
//
// Linux has no per-process CPU-usage monitor and no idle-exit policy, so the
// monitor and the keep-alive transactions are counted stand-ins: they change
// no operating-system state, but they remember what was asked of them so
// that callers (and tests) can see that requests pair up.
//
// Thread safety: every function here may be called from any thread. The
// counters are atomic; a WorkQueue guards its job list with its own mutex.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <deque>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <thread>

namespace platform {

// --- Work queues ----------------------------------------------------------

// A serial work queue: jobs run one at a time, in the order they were
// queued, on one worker thread that the queue owns. The worker is started by
// the first job. Destroying the queue runs every job already queued and then
// joins the worker; process-wide queues are leaked and never destroyed.
class WorkQueue {
 public:
  using Job = std::function<void()>;

  explicit WorkQueue(std::string label);
  ~WorkQueue();
  WorkQueue(const WorkQueue&) = delete;
  WorkQueue& operator=(const WorkQueue&) = delete;

  const std::string& label() const { return label_; }

  // Queues `job` and returns at once. The queue holds the job until it has
  // run. A job must not throw.
  void async(Job job);

  // A process-wide serial queue for background work, created on first use.
  static WorkQueue& shared();

 private:
  void run();

  const std::string label_;
  std::mutex mutex_;  // guards jobs_, stopping_ and worker_
  std::condition_variable wake_;
  std::deque<Job> jobs_;
  bool stopping_ = false;
  std::thread worker_;
};

// --- Keep-alive transactions -----------------------------------------------

// Opens one transaction: the process is busy and must not be ended for
// idleness while any transaction is open.
void ProcessKeepAliveTransactionOpen();
// Closes one transaction opened before.
void ProcessKeepAliveTransactionClose();
// Number of transactions open right now.
int64_t ProcessKeepAliveTransactionCount();

// --- CPU-usage monitor -----------------------------------------------------

// Switches the monitor off for the current process.
void CPUUsageMonitorDisableForCurrentProcess();
// Restores the monitor's default limits for the current process.
void CPUUsageMonitorRestoreDefaultsForCurrentProcess();
// Whether the monitor watches the current process (true from program load).
bool CPUUsageMonitorIsEnabledForCurrentProcess();
// How often each of the two calls above has been made in this process.
uint64_t CPUUsageMonitorDisableCount();
uint64_t CPUUsageMonitorRestoreCount();

// --- Thread names ----------------------------------------------------------

// Names the calling thread (also visible to the kernel, truncated to its 15
// bytes). A thread that was never named through this call has no name, even
// though the kernel shows one for every thread.
void setCurrentThreadName(const std::string& name);
// The calling thread's name, or none when it was never named.
std::optional<std::string> currentThreadName();

// --- Crash annotation -------------------------------------------------------

// The record that a crash report includes. 64 bytes: the version (5 from
// program load), the address of a message text, every other field zero.
struct CrashAnnotation {
  uint64_t version;
  uint64_t message;
  uint64_t reserved[6];
};
static_assert(sizeof(CrashAnnotation) == 64, "the crash annotation is 64 bytes");

inline constexpr uint64_t kCrashAnnotationVersion = 5;

// The process's crash annotation and the mutex that guards it. Both exist
// from program load (constant-initialised) and are never destroyed.
extern CrashAnnotation gCrashAnnotation;
extern std::mutex gCrashAnnotationMutex;

// Writes `text` to the standard error stream, whole, without buffering.
void writeToStandardError(const std::string& text);

// Ends the process abnormally (SIGABRT). Does not return.
[[noreturn]] void abortProcess();

}  // namespace platform
