// Utility functions of the runtime support: loading a bundle's Info.plist,
// the SHA-256 digest of a file, the counted switch-off of the CPU-usage
// monitor, transactional tasks on a work queue, the crash report for an
// uncaught exception, and four helpers that normalise values read from
// property lists.
//
// None of these functions produces an error record: failures are an absent
// result plus the system-log lines named with each function. Nothing throws.
//
// Classes. The type helpers take a class as a platform::Value::Type. An
// object is an instance of a class when its type is that type, except that
// the two integer types (signed and unsigned) are one class: signedness is
// how the value is stored, not what it is.
//
// Sets. Property lists have no set type, so a set is a std::set of values
// that convert to platform::Value (the system's sets are sets of strings:
// filter keys, bundle identifiers). The set overloads treat it as the
// collection it is, walking it in its own (sorted) order.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "Platform/BundleReader.h"
#include "Platform/Foundation/URL.h"
#include "Platform/Foundation/Value.h"
#include "Platform/Process.h"

// --- Info.plist ---------------------------------------------------------------

// The Info.plist of the bundle at `bundleURL` as a new dictionary the caller
// owns, or none on any failure (each failure writes one line). Without
// `filterKeys` (null) the whole info dictionary less the reader's
// "RkBundleInfoPlistURL" entry; with them, only the entries under those keys
// (an "RkBundleInfoPlistURL" entry of the file itself then stays).
// A missing Info.plist writes only a level-7 line.
// Thread safety: any thread; bundle opening and reading are serialised by a
// process-wide lock (the existence test runs outside it).
std::optional<platform::Dictionary> QSLoadInfoPlist(const platform::URL& bundleURL,
                                                    const std::set<std::string>* filterKeys = nullptr);
// The same through `reader` instead of the process's file-system reader.
std::optional<platform::Dictionary> QSLoadInfoPlist(const platform::URL& bundleURL,
                                                    const std::set<std::string>* filterKeys,
                                                    platform::BundleReader& reader);

// --- Digest -------------------------------------------------------------------

// The SHA-256 of the file at `location` as 64 lowercase hexadecimal
// characters, or none when the file cannot be read (the reader's line, then
// "Failed to read %@ : %s"). Reads at most 65,536 bytes at a time.
std::optional<std::string> QSCreateSHA256Digest(const platform::URL& location);
std::optional<std::string> QSCreateSHA256Digest(const std::string& path);

// Receives each chunk of a file in order; answer false to stop the read.
using QSReadFileConsumer = std::function<bool(const uint8_t* bytes, size_t length)>;

// Reads the file at `path` in chunks of at most 65,536 bytes through one
// buffer of min(size, 65,536) bytes, handing each chunk to `consumer`. The
// size is taken once, when the file is opened. True when the whole file was
// handed over (an empty file gives no chunk); false after a failure (logged
// under "_ReadFile") or a refusal of the consumer (not logged).
[[nodiscard]] bool _ReadFile(const char* path, const QSReadFileConsumer& consumer);

// --- Resource usage -----------------------------------------------------------

// Counted: the first assertion switches the CPU-usage monitor off for this
// process, the clear that brings the count back to 0 restores its defaults.
// The count is changed atomically; any thread. The count is not checked for
// going below 0.
void QSAssertHighResourceUsage();
void QSClearResourceAssertion();
// The current number of assertions.
int32_t QSHighResourceUsageAssertionCount();

// --- Transactional tasks --------------------------------------------------------

// Opens a keep-alive transaction, queues `task` on `queue` and returns at
// once. The queued job runs the task on the queue's thread and then closes
// the transaction. The queue holds the task until it has run.
void QSRunTransactionalTask(platform::WorkQueue& queue, std::function<void()> task);

// --- Crash report ------------------------------------------------------------------

// An uncaught exception: its name and reason, each possibly absent, and the
// symbols of its call stack.
struct QSException {
  std::optional<std::string> name;
  std::optional<std::string> reason;
  std::vector<std::string> callStackSymbols;
};

// The report text for `exception` raised on the calling thread.
std::string QSCrashReportText(const QSException& exception);

// Records the report in the crash annotation (a heap copy that is never
// freed), writes it to the standard error stream and aborts. The annotation's
// mutex is taken and never released, so a second crashing thread waits until
// the process ends and the first report is the one recorded.
[[noreturn]] void QSCrashOnException(const QSException& exception);

// --- Type helpers --------------------------------------------------------------------

// Whether `object` is an instance of `cls` (see Classes above).
bool QSObjectIsKindOfClass(const platform::Value& object, platform::Value::Type cls);

// None for a null (absent) object; a string as it is; anything else as its
// textual description ("%@").
std::optional<std::string> QSStringifyObject(const platform::Value& object);

// True when every element of `collection` is an instance of `cls`, checked in
// order up to the first one that is not. An array walks its elements, a
// dictionary its keys; a null (absent) or empty collection gives true, any
// other object false.
bool QSArrayContainsOnlyClass(const platform::Value& collection, platform::Value::Type cls);

template <class T>
bool QSArrayContainsOnlyClass(const std::set<T>& collection, platform::Value::Type cls) {
  for (const T& member : collection) {
    if (!QSObjectIsKindOfClass(platform::Value(member), cls)) return false;
  }
  return true;
}

// The boolean value of a number (booleans included; non-zero is true);
// `defaultValue` for anything else, strings and absent objects included.
bool QSBooleanValue(const platform::Value& object, bool defaultValue);

// None for an absent object; an array: itself when it holds only instances
// of `cls`, else none; an instance of `cls`: an array of just that object;
// anything else: none.
std::optional<platform::Array> QSArrayifyThing(const platform::Value& object, platform::Value::Type cls);

// A set: its members as an array, in the set's order, when all of them are
// instances of `cls`; else none.
template <class T>
std::optional<platform::Array> QSArrayifyThing(const std::set<T>& object, platform::Value::Type cls) {
  if (!QSArrayContainsOnlyClass(object, cls)) return std::nullopt;
  platform::Array members;
  members.reserve(object.size());
  for (const T& member : object) members.emplace_back(member);
  return members;
}
