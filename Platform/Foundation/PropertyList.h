// Property lists: reading (XML and binary) and writing (XML, or binary on
// request) of Values through libplist.
//
// Reading validates what libplist lets pass: an empty file, a truncated or
// malformed document, trailing garbage, a missing "</plist>", a dictionary
// key without a value and an integer element whose text is not a number are
// errors, never crashes. So are binary documents that would bring libplist
// down: strings holding a NUL character, nesting deeper than 512 levels and
// shared objects that expand to millions of values. A UTF-8 byte-order mark
// is accepted. Errors are in kFileErrorDomain (code 260 for a missing file,
// 256 for any other read failure, with the underlying POSIX error where there
// is one, and the path under kFilePathErrorKey) and say what was wrong.
// Integers up to INT64_MAX read as signed, larger ones as unsigned; a keyed
// archive's UID reads as the dictionary {"CF$UID" = n}.
//
// Writing: with `atomically`, the data goes to a temporary file in the same
// directory, is flushed to disk and renamed over the target (which keeps its
// permissions; a new file gets 0644), and the directory is flushed, so the
// target is either the old file or the new one, whole; on failure the
// temporary file is removed. Failures are kFileErrorDomain 512 with the POSIX
// error of the failed call underneath. Unsigned integers above INT64_MAX are
// written so that they read back unsigned. Dates must lie within 2^31 seconds
// of 2001-01-01; the XML form keeps whole seconds only, the binary form
// microseconds. Text holding a NUL character cannot be written, and the
// binary form needs well-formed UTF-8 (the XML form keeps any bytes).
//
// Thread safety: all functions may be called from any thread.
#pragma once

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "Platform/Foundation/Error.h"
#include "Platform/Foundation/FileErrors.h"
#include "Platform/Foundation/URL.h"
#include "Platform/Foundation/Value.h"

namespace platform::plist {

enum class Format { XML, Binary };

// Whether an atomic write is flushed. Flushed: the data before the file gets
// its name, then the directory, so the write survives a power cut by itself.
// DataFlushed: the data only; the name then persists in order with the other
// changes of its file system (whatever changes there after it cannot reach
// the disk before it), but nothing on another file system is ordered after
// it. Scratch writes still replace the target whole or not at all for every
// reader, but a power cut may lose them: for files that are read back and
// removed before anything depends on them.
enum class Durability { Flushed, DataFlushed, Scratch };

// Files are read only when they are regular files no larger than a limit,
// checked against the open file's status before anything is allocated; the
// open never blocks (a FIFO or a device is refused, not waited on). The
// limits are far above what a real file of each kind holds.
inline constexpr size_t kPropertyListFileSizeLimit = size_t{32} << 20;
inline constexpr size_t kIconFileSizeLimit = size_t{8} << 20;

// Whether a symbolic link in the last component is followed or refused.
enum class FinalLink { Follow, Refuse };

struct ReadOptions {
  size_t sizeLimit = kPropertyListFileSizeLimit;
  FinalLink finalLink = FinalLink::Follow;
};

// Parses a property list from memory (either format).
std::optional<Value> parse(const void* bytes, size_t length, Error* error = nullptr);
// Reads and parses a whole file.
std::optional<Value> readFile(const URL& url, Error* error = nullptr);
std::optional<Value> readFile(const URL& url, const ReadOptions& options, Error* error = nullptr);
// Reads a file whose root must be a dictionary; another root is an error
// (kFileErrorDomain, 256, "... root is a <type>, not a dictionary").
std::optional<Dictionary> readDictionary(const URL& url, Error* error = nullptr);
std::optional<Dictionary> readDictionary(const URL& url, const ReadOptions& options, Error* error = nullptr);

// Serialises a Value. Null Values, URLs and Errors cannot be serialised (an
// error); a URL nested inside is written as its path string.
std::optional<Data> serialize(const Value& value, Format format, Error* error = nullptr);
[[nodiscard]] bool writeFile(const Value& value, const URL& url, Format format = Format::XML, bool atomically = true,
                             Error* error = nullptr, Durability durability = Durability::Flushed);

// A dictionary whose entries are written in the order given (a Dictionary is
// ordered by key). Later duplicates of a key replace earlier ones in place.
using OrderedEntries = std::vector<std::pair<std::string, Value>>;
[[nodiscard]] bool writeOrderedDictionary(const OrderedEntries& entries, const URL& url, Format format = Format::XML,
                            bool atomically = true, Error* error = nullptr,
                            Durability durability = Durability::Flushed);

// Reads a whole file's bytes (no caching), with the property-list limit
// unless told otherwise. Missing file: kFileErrorDomain 260 with the POSIX
// error underneath; other failures (a refused link: ELOOP underneath; not a
// regular file; larger than the limit, also when it grows while being read):
// kFileErrorDomain 256.
std::optional<Data> readFileBytes(const URL& url, Error* error = nullptr);
std::optional<Data> readFileBytes(const URL& url, const ReadOptions& options, Error* error = nullptr);
// Writes bytes, atomically when asked (temporary file, fsync, rename).
[[nodiscard]] bool writeFileBytes(const Data& data, const URL& url, bool atomically, Error* error = nullptr,
                    Durability durability = Durability::Flushed);

}  // namespace platform::plist
