// Package tessel records trace points: events, intervals and animations for tessel_reporter.
//
//	tessel.Event(tessel.Point{Subsystem: "com.vantor.Calendar", Category: "View", Name: "Open",
//		Telemetry: true, String1: tessel.String{"period", "week"}, Number1: tessel.Int("events", 12)})
//
//	load := tessel.Begin(tessel.Point{Subsystem: "com.vantor.Calendar", Category: "View", Name: "Load"})
//	defer load.End()
//
// It needs Linux and the standard library alone. A trace point is an entry of the system journal and
// is sent as one datagram to the journal's socket.
//
// Every call answers nil or a syscall.Errno, which a program may ignore. These are mistakes of the
// caller, and nothing is recorded:
//
//	EINVAL        a subsystem or category that is empty; a text with a NUL
//	EBADMSG       a label without a value or the other way round
//	EDOM          a number or frame rate that is not finite
//	EMSGSIZE      a text longer than ValueMax bytes
//	ENOKEY        an attribute key that is empty, or holds '=' or a line feed
//	ENAMETOOLONG  an attribute key longer than KeyMax bytes
//	E2BIG         more than AttributesMax attributes
//	ECANCELED     the end of an interval that was begun while recording was off, or ended before
//
// Any other value means that the trace point is lost, and counted: EAGAIN, the journal had no room;
// ENOENT or ECONNREFUSED, no journal is running; EMSGSIZE, where the point is larger than the
// socket's buffer; or another error of the system.
//
// Waiting: where the journal has no room, a call waits for it, at most 20 ms. After a wait that ended
// in nothing, calls wait 1 ms in each second, until a trace point is taken again. NoWait of a Point,
// or TESSEL_TRACE_WAIT=0 in the environment, never waits; another number there is the longest wait in
// milliseconds, up to 1000.
//
// Losses: each later trace point says how many this process has lost so far. Go runs nothing at exit,
// so main says what is left; Close waits up to 1 s to do so:
//
//	func main() {
//		defer tessel.Close()
//
// TESSEL_TRACE in the environment, read by the first call: 0 records nothing; check tells mistakes
// and losses on standard error, once for each place in the source. Any goroutine may call any
// function.
package tessel

import (
	"math"
	"strconv"
	"strings"
	"syscall"
	"time"
)

const (
	ValueMax      = 4096 // bytes of one text; of key, '=' and value of an attribute
	KeyMax        = 64   // bytes of an attribute key
	AttributesMax = 32   // attributes of one trace point
)

// String is a labelled string; absent while both are empty. One of them alone is a mistake.
type String struct{ Label, Value string }

// Number is a labelled number, made by Int, Uint or Float; absent without a label.
type Number struct {
	label, text string
	finite      bool
}

func Int(label string, value int64) Number {
	return Number{label, strconv.FormatInt(value, 10), true}
}

func Uint(label string, value uint64) Number {
	return Number{label, strconv.FormatUint(value, 10), true}
}

func Float(label string, value float64) Number {
	text, finite := decimal(value)
	return Number{label, text, finite}
}

// Attribute of an interval. The key is not empty and holds neither '=' nor a line feed.
type Attribute struct{ Key, Value string }

// Point is one trace point. What is zero is absent; Subsystem and Category are required.
type Point struct {
	Subsystem, Category, Name string
	String1, String2          String
	Number1, Number2          Number
	Attributes                []Attribute
	IntervalID                string // pairs begin and end; absent: an id of the interval's own
	SystemScope               bool   // begin and end may come from different processes
	Telemetry                 bool   // may be reported; without it the point stays on the machine
	NoWait                    bool   // rather lost than waited for
}

// Enabled tells whether trace points are recorded: ask before work that is done for one only.
func Enabled() bool { return mode() != modeOff }

// Enable switches recording on or off for the program, whatever the environment says.
func Enable(on bool) { setMode(on) }

// Lost is how many trace points this process has lost so far.
func Lost() uint64 { return lost.Load() }

// Close says how many points were lost, where no later point has said so. Recording goes on after it.
func Close() { flush() }

// Event records a single event. An IntervalID and SystemScope mean nothing to it.
func Event(point Point) error {
	if !Enabled() {
		return nil
	}
	message := newMessage("event", &point)
	if point.IntervalID != "" {
		say("dropped", "an event has no interval_id", "")
	}
	if point.SystemScope {
		say("dropped", "an event has no scope", "")
	}
	_, err := message.record()
	return err
}

// End ends an interval that was begun elsewhere, perhaps by another process in system scope. The
// reader takes the duration from the two times.
func End(point Point) error {
	if !Enabled() {
		return nil
	}
	message := newMessage("end", &point)
	message.interval(&point, 0)
	_, err := message.record()
	return err
}

// Interval was begun by Begin. Point may be changed until the end; what the end says wins.
type Interval struct {
	Point Point
	start time.Time
	id    uint64
	err   error // of the begin; what the end answers while the interval is not open
	open  bool
	lost  bool // the begin, and the end was not counted yet
}

// Begin begins an interval. Err of the result answers whether that was recorded.
func Begin(point Point) *Interval {
	interval := &Interval{Point: point, start: time.Now()}
	if !Enabled() {
		return interval
	}
	// Unique in the process. A second begin with one id would take the place of the first.
	interval.id = intervals.Add(1)<<40 ^ uint64(interval.start.UnixNano())
	message := newMessage("begin", &point)
	message.interval(&point, interval.id)
	interval.lost, interval.err = message.record()
	interval.open = interval.err == nil
	return interval
}

// Err is the answer of the begin.
func (i *Interval) Err() error { return i.err }

// End ends the interval, with the time since its begin.
func (i *Interval) End() error { return i.end(nil) }

// EndAnimation ends an interval that measured an animation, at frameRate frames a second.
func (i *Interval) EndAnimation(frameRate float64) error {
	return i.end(&frameRate)
}

func (i *Interval) end(frameRate *float64) error {
	if !Enabled() {
		return nil
	}
	if !i.open {
		return i.endUnopened()
	}
	i.open = false
	message := newMessage("end", &i.Point)
	message.interval(&i.Point, i.id)
	message.duration(time.Since(i.start))
	if frameRate != nil {
		message.frameRate(*frameRate)
	}
	_, err := message.record()
	return err
}

// endUnopened: where its begin is lost, the end is lost with it, since alone it would pair with
// nothing. It counts once, however often it is tried.
func (i *Interval) endUnopened() error {
	effect, words := "refused", "its begin was refused"
	if i.lost {
		countLost()
		effect, words = "lost", "its begin was lost"
	} else if i.err == nil {
		words = "the interval is not open"
	}
	i.lost = false
	say(effect, words, "")
	if i.err == nil {
		return syscall.ECANCELED
	}
	return i.err
}

// decimal is text that reads back as the same double, never as an integer.
func decimal(value float64) (text string, finite bool) {
	if math.IsNaN(value) || math.IsInf(value, 0) {
		return "", false
	}
	text = strconv.FormatFloat(value, 'g', 15, 64)
	if readBack, _ := strconv.ParseFloat(text, 64); readBack != value {
		text = strconv.FormatFloat(value, 'g', 17, 64)
	}
	if !strings.ContainsAny(text, ".e") {
		text += ".0"
	}
	return text, true
}
