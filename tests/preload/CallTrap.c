// A library preloaded into the programs under test that sees every libc call
// that changes a file system. Driven by the environment:
//
//   QS_TRAP_SCOPE=DIR     only calls on paths under DIR count (required)
//   QS_TRAP_KILL_AT=N     the process kills itself (SIGKILL) just before the
//                         Nth counted call, so calls 1..N-1 happened
//   QS_TRAP_COUNT=FILE    the number of counted calls is written to FILE at
//                         exit
//   QS_TRAP_RECORD=FILE   each counted call that succeeded is appended to
//                         FILE, one line per call (format below), with the
//                         device it hit, the paths it named and the data it
//                         wrote, so that a test can rebuild the file systems
//                         as they stood after any prefix of the calls
//   QS_TRAP_EIO=TEXT      reading a file opened under a name containing TEXT
//                         fails with EIO
//
// Record lines: nine tab-separated fields
//   op dev ino path1 path2 n1 n2 n3 data
// op is a word (open, write, trunc, fsync, syncfs, mkdir, rmdir, unlink,
// rename, link, symlink, setxattr, removexattr, chmod, chown, utimens, mknod);
// dev and ino are decimal; paths and data are hex ("-" when empty); n1..n3
// are decimal. Paths are absolute, resolved at the time of the call; a
// descriptor's path is the kernel's name for it ("... (deleted)" for an
// unnamed file).
//
// copy_file_range and sendfile are recorded as the writes of the data they
// copied, read again from the source; clones (FICLONE) are refused.
#define _GNU_SOURCE
#pragma GCC diagnostic ignored "-Wformat-truncation"
#include <dlfcn.h>
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <pthread.h>
#include <signal.h>
#include <stdarg.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/sendfile.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/types.h>
#include <sys/uio.h>
#include <unistd.h>

enum { kMaxTrackedFDs = 4096 };

static pthread_mutex_t gLock = PTHREAD_MUTEX_INITIALIZER;
static const char* gScope;
static size_t gScopeLength;
static long gKillAt;
static long gCount;
static int gRecordFD = -1;
static const char* gCountPath;
static const char* gEIOText;
static unsigned char gEIOFDs[kMaxTrackedFDs];

#define REAL(name) ((__typeof__(&name))real(#name))
static void* real(const char* name) {
  void* f = dlsym(RTLD_NEXT, name);
  if (!f) abort();
  return f;
}

__attribute__((constructor)) static void start(void) {
  gScope = getenv("QS_TRAP_SCOPE");
  if (gScope) gScopeLength = strlen(gScope);
  const char* kill = getenv("QS_TRAP_KILL_AT");
  gKillAt = kill ? atol(kill) : 0;
  gCountPath = getenv("QS_TRAP_COUNT");
  gEIOText = getenv("QS_TRAP_EIO");
  const char* record = getenv("QS_TRAP_RECORD");
  if (record) gRecordFD = (int)syscall(SYS_openat, AT_FDCWD, record, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
}

__attribute__((destructor)) static void finish(void) {
  if (!gCountPath) return;
  char text[32];
  int length = snprintf(text, sizeof text, "%ld\n", gCount);
  int fd = (int)syscall(SYS_openat, AT_FDCWD, gCountPath, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
  if (fd < 0) return;
  (void)syscall(SYS_write, fd, text, (size_t)length);
  (void)syscall(SYS_close, fd);
}

// ---- Paths ------------------------------------------------------------------

static void fdPath(int fd, char* out) {
  char link[64];
  snprintf(link, sizeof link, "/proc/self/fd/%d", fd);
  ssize_t n = readlink(link, out, PATH_MAX - 1);
  out[n < 0 ? 0 : n] = 0;
}

static void atPath(int dirfd, const char* name, char* out) {
  if (!name) {
    out[0] = 0;
    return;
  }
  if (name[0] == '/' || (dirfd == AT_FDCWD && !getcwd(out, PATH_MAX))) {
    snprintf(out, PATH_MAX, "%s", name);
    return;
  }
  char base[PATH_MAX];
  if (dirfd == AT_FDCWD) {
    snprintf(base, sizeof base, "%s", out);
  } else {
    fdPath(dirfd, base);
  }
  if (name[0] == 0) {
    snprintf(out, PATH_MAX, "%s", base);
  } else {
    snprintf(out, PATH_MAX, "%s/%s", base, name);
  }
}

static int inScope(const char* path) {
  return gScope && strncmp(path, gScope, gScopeLength) == 0 &&
         (path[gScopeLength] == 0 || path[gScopeLength] == '/');
}

// The device of the file system a name lives on: its parent directory's.
static dev_t parentDevice(const char* path) {
  char parent[PATH_MAX];
  snprintf(parent, sizeof parent, "%s", path);
  char* slash = strrchr(parent, '/');
  if (slash == parent) slash[1] = 0;
  else if (slash) *slash = 0;
  struct stat st;
  return stat(parent, &st) == 0 ? st.st_dev : 0;
}

// ---- Counting and recording -----------------------------------------------------

// Counts a call on `path`; kills the process when it is the one asked for.
// True when the call counts (is in scope).
static int count(const char* path) {
  if (!inScope(path)) return 0;
  pthread_mutex_lock(&gLock);
  long n = ++gCount;
  pthread_mutex_unlock(&gLock);
  if (gKillAt > 0 && n == gKillAt) kill(getpid(), SIGKILL);
  return 1;
}

static void appendHex(char** at, const void* bytes, size_t length) {
  static const char digits[] = "0123456789abcdef";
  const unsigned char* b = bytes;
  if (length == 0) *(*at)++ = '-';
  for (size_t i = 0; i < length; ++i) {
    *(*at)++ = digits[b[i] >> 4];
    *(*at)++ = digits[b[i] & 15];
  }
}

static void record(const char* op, dev_t dev, ino_t ino, const char* path1, const char* path2, long long n1,
                   long long n2, long long n3, const void* data, size_t dataLength) {
  if (gRecordFD < 0) return;
  size_t p1 = path1 ? strlen(path1) : 0, p2 = path2 ? strlen(path2) : 0;
  size_t capacity = 256 + 2 * (p1 + p2 + dataLength);
  char* line = malloc(capacity);
  if (!line) abort();
  char* at = line + snprintf(line, 128, "%s\t%llu\t%llu\t", op, (unsigned long long)dev, (unsigned long long)ino);
  appendHex(&at, path1, p1);
  *at++ = '\t';
  appendHex(&at, path2, p2);
  at += snprintf(at, 100, "\t%lld\t%lld\t%lld\t", n1, n2, n3);
  appendHex(&at, data, dataLength);
  *at++ = '\n';
  pthread_mutex_lock(&gLock);
  (void)syscall(SYS_write, gRecordFD, line, (size_t)(at - line));
  pthread_mutex_unlock(&gLock);
  free(line);
}

static void recordOnFD(const char* op, int fd, const char* path2, long long n1, long long n2, long long n3,
                       const void* data, size_t length) {
  char path[PATH_MAX];
  fdPath(fd, path);
  struct stat st;
  if (fstat(fd, &st) != 0) return;
  record(op, st.st_dev, st.st_ino, path, path2, n1, n2, n3, data, length);
}

static void recordOnPath(const char* op, const char* path, const char* path2, long long n1, long long n2,
                         long long n3, const void* data, size_t length) {
  record(op, parentDevice(path), 0, path, path2, n1, n2, n3, data, length);
}

// A call on a descriptor: counted when the descriptor's file is in scope.
static int countFD(int fd, char* path) {
  fdPath(fd, path);
  return count(path);
}

// ---- Opening ---------------------------------------------------------------------

static int changes(int flags) {
  return (flags & (O_CREAT | O_TRUNC)) || (flags & O_TMPFILE) == O_TMPFILE;
}

static int afterOpen(int fd, int counted, int flags, mode_t mode, const char* name) {
  if (fd < 0) return fd;
  if (gEIOText && name && strstr(name, gEIOText) && fd < kMaxTrackedFDs) gEIOFDs[fd] = 1;
  else if (fd < kMaxTrackedFDs) gEIOFDs[fd] = 0;
  if (counted && changes(flags)) {
    char path[PATH_MAX];
    fdPath(fd, path);
    struct stat st;
    if (fstat(fd, &st) == 0) record("open", st.st_dev, st.st_ino, path, NULL, flags, mode, 0, NULL, 0);
  }
  return fd;
}

static int openAt(int dirfd, const char* name, int flags, mode_t mode) {
  char path[PATH_MAX];
  atPath(dirfd, name, path);
  int counted = changes(flags) && count(path);
  int fd = (int)syscall(SYS_openat, dirfd, name, flags, mode);
  return afterOpen(fd, counted, flags, mode, name);
}

#define MODE_ARG(flags)                                               \
  mode_t mode = 0;                                                    \
  if ((flags & O_CREAT) || (flags & O_TMPFILE) == O_TMPFILE) {        \
    va_list args;                                                     \
    va_start(args, flags);                                            \
    mode = va_arg(args, mode_t);                                      \
    va_end(args);                                                     \
  }

int open(const char* name, int flags, ...) {
  MODE_ARG(flags);
  return openAt(AT_FDCWD, name, flags, mode);
}
int open64(const char* name, int flags, ...) {
  MODE_ARG(flags);
  return openAt(AT_FDCWD, name, flags, mode);
}
int openat(int dirfd, const char* name, int flags, ...) {
  MODE_ARG(flags);
  return openAt(dirfd, name, flags, mode);
}
int openat64(int dirfd, const char* name, int flags, ...) {
  MODE_ARG(flags);
  return openAt(dirfd, name, flags, mode);
}
int creat(const char* name, mode_t mode) { return openAt(AT_FDCWD, name, O_CREAT | O_WRONLY | O_TRUNC, mode); }
int creat64(const char* name, mode_t mode) { return openAt(AT_FDCWD, name, O_CREAT | O_WRONLY | O_TRUNC, mode); }

// ---- Reading (faults only) -------------------------------------------------------

static int failsReading(int fd) { return gEIOText && fd >= 0 && fd < kMaxTrackedFDs && gEIOFDs[fd]; }

ssize_t read(int fd, void* buffer, size_t length) {
  if (failsReading(fd)) {
    errno = EIO;
    return -1;
  }
  return REAL(read)(fd, buffer, length);
}

// ---- Data -----------------------------------------------------------------------

static ssize_t writeAt(int fd, const void* buffer, size_t length, off_t offset, int positioned) {
  char path[PATH_MAX];
  if (!countFD(fd, path)) {
    return positioned ? REAL(pwrite)(fd, buffer, length, offset) : REAL(write)(fd, buffer, length);
  }
  if (!positioned) {
    offset = lseek(fd, 0, SEEK_CUR);
    if (fcntl(fd, F_GETFL) & O_APPEND) {
      struct stat st;
      offset = fstat(fd, &st) == 0 ? st.st_size : 0;
    }
  }
  ssize_t n = positioned ? REAL(pwrite)(fd, buffer, length, offset) : REAL(write)(fd, buffer, length);
  if (n > 0) recordOnFD("write", fd, NULL, offset, 0, 0, buffer, (size_t)n);
  return n;
}

ssize_t write(int fd, const void* buffer, size_t length) { return writeAt(fd, buffer, length, 0, 0); }
ssize_t pwrite(int fd, const void* buffer, size_t length, off_t offset) {
  return writeAt(fd, buffer, length, offset, 1);
}
ssize_t pwrite64(int fd, const void* buffer, size_t length, off_t offset) {
  return writeAt(fd, buffer, length, offset, 1);
}

// A copy made inside the kernel is recorded as the write of the bytes it
// copied, read again from the source.
static void recordCopiedData(int in, off_t from, int out, off_t at, size_t length) {
  if (gRecordFD < 0) return;
  char* copied = malloc(length);
  if (!copied || pread(in, copied, length, from) != (ssize_t)length) abort();
  recordOnFD("write", out, NULL, at, 0, 0, copied, length);
  free(copied);
}

ssize_t copy_file_range(int in, off_t* inOffset, int out, off_t* outOffset, size_t length, unsigned flags) {
  char path[PATH_MAX];
  if (failsReading(in)) {
    errno = EIO;
    return -1;
  }
  if (!countFD(out, path)) return REAL(copy_file_range)(in, inOffset, out, outOffset, length, flags);
  off_t at = outOffset ? *outOffset : lseek(out, 0, SEEK_CUR);
  off_t from = inOffset ? *inOffset : lseek(in, 0, SEEK_CUR);
  ssize_t n = REAL(copy_file_range)(in, inOffset, out, outOffset, length, flags);
  if (n > 0) recordCopiedData(in, from, out, at, (size_t)n);
  return n;
}

// sendfile writes at the destination's file offset.
static ssize_t sendFile(int out, int in, off_t* inOffset, size_t length) {
  char path[PATH_MAX];
  if (failsReading(in)) {
    errno = EIO;
    return -1;
  }
  if (!countFD(out, path)) return REAL(sendfile)(out, in, inOffset, length);
  off_t at = lseek(out, 0, SEEK_CUR);
  off_t from = inOffset ? *inOffset : lseek(in, 0, SEEK_CUR);
  ssize_t n = REAL(sendfile)(out, in, inOffset, length);
  if (n > 0) recordCopiedData(in, from, out, at, (size_t)n);
  return n;
}
ssize_t sendfile(int out, int in, off_t* inOffset, size_t length) { return sendFile(out, in, inOffset, length); }
ssize_t sendfile64(int out, int in, off_t* inOffset, size_t length) { return sendFile(out, in, inOffset, length); }

// Of ioctl only a clone changes a file: it is refused here, so that copies
// take the ways whose data the record can see.
int ioctl(int fd, unsigned long request, ...) {
  va_list args;
  va_start(args, request);
  void* argument = va_arg(args, void*);
  va_end(args);
  if (request == FICLONE || request == FICLONERANGE) {
    char path[PATH_MAX];
    if (countFD(fd, path)) {
      errno = EOPNOTSUPP;
      return -1;
    }
  }
  return REAL(ioctl)(fd, request, argument);
}

static int truncateFD(int fd, off_t length) {
  char path[PATH_MAX];
  int counted = countFD(fd, path);
  int result = REAL(ftruncate)(fd, length);
  if (counted && result == 0) recordOnFD("trunc", fd, NULL, length, 0, 0, NULL, 0);
  return result;
}
int ftruncate(int fd, off_t length) { return truncateFD(fd, length); }
int ftruncate64(int fd, off_t length) { return truncateFD(fd, length); }

int truncate(const char* name, off_t length) {
  int fd = openAt(AT_FDCWD, name, O_WRONLY | O_CLOEXEC, 0);
  if (fd < 0) return -1;
  int result = truncateFD(fd, length);
  close(fd);
  return result;
}

int fallocate(int fd, int mode, off_t offset, off_t length) {
  char path[PATH_MAX];
  int counted = countFD(fd, path);
  int result = REAL(fallocate)(fd, mode, offset, length);
  if (counted && result == 0 && mode == 0) {
    struct stat st;
    if (fstat(fd, &st) == 0) recordOnFD("trunc", fd, NULL, st.st_size, 0, 0, NULL, 0);
  }
  return result;
}

// ---- Flushes ----------------------------------------------------------------------

static int flush(int fd, int (*call)(int), const char* op) {
  char path[PATH_MAX];
  int counted = countFD(fd, path);
  int result = call(fd);
  if (counted && result == 0) recordOnFD(op, fd, NULL, 0, 0, 0, NULL, 0);
  return result;
}
int fsync(int fd) { return flush(fd, REAL(fsync), "fsync"); }
int fdatasync(int fd) { return flush(fd, REAL(fdatasync), "fsync"); }
int syncfs(int fd) { return flush(fd, REAL(syncfs), "syncfs"); }

// ---- Names -------------------------------------------------------------------------

int mkdirat(int dirfd, const char* name, mode_t mode) {
  char path[PATH_MAX];
  atPath(dirfd, name, path);
  int counted = count(path);
  int result = REAL(mkdirat)(dirfd, name, mode);
  if (counted && result == 0) recordOnPath("mkdir", path, NULL, mode, 0, 0, NULL, 0);
  return result;
}
int mkdir(const char* name, mode_t mode) { return mkdirat(AT_FDCWD, name, mode); }

char* mkdtemp(char* pattern) {
  char* result = REAL(mkdtemp)(pattern);
  if (result) {
    char path[PATH_MAX];
    atPath(AT_FDCWD, result, path);
    if (count(path)) recordOnPath("mkdir", path, NULL, 0700, 0, 0, NULL, 0);
  }
  return result;
}

int unlinkat(int dirfd, const char* name, int flags) {
  char path[PATH_MAX];
  atPath(dirfd, name, path);
  int counted = count(path);
  int result = REAL(unlinkat)(dirfd, name, flags);
  if (counted && result == 0) {
    recordOnPath(flags & AT_REMOVEDIR ? "rmdir" : "unlink", path, NULL, 0, 0, 0, NULL, 0);
  }
  return result;
}
int unlink(const char* name) { return unlinkat(AT_FDCWD, name, 0); }
int rmdir(const char* name) { return unlinkat(AT_FDCWD, name, AT_REMOVEDIR); }
int remove(const char* name) {
  struct stat st;
  return unlinkat(AT_FDCWD, name, lstat(name, &st) == 0 && S_ISDIR(st.st_mode) ? AT_REMOVEDIR : 0);
}

int renameat2(int fromfd, const char* from, int tofd, const char* to, unsigned flags) {
  char fromPath[PATH_MAX], toPath[PATH_MAX];
  atPath(fromfd, from, fromPath);
  atPath(tofd, to, toPath);
  int counted = count(inScope(toPath) ? toPath : fromPath);
  int result = REAL(renameat2)(fromfd, from, tofd, to, flags);
  if (counted && result == 0) recordOnPath("rename", toPath, fromPath, flags, 0, 0, NULL, 0);
  return result;
}
int renameat(int fromfd, const char* from, int tofd, const char* to) { return renameat2(fromfd, from, tofd, to, 0); }
int rename(const char* from, const char* to) { return renameat2(AT_FDCWD, from, AT_FDCWD, to, 0); }

int linkat(int fromfd, const char* from, int tofd, const char* to, int flags) {
  char fromPath[PATH_MAX], toPath[PATH_MAX];
  struct stat st = {0};
  // A descriptor's entry in /proc (or the descriptor itself) names an inode,
  // often one without a name: the record keeps the inode.
  if (strncmp(from, "/proc/self/fd/", 14) == 0 || (flags & AT_EMPTY_PATH)) {
    int fd = (flags & AT_EMPTY_PATH) && from[0] == 0 ? fromfd : atoi(from + 14);
    fdPath(fd, fromPath);
    (void)fstat(fd, &st);
  } else {
    atPath(fromfd, from, fromPath);
    (void)fstatat(fromfd, from, &st, AT_SYMLINK_NOFOLLOW);
  }
  atPath(tofd, to, toPath);
  int counted = count(toPath);
  int result = REAL(linkat)(fromfd, from, tofd, to, flags);
  if (counted && result == 0) record("link", parentDevice(toPath), st.st_ino, toPath, fromPath, 0, 0, 0, NULL, 0);
  return result;
}
int link(const char* from, const char* to) { return linkat(AT_FDCWD, from, AT_FDCWD, to, 0); }

int symlinkat(const char* target, int dirfd, const char* name) {
  char path[PATH_MAX];
  atPath(dirfd, name, path);
  int counted = count(path);
  int result = REAL(symlinkat)(target, dirfd, name);
  if (counted && result == 0) recordOnPath("symlink", path, target, 0, 0, 0, NULL, 0);
  return result;
}
int symlink(const char* target, const char* name) { return symlinkat(target, AT_FDCWD, name); }

int mknodat(int dirfd, const char* name, mode_t mode, dev_t dev) {
  char path[PATH_MAX];
  atPath(dirfd, name, path);
  int counted = count(path);
  int result = REAL(mknodat)(dirfd, name, mode, dev);
  if (counted && result == 0) recordOnPath("mknod", path, NULL, mode, (long long)dev, 0, NULL, 0);
  return result;
}
int mknod(const char* name, mode_t mode, dev_t dev) { return mknodat(AT_FDCWD, name, mode, dev); }

// ---- Attributes --------------------------------------------------------------------

static int xattrSet(const char* path, const char* name, const void* value, size_t size, int flags, int nofollow,
                    int result) {
  if (result == 0) recordOnPath("setxattr", path, name, flags, nofollow, 0, value, size);
  return result;
}
int setxattr(const char* p, const char* name, const void* value, size_t size, int flags) {
  char path[PATH_MAX];
  atPath(AT_FDCWD, p, path);
  int counted = count(path);
  int result = REAL(setxattr)(p, name, value, size, flags);
  return counted ? xattrSet(path, name, value, size, flags, 0, result) : result;
}
int lsetxattr(const char* p, const char* name, const void* value, size_t size, int flags) {
  char path[PATH_MAX];
  atPath(AT_FDCWD, p, path);
  int counted = count(path);
  int result = REAL(lsetxattr)(p, name, value, size, flags);
  return counted ? xattrSet(path, name, value, size, flags, 1, result) : result;
}
int fsetxattr(int fd, const char* name, const void* value, size_t size, int flags) {
  char path[PATH_MAX];
  int counted = countFD(fd, path);
  int result = REAL(fsetxattr)(fd, name, value, size, flags);
  if (counted && result == 0) recordOnFD("setxattr", fd, name, flags, 0, 0, value, size);
  return result;
}
static int xattrRemove(const char* path, const char* name, int nofollow, int result) {
  if (result == 0) recordOnPath("removexattr", path, name, nofollow, 0, 0, NULL, 0);
  return result;
}
int removexattr(const char* p, const char* name) {
  char path[PATH_MAX];
  atPath(AT_FDCWD, p, path);
  int counted = count(path);
  int result = REAL(removexattr)(p, name);
  return counted ? xattrRemove(path, name, 0, result) : result;
}
int lremovexattr(const char* p, const char* name) {
  char path[PATH_MAX];
  atPath(AT_FDCWD, p, path);
  int counted = count(path);
  int result = REAL(lremovexattr)(p, name);
  return counted ? xattrRemove(path, name, 1, result) : result;
}
int fremovexattr(int fd, const char* name) {
  char path[PATH_MAX];
  int counted = countFD(fd, path);
  int result = REAL(fremovexattr)(fd, name);
  if (counted && result == 0) recordOnFD("removexattr", fd, name, 0, 0, 0, NULL, 0);
  return result;
}

int fchmodat(int dirfd, const char* name, mode_t mode, int flags) {
  char path[PATH_MAX];
  atPath(dirfd, name, path);
  int counted = count(path);
  int result = REAL(fchmodat)(dirfd, name, mode, flags);
  if (counted && result == 0) recordOnPath("chmod", path, NULL, mode, 0, 0, NULL, 0);
  return result;
}
int chmod(const char* name, mode_t mode) { return fchmodat(AT_FDCWD, name, mode, 0); }
int fchmod(int fd, mode_t mode) {
  char path[PATH_MAX];
  int counted = countFD(fd, path);
  int result = REAL(fchmod)(fd, mode);
  if (counted && result == 0) recordOnFD("chmod", fd, NULL, mode, 0, 0, NULL, 0);
  return result;
}

int fchownat(int dirfd, const char* name, uid_t uid, gid_t gid, int flags) {
  char path[PATH_MAX];
  atPath(dirfd, name, path);
  int counted = count(path);
  int result = REAL(fchownat)(dirfd, name, uid, gid, flags);
  if (counted && result == 0) {
    recordOnPath("chown", path, NULL, (int)uid, (int)gid, !!(flags & AT_SYMLINK_NOFOLLOW), NULL, 0);
  }
  return result;
}
int chown(const char* name, uid_t uid, gid_t gid) { return fchownat(AT_FDCWD, name, uid, gid, 0); }
int lchown(const char* name, uid_t uid, gid_t gid) {
  return fchownat(AT_FDCWD, name, uid, gid, AT_SYMLINK_NOFOLLOW);
}
int fchown(int fd, uid_t uid, gid_t gid) {
  char path[PATH_MAX];
  int counted = countFD(fd, path);
  int result = REAL(fchown)(fd, uid, gid);
  if (counted && result == 0) recordOnFD("chown", fd, NULL, (int)uid, (int)gid, 0, NULL, 0);
  return result;
}

int utimensat(int dirfd, const char* name, const struct timespec times[2], int flags) {
  char path[PATH_MAX];
  const char* volatile given = name;  // glibc declares it non-null; the kernel takes null
  if (given) {
    atPath(dirfd, name, path);
  } else {
    fdPath(dirfd, path);
  }
  int counted = count(path);
  int result = REAL(utimensat)(dirfd, name, times, flags);
  if (counted && result == 0 && times) {
    recordOnPath("utimens", path, NULL, !!(flags & AT_SYMLINK_NOFOLLOW), 0, 0, times, 2 * sizeof times[0]);
  }
  return result;
}
int futimens(int fd, const struct timespec times[2]) {
  char path[PATH_MAX];
  int counted = countFD(fd, path);
  int result = REAL(futimens)(fd, times);
  if (counted && result == 0 && times) recordOnFD("utimens", fd, NULL, 0, 0, 0, times, 2 * sizeof times[0]);
  return result;
}
