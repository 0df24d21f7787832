/* How trace.h speaks to the journal: one datagram socket for the program, messages in the journal's
 * native form, and a bounded wait where the socket is full. For trace.h alone; names that end in an
 * underscore are not for users.
 */
#ifndef TESSEL_TRACE_JOURNAL_H
#define TESSEL_TRACE_JOURNAL_H

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
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

#include "trace_state.h"

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

#if !defined(__cplusplus) && defined(__GLIBC__) && !defined(__USE_MISC)
extern long syscall(long number, ...); /* strict C11 hides it */
#endif

/* NOLINTBEGIN(modernize-use-nullptr): this is C as well */

enum {
  /* what strict C11 hides */
  TESSEL_S_IFMT_ = 0170000,
  TESSEL_S_IFSOCK_ = 0140000,
  TESSEL_F_DUPFD_CLOEXEC_ = 1030,
  TESSEL_F_ADD_SEALS_ = 1033,
  TESSEL_MFD_FLAGS_ = 1 | 2,         /* close on exec, allow sealing */
  TESSEL_ALL_SEALS_ = 1 | 2 | 4 | 8, /* seal, shrink, grow, write */
  TESSEL_WAIT_DEFAULT_ = 20,         /* milliseconds */
  TESSEL_WAIT_MAX_ = 1000,
  /* We get what the system gives at most, usually 400 KiB: a burst of 300 points then finds room.
   */
  TESSEL_SEND_BUFFER_ = 8 << 20
};

/* A datagram in the making. A mistake of the caller and an error of the system are kept apart: only
 * the second makes the point a lost one. */
typedef struct tessel_message_ {
  size_t used;
  int memfd; /* holds what went before the buffer; -1 while nothing did */
  int error;
  int refused;       /* 0: no mistake; of several the first */
  const char* words; /* of the mistake: the whole text, or the name of the part that is too long */
  size_t size;       /* of that part; else 0 */
  size_t limit;
  char bytes[TESSEL_BUFFER_SIZE];
} tessel_message_;

TESSEL_INNER_ void tessel_start_(tessel_message_* message) {
  message->used = 0;
  message->memfd = -1;
  message->error = 0;
  message->refused = 0;
}

TESSEL_SLOW_ void tessel_refuse_(tessel_message_* message, int error, const char* words,
                                 size_t size, size_t limit) {
  if (message->refused) return;
  message->refused = error;
  message->words = words;
  message->size = size;
  message->limit = limit;
}

/* ---- The socket ----------------------------------------------------------------------------- */

/* Connecting anew moves a socket to a journal that was restarted; no descriptor changes hands. */
TESSEL_SLOW_ int tessel_connect_(int fd) {
  struct sockaddr_un address;
  const char* path = getauxval(AT_SECURE) ? "" : getenv("TESSEL_JOURNAL_SOCKET");
  if (!path || !*path) path = TESSEL_JOURNAL_SOCKET;
  const size_t length = strlen(path);
  if (length >= sizeof address.sun_path) return EADDRNOTAVAIL;
  memset(&address, 0, sizeof address);
  address.sun_family = AF_UNIX;
  memcpy(address.sun_path, path, length);
  return connect(fd, (const struct sockaddr*)&address, sizeof address) == 0 ? 0 : errno;
}

/* A new socket, away from the numbers of the standard streams. */
TESSEL_SLOW_ int tessel_open_(uint64_t* handle) {
  struct stat status;
  const int room = TESSEL_SEND_BUFFER_;
  int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  if (fd >= 0 && fd <= 2) {
    const int low = fd;
    fd = fcntl(low, TESSEL_F_DUPFD_CLOEXEC_, 3);
    close(low);
  }
  if (fd < 0) return errno;
  setsockopt(fd, SOL_SOCKET, SO_SNDBUF, &room, sizeof room); /* without it a burst waits earlier */
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
  uint64_t handle = __atomic_load_n(&tessel_state_v2_.socket, __ATOMIC_ACQUIRE);
  if (!tessel_is_ours_(handle)) {
    uint64_t fresh = 0;
    const int error = tessel_open_(&fresh);
    if (error) return error;
    if (__atomic_compare_exchange_n(&tessel_state_v2_.socket, &handle, fresh, false,
                                    __ATOMIC_ACQ_REL, __ATOMIC_ACQUIRE)) {
      handle = fresh;
    } else {
      close((int)(uint32_t)fresh);
    }
  }
  *fd = (int)(uint32_t)handle;
  return 0;
}

/* ---- The message ---------------------------------------------------------------------------- */

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
    tessel_refuse_(message, EMSGSIZE, name, size, TESSEL_VALUE_MAX);
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

/* Decimal text of `value`, ending before `end`; answers where it begins. */
TESSEL_INNER_ char* tessel_decimal_(char* end, uint64_t value) {
  do {
    *--end = (char)('0' + value % 10);
  } while (value /= 10);
  return end;
}

TESSEL_INNER_ void tessel_put_integer_(tessel_message_* message, const char* name, bool negative,
                                       uint64_t magnitude) {
  char text[24];
  char* const end = text + sizeof text;
  char* begin = tessel_decimal_(end, magnitude);
  if (negative) *--begin = '-';
  tessel_put_field_(message, name, begin, (size_t)(end - begin));
}

/* Adds the two fields that tell `total`, a word of tessel_total_() that is not 0. */
TESSEL_SLOW_ void tessel_put_losses_(tessel_message_* message, uint64_t total) {
  const uint64_t since = __atomic_load_n(&tessel_state_v2_.since, __ATOMIC_RELAXED);
  tessel_put_integer_(message, "TESSEL_LOST=", false,
                      total & (((uint64_t)1 << TESSEL_COUNT_BITS_) - 1));
  tessel_put_integer_(message, "TESSEL_LOST_SINCE=", false, since >> TESSEL_SINCE_BITS_);
}

/* ---- Sending -------------------------------------------------------------------------------- */

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

/* One attempt. It sends to the journal's successor where it was restarted, and as a memory file
 * where the system's datagrams are smaller than the buffer. */
TESSEL_INNER_ int tessel_offer_(tessel_message_* message) {
  int fd = -1;
  int error = tessel_socket_(&fd);
  if (error) return error;
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

/* Whether room may come by waiting. The second: more memory files are under way than the process
 * may have descriptors. */
TESSEL_INNER_ bool tessel_is_full_(int error) { return error == EAGAIN || error == ETOOMANYREFS; }

/* The longest wait of a call, in milliseconds. */
TESSEL_SLOW_ int tessel_wait_limit_(void) {
  int wait = __atomic_load_n(&tessel_state_v2_.wait, __ATOMIC_RELAXED);
  if (wait == 0) {
    const char* const text = getenv("TESSEL_TRACE_WAIT");
    const size_t digits = text ? strspn(text, "0123456789") : 0;
    int limit = TESSEL_WAIT_DEFAULT_;
    if (digits != 0 && text[digits] == '\0') {
      const unsigned long given = strtoul(text, NULL, 10); /* too many digits: the greatest */
      limit = given < TESSEL_WAIT_MAX_ ? (int)given : TESSEL_WAIT_MAX_;
    }
    wait = limit + 1;
    __atomic_store_n(&tessel_state_v2_.wait, wait, __ATOMIC_RELAXED);
  }
  return wait - 1;
}

/* Offers the message again and again, for at most `limit` nanoseconds. The socket reports room for
 * each single datagram that the daemon takes. To wake up for each would cost more than to send it.
 * So we nap while the daemon takes some twenty, and ask the socket only where that did not help. */
TESSEL_SLOW_ int tessel_offer_within_(tessel_message_* message, int error, uint64_t limit) {
  const struct timespec nap = {0, 200000};
  const uint64_t start = tessel_now_ns_();
  uint64_t spent = 0;
  for (bool ask = false; tessel_is_full_(error) && spent < limit; ask = error == EAGAIN) {
    struct pollfd room = {-1, POLLOUT, 0};
    /* Looked for each time: the program may have closed it while we waited. */
    const int missing = ask ? tessel_socket_(&room.fd) : 0;
    if (missing) return missing;
    if (ask) poll(&room, 1, (int)((limit - spent + 999999u) / 1000000u));
    nanosleep(&nap, NULL);
    error = tessel_offer_(message);
    spent = tessel_now_ns_() - start;
  }
  return error;
}

/* Waits for room. After a wait that ended without any, the daemon takes nothing, and programs must
 * not stand still for it: then a call waits a thousandth of the time since that wait began. Who
 * takes this time sets the beginning anew, so it is taken once however many threads record. */
TESSEL_SLOW_ int tessel_wait_(tessel_message_* message, int error) {
  uint64_t limit = (uint64_t)tessel_wait_limit_() * 1000000u;
  const uint64_t taken = __atomic_load_n(&tessel_state_v2_.taken, __ATOMIC_RELAXED);
  uint64_t stuck = __atomic_load_n(&tessel_state_v2_.stuck, __ATOMIC_RELAXED);
  const uint64_t now = tessel_now_ns_();
  if (limit == 0) return error;
  if (stuck) {
    const uint64_t earned = (now - stuck) / 1000u;
    if (earned < limit) limit = earned;
    if (limit < 1000000u ||
        !__atomic_compare_exchange_n(&tessel_state_v2_.stuck, &stuck, now, false, __ATOMIC_RELAXED,
                                     __ATOMIC_RELAXED)) {
      return error;
    }
  }
  error = tessel_offer_within_(message, error, limit);
  /* Another thread may have been quicker each time. Then the daemon does take points. */
  const bool idle = taken == __atomic_load_n(&tessel_state_v2_.taken, __ATOMIC_RELAXED);
  if (tessel_is_full_(error) && idle) {
    __atomic_store_n(&tessel_state_v2_.stuck, now, __ATOMIC_RELAXED);
  }
  return error;
}

/* Sends what the message holds. Answers 0 or why the point is lost. */
TESSEL_INNER_ int tessel_deliver_(tessel_message_* message, bool may_wait) {
  if (message->memfd >= 0) tessel_spill_(message);
  if (message->error) return message->error;
  int error = tessel_offer_(message);
  if (__builtin_expect(tessel_is_full_(error), 0) && may_wait) error = tessel_wait_(message, error);
  if (!error) {
    __atomic_add_fetch(&tessel_state_v2_.taken, 1, __ATOMIC_RELAXED);
    if (__atomic_load_n(&tessel_state_v2_.stuck, __ATOMIC_RELAXED)) {
      __atomic_store_n(&tessel_state_v2_.stuck, 0, __ATOMIC_RELAXED);
    }
  }
  return error;
}

/* Sends the message with what was lost before it, and counts it where the socket does not take it.
 */
TESSEL_INNER_ int tessel_hand_over_(tessel_message_* message, bool may_wait) {
  const uint64_t total = tessel_total_();
  if (__builtin_expect(total != 0, 0)) tessel_put_losses_(message, total);
  const int error = tessel_deliver_(message, may_wait);
  if (__builtin_expect(error != 0, 0)) {
    tessel_count_lost_();
  } else if (__builtin_expect(total != 0, 0)) {
    tessel_note_told_(total);
  }
  return error;
}

#ifndef TESSEL_TRACE_DISABLED
/* The last of the program or library: at exit() and after main(), and where a library is unloaded.
 * Its priority is the lowest that programs may use, so it comes after all destructors that may
 * still record. Every file that includes the header asks for this call, and the first one does it
 * all. */
__attribute__((destructor(101), weak, visibility("hidden"))) void tessel_at_exit_v2_(void);
/* NOLINTNEXTLINE(misc-definitions-in-headers): weak */
void tessel_at_exit_v2_(void) {
  /* Nothing repeats this entry, so it waits longer than a call, and where no call may wait. */
  const uint64_t most_ns = 1000000000u;
  const uint64_t total = tessel_total_();
  const uint64_t told = __atomic_load_n(&tessel_state_v2_.told, __ATOMIC_RELAXED);
  if (total != 0 && (told >> TESSEL_COUNT_BITS_ != total >> TESSEL_COUNT_BITS_ || told < total)) {
    tessel_message_ message;
    tessel_start_(&message);
    tessel_put_field_(&message, "PRIORITY=", "7", 1);
    tessel_put_losses_(&message, total);
    int error = tessel_offer_(&message);
    if (error) error = tessel_offer_within_(&message, error, most_ns);
    if (!error) tessel_note_told_(total);
    if (message.memfd >= 0) close(message.memfd);
  }
  /* A library that is loaded again opens a socket of its own. */
  const uint64_t handle = __atomic_exchange_n(&tessel_state_v2_.socket, 0, __ATOMIC_ACQ_REL);
  if (tessel_is_ours_(handle)) close((int)(uint32_t)handle);
}
#endif

/* NOLINTEND(modernize-use-nullptr) */

#ifdef __cplusplus
#pragma GCC diagnostic pop
}
#endif

#endif
