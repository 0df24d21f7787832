#!/usr/bin/env python3
"""What files cost that were made to cost much: seconds a megabyte, and how late a stop is heeded.

bench/made_up_files.py BIN [MEGABYTES [NAME...]]: BIN holds the programs of a release build. `tesselctl explain
--summary` reads each file, and `stop_bench` stops the reading at random moments. Both figures are processor time
of the reader, so that a busy machine changes them little. A file that costs more than 0.25 s a megabyte, or a
stop that the reader heeds later than 50 ms, ends the program with 1.
"""
import lzma
import os
import re
import resource
import struct
import subprocess
import sys
import tempfile
import time

DATA, FIELD, ENTRY, ARRAY = 1, 2, 3, 6
XZ, LZ4, ZSTD = 1, 2, 4
COMPACT = 16
ONLINE, ARCHIVED = 1, 2
ENTRY_HEAD, ARRAY_HEAD = 64, 24
MAX_ITEMS = 2048
MOST_SECONDS, MOST_LATE = 0.25, 50.0
POINT = [b"TESSEL_KIND=event", b"TESSEL_SUBSYSTEM=com.vantor.a", b"TESSEL_CATEGORY=b", b"TESSEL_NAME=c"]


class Journal:
    """A file without hash tables, whose hashes are all wrong. Places are offsets in bytes."""

    def __init__(self, compact=False, state=ARCHIVED):
        self.compact = compact
        self.bytes = bytearray(272)
        self.bytes[0:8] = b"LPKSHHRH"
        self.bytes[16] = state
        struct.pack_into("<I", self.bytes, 12, XZ | LZ4 | 8 | (COMPACT if compact else 0))
        self.bytes[24:88] = bytes(range(64))
        self.put(88, 272)  # the size of the header
        self.now = int(time.time() * 1e6) - 3600 * 10**6
        self.numbers = 0
        self.data_head = 72 if compact else 64
        self.item_size = 4 if compact else 16

    def put(self, at, value):
        struct.pack_into("<Q", self.bytes, at, value)

    def here(self):
        self.bytes += bytes(-len(self.bytes) % 8)
        return len(self.bytes)

    def append(self, kind, body, size=None, flags=0):
        place = self.here()
        self.bytes += struct.pack("<BB6xQ", kind, flags, size or len(body) + 16) + body
        return place

    def data(self, text, flags=0, size=None, entries=2):
        head = struct.pack("<6Q", 0, 0, 0, 0, 0, entries) + bytes(self.data_head - 64)
        return self.append(DATA, head + text, size, flags)

    def entry(self, items, size=None):
        self.numbers += 1
        pack = "<I" if self.compact else "<Q8x"
        return self.append(ENTRY, struct.pack("<3Q16sQ", self.numbers, self.now + self.numbers, self.numbers,
                                              b"\1" * 16, 0)
                           + b"".join(struct.pack(pack, item) for item in items), size)

    def entries(self, items_of, size):
        """Entries until the file has `size` bytes; each has the items that items_of(number) answers."""
        places = []
        while len(self.bytes) < size:
            places.append(self.entry(items_of(len(places))))
        return places

    def array(self, places, after=0):
        return self.append(ARRAY, struct.pack(f"<Q{len(places)}{'I' if self.compact else 'Q'}", after, *places))

    def finish(self, array, count):
        self.put(96, self.here() - 272)
        self.put(136, len(self.bytes) - 8)
        self.put(152, count)
        self.put(160, count)
        self.put(168, 1)
        self.put(176, array)
        self.put(184, self.now + 1)
        self.put(192, self.now + self.numbers)
        self.put(200, self.numbers)
        return bytes(self.bytes)

    def listed(self, places):
        return self.finish(self.array(places), len(places))


def zstd_raw(text, window_log=None):
    """A frame of uncompressed blocks, or with the window that its head asks for."""
    head = struct.pack("<IBB", 0xFD2FB528, 0, (window_log - 10) << 3 if window_log else 0x58)
    blocks = b""
    for at in range(0, len(text), 1 << 17):
        piece = text[at:at + (1 << 17)]
        last = at + len(piece) == len(text)
        blocks += struct.pack("<I", len(piece) << 3 | last)[:3] + piece
    return head + blocks


def zstd_repeated(byte, length):
    """A frame of blocks that repeat one byte: 4 bytes for each 128 KiB."""
    head = struct.pack("<IBB", 0xFD2FB528, 0, 0x58)
    blocks = []
    while length:
        piece = min(length, 1 << 17)
        length -= piece
        blocks.append(struct.pack("<I", piece << 3 | 2 | (length == 0))[:3] + byte)
    return head + b"".join(blocks)


def lz4_repeated(text, length):
    """A block: the text, and then a match that repeats its last byte."""
    match = length - len(text) - 4 - 15
    return struct.pack("<Q", length) + b"\xff" + bytes([len(text) - 15]) + text + b"\1\0" \
        + b"\xff" * (match // 255) + bytes([match % 255])


def skippable_frames(size):
    """Values that share one payload of zstd frames which a decoder has to skip."""
    journal = Journal()
    points = [journal.data(point) for point in POINT]
    start = len(journal.bytes)
    values = [journal.data(b"", ZSTD, size - number * 64) for number in range(MAX_ITEMS - 4)]
    journal.bytes += struct.pack("<II", 0x184D2A50, 0) * ((size - (len(journal.bytes) - start)) // 8)
    return journal.listed([journal.entry([*points, *values])])


def frames_after_a_frame(size):
    """The same frames behind an empty one, which every value begins with."""
    journal = Journal()
    points = [journal.data(point) for point in POINT]
    empty = struct.pack("<IBB", 0xFD2FB528, 0, 0x58) + b"\1\0\0"
    values = [journal.data(empty, ZSTD, size - number * 80) for number in range(MAX_ITEMS - 4)]
    journal.bytes += struct.pack("<II", 0x184D2A50, 0) * ((size - len(journal.bytes)) // 8)
    return journal.listed([journal.entry([*points, *values])])


def empty_blocks(size):
    """Values that share one frame of blocks with nothing in them."""
    journal = Journal()
    points = [journal.data(point) for point in POINT]
    head = struct.pack("<IBB", 0xFD2FB528, 0, 0x58)
    count = 700  # their own bytes come out of the frame as well, and must not fill the reader's buffer
    values = []
    for number in range(count):
        # A block of all further values leads to the empty ones.
        block = struct.pack("<I", (count - number - 1) * 80 + 7 << 3)[:3]
        values.append(journal.data(head + block, ZSTD, size - number * 80))
    journal.here()
    journal.bytes += bytes(3) * ((size - len(journal.bytes)) // 3)
    return journal.listed([journal.entry([*points, *values])])


def overlapping_entries(size):
    """Entries of 2,048 items, each of which begins in the one before."""
    journal = Journal()
    places = [journal.entry([], ENTRY_HEAD + MAX_ITEMS * 16) for _ in range(size // (ENTRY_HEAD + 8))]
    journal.bytes += bytes(MAX_ITEMS * 16)
    return journal.listed(places)


def short_arrays(size):
    """A chain of arrays of one item, which is no entry."""
    journal = Journal(state=ONLINE)
    first = journal.entry([journal.data(POINT[0])])
    place = journal.here()
    count = size // 32
    for number in range(count):
        journal.array([first], place + (number + 1) * 32 if number + 1 < count else 0)
    return journal.finish(place, count)


def empty_arrays(size):
    """A chain of arrays without an item."""
    journal = Journal()
    place = journal.here()
    count = size // 24
    for number in range(count):
        journal.array([], place + (number + 1) * 24 if number + 1 < count else 0)
    return journal.finish(place, 1)


def overlapping_arrays(size):
    """A chain of arrays, each of which begins in the one before and ends with it. They list one entry."""
    journal = Journal()
    entry = journal.entry([journal.data(text) for text in POINT])
    place = journal.here()
    words = size // 8
    body = [entry] * words
    step = 64
    for at in range(0, words - step, step):
        body[at:at + 3] = [ARRAY, (words - at) * 8, place + (at + step) * 8 if at + 2 * step < words else 0]
    journal.bytes += struct.pack(f"<{words}Q", *body)
    return journal.finish(place, words)


def chain_that_turns_back(size):
    """Two arrays that link to one another, and a count that claims more."""
    journal = Journal()
    data = [journal.data(text) for text in POINT]
    places = journal.entries(lambda _: data, size)
    first = journal.array(places[:len(places) // 2])
    second = journal.array(places[len(places) // 2:], first)
    journal.put(first + 16, second)
    return journal.finish(first, 2 * len(places))


def objects_that_end_far_away(size):
    """Every sixteen bytes an object whose size leads into zeros."""
    journal = Journal()
    half = size // 2
    start = len(journal.bytes)
    for at in range(0, half, 16):
        journal.bytes += struct.pack("<BB6xQ", DATA, 0, half - at + at % 8000)
    journal.bytes += bytes(half) + b"\1"
    return journal.finish(start, 1)


def objects_that_lead_back_and_forth(size):
    """Objects that end where none begins, in a file that claims to be written still."""
    journal = Journal(state=ONLINE)
    start = len(journal.bytes)
    half = size // 2
    for at in range(0, half, 16):
        journal.bytes += struct.pack("<BB6xQ", DATA, 0, size - at - 8)
    journal.bytes += b"\xff" * half
    file = bytearray(journal.finish(journal.array([start + 8]), 2))
    struct.pack_into("<Q", file, 136, start)
    return bytes(file)


def tiny_objects(size):
    """Millions of the smallest objects, and one entry at the end."""
    journal = Journal()
    item = struct.pack("<BB6xQ", FIELD, 0, 41) + bytes(32)
    journal.bytes += item * (size // len(item))
    return journal.listed([journal.entry([journal.data(text) for text in POINT])])


def one_value_often(text, flags=0, compact=True):
    """Entries of 2,048 items, which all name one value."""
    def make(size):
        journal = Journal(compact)
        value = journal.data(text, flags)
        points = [journal.data(point) for point in POINT]
        return journal.listed(journal.entries(lambda _: [*points, *[value] * (MAX_ITEMS - 4)], size))
    return make


def values_in_turn(text, count, flags=0, compact=True):
    """Entries of 2,048 items, which name `count` values in turn: more than can be remembered at once."""
    def make(size):
        journal = Journal(compact)
        values = [journal.data(text, flags) for _ in range(count(size))]
        points = [journal.data(point) for point in POINT]
        items = MAX_ITEMS - 4
        def items_of(number):
            first = number * items % len(values)
            return [*points, *(values[first:] + values * (items // len(values) + 1))[:items]]
        return journal.listed(journal.entries(items_of, size))
    return make


def no_value(size):
    """Entries of 2,048 items, which lead to places far away that hold no value."""
    journal = Journal(True)
    points = [journal.data(point) for point in POINT]
    holes = len(journal.bytes)
    journal.bytes += b"\xff" * (size // 8)
    items = [holes + at * 8 for at in range(0, MAX_ITEMS - 4)]
    return journal.listed(journal.entries(lambda _: [*points, *items], size))


def far_values(size):
    """Short entries, each with a value of its own at the other end of the file."""
    journal = Journal(True)
    points = [journal.data(point) for point in POINT]
    far = [journal.data(b"TESSEL_NAME=%d" % number) for number in range(size // 200)]
    return journal.listed([journal.entry([*points, value]) for value in far])


def trace_points(size):
    """The most trace points that a file can hold: entries of the fields that they need, all different times."""
    journal = Journal(True)
    points = [journal.data(point) for point in POINT]
    return journal.listed(journal.entries(lambda _: points, size))


def export_stream(entry):
    def make(size):
        return entry * (size // len(entry))
    return make


def export_field(name, length, value):
    return name + b"\n" + struct.pack("<Q", length) + value + b"\n"


EXPORT_HEAD = b"__REALTIME_TIMESTAMP=%d\n" % (int(time.time() * 1e6) - 3600 * 10**6)
LONG = b"TESSEL_NAME=" + b"a" * (1 << 20)
BOMB = b"TESSEL_NAME="
XZ_BOMB = lzma.compress(BOMB + bytes(64 << 20), lzma.FORMAT_XZ, lzma.CHECK_NONE, preset=0)

FILES = {
    "skippable_frames": skippable_frames,
    "frames_after_a_frame": frames_after_a_frame,
    "empty_blocks": empty_blocks,
    "overlapping_entries": overlapping_entries,
    "empty_arrays": empty_arrays,
    "short_arrays": short_arrays,
    "overlapping_arrays": overlapping_arrays,
    "chain_that_turns_back": chain_that_turns_back,
    "objects_that_end_far_away": objects_that_end_far_away,
    "objects_that_lead_back_and_forth": objects_that_lead_back_and_forth,
    "tiny_objects": tiny_objects,
    "short_value_often": one_value_often(b"TESSEL_NAME=a"),
    "value_of_60_kb_often": one_value_often(LONG[:60_000]),
    "value_of_1_mb_often": one_value_often(LONG),
    "zstd_bomb_often": one_value_often(zstd_repeated(b"a", 64 << 20), ZSTD),
    "zstd_raw_often": one_value_often(zstd_raw(LONG), ZSTD),
    "lz4_bomb_often": one_value_often(lz4_repeated(BOMB + bytes(40), 4 << 20), LZ4),
    "xz_bomb_often": one_value_often(XZ_BOMB[:20_000], XZ),
    "values_of_100_bytes_in_turn": values_in_turn(LONG[:100], lambda size: size // 400),
    "values_of_60_kb_in_turn": values_in_turn(LONG[:60_000], lambda size: size // 120_000),
    "zstd_values_in_turn": values_in_turn(zstd_raw(LONG[:100]), lambda size: size // 400, ZSTD),
    "zstd_bombs": values_in_turn(zstd_repeated(b"a", 64 << 10), lambda size: size // 200, ZSTD),
    "zstd_windows": values_in_turn(zstd_raw(LONG[:100], 23), lambda size: size // 400, ZSTD),
    "lz4_bombs": values_in_turn(lz4_repeated(BOMB + bytes(40), 60_000), lambda size: size // 800, LZ4),
    "xz_bombs": values_in_turn(lzma.compress(BOMB + bytes(60_000), lzma.FORMAT_XZ, lzma.CHECK_NONE, preset=0),
                               lambda size: size // 400, XZ),
    "no_value": no_value,
    "far_values": far_values,
    "trace_points": trace_points,
    "export_lines": export_stream(b"\n"),
    "export_garbage": export_stream(b"a\n"),
    "export_wrong_lengths": export_stream(EXPORT_HEAD + export_field(b"T", 300_007, b"") + b"\n"),
    "export_longest_lengths": export_stream(EXPORT_HEAD + export_field(b"T", (768 << 20) - 1, b"") + b"\n"),
    "export_many_fields": export_stream(EXPORT_HEAD + b"TESSEL_NAME=a\n" * 10_000 + b"\n"),
    "export_points": export_stream(EXPORT_HEAD + b"\n".join(POINT) + b"\n\n"),
    "export_long_values": export_stream(EXPORT_HEAD + b"\n".join(POINT) + b"\n"
                                        + export_field(b"TESSEL_TEXT", 1 << 20, bytes(1 << 20)) + b"\n"),
}


def processor_seconds(command):
    """Of a command, in user and kernel, and what it prints."""
    before = resource.getrusage(resource.RUSAGE_CHILDREN)
    done = subprocess.run(command, capture_output=True, text=True, check=False)
    after = resource.getrusage(resource.RUSAGE_CHILDREN)
    return after.ru_utime - before.ru_utime + after.ru_stime - before.ru_stime, done


def main():
    binaries, megabytes = sys.argv[1], float(sys.argv[2]) if len(sys.argv) > 2 else 8
    over = []
    for name in sys.argv[3:] or FILES:
        with tempfile.TemporaryDirectory() as folder:
            path = os.path.join(folder, "a.export" if name.startswith("export") else "a.journal")
            with open(path, "wb") as file:
                file.write(FILES[name](int(megabytes * 2**20)))
            size = os.path.getsize(path) / 2**20
            took, done = processor_seconds([f"{binaries}/tesselctl", "explain", "--summary", "--store", folder])
            stops = subprocess.run([f"{binaries}/stop_bench", folder, "20"], capture_output=True, text=True,
                                   check=False).stdout
            late = re.search(r"processor time .* worst ([\d.]+) ms", stops)
            late = float(late[1]) if late else 0.0
            print(f"{name:34s} {size:5.1f} MB {took / size:7.3f} s a MB, stop after {late:8.2f} ms, "
                  f"status {done.returncode}", flush=True)
            if took / size > MOST_SECONDS or late > MOST_LATE:
                over.append(name)
    if over:
        sys.exit("over the bounds: " + ", ".join(over))


if __name__ == "__main__":
    main()
