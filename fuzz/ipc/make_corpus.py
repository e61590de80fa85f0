#!/usr/bin/env python3
"""Writes the seed corpus of the IPC fuzzer into corpus/ next to this script.

Seeds are frame payloads as clients and the daemon send them, whole length-prefixed
streams for the frame reader, and inputs broken in the ways a decoder must refuse. Run
again after changing a seed; the files are committed so that the replay test needs no
generator.
"""
import os
import struct
import sys

sys.path.insert(0, os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
from seeds import write_corpus  # noqa: E402


def uint(n):
    if n < 0x80:
        return bytes([n])
    if n <= 0xFF:
        return b"\xcc" + struct.pack(">B", n)
    if n <= 0xFFFF:
        return b"\xcd" + struct.pack(">H", n)
    if n <= 0xFFFFFFFF:
        return b"\xce" + struct.pack(">I", n)
    return b"\xcf" + struct.pack(">Q", n)


def neg(n):
    if n >= -32:
        return struct.pack(">b", n)
    return b"\xd3" + struct.pack(">q", n)


def string(s):
    data = s.encode()
    if len(data) < 32:
        return bytes([0xA0 | len(data)]) + data
    return b"\xd9" + bytes([len(data)]) + data


def binary(data):
    return b"\xc4" + bytes([len(data)]) + data


def array(items):
    return bytes([0x90 | len(items)]) + b"".join(items)


def mapping(pairs):
    return bytes([0x80 | len(pairs)]) + b"".join(string(k) + v for k, v in pairs)


def uuid(raw):
    return b"\xd8\x01" + raw


def timestamp64(seconds, nanoseconds):
    return b"\xd7\xff" + struct.pack(">Q", nanoseconds << 34 | seconds)


def timestamp96(seconds, nanoseconds):
    return b"\xc7\x0c\xff" + struct.pack(">Iq", nanoseconds, seconds)


def frame(kind, ident, body):
    return array([uint(kind), uint(ident), body])


def prefixed(payload):
    return struct.pack("<I", len(payload)) + payload


REQUEST = frame(0, 1, mapping([
    ("Command", uint(1)),
    ("ContainerClass", uint(2)),
    ("Identifier", string("com.example.app")),
    ("PersonaUniqueString", string("0C2F1A7E-5B8D-4E61-9F0A-3D2C1B4A5E6F")),
    ("Transient", b"\xc2"),
]))
REPLY = frame(1, 1, mapping([
    ("ReplyError", uint(1)),
    ("UUID", uuid(bytes(range(16)))),
    ("Created", timestamp64(1700000000, 250000000)),
    ("Ancient", timestamp96(-86400, 5)),
    ("Size", uint(2 ** 64 - 1)),
    ("Delta", neg(-300)),
    ("Ratio", b"\xcb" + struct.pack(">d", 0.5)),
    ("Single", b"\xca" + struct.pack(">f", 1.5)),
    ("Blob", binary(b"\x00\x01\xff")),
    ("Paths", array([string("/private/var/mobile/Containers/Data/Application/A"), string("")])),
    ("Nothing", b"\xc0"),
]))
HELLO = frame(2, 7, mapping([
    ("CodeSigningIdentifier", string("com.example.tool")),
    ("Entitlements", mapping([("com.example.containers", array([string("group.a")]))])),
    ("Sandboxed", b"\xc3"),
]))

SEEDS = {
    "request": REQUEST,
    "reply": REPLY,
    "hello": HELLO,
    "stream_two_frames": prefixed(REQUEST) + prefixed(HELLO),
    "timestamp32": b"\xd6\xff" + struct.pack(">I", 1700000000),
    "unknown_ext": mapping([("x", b"\xd4\x07\x00"), ("y", b"\xd6\x01\x00\x00\x00\x00")]),
    # Broken ones.
    "nested_too_deep": b"\x91" * 65 + b"\xc0",
    "array32_huge_count": b"\xdd\xff\xff\xff\xff\xc0",
    "str32_past_end": b"\xdb\x00\x01\x00\x00abc",
    "integer_map_key": b"\x81\x01\xc0",
    "duplicate_key": b"\x82\xa1k\x01\xa1k\x02",
    "invalid_utf8": b"\xa2\xc3\x28",
    "trailing_byte": REQUEST + b"\xc0",
    "body_not_map": frame(0, 1, array([])),
    "stream_oversized_length": struct.pack("<I", 16 * 1024 * 1024 + 1) + b"\x93",
    "stream_cut_in_payload": prefixed(REQUEST)[:-3],
}

if __name__ == "__main__":
    write_corpus(__file__, SEEDS)
