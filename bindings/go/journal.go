package tessel

// The way to the journal: one non-blocking datagram socket for the process, a bounded wait, and the
// count of what was lost.

import (
	"fmt"
	"os"
	"path/filepath"
	"runtime"
	"strconv"
	"strings"
	"sync"
	"sync/atomic"
	"syscall"
	"time"
	"unsafe"
)

const (
	journalSocket = "/run/systemd/journal/socket"
	defaultWait   = 20 * time.Millisecond
	longestWait   = time.Second
	// After a wait that ended without room a call may wait a thousandth of the time since that wait
	// began: a journal that takes nothing costs a program no more.
	waitShare = 1000
	// Nothing repeats the last entry, so it waits longer than a call, and where no call may wait.
	closeWait = time.Second
	// We get what the system gives at most, usually 400 KiB: a burst of 300 points then finds room.
	sendBuffer = 8 << 20
)

const (
	modeUnknown int32 = iota
	modeOn
	modeOff
)

var (
	intervals atomic.Uint64
	lost      atomic.Uint64
	since     atomic.Int64  // microseconds since 1970 of the first loss
	told      atomic.Uint64 // the greatest total that the socket took

	resolved sync.Once
	modeNow  atomic.Int32
	check    bool
	waitMax  time.Duration
	started  = time.Now()
	taken    atomic.Uint64 // points that the socket took, of all goroutines
	stuck    atomic.Int64  // when the last wait began that ended without room, since started; 0: none
	spoken   sync.Map      // what check has said, and where
)

func resolve() {
	resolved.Do(func() {
		value := os.Getenv("TESSEL_TRACE")
		check = value == "check" && !hasMoreRights()
		waitMax = waitFrom(os.Getenv("TESSEL_TRACE_WAIT"))
		now := modeOn
		if value == "0" {
			now = modeOff
		}
		modeNow.CompareAndSwap(modeUnknown, now)
	})
}

// waitFrom takes milliseconds; what is no number counts as absent.
func waitFrom(text string) time.Duration {
	if text == "" || strings.Trim(text, "0123456789") != "" {
		return defaultWait
	}
	ms, err := strconv.ParseUint(text, 10, 64)
	if err != nil || ms > uint64(longestWait/time.Millisecond) {
		return longestWait
	}
	return time.Duration(ms) * time.Millisecond
}

func mode() int32 {
	resolve()
	return modeNow.Load()
}

func setMode(on bool) {
	resolve()
	if on {
		modeNow.Store(modeOn)
	} else {
		modeNow.Store(modeOff)
	}
}

// --- Losses.

// record sends the message and counts it where the socket does not take it. A point that breaks a
// rule is no lost one: that is a mistake of the program, and the same every time.
func (m *message) record() (isLost bool, err error) {
	if m.refused != 0 {
		say("refused", m.words, m.kind)
		return false, m.refused
	}
	total := lost.Load()
	m.losses(total)
	number := deliver(m.bytes, m.noWait)
	switch number {
	case 0:
		raise(&told, total)
		return false, nil
	case syscall.EAGAIN:
		say("lost", "the journal has no room", "")
	case syscall.ENOENT, syscall.ECONNREFUSED:
		say("lost", "no journal is running", "")
	default:
		say("lost", number.Error(), "")
	}
	countLost()
	return true, number
}

// countLost: the time goes in before the count, so whoever sees a count sees the time.
func countLost() {
	since.CompareAndSwap(0, time.Now().UnixMicro())
	lost.Add(1)
}

func flush() {
	resolve()
	total := lost.Load()
	if total <= told.Load() {
		return
	}
	m := &message{}
	m.put("PRIORITY", "7")
	m.losses(total)
	err := offer(m.bytes)
	if err == syscall.EAGAIN {
		err = offerWithin(m.bytes, closeWait)
	}
	if err == 0 {
		raise(&told, total)
	}
}

func raise(value *atomic.Uint64, to uint64) {
	for now := value.Load(); now < to && !value.CompareAndSwap(now, to); now = value.Load() {
	}
}

// say writes what check asks for, once for each place that called into the package and each mistake.
func say(effect, words, kind string) {
	if !check {
		return
	}
	if kind == "" {
		kind = words
	}
	callers := make([]uintptr, 16)
	frames := runtime.CallersFrames(callers[:runtime.Callers(1, callers)])
	frame, more := frames.Next()
	own := strings.TrimSuffix(frame.Function, "say") // the package, under whatever path it is imported
	for more && strings.HasPrefix(frame.Function, own) {
		frame, more = frames.Next()
	}
	place := fmt.Sprintf("%s:%d: %s: ", filepath.Base(frame.File), frame.Line, effect)
	if _, before := spoken.LoadOrStore(place+kind, true); !before {
		fmt.Fprintf(os.Stderr, "tessel: %s%s\n", place, words)
	}
}

// --- The socket.

// connection is a descriptor, and what it was when we opened it.
type connection struct {
	fd    int
	inode uint64
}

var current atomic.Pointer[connection]

// isOurs is false where the program closed descriptors that it does not know: something else may
// have the number now.
func (c *connection) isOurs() bool {
	var status syscall.Stat_t
	return c != nil && syscall.Fstat(c.fd, &status) == nil && status.Ino == c.inode &&
		status.Mode&syscall.S_IFMT == syscall.S_IFSOCK
}

// hasMoreRights tells whether the program runs with more rights than its caller, as the kernel sees
// it. Then the caller's environment chooses no socket, and standard error may be something else.
func hasMoreRights() bool {
	const atSecure = 23
	vector, err := os.ReadFile("/proc/self/auxv")
	count := len(vector) / int(unsafe.Sizeof(uintptr(0)))
	if err != nil || count == 0 {
		return os.Getuid() != os.Geteuid() || os.Getgid() != os.Getegid()
	}
	words := unsafe.Slice((*uintptr)(unsafe.Pointer(&vector[0])), count)
	for i := 0; i+1 < count; i += 2 {
		if words[i] == atSecure {
			return words[i+1] != 0
		}
	}
	return false
}

// socketPath asks the environment, but not in a program with more rights than its caller.
func socketPath() string {
	path := os.Getenv("TESSEL_JOURNAL_SOCKET")
	if path == "" || hasMoreRights() {
		return journalSocket
	}
	return path
}

func errnoOf(err error) syscall.Errno {
	if err == nil {
		return 0
	}
	if number, known := err.(syscall.Errno); known {
		return number
	}
	return syscall.EIO
}

func connect(fd int) syscall.Errno {
	return errnoOf(syscall.Connect(fd, &syscall.SockaddrUnix{Name: socketPath()}))
}

// awayFromStreams moves a descriptor that has the number of a closed standard stream: what the program
// writes there would go to the journal.
func awayFromStreams(fd int) (int, syscall.Errno) {
	if fd > 2 {
		return fd, 0
	}
	moved, _, err := syscall.Syscall(syscall.SYS_FCNTL, uintptr(fd), syscall.F_DUPFD_CLOEXEC, 3)
	syscall.Close(fd)
	return int(moved), err
}

// connected is the socket, opened on first use; of two goroutines that open it one yields.
func connected() (int, syscall.Errno) {
	before := current.Load()
	if before.isOurs() {
		return before.fd, 0
	}
	fd, err := syscall.Socket(syscall.AF_UNIX, syscall.SOCK_DGRAM|syscall.SOCK_CLOEXEC|syscall.SOCK_NONBLOCK, 0)
	if err != nil {
		return -1, errnoOf(err)
	}
	fd, failed := awayFromStreams(fd)
	if failed != 0 {
		return -1, failed
	}
	syscall.SetsockoptInt(fd, syscall.SOL_SOCKET, syscall.SO_SNDBUF, sendBuffer)
	var status syscall.Stat_t
	if failed = connect(fd); failed == 0 {
		failed = errnoOf(syscall.Fstat(fd, &status))
	}
	if failed != 0 {
		syscall.Close(fd)
		return -1, failed
	}
	if !current.CompareAndSwap(before, &connection{fd, status.Ino}) {
		syscall.Close(fd)
		return current.Load().fd, 0
	}
	return fd, 0
}

func send(fd int, bytes []byte) syscall.Errno {
	return errnoOf(syscall.Sendmsg(fd, bytes, nil, nil, syscall.MSG_DONTWAIT|syscall.MSG_NOSIGNAL))
}

func deliver(bytes []byte, noWait bool) syscall.Errno {
	err := offer(bytes)
	if err == syscall.EAGAIN && !noWait {
		err = wait(bytes)
	}
	if err == 0 {
		taken.Add(1)
		if stuck.Load() != 0 {
			stuck.Store(0)
		}
	}
	return err
}

// offer is one attempt, to the journal's successor where it was restarted.
func offer(bytes []byte) syscall.Errno {
	fd, err := connected()
	if err != 0 {
		return err
	}
	err = send(fd, bytes)
	if err == syscall.ECONNREFUSED || err == syscall.ENOTCONN || err == syscall.ECONNRESET {
		if err = connect(fd); err == 0 {
			err = send(fd, bytes)
		}
	}
	return err
}

// wait waits for room. After a wait that ended without any, the daemon takes nothing, and programs
// must not stand still for it. Who takes the time that was earned since sets its beginning anew, so
// it is taken once however many goroutines record.
func wait(bytes []byte) syscall.Errno {
	limit := waitMax
	before := taken.Load()
	now := int64(time.Since(started))
	if began := stuck.Load(); began != 0 {
		if earned := time.Duration(now-began) / waitShare; earned < limit {
			limit = earned
		}
		if limit < time.Millisecond || !stuck.CompareAndSwap(began, now) {
			return syscall.EAGAIN
		}
	}
	if limit == 0 {
		return syscall.EAGAIN
	}
	err := offerWithin(bytes, limit)
	// Another goroutine may have been quicker each time. Then the daemon does take points.
	if err == syscall.EAGAIN && taken.Load() == before {
		stuck.Store(now)
	}
	return err
}

// offerWithin: another goroutine may take the room before us, so we may wait again.
func offerWithin(bytes []byte, limit time.Duration) syscall.Errno {
	deadline := time.Now().Add(limit)
	err := syscall.EAGAIN
	for left := limit; err == syscall.EAGAIN && left > 0; left = time.Until(deadline) {
		fd, missing := connected()
		if missing != 0 {
			return missing
		}
		room := struct {
			fd              int32
			events, revents int16
		}{int32(fd), 4 /* POLLOUT */, 0}
		timeout := syscall.NsecToTimespec(int64(left))
		syscall.Syscall6(syscall.SYS_PPOLL, uintptr(unsafe.Pointer(&room)), 1, uintptr(unsafe.Pointer(&timeout)), 0, 0, 0)
		err = offer(bytes)
	}
	return err
}
