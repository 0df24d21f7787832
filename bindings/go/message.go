package tessel

// The message of a trace point: fields in the journal's native form, and the rules for them.

import (
	"encoding/binary"
	"fmt"
	"math"
	"strconv"
	"strings"
	"syscall"
	"time"
	"unicode/utf8"
)

// message is a datagram in the making. The first rule that its point breaks stays in refused.
type message struct {
	bytes   []byte
	noWait  bool
	refused syscall.Errno
	words   string
	kind    string // stands for words where we ask whether they were told: it lacks the numbers
}

func (m *message) refuse(err syscall.Errno, words, kind string) {
	if m.refused == 0 {
		m.refused, m.words, m.kind = err, words, kind
	}
}

func (m *message) refuseSize(err syscall.Errno, what string, size, limit int) {
	m.refuse(err, fmt.Sprintf("%s has %d bytes, the limit is %d", what, size, limit), what)
}

// put adds a field. A value with a line feed goes by length, or it could forge fields.
func (m *message) put(name, value string) {
	if len(value) > ValueMax {
		m.refuseSize(syscall.EMSGSIZE, name, len(value), ValueMax)
		return
	}
	if strings.IndexByte(value, 0) >= 0 {
		m.refuse(syscall.EINVAL, name+" holds a NUL", "")
		return
	}
	if check && !utf8.ValidString(value) {
		say("changed", name+" is not UTF-8", "")
	}
	m.bytes = append(m.bytes, name...)
	if strings.IndexByte(value, '\n') >= 0 {
		m.bytes = append(m.bytes, '\n')
		m.bytes = binary.LittleEndian.AppendUint64(m.bytes, uint64(len(value)))
	} else {
		m.bytes = append(m.bytes, '=')
	}
	m.bytes = append(m.bytes, value...)
	m.bytes = append(m.bytes, '\n')
}

func (m *message) putPresent(name, value string) {
	if value != "" {
		m.put(name, value)
	}
}

func (m *message) putRequired(name, value, words string) {
	if value == "" {
		m.refuse(syscall.EINVAL, words, "")
	}
	m.put(name, value)
}

func (m *message) putString(slot string, value String) {
	if value == (String{}) {
		return
	}
	if value.Label == "" {
		m.refuse(syscall.EBADMSG, slot+" has a value and no label", "")
	} else if value.Value == "" {
		m.refuse(syscall.EBADMSG, slot+" has a label and no value", "")
	}
	name := "TESSEL_" + strings.ToUpper(slot)
	m.put(name+"_NAME", value.Label)
	m.put(name+"_VALUE", value.Value)
}

func (m *message) putNumber(slot string, value Number) {
	if value.label == "" {
		if value.text != "" {
			say("dropped", slot+" has a value and no label", "")
		}
		return
	}
	if !value.finite {
		m.refuse(syscall.EDOM, slot+" is not finite", "")
	}
	name := "TESSEL_" + strings.ToUpper(slot)
	m.put(name+"_NAME", value.label)
	m.put(name+"_VALUE", value.text)
}

func (m *message) putAttribute(attribute Attribute) {
	text := attribute.Key + "=" + attribute.Value
	switch {
	case attribute.Key == "":
		m.refuse(syscall.ENOKEY, "an attribute has no key", "")
	case strings.ContainsAny(attribute.Key, "=\n"):
		m.refuse(syscall.ENOKEY, "an attribute key holds '=' or a line feed", "")
	case len(attribute.Key) > KeyMax:
		m.refuseSize(syscall.ENAMETOOLONG, "an attribute key", len(attribute.Key), KeyMax)
	case len(text) > ValueMax:
		m.refuseSize(syscall.EMSGSIZE, "an attribute", len(text), ValueMax)
	default:
		m.put("TESSEL_ATTRIBUTE", text)
	}
}

func (m *message) putAttributes(attributes []Attribute) {
	if len(attributes) > AttributesMax {
		words := fmt.Sprintf("there are %d attributes, the limit is %d", len(attributes), AttributesMax)
		m.refuse(syscall.E2BIG, words, "attributes")
		return
	}
	for i, attribute := range attributes {
		m.putAttribute(attribute)
		for j := 0; check && j < i; j++ {
			if attributes[j].Key == attribute.Key {
				say("dropped", "two attributes have one key", "")
			}
		}
	}
}

// newMessage holds the fields of every kind of point. Priority debug: the journal then counts trace
// points against its rate limit apart from the program's own messages.
func newMessage(kind string, point *Point) *message {
	m := &message{bytes: make([]byte, 0, 512), noWait: point.NoWait}
	m.put("TESSEL_KIND", kind)
	m.put("PRIORITY", "7")
	m.putRequired("TESSEL_SUBSYSTEM", point.Subsystem, "the subsystem is missing")
	m.putRequired("TESSEL_CATEGORY", point.Category, "the category is missing")
	m.putPresent("TESSEL_NAME", point.Name)
	if point.Telemetry {
		m.put("TESSEL_TELEMETRY", "1")
	}
	m.putString("string1", point.String1)
	m.putString("string2", point.String2)
	m.putNumber("number1", point.Number1)
	m.putNumber("number2", point.Number2)
	m.putAttributes(point.Attributes)
	return m
}

// interval adds what only intervals carry. id: 0 where the interval has none of its own.
func (m *message) interval(point *Point, id uint64) {
	if point.IntervalID != "" {
		m.put("TESSEL_INTERVAL_ID", point.IntervalID)
	} else if id != 0 {
		m.put("TESSEL_INTERVAL_ID", strconv.FormatUint(id, 10))
	}
	if point.SystemScope {
		m.put("TESSEL_INTERVAL_SCOPE", "system")
	}
}

func (m *message) duration(elapsed time.Duration) {
	m.put("TESSEL_DURATION", fmt.Sprintf("%d.%09d", elapsed/time.Second, elapsed%time.Second))
}

// frameRate: the reader keeps it as a 32-bit float, so one that is no such float would cost the
// interval.
func (m *message) frameRate(rate float64) {
	text, _ := decimal(rate)
	if narrow := float64(float32(rate)); math.IsNaN(narrow) || math.IsInf(narrow, 0) {
		m.refuse(syscall.EDOM, "frame_rate is not finite", "")
	}
	m.put("TESSEL_FRAME_RATE", text)
}

func (m *message) losses(total uint64) {
	if total > 0 {
		m.put("TESSEL_LOST", strconv.FormatUint(total, 10))
		m.put("TESSEL_LOST_SINCE", strconv.FormatInt(since.Load(), 10))
	}
}
