//! An interval as a guard.

use crate::journal;
use crate::libc;
use crate::{enabled, Error, Point};
use std::panic::Location;
use std::time::Duration;

/// An interval that was begun. It ends when it goes out of scope.
#[must_use = "an interval ends when it goes out of scope; `_` drops it at once"]
#[derive(Debug)]
pub struct Interval<'a> {
    /// What the end will say; for values that are not known at the begin.
    pub point: Point<'a>,
    start: u64,
    id: u64,
    begun: Result<(), Error>, // what the end answers while the interval is not open
    open: bool,
    lost: bool, // the begin, and the end was not counted yet
    place: &'static Location<'static>,
}

impl<'a> Interval<'a> {
    pub(crate) fn begin(point: Point<'a>, place: &'static Location<'static>) -> Self {
        let start = journal::monotonic_ns();
        let mut interval = Interval { point, start, id: 0, begun: Ok(()), open: false, lost: false, place };
        if enabled() {
            // Unique in the process. A second begin with one id would take the place of the first.
            interval.id = journal::next_interval() << 40 ^ start;
            let mut message = point.message("begin", place);
            point.put_interval(&mut message, Some(interval.id));
            (interval.lost, interval.begun) = message.record(!point.no_wait);
            interval.open = interval.begun.is_ok();
        }
        interval
    }

    /// The answer of the begin.
    pub fn begun(&self) -> Result<(), Error> {
        self.begun
    }

    /// Ends it, with the time since its begin.
    #[track_caller]
    pub fn end(&mut self) -> Result<(), Error> {
        self.finish(None, Location::caller())
    }

    /// Ends an interval that measured an animation, at `frame_rate` frames a second.
    #[track_caller]
    pub fn end_animation(&mut self, frame_rate: f64) -> Result<(), Error> {
        self.finish(Some(frame_rate), Location::caller())
    }

    fn finish(&mut self, frame_rate: Option<f64>, place: &'static Location<'static>) -> Result<(), Error> {
        if !enabled() {
            return Ok(());
        }
        if !self.open {
            return self.end_unopened(place);
        }
        self.open = false;
        let elapsed = Duration::from_nanos(journal::monotonic_ns() - self.start);
        let mut message = self.point.message("end", place);
        self.point.put_interval(&mut message, Some(self.id));
        message.put("TESSEL_DURATION", format!("{}.{:09}", elapsed.as_secs(), elapsed.subsec_nanos()).as_bytes());
        if let Some(rate) = frame_rate {
            message.put_frame_rate(rate);
        }
        message.record(!self.point.no_wait).1
    }

    /// Where its begin is lost, the end is lost with it: alone it would pair with nothing. It counts
    /// once, however often it is tried.
    fn end_unopened(&mut self, place: &'static Location<'static>) -> Result<(), Error> {
        if self.lost {
            journal::count_lost();
            journal::say("lost", "its begin was lost", "", place);
        } else {
            let words = if self.begun.is_ok() { "the interval is not open" } else { "its begin was refused" };
            journal::say("refused", words, "", place);
        }
        self.lost = false;
        self.begun.and(Err(Error(libc::ECANCELED)))
    }
}

impl Drop for Interval<'_> {
    fn drop(&mut self) {
        if self.open || self.lost {
            let _ = self.finish(None, self.place);
        }
    }
}
