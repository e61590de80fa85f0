#!/usr/bin/env python3
"""Writes the seed corpus of the upcall fuzzer into corpus/ next to this script.

Each seed is a packet on the upcall socket: the 56-byte request layout followed by a
request buffer, well formed or broken the way a sender might break it. Run again after
changing a seed; the files are committed so that the replay test needs no generator.
"""
import os
import struct
import sys

sys.path.insert(0, os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
from seeds import write_corpus  # noqa: E402

UINT32, STRING = 1, 2
BASE = 322514900
COMPLEX = 0x80000000


def header(item_type, tag, value):
    return struct.pack("<HHI", item_type, tag, value)


def string(tag, text):
    data = text.encode() + b"\0"
    return header(STRING, tag, len(data)) + data + b"\0" * (-len(data) % 8)


def uint32(tag, value):
    return header(UINT32, tag, value)


END = b"\0" * 8


def packet(buffer, msg_id=BASE, bits=COMPLEX | 19 | 21 << 8, size=56, count=1, kind=1, data_count=None):
    data_count = len(buffer) if data_count is None else data_count
    layout = struct.pack("<IIIIII", bits, size, 0, 0, 0, msg_id)
    layout += struct.pack("<I", count) + struct.pack("<QBBBBI", 0, 0, 1, 0, kind, len(buffer))
    layout += bytes([0, 0, 0, 0, 1, 0, 0, 0]) + struct.pack("<I", data_count)
    assert len(layout) == 56
    return layout + buffer


APP = (string(0, "com.example.app") + string(1, "com.example.app") + uint32(3, 501)
       + string(4, "group.com.example.a") + string(4, "group.com.example.b") + uint32(5, 0)
       + string(6, "com.example.system") + string(7, "systemgroup.com.example") + uint32(8, 0xFFFFFFFF) + END)

SEEDS = {
    "app_with_groups": packet(APP),
    "plugin": packet(string(0, "com.example.plugin") + uint32(5, 1) + uint32(8, 0xFFFFFFFF) + END),
    "repeated_singular": packet(string(1, "first") + string(1, "second") + END),
    "unknown_tag": packet(string(0, "x") + uint32(9, 1) + END),
    "uid_as_string": packet(string(3, "501") + END),
    "no_end_marker": packet(string(0, "com.example.app")),
    "empty_buffer": packet(b""),
    "unused_id": packet(APP, msg_id=BASE + 1),
    "foreign_id": packet(APP, msg_id=7),
    "not_complex": packet(APP, bits=19),
    "two_descriptors": packet(APP, count=2),
    "not_out_of_line": packet(APP, kind=2),
    "lying_data_count": packet(APP, data_count=8),
    "short_layout": packet(APP)[:40],
    "short_header": packet(APP)[:10],
}

if __name__ == "__main__":
    write_corpus(__file__, SEEDS)
