"""Records what the lines of standard input say, and answers each action with its errno value."""
import os
import socket
import sys

import tessel

TEXTS = {"s": "string", "n": "number"}
intervals = {}
point = {}
names = ()


def text(word):
    return None if word == "-" else os.fsdecode(bytes.fromhex(word[1:]))


def shrink_sockets():
    for fd in range(3, 64):
        try:
            with socket.socket(fileno=os.dup(fd)) as sock:
                sock.setsockopt(socket.SOL_SOCKET, socket.SO_SNDBUF, 4096)
        except OSError:
            pass


def add(word, words):
    if word[1] == "s":
        point["string" + word[2]] = (text(next(words)), text(next(words)))
    elif word[1] == "n":
        label, kind, value = text(next(words)), next(words), next(words)
        point["number" + word[2]] = (label, float(value) if kind == "d" else int(value))
    elif word[1] == "a":
        key, value = text(next(words)), text(next(words))
        point.setdefault("attributes", {})[key] = value
    else:
        key = {"i": "interval_id", "y": "system_scope", "t": "telemetry", "w": "no_wait"}[word[1]]
        point[key] = text(next(words)) if word[1] == "i" else True


def end(token, **more):
    interval = intervals[token]
    for key, value in zip(("subsystem", "category", "name"), names):
        setattr(interval, key, value)
    for key, value in point.items():
        setattr(interval, key, value)
    return interval.end(**more)


def act(word, words):
    if word == "v":
        return tessel.event(*names, **point)
    if word[0] == "b":
        intervals[word] = interval = tessel.interval(*names, **point)
        return interval.begin()
    if word == "e":
        return tessel.end(*names, **point)
    if word[0] == "e":
        return end("b" + word[1:])
    if word[0] == "a":
        return end("b" + word[1:], frame_rate=float(next(words)))
    if word == "r":
        return sum(tessel.event(*names, **point) != 0 for _ in range(int(next(words))))
    if word == "z":
        return shrink_sockets() or 0
    return tessel.enable(next(words) == "1") or 0


def run(words):
    global point, names
    for word in words:
        if word == "new":
            names, point = (text(next(words)), text(next(words)), text(next(words))), {}
        elif word[0] == "+":
            add(word, words)
        elif word == "fork":
            child = os.fork()
            if child:
                os.waitpid(child, 0)
                sys.exit(0)
            return 0
        else:
            return act(word, words)


for line in iter(sys.stdin.readline, ""):
    print(run(iter(line.split())), flush=True)
