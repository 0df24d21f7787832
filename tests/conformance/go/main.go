// Records what the lines of standard input say, and answers each action with its errno value.
package main

import (
	"bufio"
	"encoding/hex"
	"fmt"
	"os"
	"strconv"
	"strings"
	"syscall"

	"tessel"
)

var (
	words     []string
	point     tessel.Point
	intervals [8]*tessel.Interval
)

func next() string {
	word := words[0]
	words = words[1:]
	return word
}

func text() string {
	bytes, _ := hex.DecodeString(strings.TrimPrefix(next(), "x"))
	return string(bytes)
}

func number() tessel.Number {
	label, kind, value := text(), next(), next()
	switch kind {
	case "i":
		whole, _ := strconv.ParseInt(value, 10, 64)
		return tessel.Int(label, whole)
	case "u":
		whole, _ := strconv.ParseUint(value, 10, 64)
		return tessel.Uint(label, whole)
	}
	fraction, _ := strconv.ParseFloat(value, 64)
	return tessel.Float(label, fraction)
}

func add(word string) {
	switch word {
	case "+s1":
		point.String1 = tessel.String{Label: text(), Value: text()}
	case "+s2":
		point.String2 = tessel.String{Label: text(), Value: text()}
	case "+n1":
		point.Number1 = number()
	case "+n2":
		point.Number2 = number()
	case "+a":
		point.Attributes = append(point.Attributes, tessel.Attribute{Key: text(), Value: text()})
	case "+i":
		point.IntervalID = text()
	case "+y":
		point.SystemScope = true
	case "+t":
		point.Telemetry = true
	case "+w":
		point.NoWait = true
	}
}

func act(word string) error {
	token := 0
	if len(word) == 3 {
		token = int(word[2] - '0')
	}
	switch word[0] {
	case 'v':
		return tessel.Event(point)
	case 'b':
		intervals[token] = tessel.Begin(point)
		return intervals[token].Err()
	case 'e':
		if word == "e" {
			return tessel.End(point)
		}
		intervals[token].Point = point
		return intervals[token].End()
	case 'a':
		rate, _ := strconv.ParseFloat(next(), 64)
		intervals[token].Point = point
		return intervals[token].EndAnimation(rate)
	case 'r':
		count, _ := strconv.Atoi(next())
		failed := syscall.Errno(0)
		for ; count > 0; count-- {
			if tessel.Event(point) != nil {
				failed++
			}
		}
		return failed
	case 'z':
		for fd := 3; fd < 64; fd++ {
			syscall.SetsockoptInt(fd, syscall.SOL_SOCKET, syscall.SO_SNDBUF, 4096)
		}
	case 'o':
		tessel.Enable(next() == "1")
	}
	return nil
}

func run() error {
	for len(words) > 0 {
		word := next()
		switch {
		case word == "new":
			point = tessel.Point{Subsystem: text(), Category: text(), Name: text()}
		case word[0] == '+':
			add(word)
		default:
			return act(word)
		}
	}
	return nil
}

func main() {
	defer tessel.Close()
	lines := bufio.NewScanner(os.Stdin)
	lines.Buffer(nil, 1<<20)
	for lines.Scan() {
		words = strings.Fields(lines.Text())
		number, _ := run().(syscall.Errno)
		fmt.Println(int(number))
	}
}
