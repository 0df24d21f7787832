// A library to preload into the service: makes a chosen system call fail, kills the process at a
// chosen call or log line, steps the clock, and keeps what a power cut would leave.
//
//   FAULT_PATH     text in the path of the files that faults are about
//   FAULT_AT       number of the first call about such a file that the fault strikes; 1 is the first
//   FAULT_TIMES    how many calls it strikes from there on; default all
//   FAULT_ERRNO    what they fail with; 0 kills the process instead of letting the call happen
//   FAULT_SYNC     1: only flushes count as calls
//   FAULT_COUNT    file that the number of calls is written to, call by call
//   FAULT_LINE     text of a log line on standard error, right after which the process is killed
//   FAULT_DURABLE  directory that a file is copied to whenever it has been flushed
//   FAULT_CLOCK    file with seconds by which the wall clock is wrong; may appear at any time
//   FAULT_HURRY    1: a wait of less than two seconds for which nothing comes is over after a
//                  millisecond; what it should have taken has passed by the wall clock and by the
//                  clock since boot, and by the steady clock of the thread that waited
//
// Calls are counted that change a file: open for creating, write, truncate, flush, map, rename,
// remove.

#define _GNU_SOURCE
#include <dlfcn.h>
#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <stdarg.h>
#include <stdatomic.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

#define REAL(name) ((__typeof__(&name))dlsym(RTLD_NEXT, #name))

static atomic_long calls;

static long number(const char* variable, long otherwise) {
  const char* text = getenv(variable);
  return text != NULL ? atol(text) : otherwise;
}

// By system call, so that no wrapper of a sanitizer or of this file is in the way.
static long rawOpen(const char* path, int flags, int mode) {
  return syscall(SYS_openat, AT_FDCWD, path, flags, mode);
}

static void die(void) {
  syscall(SYS_kill, getpid(), SIGKILL);
}

static void writeCount(long count) {
  const char* path = getenv("FAULT_COUNT");
  if (path == NULL) return;
  char text[32];
  const int length = snprintf(text, sizeof text, "%ld", count);
  const int file = (int)rawOpen(path, O_WRONLY | O_CREAT | O_TRUNC, 0600);
  syscall(SYS_write, file, text, (size_t)length);
  syscall(SYS_close, file);
}

// Whether the call is to fail; errno is set then.
static int struck(const char* path, int isFlush) {
  const char* wanted = getenv("FAULT_PATH");
  if (wanted == NULL || path == NULL || strstr(path, wanted) == NULL) return 0;
  if (number("FAULT_SYNC", 0) != 0 && !isFlush) return 0;
  const long call = atomic_fetch_add(&calls, 1) + 1;
  writeCount(call);
  const long first = number("FAULT_AT", 0);
  const long times = number("FAULT_TIMES", 0);
  if (first == 0 || call < first || (times != 0 && call >= first + times)) return 0;
  const int error = (int)number("FAULT_ERRNO", EIO);
  if (error == 0) die();
  errno = error;
  return 1;
}

static const char* pathOf(int fd, char* buffer, size_t size) {
  char link[64];
  snprintf(link, sizeof link, "/proc/self/fd/%d", fd);
  const ssize_t length = readlink(link, buffer, size - 1);
  if (length < 0) return NULL;
  buffer[length] = '\0';
  return buffer;
}

static int struckFd(int fd, int isFlush) {
  char buffer[4096];
  if (getenv("FAULT_PATH") == NULL) return 0;
  return struck(pathOf(fd, buffer, sizeof buffer), isFlush);
}

// A copy under another name, renamed when complete: a kill in the middle leaves the one before.
static void keepDurable(int fd) {
  const char* directory = getenv("FAULT_DURABLE");
  char path[4096], fresh[5000], kept[5000], block[65536];
  struct stat facts;
  if (directory == NULL || fstat(fd, &facts) != 0 || !S_ISREG(facts.st_mode)) return;
  if (pathOf(fd, path, sizeof path) == NULL) return;
  const char* name = strrchr(path, '/') + 1;
  snprintf(kept, sizeof kept, "%s/%s", directory, name);
  snprintf(fresh, sizeof fresh, "%s/.fresh", directory);
  const int from = (int)rawOpen(path, O_RDONLY, 0);
  const int to = (int)rawOpen(fresh, O_WRONLY | O_CREAT | O_TRUNC, 0600);
  long length;
  while ((length = syscall(SYS_read, from, block, sizeof block)) > 0)
    syscall(SYS_write, to, block, (size_t)length);
  syscall(SYS_close, from);
  syscall(SYS_close, to);
  syscall(SYS_renameat, AT_FDCWD, fresh, AT_FDCWD, kept);
}

static int opened(const char* path, int flags) {
  return (flags & O_CREAT) != 0 && struck(path, 0) ? -1 : 0;
}

#define OPEN(name)                                            \
  int name(const char* path, int flags, ...) {                \
    va_list rest;                                             \
    va_start(rest, flags);                                    \
    const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(rest, mode_t) : 0; \
    va_end(rest);                                             \
    if (opened(path, flags) != 0) return -1;                  \
    return REAL(name)(path, flags, mode);                     \
  }
OPEN(open)
OPEN(open64)

static void afterLogLine(int fd, const void* data, size_t size) {
  const char* line = getenv("FAULT_LINE");
  if (fd == STDERR_FILENO && line != NULL && memmem(data, size, line, strlen(line)) != NULL) die();
}

ssize_t write(int fd, const void* data, size_t size) {
  if (fd != STDERR_FILENO && struckFd(fd, 0)) return -1;
  const ssize_t written = REAL(write)(fd, data, size);
  afterLogLine(fd, data, size);
  return written;
}

ssize_t pwrite64(int fd, const void* data, size_t size, off64_t offset) {
  if (struckFd(fd, 0)) return -1;
  return REAL(pwrite64)(fd, data, size, offset);
}

int ftruncate64(int fd, off64_t length) {
  if (struckFd(fd, 0)) return -1;
  return REAL(ftruncate64)(fd, length);
}

int fsync(int fd) {
  if (struckFd(fd, 1)) return -1;
  const int result = REAL(fsync)(fd);
  keepDurable(fd);
  return result;
}

int fdatasync(int fd) {
  if (struckFd(fd, 1)) return -1;
  const int result = REAL(fdatasync)(fd);
  keepDurable(fd);
  return result;
}

void* mmap64(void* address, size_t length, int protection, int flags, int fd, off64_t offset) {
  if (fd >= 0 && (flags & MAP_SHARED) != 0 && struckFd(fd, 0)) return MAP_FAILED;
  return REAL(mmap64)(address, length, protection, flags, fd, offset);
}

int rename(const char* from, const char* to) {
  if (struck(to, 0)) return -1;
  return REAL(rename)(from, to);
}

int unlink(const char* path) {
  if (struck(path, 0)) return -1;
  return REAL(unlink)(path);
}

int unlinkat(int directory, const char* path, int flags) {
  if (struck(path, 0)) return -1;
  return REAL(unlinkat)(directory, path, flags);
}

int mkdir(const char* path, mode_t mode) {
  if (struck(path, 0)) return -1;
  return REAL(mkdir)(path, mode);
}

static long clockIsWrongBy(void) {
  const char* path = getenv("FAULT_CLOCK");
  char text[32] = "";
  if (path == NULL) return 0;
  const long file = rawOpen(path, O_RDONLY, 0);
  if (file < 0) return 0;
  const long length = syscall(SYS_read, (int)file, text, sizeof text - 1);
  syscall(SYS_close, (int)file);
  return length > 0 ? atol(text) : 0;
}

enum { kSecond = 1000000000, kMillisecond = 1000000 };

// Nanoseconds that were not waited for: by any thread, by this one. What others time by the steady
// clock, such as polls of past runs, is not hurried on with it.
static atomic_long skipped;
static _Thread_local long skippedHere;

static long nanoseconds(const struct timespec* time) {
  return time->tv_sec * kSecond + time->tv_nsec;
}

static struct timespec timespecOf(long time) {
  return (struct timespec){time / kSecond, time % kSecond};
}

int clock_gettime(clockid_t clock, struct timespec* now) {
  const int result = (int)syscall(SYS_clock_gettime, clock, now);
  if (result != 0) return result;
  if (clock == CLOCK_REALTIME) now->tv_sec += clockIsWrongBy();
  if (clock == CLOCK_REALTIME || clock == CLOCK_BOOTTIME)
    *now = timespecOf(nanoseconds(now) + atomic_load(&skipped));
  if (clock == CLOCK_MONOTONIC) *now = timespecOf(nanoseconds(now) + skippedHere);
  return 0;
}

int pthread_cond_clockwait(pthread_cond_t* condition, pthread_mutex_t* mutex, clockid_t clock,
                           const struct timespec* until) {
  struct timespec now;
  syscall(SYS_clock_gettime, clock, &now);
  const long deadline = nanoseconds(until) - skippedHere;
  const long remaining = deadline - nanoseconds(&now);
  const int hurried = number("FAULT_HURRY", 0) != 0 && remaining > kMillisecond &&
                      remaining < 2L * kSecond;
  const struct timespec end = timespecOf(hurried ? nanoseconds(&now) + kMillisecond : deadline);
  const int result = REAL(pthread_cond_clockwait)(condition, mutex, clock, &end);
  if (hurried && result == ETIMEDOUT) {
    atomic_fetch_add(&skipped, remaining - kMillisecond);
    skippedHere += remaining - kMillisecond;
  }
  return result;
}
