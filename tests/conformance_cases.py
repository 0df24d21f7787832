"""The trace points of conformance_test.py, and what each is as a line for a runner, as JSON, and as an entry."""
import errno
import json
import re
import struct


def point(name="n", subsystem="s", category="c", **more):
    """`s1`, `s2`: label and value. `n1`, `n2`: kind (i, u, d), label, value. `a`: attributes. `i`: id. `y`: system
    scope. `t`: telemetry."""
    return {"names": (subsystem, category, name), **more}


OVER = "x" * 4097
LARGE = point(s1=("l" * 4096, "v" * 4096), s2=("l" * 4096, "w" * 4096), t=True,
              a=[(f"key{i}", "y" * 4090) for i in range(32)])
UNSAYABLE = None  # in place of an errno value: this language cannot say that

# Each case: (point, action, errno value) in order, where it matters with the value of a language that differs.
CASES = {
    "every field": [
        (point("Ev", "com.vantor.Calendar", "View", t=True, s1=("period", "week"), s2=("view", "list"),
               n1=("i", "low", -2**63), n2=("u", "high", 2**64 - 1), a=[("k", "v=w"), ("long" * 16, "")]), "v", 0),
        (point("In", i="some id", y=True, t=True, n1=("i", "n", 0)), "b:1", 0),
        (point("In", i="some id", y=True, t=True, n1=("d", "n", 0.1), a=[("key", "a")]), "a:1 59.94", 0)],
    "names alone": [(point(None), "v", 0), (point(None), "b:1", 0), (point(None), "e:1", 0)],
    "ended elsewhere": [(point(i="7", y=True), "e", 0)],
    "two at once": [(point(), "b:1", 0), (point(), "b:2", 0), (point(), "e:1", 0), (point(), "e:2", 0)],
    "doubles": [(point(n1=("d", "a", a), n2=("d", "b", b)), "v", 0)
                for a, b in ((5.0, -0.5), (1e22, 1e-7), (5e-324, 1.7976931348623157e308), (1 / 3, 123456789.125))],
    "longest": [(point("n" * 4096, "s" * 4096, "c" * 4096), "v", 0), (LARGE, "v", 0),
                (point(a=[("k" * 64, "v" * 4031)]), "v", 0), (point(i="i" * 4096), "b:1", 0), (point(i="i" * 4096), "e:1", 0)],
    "too long": [(point(OVER), "v", errno.EMSGSIZE), (point(subsystem=OVER), "v", errno.EMSGSIZE),
                 (point(category="ä" * 2049), "v", errno.EMSGSIZE), (point(s2=("a", OVER)), "v", errno.EMSGSIZE),
                 (point(s1=(OVER, "a")), "v", errno.EMSGSIZE), (point(n1=("i", OVER, 1)), "v", errno.EMSGSIZE),
                 (point(i=OVER), "b:1", errno.EMSGSIZE), (point(a=[("k", "v" * 4095)]), "v", errno.EMSGSIZE),
                 (point(a=[("k" * 65, "v")]), "v", errno.ENAMETOOLONG),
                 (point(a=[(f"k{i}", "v") for i in range(33)]), "v", errno.E2BIG)],
    "mistakes": [(point(subsystem=""), "v", errno.EINVAL), (point(category=""), "v", errno.EINVAL),
                 (point(category=None), "v", errno.EINVAL),
                 (point(s1=("a", None)), "v", errno.EBADMSG, {"rust": UNSAYABLE, "shell": UNSAYABLE}),
                 (point(s2=(None, "a")), "v", errno.EBADMSG, {"rust": UNSAYABLE, "shell": UNSAYABLE}),
                 (point(n1=("d", "a", "nan")), "v", errno.EDOM), (point(n2=("d", "a", "inf")), "v", errno.EDOM),
                 (point(a=[("", "v")]), "v", errno.ENOKEY), (point(a=[("a=b", "v")]), "v", errno.ENOKEY),
                 (point(a=[("a\nb", "v")]), "v", errno.ENOKEY)],
    "misused intervals": [
        (point(), "b:1", 0), (point(), "e:1", 0), (point(), "e:1", errno.ECANCELED, {"shell": UNSAYABLE}),
        (point(subsystem=""), "b:1", errno.EINVAL, {"shell": UNSAYABLE}), (point(), "e:1", errno.EINVAL, {"shell": UNSAYABLE}),
        (point(), "b:1", 0), (point(), "a:1 1e39", errno.EDOM)],
    "control characters": [(point("\x01\t\x1b[31m\r\x7f", s1=("a\nTESSEL_KIND=end\n", "\nMESSAGE=forged\n"),
                                  a=[("key", "\n\n"), ("tab\t", "x")], n1=("i", "\n", 1)), "v", 0)],
    "unicode": [(point("Grüße \U0001f4c5", s1=("日", "本"), a=[("ключ", "значение")]), "v", 0)],
    "bytes that are no text": [(point(s1=("a", b"\xff\xfe"), s2=(b"\xed\xa0\x80", "b")), "v", 0, {"shell": errno.EINVAL})],
    "a NUL": [(point("a\0b"), "v", errno.EINVAL, {"c": UNSAYABLE, "cpp": UNSAYABLE})],
}


def encoded(text):
    return text if isinstance(text, bytes) else text.encode()


def word(text):
    return "-" if text is None else "x" + encoded(text).hex()


def line(what, action):
    """For a runner."""
    words = ["new", *map(word, what["names"])]
    for key, value in what.items():
        if key[0] == "s":
            words += ["+" + key, *map(word, value)]
        elif key[0] == "n" and key != "names":
            words += ["+" + key, word(value[1]), value[0], repr(value[2]).strip("'")]
        elif key == "a":
            words += [part for pair in value for part in ("+a", word(pair[0]), word(pair[1]))]
        elif key == "i":
            words += ["+i", word(value)]
        elif key != "names":
            words += ["+" + key]
    return " ".join([*words, action])


def json_line(what, action):
    """For the shell. Ids make its begins and ends belong together."""
    plain = {"kind": {"v": "event", "b": "begin"}.get(action[0], "end")}
    plain.update((key, text) for key, text in zip(("subsystem", "category", "name"), what["names"]) if text is not None)
    for key, value in what.items():
        if key in ("s1", "s2"):
            plain["string" + key[1]] = dict([[encoded(text).decode("utf-8", "surrogateescape") for text in value]])
        elif key in ("n1", "n2"):
            plain["number" + key[1]] = {value[1]: float(value[2]) if value[0] == "d" else value[2]}
    plain.update({"attributes": dict(what["a"])} if "a" in what else {})
    plain.update({"telemetry": True} if "t" in what else {})
    if action[0] != "v":
        plain["id"] = what.get("i", 99000 + int(action[2:3] or 0))
        plain.update({"scope": "system"} if "y" in what else {})
    if action[0] == "a":
        plain["frame_rate"] = float(action.split()[1])
    return json.dumps(plain, ensure_ascii=False).encode("utf-8", "surrogateescape")


def decimal(value):
    text = next(text for text in ("%.15g" % value, "%.17g" % value) if float(text) == value)
    return (text if re.search("[.e]", text) else text + ".0").encode()


def fields(what, action, language):
    """The entry that a point must become: sorted pairs of field and value."""
    kind = {"v": b"event", "b": b"begin"}.get(action[0], b"end")
    made = [("PRIORITY", b"7"), ("TESSEL_KIND", kind)]
    made += [("TESSEL_" + name, encoded(text))
             for name, text in zip(("SUBSYSTEM", "CATEGORY", "NAME"), what["names"]) if text is not None]
    for key, value in what.items():
        name = {"s": "TESSEL_STRING", "n": "TESSEL_NUMBER"}.get(key[0], "") + key[1:]
        if key in ("s1", "s2", "n1", "n2"):
            label, text = value[-2:]
            if key[0] == "n":
                text = decimal(text) if value[0] == "d" else str(text)
            made += [(name + "_NAME", encoded(label)), (name + "_VALUE", encoded(text))]
    made += [("TESSEL_ATTRIBUTE", encoded(key) + b"=" + encoded(value)) for key, value in what.get("a", ())]
    made += [("TESSEL_TELEMETRY", b"1")] if "t" in what else []
    if action[0] != "v":
        made += [("TESSEL_INTERVAL_ID", encoded(what["i"]) if "i" in what else "own")] if "i" in what or ":" in action else []
        made += [("TESSEL_INTERVAL_SCOPE", b"system")] if "y" in what else []
    made += [("TESSEL_FRAME_RATE", decimal(float(action.split()[1])))] if action[0] == "a" else []
    if action[0] in "ea" and ":" in action and language != "shell":
        made += [("TESSEL_DURATION", "measured")]
    return sorted(made, key=repr)


def read_back(entry):
    """The fields of an entry as fields() gives them, without those of the daemon."""
    made = []
    for name, value in entry:
        if name == "TESSEL_INTERVAL_ID" and re.fullmatch(rb"[0-9]{5,20}", value):
            value = "own"
        elif name == "TESSEL_DURATION" and re.fullmatch(rb"[0-9]+\.[0-9]{9}", value):
            value = "measured"
        if not name.startswith("_"):
            made.append((name, value))
    return sorted(made, key=repr)


def parsed(export):
    """The entries of an export, each a list of (field, value)."""
    entries, entry, at = [], [], 0
    while at < len(export):
        end = export.index(b"\n", at)
        name, equals, value = export[at:end].partition(b"=")
        at = end + 1
        if not name:
            entries.append(entry)
            entry = []
            continue
        if not equals:
            size = struct.unpack_from("<Q", export, at)[0]
            value = export[at + 8:at + 8 + size]
            at += 9 + size
        entry.append((name.decode(), value))
    return entries
