//! Records what the lines of standard input say, and answers each action with its errno value.
use std::io::{BufRead, Write};
use std::os::raw::{c_int, c_void};
use tessel::{Error, Interval, Number, Point};

extern "C" {
    fn fork() -> c_int;
    fn waitpid(process: c_int, status: *mut c_int, options: c_int) -> c_int;
    fn setsockopt(fd: c_int, level: c_int, name: c_int, value: *const c_void, size: u32) -> c_int;
}

/// Points keep references, so texts are never freed.
fn text(word: &str) -> Option<&'static [u8]> {
    let hex = word.strip_prefix('x')?.as_bytes();
    let bytes = hex.chunks(2).map(|pair| u8::from_str_radix(std::str::from_utf8(pair).unwrap(), 16).unwrap());
    Some(Box::leak(bytes.collect::<Vec<u8>>().into_boxed_slice()))
}

fn utf8(word: &str) -> &'static str {
    std::str::from_utf8(text(word).unwrap_or(b"")).unwrap_or("\u{fffd}")
}

fn number(kind: &str, value: &str) -> Number {
    match kind {
        "i" => Number::Signed(value.parse().unwrap()),
        "u" => Number::Unsigned(value.parse().unwrap()),
        _ => Number::Float(value.parse().unwrap()),
    }
}

fn errno(answer: Result<(), Error>) -> i32 {
    answer.map_or_else(|error| error.errno(), |_| 0)
}

struct Runner {
    point: Point<'static>,
    attributes: Vec<(&'static str, &'static str)>,
    intervals: Vec<Option<Interval<'static>>>,
}

impl Runner {
    fn add<'a>(&mut self, word: &str, mut next: impl FnMut() -> &'a str) {
        let point = self.point;
        self.point = match word {
            "+s1" => point.string1(text(next()).unwrap(), text(next()).unwrap()),
            "+s2" => point.string2(text(next()).unwrap(), text(next()).unwrap()),
            "+n1" => point.number1(text(next()).unwrap(), number(next(), next())),
            "+n2" => point.number2(text(next()).unwrap(), number(next(), next())),
            "+i" => point.interval_id(text(next()).unwrap()),
            "+y" => point.system_scope(),
            "+t" => point.telemetry(),
            "+w" => point.no_wait(),
            _ => {
                self.attributes.push((utf8(next()), utf8(next())));
                point.attributes(Vec::leak(self.attributes.clone()))
            }
        };
    }

    fn act<'a>(&mut self, word: &str, mut next: impl FnMut() -> &'a str) -> i32 {
        let token = word.bytes().nth(2).map_or(0, |digit| usize::from(digit - b'0'));
        let interval = &mut self.intervals[token];
        match &word[..1] {
            "v" => errno(self.point.event()),
            "b" => errno(interval.insert(self.point.begin()).begun()),
            "e" if word.len() == 1 => errno(self.point.end()),
            "e" | "a" => {
                let interval = interval.as_mut().unwrap();
                interval.point = self.point;
                errno(if word.starts_with('e') {
                    interval.end()
                } else {
                    interval.end_animation(next().parse().unwrap())
                })
            }
            "r" => (0..next().parse::<i32>().unwrap()).filter(|_| self.point.event().is_err()).count() as i32,
            "z" => {
                let size = 4096;
                (3..64).for_each(|fd| unsafe { setsockopt(fd, 1, 7, (&size as *const i32).cast(), 4); });
                0
            }
            _ => {
                tessel::enable(next() == "1");
                0
            }
        }
    }

    /// Nothing where the parent of a fork ends.
    fn run(&mut self, line: &str) -> Option<i32> {
        let mut words = line.split_whitespace();
        while let Some(word) = words.next() {
            let mut next = || words.next().unwrap();
            if word == "new" {
                let (subsystem, category) = (text(next()).unwrap_or(b""), text(next()).unwrap_or(b""));
                let name = text(next());
                self.point =
                    name.map_or(Point::unnamed(subsystem, category), |name| Point::new(subsystem, category, name));
                self.attributes.clear();
            } else if word.starts_with('+') {
                self.add(word, next);
            } else if word == "fork" {
                let child = unsafe { fork() };
                if child != 0 {
                    unsafe { waitpid(child, std::ptr::null_mut(), 0) };
                    return None;
                }
                return Some(0);
            } else {
                return Some(self.act(word, next));
            }
        }
        Some(-1)
    }
}

fn main() {
    let mut runner =
        Runner { point: Point::unnamed("", ""), attributes: vec![], intervals: (0..8).map(|_| None).collect() };
    for line in std::io::stdin().lock().lines() {
        match runner.run(&line.unwrap()) {
            Some(answer) => println!("{}", answer),
            None => break,
        }
        std::io::stdout().flush().unwrap();
    }
}
