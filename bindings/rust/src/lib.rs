//! Trace points: records events, intervals and animations for tessel_reporter.
//!
//! ```no_run
//! use tessel::Point;
//!
//! let open = Point::new("com.vantor.Calendar", "View", "Open").string1("period", "week").number1("events", 12);
//! open.telemetry().event().ok();
//!
//! let mut load = Point::new("com.vantor.Calendar", "View", "Load").telemetry().begin();
//! load.point = load.point.number1("bytes", 4096u64); // known only now
//! // ends where the scope does
//! ```
//!
//! It needs Linux and the standard library alone. A trace point is an entry of the system journal and
//! is sent as one datagram to the journal's socket.
//!
//! Every call answers an [`Error`] that holds an errno value. A program may ignore it. These are
//! mistakes of the caller, and nothing is recorded:
//!
//! | errno | means |
//! |---|---|
//! | `EINVAL` | a subsystem or category that is empty; a text with a NUL |
//! | `EDOM` | a number or frame rate that is not finite |
//! | `EMSGSIZE` | a text longer than [`VALUE_MAX`] bytes |
//! | `ENOKEY` | an attribute key that is empty, or holds '=' or a line feed |
//! | `ENAMETOOLONG` | an attribute key longer than [`KEY_MAX`] bytes |
//! | `E2BIG` | more than [`ATTRIBUTES_MAX`] attributes |
//! | `ECANCELED` | the end of an interval that was begun while recording was off, or ended before |
//!
//! Any other value means that the trace point is lost, and counted: `EAGAIN`, the journal had no room;
//! `ENOENT` or `ECONNREFUSED`, no journal is running; `EMSGSIZE`, where the point is larger than the
//! socket's buffer; or another error of the system.
//!
//! Waiting: where the journal has no room, a call waits for it, at most 20 ms. After a wait that ended
//! in nothing, calls wait 1 ms in each second, until a trace point is taken again. [`Point::no_wait`],
//! or `TESSEL_TRACE_WAIT=0` in the environment, never waits; another number there is the longest wait
//! in milliseconds, up to 1000.
//!
//! Losses: each later trace point says how many this process has lost so far. When `main` returns or
//! calls `std::process::exit`, the process says it once more where the number has grown since, and
//! waits up to 1 s to do so. A signal that kills skips that: call [`flush`] before. A forked child
//! counts for itself, from zero.
//!
//! `TESSEL_TRACE` in the environment, read by the first call: `0` records nothing; `check` tells
//! mistakes and losses on standard error, once for each place in the source. Any thread may call any
//! function.

#![cfg(target_os = "linux")]

mod interval;
mod journal;
mod libc;
mod message;

pub use interval::Interval;
use message::Message;
use std::panic::Location;

/// Bytes of one text; of key, '=' and value of an attribute.
pub const VALUE_MAX: usize = 4096;
/// Bytes of an attribute key.
pub const KEY_MAX: usize = 64;
/// Attributes of one trace point.
pub const ATTRIBUTES_MAX: usize = 32;

/// Why a trace point was not recorded.
#[derive(Clone, Copy, Debug, PartialEq, Eq)]
pub struct Error(i32);

impl Error {
    /// The errno value.
    pub fn errno(self) -> i32 {
        self.0
    }
}

impl std::fmt::Display for Error {
    fn fmt(&self, formatter: &mut std::fmt::Formatter<'_>) -> std::fmt::Result {
        std::io::Error::from_raw_os_error(self.0).fmt(formatter)
    }
}

impl std::error::Error for Error {}

/// The value of a labelled number. Integers stay integers.
#[derive(Clone, Copy, Debug)]
pub enum Number {
    Signed(i64),
    Unsigned(u64),
    Float(f64),
}

macro_rules! number_from {
    ($kind:ident, $wide:ty: $($narrow:ty)*) => {
        $(impl From<$narrow> for Number {
            fn from(value: $narrow) -> Self {
                Number::$kind(value as $wide)
            }
        })*
    };
}
number_from!(Signed, i64: i8 i16 i32 i64 isize);
number_from!(Unsigned, u64: u8 u16 u32 u64 usize);
number_from!(Float, f64: f32 f64);

type Text<'a> = &'a [u8];

/// One trace point. It keeps references: its texts must outlive it and every interval made of it. A
/// text is a `str`, or bytes that need not be UTF-8.
#[derive(Clone, Copy, Debug)]
pub struct Point<'a> {
    subsystem: Text<'a>,
    category: Text<'a>,
    name: Option<Text<'a>>,
    strings: [Option<(Text<'a>, Text<'a>)>; 2],
    numbers: [Option<(Text<'a>, Number)>; 2],
    attributes: &'a [(&'a str, &'a str)],
    interval_id: Option<Text<'a>>,
    system_scope: bool,
    telemetry: bool,
    no_wait: bool,
}

impl<'a> Point<'a> {
    pub fn new<S, C, N>(subsystem: &'a S, category: &'a C, name: &'a N) -> Self
    where
        S: AsRef<[u8]> + ?Sized,
        C: AsRef<[u8]> + ?Sized,
        N: AsRef<[u8]> + ?Sized,
    {
        Point { name: Some(name.as_ref()), ..Self::unnamed(subsystem, category) }
    }

    /// A point that is told apart by subsystem and category alone.
    pub fn unnamed<S, C>(subsystem: &'a S, category: &'a C) -> Self
    where
        S: AsRef<[u8]> + ?Sized,
        C: AsRef<[u8]> + ?Sized,
    {
        Point {
            subsystem: subsystem.as_ref(),
            category: category.as_ref(),
            name: None,
            strings: [None; 2],
            numbers: [None; 2],
            attributes: &[],
            interval_id: None,
            system_scope: false,
            telemetry: false,
            no_wait: false,
        }
    }

    #[must_use]
    pub fn string1<L, V>(mut self, label: &'a L, value: &'a V) -> Self
    where
        L: AsRef<[u8]> + ?Sized,
        V: AsRef<[u8]> + ?Sized,
    {
        self.strings[0] = Some((label.as_ref(), value.as_ref()));
        self
    }

    #[must_use]
    pub fn string2<L, V>(mut self, label: &'a L, value: &'a V) -> Self
    where
        L: AsRef<[u8]> + ?Sized,
        V: AsRef<[u8]> + ?Sized,
    {
        self.strings[1] = Some((label.as_ref(), value.as_ref()));
        self
    }

    #[must_use]
    pub fn number1<L: AsRef<[u8]> + ?Sized>(mut self, label: &'a L, value: impl Into<Number>) -> Self {
        self.numbers[0] = Some((label.as_ref(), value.into()));
        self
    }

    #[must_use]
    pub fn number2<L: AsRef<[u8]> + ?Sized>(mut self, label: &'a L, value: impl Into<Number>) -> Self {
        self.numbers[1] = Some((label.as_ref(), value.into()));
        self
    }

    /// Key and value each. A key is not empty and holds neither '=' nor a line feed.
    #[must_use]
    pub fn attributes(mut self, attributes: &'a [(&'a str, &'a str)]) -> Self {
        self.attributes = attributes;
        self
    }

    /// Pairs begin and end. Without it an interval has an id of its own.
    #[must_use]
    pub fn interval_id<I: AsRef<[u8]> + ?Sized>(mut self, id: &'a I) -> Self {
        self.interval_id = Some(id.as_ref());
        self
    }

    /// Begin and end may come from different processes.
    #[must_use]
    pub fn system_scope(mut self) -> Self {
        self.system_scope = true;
        self
    }

    /// It may be reported. Without it the trace point stays on the machine.
    #[must_use]
    pub fn telemetry(mut self) -> Self {
        self.telemetry = true;
        self
    }

    /// Loses the point at once where the journal has no room.
    #[must_use]
    pub fn no_wait(mut self) -> Self {
        self.no_wait = true;
        self
    }

    /// Records a single event. An interval id and system scope mean nothing to it.
    #[track_caller]
    pub fn event(&self) -> Result<(), Error> {
        if !enabled() {
            return Ok(());
        }
        let place = Location::caller();
        if self.interval_id.is_some() {
            journal::say("dropped", "an event has no interval_id", "", place);
        }
        if self.system_scope {
            journal::say("dropped", "an event has no scope", "", place);
        }
        self.message("event", place).record(!self.no_wait).1
    }

    /// Begins an interval, which ends when the result goes out of scope, or before by one of its ends.
    #[track_caller]
    pub fn begin(&self) -> Interval<'a> {
        Interval::begin(*self, Location::caller())
    }

    /// Ends an interval that was begun elsewhere, perhaps by another process in system scope. The
    /// reader takes the duration from the two times.
    #[track_caller]
    pub fn end(&self) -> Result<(), Error> {
        if !enabled() {
            return Ok(());
        }
        let mut message = self.message("end", Location::caller());
        self.put_interval(&mut message, None);
        message.record(!self.no_wait).1
    }

    /// The fields of every kind of point. Priority debug: the journal then counts trace points against
    /// its rate limit apart from the program's own messages.
    fn message(&self, kind: &str, place: &'static Location<'static>) -> Message {
        let mut message = Message::new(place);
        message.put("TESSEL_KIND", kind.as_bytes());
        message.put("PRIORITY", b"7");
        message.put_required("TESSEL_SUBSYSTEM", self.subsystem, "the subsystem is missing");
        message.put_required("TESSEL_CATEGORY", self.category, "the category is missing");
        if let Some(name) = self.name {
            message.put("TESSEL_NAME", name);
        }
        if self.telemetry {
            message.put("TESSEL_TELEMETRY", b"1");
        }
        for (slot, pair) in self.strings.iter().enumerate() {
            if let Some((label, value)) = pair {
                message.put(["TESSEL_STRING1_NAME", "TESSEL_STRING2_NAME"][slot], label);
                message.put(["TESSEL_STRING1_VALUE", "TESSEL_STRING2_VALUE"][slot], value);
            }
        }
        for (slot, pair) in self.numbers.iter().enumerate() {
            if let Some((label, value)) = pair {
                message.put(["TESSEL_NUMBER1_NAME", "TESSEL_NUMBER2_NAME"][slot], label);
                message.put_number(
                    ["TESSEL_NUMBER1_VALUE", "TESSEL_NUMBER2_VALUE"][slot],
                    *value,
                    ["number1", "number2"][slot],
                );
            }
        }
        message.put_attributes(self.attributes);
        message
    }

    fn put_interval(&self, message: &mut Message, own_id: Option<u64>) {
        if let Some(id) = self.interval_id {
            message.put("TESSEL_INTERVAL_ID", id);
        } else if let Some(id) = own_id {
            message.put("TESSEL_INTERVAL_ID", id.to_string().as_bytes());
        }
        if self.system_scope {
            message.put("TESSEL_INTERVAL_SCOPE", b"system");
        }
    }
}

/// Whether trace points are recorded: ask before work that is done for a trace point only.
pub fn enabled() -> bool {
    journal::enabled()
}

/// Switches recording on or off for the program, whatever the environment says.
pub fn enable(on: bool) {
    journal::enable(on)
}

/// How many trace points this process has lost so far.
pub fn lost() -> u64 {
    journal::lost()
}

/// Says how many points were lost, where no later point has said so. The process does it at exit.
pub fn flush() {
    journal::flush()
}
