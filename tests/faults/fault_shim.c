// A library to preload into the service. It makes a chosen system call fail, kills the process at a
// chosen call or log line, shifts the clock, and keeps the files that a power cut would leave.
//
//   FAULT_PATH     the faults strike files whose path contains this text
//   FAULT_CALL     only this call counts, for example "flock"; by default every call that changes a
//                  file: open for creating, write, truncate, flush, map, rename, remove.
//                  "open_existing" is an open that may not create
//   FAULT_AT       number of the first call that fails; 1 is the first on such a file
//   FAULT_TIMES    how many calls in a row fail; by default all that follow
//   FAULT_ERRNO    the error of a call that fails; 0 kills the process before the call
//   FAULT_COUNT    file that receives the number of calls so far
//   FAULT_LINE     kills the process after it wrote this text to standard error
//   FAULT_DURABLE  directory that receives a copy of each file whenever the file is flushed
//   FAULT_CLOCK    file with the seconds by which the wall clock is wrong; it may appear at any time
//   FAULT_STEADY   the same of the steady clock, of all threads. Waits last as long as they did
//   FAULT_SLOW     milliseconds that each flush takes
//   FAULT_HURRY    1: a wait of one and a half to three seconds ends after a millisecond. The wall
//                  clock, the clock since boot and the steady clock of that thread jump over the
//                  rest
//   FAULT_STRUCK   file that is made when the first fault strikes, so that a test can tell a
//                  service that withstood its fault from one that never met it

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
#include <sys/file.h>
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

// A direct system call: the functions of this file and of a sanitizer would count it as a call of
// the service.
static long rawOpen(const char* path, int flags, int mode) {
  return syscall(SYS_openat, AT_FDCWD, path, flags, mode);
}

static void noteStrike(void) {
  static atomic_flag noted = ATOMIC_FLAG_INIT;
  const char* path = getenv("FAULT_STRUCK");
  if (path == NULL || atomic_flag_test_and_set(&noted)) return;
  syscall(SYS_close, (int)rawOpen(path, O_WRONLY | O_CREAT, 0600));
}

static void die(void) {
  noteStrike();
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

// A lock or a mere look changes no file, so these count only where FAULT_CALL names them.
static int counts(const char* name) {
  const char* wanted = getenv("FAULT_CALL");
  if (wanted != NULL) return strcmp(name, wanted) == 0;
  return strcmp(name, "flock") != 0 && strcmp(name, "open_existing") != 0;
}

// Whether the call must fail; then errno is set.
static int struck(const char* name, const char* path) {
  const char* wanted = getenv("FAULT_PATH");
  if (wanted == NULL || path == NULL || strstr(path, wanted) == NULL || !counts(name)) return 0;
  const long call = atomic_fetch_add(&calls, 1) + 1;
  writeCount(call);
  const long first = number("FAULT_AT", 0);
  const long times = number("FAULT_TIMES", 0);
  if (first == 0 || call < first || (times != 0 && call >= first + times)) return 0;
  const int error = (int)number("FAULT_ERRNO", EIO);
  if (error == 0) die();
  noteStrike();
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

static int struckFd(const char* name, int fd) {
  char buffer[4096];
  if (getenv("FAULT_PATH") == NULL) return 0;
  return struck(name, pathOf(fd, buffer, sizeof buffer));
}

// Copies to another name and renames: a kill in the middle then leaves the previous copy whole.
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
  return struck((flags & O_CREAT) != 0 ? "open" : "open_existing", path) ? -1 : 0;
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
  if (fd != STDERR_FILENO && struckFd("write", fd)) return -1;
  const ssize_t written = REAL(write)(fd, data, size);
  afterLogLine(fd, data, size);
  return written;
}

ssize_t pwrite64(int fd, const void* data, size_t size, off64_t offset) {
  if (struckFd("pwrite64", fd)) return -1;
  return REAL(pwrite64)(fd, data, size, offset);
}

int ftruncate64(int fd, off64_t length) {
  if (struckFd("ftruncate64", fd)) return -1;
  return REAL(ftruncate64)(fd, length);
}

static void takeTime(void) {
  const long milliseconds = number("FAULT_SLOW", 0);
  if (milliseconds == 0) return;
  noteStrike();
  const struct timespec time = {milliseconds / 1000, milliseconds % 1000 * 1000000};
  syscall(SYS_nanosleep, &time, NULL);
}

int fsync(int fd) {
  takeTime();
  if (struckFd("fsync", fd)) return -1;
  const int result = REAL(fsync)(fd);
  keepDurable(fd);
  return result;
}

int fdatasync(int fd) {
  takeTime();
  if (struckFd("fdatasync", fd)) return -1;
  const int result = REAL(fdatasync)(fd);
  keepDurable(fd);
  return result;
}

void* mmap64(void* address, size_t length, int protection, int flags, int fd, off64_t offset) {
  if (fd >= 0 && (flags & MAP_SHARED) != 0 && struckFd("mmap64", fd)) return MAP_FAILED;
  return REAL(mmap64)(address, length, protection, flags, fd, offset);
}

int rename(const char* from, const char* to) {
  if (struck("rename", to)) return -1;
  return REAL(rename)(from, to);
}

int unlink(const char* path) {
  if (struck("unlink", path)) return -1;
  return REAL(unlink)(path);
}

int unlinkat(int directory, const char* path, int flags) {
  if (struck("unlinkat", path)) return -1;
  return REAL(unlinkat)(directory, path, flags);
}

int mkdir(const char* path, mode_t mode) {
  if (struck("mkdir", path)) return -1;
  return REAL(mkdir)(path, mode);
}

int flock(int fd, int operation) {
  if (struckFd("flock", fd)) return -1;
  return REAL(flock)(fd, operation);
}

static long clockIsWrongBy(const char* variable) {
  const char* path = getenv(variable);
  char text[32] = "";
  if (path == NULL) return 0;
  const long file = rawOpen(path, O_RDONLY, 0);
  if (file < 0) return 0;
  const long length = syscall(SYS_read, (int)file, text, sizeof text - 1);
  syscall(SYS_close, (int)file);
  if (length > 0) noteStrike();
  return length > 0 ? atol(text) : 0;
}

enum { kSecond = 1000000000, kMillisecond = 1000000 };

// Nanoseconds that the waits left out: of all threads, and of this thread. The steady clock jumps
// for the waiting thread only. Otherwise each hurried wait would hurry the polls of past runs too.
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
  if (clock == CLOCK_REALTIME) now->tv_sec += clockIsWrongBy("FAULT_CLOCK");
  if (clock == CLOCK_REALTIME || clock == CLOCK_BOOTTIME)
    *now = timespecOf(nanoseconds(now) + atomic_load(&skipped));
  if (clock == CLOCK_MONOTONIC || clock == CLOCK_MONOTONIC_RAW)
    *now = timespecOf(nanoseconds(now) + skippedHere + clockIsWrongBy("FAULT_STEADY") * kSecond);
  return 0;
}

int pthread_cond_clockwait(pthread_cond_t* condition, pthread_mutex_t* mutex, clockid_t clock,
                           const struct timespec* until) {
  struct timespec now;
  syscall(SYS_clock_gettime, clock, &now);
  const long ahead = clock == CLOCK_MONOTONIC ? clockIsWrongBy("FAULT_STEADY") * kSecond : 0;
  const long deadline = nanoseconds(until) - skippedHere - ahead;
  const long remaining = deadline - nanoseconds(&now);
  // Not the timer of the spool's flushes, which comes once a second: its jumps would hurry the
  // polls of past runs, which have the same thread.
  const int hurried = number("FAULT_HURRY", 0) != 0 && remaining > 1500L * kMillisecond &&
                      remaining < 3L * kSecond;
  const struct timespec end = timespecOf(hurried ? nanoseconds(&now) + kMillisecond : deadline);
  const int result = REAL(pthread_cond_clockwait)(condition, mutex, clock, &end);
  if (hurried && result == ETIMEDOUT) {
    noteStrike();
    atomic_fetch_add(&skipped, remaining - kMillisecond);
    skippedHere += remaining - kMillisecond;
  }
  return result;
}
