//! The message of a trace point: fields in the journal's native form, and the rules for them.

use crate::journal;
use crate::libc;
use crate::{Error, Number, ATTRIBUTES_MAX, KEY_MAX, VALUE_MAX};
use std::panic::Location;

/// A datagram in the making. The first rule that its point breaks stays in `refused`.
pub(crate) struct Message {
    bytes: Vec<u8>,
    refused: Option<Refusal>,
    place: &'static Location<'static>,
}

struct Refusal {
    error: i32,
    words: String,
    /// Stands for the words where we ask whether they were told: it lacks the numbers.
    kind: String,
}

impl Message {
    pub(crate) fn new(place: &'static Location<'static>) -> Self {
        Message { bytes: Vec::with_capacity(512), refused: None, place }
    }

    fn refuse(&mut self, error: i32, words: String) {
        self.refused.get_or_insert(Refusal { error, words, kind: String::new() });
    }

    fn refuse_size(&mut self, error: i32, what: &str, size: usize, limit: usize) {
        let words = format!("{} has {} bytes, the limit is {}", what, size, limit);
        self.refused.get_or_insert(Refusal { error, words, kind: what.to_string() });
    }

    /// Adds a field. A value with a line feed goes by length, or it could forge fields.
    pub(crate) fn put(&mut self, name: &str, value: &[u8]) {
        if value.len() > VALUE_MAX {
            return self.refuse_size(libc::EMSGSIZE, name, value.len(), VALUE_MAX);
        }
        if value.contains(&0) {
            return self.refuse(libc::EINVAL, format!("{} holds a NUL", name));
        }
        if journal::checks() && std::str::from_utf8(value).is_err() {
            journal::say("changed", &format!("{} is not UTF-8", name), "", self.place);
        }
        self.bytes.extend_from_slice(name.as_bytes());
        if value.contains(&b'\n') {
            self.bytes.push(b'\n');
            self.bytes.extend_from_slice(&(value.len() as u64).to_le_bytes());
        } else {
            self.bytes.push(b'=');
        }
        self.bytes.extend_from_slice(value);
        self.bytes.push(b'\n');
    }

    pub(crate) fn put_required(&mut self, name: &str, value: &[u8], words: &str) {
        if value.is_empty() {
            self.refuse(libc::EINVAL, words.to_string());
        }
        self.put(name, value);
    }

    /// A double is text that reads back as the same double, never as an integer.
    pub(crate) fn put_number(&mut self, name: &str, value: Number, words: &str) {
        let text = match value {
            Number::Signed(value) => value.to_string(),
            Number::Unsigned(value) => value.to_string(),
            Number::Float(value) if value.is_finite() => decimal(value),
            Number::Float(_) => return self.refuse(libc::EDOM, format!("{} is not finite", words)),
        };
        self.put(name, text.as_bytes());
    }

    /// The reader keeps it as a 32-bit float, so one that is no such float would cost the interval.
    pub(crate) fn put_frame_rate(&mut self, rate: f64) {
        let rate = if (rate as f32).is_finite() { rate } else { f64::NAN };
        self.put_number("TESSEL_FRAME_RATE", Number::Float(rate), "frame_rate");
    }

    pub(crate) fn put_attributes(&mut self, attributes: &[(&str, &str)]) {
        if attributes.len() > ATTRIBUTES_MAX {
            let words = format!("there are {} attributes, the limit is {}", attributes.len(), ATTRIBUTES_MAX);
            self.refused.get_or_insert(Refusal { error: libc::E2BIG, words, kind: "attributes".to_string() });
            return;
        }
        for (index, (key, value)) in attributes.iter().enumerate() {
            if attributes[..index].iter().any(|(other, _)| other == key) {
                journal::say("dropped", "two attributes have one key", "", self.place);
            }
            let text = format!("{}={}", key, value);
            if key.is_empty() {
                self.refuse(libc::ENOKEY, "an attribute has no key".to_string());
            } else if key.contains(['=', '\n']) {
                self.refuse(libc::ENOKEY, "an attribute key holds '=' or a line feed".to_string());
            } else if key.len() > KEY_MAX {
                self.refuse_size(libc::ENAMETOOLONG, "an attribute key", key.len(), KEY_MAX);
            } else if text.len() > VALUE_MAX {
                self.refuse_size(libc::EMSGSIZE, "an attribute", text.len(), VALUE_MAX);
            } else {
                self.put("TESSEL_ATTRIBUTE", text.as_bytes());
            }
        }
    }

    pub(crate) fn put_losses(&mut self, total: u64, since: u64) {
        if total > 0 {
            self.put("TESSEL_LOST", total.to_string().as_bytes());
            self.put("TESSEL_LOST_SINCE", since.to_string().as_bytes());
        }
    }

    pub(crate) fn bytes(&self) -> &[u8] {
        &self.bytes
    }

    /// Sends the message, and tells whether its point is lost. A point that breaks a rule is no lost
    /// one: that is a mistake of the program, and the same every time.
    pub(crate) fn record(self, may_wait: bool) -> (bool, Result<(), Error>) {
        let place = self.place;
        if let Some(refusal) = self.refused {
            journal::say("refused", &refusal.words, &refusal.kind, place);
            return (false, Err(Error(refusal.error)));
        }
        let error = match journal::send(self, may_wait) {
            Ok(()) => return (false, Ok(())),
            Err(error) => error,
        };
        let words = match error {
            libc::EAGAIN => "the journal has no room".to_string(),
            libc::ENOENT | libc::ECONNREFUSED => "no journal is running".to_string(),
            _ => Error(error).to_string(),
        };
        journal::say("lost", &words, "", place);
        (true, Err(Error(error)))
    }
}

/// The value in its 15 or, where those do not read back as the same double, 17 digits: never an integer.
fn decimal(value: f64) -> String {
    let mut digits = 15;
    let mut text = format!("{:.14e}", value);
    if text.parse() != Ok(value) {
        digits = 17;
        text = format!("{:.16e}", value);
    }
    let (mantissa, exponent) = text.split_once('e').unwrap_or((&text, "0"));
    let exponent: i32 = exponent.parse().unwrap_or(0);
    let without_zeros = |text: &str| text.trim_end_matches('0').trim_end_matches('.').to_string();
    if exponent < -4 || exponent >= digits {
        let sign = if exponent < 0 { '-' } else { '+' };
        return format!("{}e{}{:02}", without_zeros(mantissa), sign, exponent.abs());
    }
    let text = format!("{:.*}", (digits - 1 - exponent) as usize, value);
    let text = if text.contains('.') { without_zeros(&text) } else { text };
    if text.contains('.') {
        text
    } else {
        text + ".0"
    }
}
