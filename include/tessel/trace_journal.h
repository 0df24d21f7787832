/* How trace.h speaks to the journal: one non-blocking datagram socket for the program, and messages
 * in the journal's native form. For trace.h alone; names that end in an underscore are not for
 * users.
 */
#ifndef TESSEL_TRACE_JOURNAL_H
#define TESSEL_TRACE_JOURNAL_H

#include <errno.h>
#include <fcntl.h>
#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <sys/auxv.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <unistd.h>

#ifndef TESSEL_JOURNAL_SOCKET
#define TESSEL_JOURNAL_SOCKET "/run/systemd/journal/socket"
#endif
#define TESSEL_VALUE_MAX 4096   /* bytes of one string; of key, '=' and value of an attribute */
#define TESSEL_BUFFER_SIZE 8192 /* bytes of the caller's stack */

#ifdef __cplusplus
extern "C" {
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wold-style-cast"
#pragma GCC diagnostic ignored "-Wzero-as-null-pointer-constant"
#endif

#define TESSEL_INNER_ static __attribute__((unused))
#define TESSEL_SLOW_ static __attribute__((unused, noinline))

#if !defined(__cplusplus) && defined(__GLIBC__) && !defined(__USE_MISC)
extern long syscall(long number, ...); /* strict C11 hides it */
#endif

enum {
  TESSEL_UNKNOWN_ = 0,
  TESSEL_ON_ = 1,
  TESSEL_OFF_ = 2,
  /* what strict C11 hides */
  TESSEL_S_IFMT_ = 0170000,
  TESSEL_S_IFSOCK_ = 0140000,
  TESSEL_F_DUPFD_CLOEXEC_ = 1030,
  TESSEL_F_ADD_SEALS_ = 1033,
  TESSEL_MFD_FLAGS_ = 1 | 2,        /* close on exec, allow sealing */
  TESSEL_ALL_SEALS_ = 1 | 2 | 4 | 8 /* seal, shrink, grow, write */
};

/* One per program or library, however many of its files include this header. `socket` is the
 * descriptor with the low half of its inode number above it; 0: none. */
struct tessel_state_v1_ {
  uint64_t socket;
  uint64_t intervals;
  int mode;
};
extern struct tessel_state_v1_ tessel_state_v1_;
/* NOLINTNEXTLINE(misc-definitions-in-headers): weak */
__attribute__((weak, visibility("hidden"))) struct tessel_state_v1_ tessel_state_v1_ = {0, 0, 0};

/* A datagram in the making. `memfd` holds what went before the buffer; -1 while nothing did. */
typedef struct tessel_message_ {
  size_t used;
  int memfd;
  int error;
  char bytes[TESSEL_BUFFER_SIZE];
} tessel_message_;

/* Asks the environment, once. */
TESSEL_SLOW_ bool tessel_resolve_mode_(void) {
  const char* value = getenv("TESSEL_TRACE");
  const int mode = value && strcmp(value, "0") == 0 ? TESSEL_OFF_ : TESSEL_ON_;
  int before = TESSEL_UNKNOWN_;
  const bool first = __atomic_compare_exchange_n(&tessel_state_v1_.mode, &before, mode, false,
                                                 __ATOMIC_RELAXED, __ATOMIC_RELAXED);
  return (first ? mode : before) == TESSEL_ON_;
}

/* Connecting anew moves a socket to a journal that was restarted; no descriptor changes hands. */
TESSEL_SLOW_ int tessel_connect_(int fd) {
  struct sockaddr_un address;
  const char* path = getauxval(AT_SECURE) ? "" : getenv("TESSEL_JOURNAL_SOCKET");
  if (!path || !*path) path = TESSEL_JOURNAL_SOCKET;
  const size_t length = strlen(path);
  if (length >= sizeof address.sun_path) return ENAMETOOLONG;
  memset(&address, 0, sizeof address);
  address.sun_family = AF_UNIX;
  memcpy(address.sun_path, path, length);
  return connect(fd, (const struct sockaddr*)&address, sizeof address) == 0 ? 0 : errno;
}

/* A new socket, away from the numbers of the standard streams. */
TESSEL_SLOW_ int tessel_open_(uint64_t* handle) {
  struct stat status;
  int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  if (fd >= 0 && fd <= 2) {
    const int low = fd;
    fd = fcntl(low, TESSEL_F_DUPFD_CLOEXEC_, 3);
    close(low);
  }
  if (fd < 0) return errno;
  int error = tessel_connect_(fd);
  if (!error && fstat(fd, &status) != 0) error = errno;
  if (error) {
    close(fd);
  } else {
    *handle = (uint64_t)(uint32_t)status.st_ino << 32 | (uint32_t)fd;
  }
  return error;
}

/* Whether the descriptor is still the socket that was opened under it. */
TESSEL_INNER_ bool tessel_is_ours_(uint64_t handle) {
  struct stat status;
  return handle != 0 && fstat((int)(uint32_t)handle, &status) == 0 &&
         (status.st_mode & TESSEL_S_IFMT_) == TESSEL_S_IFSOCK_ &&
         (uint32_t)status.st_ino == (uint32_t)(handle >> 32);
}

/* The socket, opened on first use; of two threads that open it one yields. */
TESSEL_INNER_ int tessel_socket_(int* fd) {
  uint64_t handle = __atomic_load_n(&tessel_state_v1_.socket, __ATOMIC_ACQUIRE);
  if (!tessel_is_ours_(handle)) {
    uint64_t fresh = 0;
    const int error = tessel_open_(&fresh);
    if (error) return error;
    if (__atomic_compare_exchange_n(&tessel_state_v1_.socket, &handle, fresh, false,
                                    __ATOMIC_ACQ_REL, __ATOMIC_ACQUIRE)) {
      handle = fresh;
    } else {
      close((int)(uint32_t)fresh);
    }
  }
  *fd = (int)(uint32_t)handle;
  return 0;
}

/* Moves the buffer into the memory file. */
TESSEL_SLOW_ void tessel_spill_(tessel_message_* message) {
  if (message->memfd < 0 && !message->error) {
    message->memfd = (int)syscall(SYS_memfd_create, "tessel-trace", TESSEL_MFD_FLAGS_);
    if (message->memfd < 0) message->error = errno;
  }
  for (size_t done = 0; done < message->used && !message->error;) {
    const ssize_t size = write(message->memfd, message->bytes + done, message->used - done);
    if (size < 0) {
      message->error = errno;
    } else {
      done += (size_t)size;
    }
  }
  message->used = 0;
}

/* `size` is at most TESSEL_BUFFER_SIZE. */
TESSEL_INNER_ void tessel_put_(tessel_message_* message, const char* bytes, size_t size) {
  if (size > sizeof message->bytes - message->used) tessel_spill_(message);
  memcpy(message->bytes + message->used, bytes, size);
  message->used += size;
}

/* One field in the journal's native form; `name` ends in '='. A value with a line feed goes by
 * length. */
static inline void tessel_put_field_(tessel_message_* message, const char* name, const char* value,
                                     size_t size) {
  if (size > TESSEL_VALUE_MAX) {
    message->error = EMSGSIZE;
    return;
  }
  if (memchr(value, '\n', size)) {
    char length[9] = {'\n', 0, 0, 0, 0, 0, 0, 0, 0};
    for (int i = 0; i < 8; ++i) length[i + 1] = (char)((uint64_t)size >> 8 * i & 0xff);
    tessel_put_(message, name, strlen(name) - 1);
    tessel_put_(message, length, sizeof length);
  } else {
    tessel_put_(message, name, strlen(name));
  }
  tessel_put_(message, value, size);
  tessel_put_(message, "\n", 1);
}

/* Hands over the memory file, which nothing can change any more: the journal asks for that. */
TESSEL_SLOW_ ssize_t tessel_send_file_(int fd, int memfd) {
  union {
    struct cmsghdr header;
    char space[CMSG_SPACE(sizeof(int))];
  } control;
  struct msghdr message;
  if (fcntl(memfd, TESSEL_F_ADD_SEALS_, TESSEL_ALL_SEALS_) != 0) return -1;
  memset(&message, 0, sizeof message);
  memset(&control, 0, sizeof control);
  control.header.cmsg_level = SOL_SOCKET;
  control.header.cmsg_type = SCM_RIGHTS;
  control.header.cmsg_len = CMSG_LEN(sizeof memfd);
  memcpy(CMSG_DATA(&control.header), &memfd, sizeof memfd);
  message.msg_control = &control;
  message.msg_controllen = sizeof control;
  return sendmsg(fd, &message, MSG_DONTWAIT | MSG_NOSIGNAL);
}

TESSEL_INNER_ int tessel_send_(int fd, const tessel_message_* message) {
  const ssize_t sent = message->memfd < 0
                           ? send(fd, message->bytes, message->used, MSG_DONTWAIT | MSG_NOSIGNAL)
                           : tessel_send_file_(fd, message->memfd);
  return sent < 0 ? errno : 0;
}

/* Sends what the message holds, to the journal's successor where it was restarted, and as a memory
 * file where the system's datagrams are smaller than the buffer. */
TESSEL_INNER_ int tessel_deliver_(tessel_message_* message) {
  int fd = -1;
  int error = tessel_socket_(&fd);
  if (error) return error;
  if (message->memfd >= 0) tessel_spill_(message);
  if (message->error) return message->error;
  error = tessel_send_(fd, message);
  if (error == ECONNREFUSED || error == ENOTCONN || error == ECONNRESET) {
    error = tessel_connect_(fd);
    if (!error) error = tessel_send_(fd, message);
  }
  if ((error == EMSGSIZE || error == ENOBUFS) && message->memfd < 0) {
    tessel_spill_(message);
    error = message->error ? message->error : tessel_send_(fd, message);
  }
  return error;
}

#ifdef __cplusplus
#pragma GCC diagnostic pop
}
#endif

#endif
