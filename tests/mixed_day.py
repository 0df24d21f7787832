"""A day that holds every kind of entry, in order of recording."""
import os

from harness import log_event, point

METAINFO = "<component type='desktop-application'><id>{}</id></component>"


def make_bundle(machine, directory, identifier):
    """Makes a bundle directory with metadata; answers the path of its executable."""
    root = os.path.join(machine.root, directory)
    os.makedirs(os.path.join(root, "usr/share/metainfo"))
    with open(os.path.join(root, "usr/share/metainfo/a.metainfo.xml"), "w", encoding="utf-8") as file:
        file.write(METAINFO.format(identifier))
    return os.path.join(root, "usr/bin", directory.split(".")[0])


def mixed_day(machine):
    """(entries, bundles): bundles maps an executable to the identifier that payloads carry."""
    clock = make_bundle(machine, "Clock.AppDir", "com.vantor.Clock")
    mail = make_bundle(machine, "Mail.app", "com.vantor.Mail")
    bare = dict(exe="/usr/bin/tool", comm="tool")
    entries = [
        log_event("no trace point"),
        point("event", "com.vantor.Calendar", "View", "Open", string1=("period", "week"), exe=clock),
        point("event", "com.vantor.Calendar", "View", "Open", string1=("period", "weekly"), exe=clock),
        point("event", "com.vantor.Calendar", "View", "Open", string1=("period", "Week"), exe=clock),
        point("event", "com.vantor.Calendar", "View", "Open", string1=("period", None), exe=clock),
        point("event", "com.vantor.Calendar", "View", "Open", string1=(None, "anything"), exe=clock),
        point("event", "com.vantor.Calendar", "View", "Open", string1=("period", "day"), string2=("size", "huge")),
        point("event", "com.vantor.Calendar", "View", "Open", string1=("a", "day"), string2=("size", "small"), **bare),
        point("event", "com.vantor.Calendar", "Sync", "Off", telemetry=False, duration="-1"),
        point("event", "com.vantor.Calendar", "Sync", "Negative", duration="-0.001", string1=("x", "unknown")),
        point("event", "com.vantor.Calendar", "Sync", "Zero", duration="0"),
        point("event", "com.vantor.Mail", "Fetch", None, string1=("account", "imap"), exe=mail),
        point("event", "com.vantor.Mail", "Fetch", "Sizes", number1=("bytes", "18446744073709551615"),
              number2=("delta", "-9223372036854775808"), exe=mail),
        point("event", "com.vantor.Mail", "Fetch", "Ratios", number1=("ratio", "0.1"), number2=(None, "5"), exe=mail),
        point("event", "com.vantor.Mail", "Fetch", "Kinds", number1=("whole", "5.0"), number2=("tiny", "-1e-400"),
              duration="3.4028235e38", exe=mail),
        point("event", "com.vantor.Mail", "Fetch", "Label alone", number1=("count", None), exe=mail),
        point("event", "com.vantor.Mail", "Gr\u00fc\u00dfe \"quoted\" \\ \U0001f600", "Name/with__marks", **bare),
        point("event", "com.vantor.quellan.knowledge", "tessel", "Footprint"),
        point("event", "com.vantor.quellan.knowledge", "tessel", "Footfall"),
        point("event", "com.vantor.Mordane.HighSeverity", "SlowNetworkCondition", "CannotSendMailCondition"),
        # Intervals: nested ids, a begin that is replaced, an end without begin, scopes, processes.
        point("begin", "com.vantor.Render", "Frame", "Draw", interval="1", mono=1_000_000),
        point("begin", "com.vantor.Render", "Frame", "Draw", interval="2", mono=2_000_000),
        point("end", "com.vantor.Render", "Frame", "Draw", interval="1", mono=2_500_000),
        point("end", "com.vantor.Render", "Frame", "Draw", interval="2", mono=2_125_000, frame_rate="59.94"),
        point("begin", "com.vantor.Render", "Frame", "Lost", mono=5_000_000),
        point("begin", "com.vantor.Render", "Frame", "Lost", mono=6_000_000),
        point("end", "com.vantor.Render", "Frame", "Lost", mono=6_250_000),
        point("end", "com.vantor.Render", "Frame", "Lost", mono=7_000_000),
        point("begin", "com.vantor.Handoff", "Link", "Up", scope="system", pid=1, exe=clock, mono=8_000_000),
        point("end", "com.vantor.Handoff", "Link", "Up", scope="system", pid=2, exe=mail, mono=8_500_000),
        point("begin", "com.vantor.Handoff", "Link", "Down", pid=1, mono=8_600_000),
        point("end", "com.vantor.Handoff", "Link", "Down", pid=2, mono=8_700_000),
        point("begin", "com.vantor.Merge", "Job", "Copy", telemetry=True, string1=("size", "small"), mono=9_000_000),
        point("end", "com.vantor.Merge", "Job", "Copy", telemetry=False, number1=("n", "3"), mono=9_100_000),
        point("begin", "com.vantor.Merge", "Job", "Backwards", mono=9_500_000),
        point("end", "com.vantor.Merge", "Job", "Backwards", mono=9_400_000),
        point("begin", "com.vantor.morvald", "Any", "Thing", mono=9_600_000),
        point("end", "com.vantor.morvald", "Any", "Thing", mono=9_700_000,
              attributes=[("BundleIdOverride", "com.vantor.Overridden"), ("Other", "x")]),
        point("begin", "com.vantor.Harrowmere", "Snapshot", "Take", frame_rate="30", mono=9_800_000,
              attributes=[("BundleIdOverride", "com.vantor.Snap")]),
        point("end", "com.vantor.Harrowmere", "Snapshot", "Take", mono=9_900_000),
        point("begin", "com.vantor.Harrowmere", "Other", "Take", mono=9_910_000),
        point("end", "com.vantor.Harrowmere", "Other", "Take", mono=9_920_000, exe=mail,
              attributes=[("BundleIdOverride", "com.vantor.Ignored")]),
    ]
    entries += [point("event", "com.vantor.TextInput", f"Keys{i % 7}", f"Key {i}", **bare) for i in range(504)]
    entries += [log_event(f"filler {i}") for i in range(20)]
    for position, entry in enumerate(entries):
        entry.at = -3600 + position
    return entries, {clock: "com.vantor.Clock", mail: "com.vantor.Mail"}
