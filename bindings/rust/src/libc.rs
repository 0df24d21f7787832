//! The part of the C library that the standard library does not offer. Every Rust program on Linux links
//! it. The errno values are those of all architectures of Linux but Alpha, MIPS, PA-RISC and SPARC.

use std::os::raw::{c_int, c_long, c_short, c_ulong, c_void};

pub const ENOENT: i32 = 2;
pub const EIO: i32 = 5;
pub const E2BIG: i32 = 7;
pub const EAGAIN: i32 = 11;
pub const EINVAL: i32 = 22;
pub const EDOM: i32 = 33;
pub const ENAMETOOLONG: i32 = 36;
pub const EMSGSIZE: i32 = 90;
pub const ECONNRESET: i32 = 104;
pub const ENOTCONN: i32 = 107;
pub const ECONNREFUSED: i32 = 111;
pub const ECANCELED: i32 = 125;
pub const ENOKEY: i32 = 126;
pub const POLLOUT: c_short = 4;
pub const AT_SECURE: c_ulong = 23;
pub const CLOCK_MONOTONIC: c_int = 1;
pub const SOL_SOCKET: c_int = 1;
pub const SO_SNDBUF: c_int = 7;

#[repr(C)]
pub struct PollFd {
    pub fd: c_int,
    pub events: c_short,
    pub revents: c_short,
}

#[repr(C)]
pub struct TimeSpec {
    pub seconds: c_long,
    pub nanoseconds: c_long,
}

extern "C" {
    pub fn poll(fds: *mut PollFd, count: c_ulong, timeout_ms: c_int) -> c_int;
    pub fn getauxval(kind: c_ulong) -> c_ulong;
    pub fn atexit(call: extern "C" fn()) -> c_int;
    pub fn clock_gettime(clock: c_int, time: *mut TimeSpec) -> c_int;
    pub fn setsockopt(fd: c_int, level: c_int, name: c_int, value: *const c_void, size: u32) -> c_int;
}
