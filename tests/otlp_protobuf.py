"""Reads OTLP's binary protobuf into what its JSON encoding would have said.

It is written after the wire format alone, so that it shares no mistake with the forwarder's writer.
"""
import struct

# Of each message: field number to (name, kind or message, whether it repeats).
ANY = {1: ("stringValue", "text", False), 2: ("boolValue", "bool", False), 3: ("intValue", "int", False),
       4: ("doubleValue", "double", False)}
ATTRIBUTE = {1: ("key", "text", False), 2: ("value", ANY, False)}
RECORD = {1: ("timeUnixNano", "fixed64", False), 11: ("observedTimeUnixNano", "fixed64", False),
          12: ("eventName", "text", False), 6: ("attributes", ATTRIBUTE, True)}
SCOPE_LOGS = {1: ("scope", {1: ("name", "text", False)}, False), 2: ("logRecords", RECORD, True)}
RESOURCE_LOGS = {1: ("resource", {1: ("attributes", ATTRIBUTE, True)}, False), 2: ("scopeLogs", SCOPE_LOGS, True)}
REQUEST = {1: ("resourceLogs", RESOURCE_LOGS, True)}
WIRE = {"text": 2, "bool": 0, "int": 0, "double": 1, "fixed64": 1}


def varint(data, at):
    value = shift = 0
    while True:
        byte = data[at]
        at += 1
        value |= (byte & 0x7f) << shift
        if byte < 0x80:
            return value, at
        shift += 7


def scalar(kind, value):
    if kind == "text":
        return bytes(value).decode()
    if kind == "double":
        return struct.unpack("<d", value)[0]
    if kind == "fixed64":
        return str(struct.unpack("<Q", value)[0])
    return bool(value) if kind == "bool" else str(value - (1 << 64) if value >> 63 else value)


def read(data, message=None):
    """The message in `data`. A field that is not in the tables, or of another wire type, is an error."""
    data, message = memoryview(data), REQUEST if message is None else message
    result, at = {name: [] for name, _, repeats in message.values() if repeats}, 0
    while at < len(data):
        tag, at = varint(data, at)
        name, kind, repeats = message[tag >> 3]
        assert tag & 7 == (2 if isinstance(kind, dict) else WIRE[kind]), (name, tag & 7)
        if tag & 7 == 0:
            value, at = varint(data, at)
        else:
            size, at = (8, at) if tag & 7 == 1 else varint(data, at)
            value, at = data[at:at + size], at + size
            assert at <= len(data), (name, "is cut off")
        value = read(value, kind) if isinstance(kind, dict) else scalar(kind, value)
        if repeats:
            result[name].append(value)
        else:
            assert name not in result, (name, "stands twice")
            result[name] = value
    return result
