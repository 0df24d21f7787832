"""Works out, without the service's code, what a run must yield for a list of recorded entries.

This is a second, plain formulation of the rules: delivery, classification, payloads, log, spool.
"""
import struct

# Known values of this platform, which may be reported. The tests also use unknown ones.
KNOWN = {"week", "day", "small", "imap", "Root", "2,2,1,0", "generationContext", "modeChange", "NO"}
# (subsystem, category, name) -> (cap, ratio); None stands for "any".
DOWNSAMPLING = {
    ("com.vantor.TextInput", None, None): (500, 503),
    ("com.vantor.quellan.knowledge", "tessel", "Footprint"): (0, 1),
    ("com.vantor.Mordane.HighSeverity", "SlowNetworkCondition", "CannotSendMailCondition"): (0, 1),
    ("com.vantor.Mordane.MediumSeverity", "HighCPUCondition", "GliskBatchIndex"): (0, 1),
}
REPORTED, DISABLED, WHITELIST, DURATION, DOWNSAMPLED = "reported", "disabled", "whitelist", "duration", "downsampled"
PROCESS_FIELDS = ("exe", "comm")


def float32(value):
    return struct.unpack("f", struct.pack("f", value))[0]


def shortest(value):
    """The double of the shortest decimal text that still reads as the same 32-bit float."""
    for digits in range(1, 18):
        text = f"{value:.{digits}g}"
        if float32(float(text)) == value:
            return float(text)
    return value


def number(text):
    try:
        value = int(text)
        return value if -2**63 <= value < 2**64 else float(value)
    except ValueError:
        return float(text)


class Thing:
    """A delivered trace object."""

    def __init__(self, kind, begin, end):
        merged = dict(begin.fields)
        merged.update(dict(end.fields))
        self.kind, self.fields, self.begin, self.end = kind, merged, begin, end
        self.attributes = dict(value.split("=", 1) for entry in (begin, end) for key, value in entry.fields
                               if key == "TESSEL_ATTRIBUTE")
        if "TESSEL_DURATION" in merged:
            self.duration = float32(float(merged["TESSEL_DURATION"]))
        else:
            self.duration = float32(0.0 if begin is end else (end.mono - begin.mono) / 1e6)

    def get(self, name):
        return self.fields.get("TESSEL_" + name)

    @property
    def path(self):
        return self.get("SUBSYSTEM"), self.get("CATEGORY"), self.get("NAME")

    @property
    def pair(self):
        return self.path[:2]


def deliver(entries):
    """The trace objects of entries, in order of delivery."""
    things, open_intervals = [], {}
    for entry in entries:
        fields = dict(entry.fields)
        if not all("TESSEL_" + name in fields for name in ("KIND", "SUBSYSTEM", "CATEGORY")):
            continue
        kind = fields["TESSEL_KIND"]
        if kind == "event":
            things.append(Thing("Event", entry, entry))
            continue
        process = entry.pid if fields.get("TESSEL_INTERVAL_SCOPE", "process") == "process" else "any"
        key = (entry.boot, process, *(fields.get("TESSEL_" + name)
                                      for name in ("SUBSYSTEM", "CATEGORY", "NAME", "INTERVAL_ID")))
        if kind == "begin":
            open_intervals[key] = entry
        elif kind == "end" and key in open_intervals:
            begin = open_intervals.pop(key)
            animated = any("TESSEL_FRAME_RATE" in dict(e.fields) for e in (begin, entry))
            things.append(Thing("AnimationInterval" if animated else "Interval", begin, entry))
    return things


class Rules:
    """Decides about objects. The downsampling counters count over all runs of one Rules object."""

    def __init__(self, internal=False):
        self.internal, self.seen, self.reported = internal, {}, {}

    def classify(self, thing):
        if thing.get("TELEMETRY") != "1":
            return DISABLED
        if thing.duration < 0:
            return DURATION
        for slot in ("STRING1", "STRING2"):
            if not self.internal and thing.get(slot + "_NAME") is not None and thing.get(slot + "_VALUE") not in KNOWN:
                return WHITELIST
        return REPORTED if self.let_through(thing) else DOWNSAMPLED

    def let_through(self, thing):
        for row in (thing.path, thing.path[:2] + (None,), thing.path[:1] + (None, None)):
            if row not in DOWNSAMPLING:
                continue
            cap, ratio = DOWNSAMPLING[row]
            self.seen[row] = self.seen.get(row, 0) + 1
            if self.reported.get(row, 0) >= cap or self.seen[row] % ratio:
                return False
            self.reported[row] = self.reported.get(row, 0) + 1
            return True
        return True


def process_name(entry, bundles):
    return bundles.get(entry.exe) or entry.comm or "Unknown"


def payload(thing, bundles, filesystem):
    pairs = [("Subsystem", thing.get("SUBSYSTEM")), ("Category", thing.get("CATEGORY")),
             ("Name", thing.get("NAME") or "Unknown")]
    for slot, label in (("STRING1", "String1"), ("STRING2", "String2"), ("NUMBER1", "Number1"),
                        ("NUMBER2", "Number2")):
        if thing.get(slot + "_NAME") is not None:
            value = thing.get(slot + "_VALUE")
            if value is not None and label.startswith("Number"):
                value = number(value)
            pairs += [(label + "Name", thing.get(slot + "_NAME")), (label + "Value", value)]
    pairs += [("IntervalType", thing.kind), ("DurationInSeconds", shortest(thing.duration))]
    override = thing.attributes.get("BundleIdOverride")
    if thing.kind == "Event":
        pairs.append(("StartProcessName", process_name(thing.begin, bundles)))
    elif override and (thing.pair[0] == "com.vantor.morvald" or thing.pair == ("com.vantor.Harrowmere", "Snapshot")):
        pairs += [("StartProcessName", override), ("EndProcessName", override)]
    else:
        pairs += [("StartProcessName", process_name(thing.begin, bundles)),
                  ("EndProcessName", process_name(thing.end, bundles))]
    if thing.kind == "AnimationInterval":
        pairs.append(("FrameRate", shortest(float32(float(thing.get("FRAME_RATE"))))))
    pairs += [("BootPartitionFS", filesystem), ("BootDiskType", "SSD")]
    return [pair for pair in pairs if pair[1] is not None]


class Run:
    """Everything one completed run must yield."""

    SECTIONS = [("Total tessel object", "AllInspected", lambda thing, verdict: True),
                ("Reported tessel object", "Reported", lambda thing, verdict: verdict == REPORTED),
                ("Reported tessel event", "ReportedEvents",
                 lambda thing, verdict: verdict == REPORTED and thing.kind == "Event"),
                ("Subsystem/category filtered tessel object", "SubsystemCategoryFiltered",
                 lambda thing, verdict: verdict == DOWNSAMPLED),
                ("Duration filtered tessel object", "DurationThresholdFiltered",
                 lambda thing, verdict: verdict == DURATION),
                ("String whitelist filtered tessel object", "StringWhitelistFiltered",
                 lambda thing, verdict: verdict == WHITELIST)]

    def __init__(self, entries, rules, bundles, filesystem):
        self.entries = entries
        self.judged = [(thing, rules.classify(thing)) for thing in deliver(entries)]
        self.object_rows = []
        for thing, verdict in self.judged:
            if verdict == REPORTED:
                pairs = payload(thing, bundles, filesystem)
                self.object_rows.append(("com.vantor.performance.tessel", pairs))
                if thing.get("NAME") is not None:
                    self.object_rows.append(("ts__" + "__".join(thing.path), pairs))

    def count(self, kind, reported):
        return sum(1 for thing, verdict in self.judged if thing.kind == kind and (verdict == REPORTED) == reported)

    def verdicts(self, wanted):
        return sum(1 for _, verdict in self.judged if verdict == wanted)

    def sections(self):
        """(header, label, total, pairs with counts in descending order, first come first) of each section."""
        for header, label, belongs in self.SECTIONS:
            counts = {}
            for thing, verdict in self.judged:
                if belongs(thing, verdict):
                    counts[thing.pair] = counts.get(thing.pair, 0) + 1
            ordered = sorted(counts.items(), key=lambda item: -item[1])
            yield header, label, sum(counts.values()), ordered

    def count_rows(self):
        return [("com.vantor.performance.tessel_counts",
                 [("Subsystem", pair[0]), ("Category", pair[1]), ("Count", count), ("Classification", label)])
                for _, label, _, ordered in self.sections() for pair, count in ordered[:5]]

    def statistics(self, interrupted=False):
        """The statistics without the duration, which differs from machine to machine."""
        kinds = ("AnimationInterval", "Interval", "Event")
        keys = ("Animations", "Intervals", "Events")
        return ([("LogObjectsProcessed", len(self.entries))] +
                [(key + "Reported", self.count(kind, True)) for key, kind in zip(keys, kinds)] +
                [(key + "NotReported", self.count(kind, False)) for key, kind in zip(keys, kinds)] +
                [("WasInterrupted", interrupted)])

    def summary_log(self):
        lines = []
        for header, _, total, ordered in self.sections():
            lines.append(f"**************\n{header} count: {total}")
            for position, (pair, count) in enumerate(ordered):
                suffix = "reported to Statora" if position < 5 else "not reported"
                lines.append(f"{pair[0]}/{pair[1]}:\t{count} (Count {suffix})")
        return lines

    def closing_line(self, seconds, interrupted=""):
        """A pattern of the line that matches any dates."""
        figures = [self.count(kind, reported) for kind in ("Event", "Interval", "AnimationInterval")
                   for reported in (True, False)]
        return ("Done processing {} reported and {} unreported events, {} reported and {} unreported intervals and "
                "{} reported and {} unreported animations ({} blacklisted, {} too short, {} whitelisted, {} telemetry "
                "not enabled) from {} log events in {}s between DATE and DATE{}").format(
                    *figures, self.verdicts(DOWNSAMPLED), self.verdicts(DURATION), self.verdicts(WHITELIST),
                    self.verdicts(DISABLED), len(self.entries), seconds, interrupted)
