// ReadOnlyFile: a file opened for reading, closed when the object goes away.
//
// The calls are the system calls themselves: on failure they return a
// negative value (or false) and leave the operating system's error number in
// errno, untouched, for the caller to report.
//
// Thread safety: one object belongs to one thread at a time.
#pragma once

#include <cstddef>
#include <cstdint>

namespace platform {

class ReadOnlyFile {
 public:
  // Opens `path` read-only without blocking (a FIFO opens at once and reads
  // as empty); check isOpen() (errno holds the reason when not).
  explicit ReadOnlyFile(const char* path);
  ~ReadOnlyFile();
  ReadOnlyFile(const ReadOnlyFile&) = delete;
  ReadOnlyFile& operator=(const ReadOnlyFile&) = delete;

  bool isOpen() const { return fd_ >= 0; }

  // The open file's size in bytes (fstat); false with errno on failure.
  [[nodiscard]] bool size(int64_t* bytes) const;

  // read(2): the number of bytes read, 0 at the end of the file, -1 with
  // errno on failure. Interrupted reads are retried.
  int64_t read(void* buffer, size_t length);

 private:
  int fd_ = -1;
};

}  // namespace platform
