//! The way to the journal: one non-blocking datagram socket for the process, a bounded wait, and the
//! count of what was lost.
//!
//! All state but that of `check` is atomic: a child that was forked while another thread recorded finds
//! no lock held.

use crate::libc;
use crate::message::Message;
use std::collections::HashSet;
use std::fs::File;
use std::io::Write;
use std::mem::ManuallyDrop;
use std::os::unix::fs::{FileTypeExt, MetadataExt};
use std::os::unix::io::{AsRawFd, FromRawFd, IntoRawFd};
use std::os::unix::net::UnixDatagram;
use std::panic::Location;
use std::sync::atomic::{AtomicBool, AtomicI32, AtomicU32, AtomicU64};
use std::sync::atomic::{Ordering::AcqRel, Ordering::Acquire, Ordering::Relaxed};
use std::sync::Mutex;
use std::time::{SystemTime, UNIX_EPOCH};

const SOCKET: &str = "/run/systemd/journal/socket";
const WAIT_MS: u32 = 20;
const WAIT_MS_MAX: u32 = 1000;
// After a wait that ended without room a call may wait a thousandth of the time since that wait began:
// a journal that takes nothing costs a program no more.
const WAIT_SHARE: u64 = 1000;
// Nothing repeats the entry at exit, so it waits longer than a call, and where no call may wait.
const FLUSH_WAIT_NS: u64 = 1_000_000_000;
const MS: u64 = 1_000_000;
// We get what the system gives at most, usually 400 KiB: a burst of 300 points then finds room.
const SEND_BUFFER: i32 = 8 << 20;

const UNKNOWN: i32 = 0;
const ON: i32 = 1;
const OFF: i32 = 2;
const CHECK: i32 = 3;

static MODE: AtomicI32 = AtomicI32::new(UNKNOWN);
/// Milliseconds.
static WAIT_MAX: AtomicU32 = AtomicU32::new(WAIT_MS);
static PROCESS: AtomicU32 = AtomicU32::new(0);
static INTERVALS: AtomicU64 = AtomicU64::new(0);
static LOST: AtomicU64 = AtomicU64::new(0);
/// Microseconds since 1970 of the first loss.
static SINCE: AtomicU64 = AtomicU64::new(0);
/// The greatest total that the socket took.
static TOLD: AtomicU64 = AtomicU64::new(0);
/// Points that the socket took, of all threads.
static TAKEN: AtomicU64 = AtomicU64::new(0);
/// When the last wait began that ended without room, by `monotonic_ns`; 0: none.
static STUCK: AtomicU64 = AtomicU64::new(0);
/// The descriptor, with the low half of its inode number above it; 0: none.
static HANDLE: AtomicU64 = AtomicU64::new(0);
static AT_EXIT: AtomicBool = AtomicBool::new(false);

fn environment(name: &str) -> Option<String> {
    std::env::var(name).ok()
}

fn resolve() -> i32 {
    if let Some(text) = environment("TESSEL_TRACE_WAIT") {
        if !text.is_empty() && text.bytes().all(|byte| byte.is_ascii_digit()) {
            // Too many digits: the greatest.
            WAIT_MAX.store(text.parse().unwrap_or(WAIT_MS_MAX).min(WAIT_MS_MAX), Relaxed);
        }
    }
    let mode = if environment("TESSEL_TRACE").as_deref() == Some("0") { OFF } else { mode_when_on() };
    MODE.compare_exchange(UNKNOWN, mode, AcqRel, Acquire).map_or_else(|before| before, |_| mode)
}

/// A program with more rights than its caller may have something else under the number of standard
/// error, so it tells no mistakes there.
fn mode_when_on() -> i32 {
    let check = environment("TESSEL_TRACE").as_deref() == Some("check") && !has_more_rights();
    if check {
        CHECK
    } else {
        ON
    }
}

fn has_more_rights() -> bool {
    // SAFETY: getauxval reads a value that the kernel gave the process.
    unsafe { libc::getauxval(libc::AT_SECURE) != 0 }
}

fn mode() -> i32 {
    match MODE.load(Relaxed) {
        UNKNOWN => resolve(),
        mode => mode,
    }
}

pub(crate) fn enabled() -> bool {
    mode() != OFF
}

pub(crate) fn enable(on: bool) {
    resolve();
    MODE.store(if on { mode_when_on() } else { OFF }, Relaxed);
}

pub(crate) fn lost() -> u64 {
    LOST.load(Relaxed)
}

pub(crate) fn next_interval() -> u64 {
    INTERVALS.fetch_add(1, Relaxed) + 1
}

pub(crate) fn checks() -> bool {
    mode() == CHECK
}

/// Sends a message with the count of what was lost before, or counts it.
pub(crate) fn send(mut message: Message, may_wait: bool) -> Result<(), i32> {
    start_anew_in_a_child();
    let total = lost();
    message.put_losses(total, SINCE.load(Relaxed));
    let answer = deliver(message.bytes(), may_wait);
    match answer {
        Ok(()) => drop(TOLD.fetch_max(total, Relaxed)),
        Err(_) => count_lost(),
    }
    answer
}

// --- Losses.

/// A forked child's losses are its own. The socket stays: a datagram carries its sender.
fn start_anew_in_a_child() {
    let process = std::process::id();
    let before = PROCESS.swap(process, Relaxed);
    if before != process && before != 0 {
        LOST.store(0, Relaxed);
        SINCE.store(0, Relaxed);
        TOLD.store(0, Relaxed);
        STUCK.store(0, Relaxed);
    }
}

/// The time goes in before the count, so whoever sees a count sees the time.
pub(crate) fn count_lost() {
    start_anew_in_a_child();
    if !AT_EXIT.swap(true, Relaxed) {
        // SAFETY: flush_at_exit is a plain function that does not unwind.
        unsafe { libc::atexit(flush_at_exit) };
    }
    let now = SystemTime::now().duration_since(UNIX_EPOCH).map_or(1, |time| time.as_micros() as u64);
    let _ = SINCE.compare_exchange(0, now, AcqRel, Acquire);
    LOST.fetch_add(1, AcqRel);
}

extern "C" fn flush_at_exit() {
    flush();
}

pub(crate) fn flush() {
    start_anew_in_a_child();
    let total = lost();
    if total <= TOLD.load(Relaxed) {
        return;
    }
    let mut message = Message::new(Location::caller());
    message.put("PRIORITY", b"7");
    message.put_losses(total, SINCE.load(Relaxed));
    let mut answer = offer(message.bytes());
    if answer == Err(libc::EAGAIN) {
        answer = offer_within(message.bytes(), FLUSH_WAIT_NS);
    }
    if answer.is_ok() {
        TOLD.fetch_max(total, Relaxed);
    }
}

/// What `check` asks for, once for each place and mistake.
pub(crate) fn say(effect: &'static str, words: &str, kind: &str, place: &'static Location<'static>) {
    // File, line, effect, mistake.
    type Told = HashSet<(&'static str, u32, &'static str, String)>;
    static TOLD: Mutex<Option<Told>> = Mutex::new(None);
    if !checks() {
        return;
    }
    let kind = if kind.is_empty() { words } else { kind };
    if let Ok(mut told) = TOLD.lock() {
        if told.get_or_insert_with(HashSet::new).insert((place.file(), place.line(), effect, kind.to_string())) {
            let file = place.file().rsplit('/').next().unwrap_or("?");
            // Not eprintln!, which panics where nobody reads.
            let _ = writeln!(std::io::stderr(), "tessel: {}:{}: {}: {}", file, place.line(), effect, words);
        }
    }
}

// --- The socket.

fn errno_of(error: std::io::Error) -> i32 {
    error.raw_os_error().unwrap_or(libc::EIO)
}

/// The environment is not asked in a program that runs with more rights than its caller.
fn socket_path() -> String {
    let path = if has_more_rights() { None } else { environment("TESSEL_JOURNAL_SOCKET") };
    path.filter(|path| !path.is_empty()).unwrap_or_else(|| SOCKET.to_string())
}

/// The socket behind a descriptor, which stays open when the result goes.
fn socket_of(fd: i32) -> ManuallyDrop<UnixDatagram> {
    // SAFETY: is_ours() has looked at the descriptor, and ManuallyDrop never closes it.
    ManuallyDrop::new(unsafe { UnixDatagram::from_raw_fd(fd) })
}

fn inode_of(fd: i32) -> Option<u64> {
    // SAFETY: only fstat is called on the descriptor, and ManuallyDrop never closes it.
    let file = ManuallyDrop::new(unsafe { File::from_raw_fd(fd) });
    file.metadata().ok().filter(|data| data.file_type().is_socket()).map(|data| data.ino())
}

/// False where the program closed descriptors that it does not know: something else may have the
/// number now.
fn is_ours(handle: u64) -> bool {
    handle != 0 && inode_of(handle as u32 as i32).map(|inode| inode as u32) == Some((handle >> 32) as u32)
}

/// The socket, opened on first use; of two threads that open it one yields.
fn connected() -> std::io::Result<i32> {
    let before = HANDLE.load(Acquire);
    if is_ours(before) {
        return Ok(before as u32 as i32);
    }
    let mut socket = UnixDatagram::unbound()?;
    if socket.as_raw_fd() <= 2 {
        socket = socket.try_clone()?; // away from the numbers of the standard streams
    }
    socket.set_nonblocking(true)?;
    // SAFETY: the value is an int that outlives the call.
    unsafe {
        let size = std::mem::size_of::<i32>() as u32;
        libc::setsockopt(
            socket.as_raw_fd(),
            libc::SOL_SOCKET,
            libc::SO_SNDBUF,
            (&SEND_BUFFER as *const i32).cast(),
            size,
        );
    }
    socket.connect(socket_path())?;
    let fd = socket.into_raw_fd();
    let fresh = inode_of(fd).unwrap_or(0) << 32 | fd as u64;
    match HANDLE.compare_exchange(before, fresh, AcqRel, Acquire) {
        Ok(_) => Ok(fd),
        Err(other) => {
            drop(ManuallyDrop::into_inner(socket_of(fd)));
            Ok(other as u32 as i32)
        }
    }
}

pub(crate) fn monotonic_ns() -> u64 {
    let mut now = libc::TimeSpec { seconds: 0, nanoseconds: 0 };
    // SAFETY: clock_gettime writes into `now`.
    unsafe { libc::clock_gettime(libc::CLOCK_MONOTONIC, &mut now) };
    now.seconds as u64 * 1_000_000_000 + now.nanoseconds as u64
}

fn deliver(bytes: &[u8], may_wait: bool) -> Result<(), i32> {
    let mut answer = offer(bytes);
    if answer == Err(libc::EAGAIN) && may_wait {
        answer = wait(bytes);
    }
    if answer.is_ok() {
        TAKEN.fetch_add(1, Relaxed);
        if STUCK.load(Relaxed) != 0 {
            STUCK.store(0, Relaxed);
        }
    }
    answer
}

/// One attempt, to the journal's successor where it was restarted.
fn offer(bytes: &[u8]) -> Result<(), i32> {
    let socket = socket_of(connected().map_err(errno_of)?);
    match socket.send(bytes).map_err(errno_of) {
        Err(libc::ECONNREFUSED | libc::ECONNRESET | libc::ENOTCONN) => {
            socket.connect(socket_path()).map_err(errno_of)?;
            socket.send(bytes).map_err(errno_of).map(drop)
        }
        answer => answer.map(drop),
    }
}

/// Waits for room. After a wait that ended without any, the daemon takes nothing, and programs must not
/// stand still for it. Who takes the time that was earned since sets its beginning anew, so it is
/// taken once however many threads record.
fn wait(bytes: &[u8]) -> Result<(), i32> {
    let mut limit = u64::from(WAIT_MAX.load(Relaxed)) * MS;
    let taken = TAKEN.load(Relaxed);
    let now = monotonic_ns();
    let stuck = STUCK.load(Relaxed);
    if stuck != 0 {
        limit = limit.min(now.saturating_sub(stuck) / WAIT_SHARE);
        if limit < MS || STUCK.compare_exchange(stuck, now, Relaxed, Relaxed).is_err() {
            return Err(libc::EAGAIN);
        }
    }
    let answer = offer_within(bytes, limit);
    // Another thread may have been quicker each time. Then the daemon does take points.
    if limit > 0 && answer == Err(libc::EAGAIN) && taken == TAKEN.load(Relaxed) {
        STUCK.store(now, Relaxed);
    }
    answer
}

/// Another thread may take the room before us, so we may wait again.
fn offer_within(bytes: &[u8], limit_ns: u64) -> Result<(), i32> {
    let start = monotonic_ns();
    let mut spent = 0;
    let mut answer = Err(libc::EAGAIN);
    while answer == Err(libc::EAGAIN) && spent < limit_ns {
        let fd = connected().map_err(errno_of)?;
        let mut room = libc::PollFd { fd, events: libc::POLLOUT, revents: 0 };
        // SAFETY: poll writes into `room`, which outlives the call.
        unsafe { libc::poll(&mut room, 1, ((limit_ns - spent + MS - 1) / MS) as i32) };
        answer = offer(bytes);
        spent = monotonic_ns() - start;
    }
    answer
}
