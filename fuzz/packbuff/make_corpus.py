#!/usr/bin/env python3
"""Writes the seed corpus of the packed-buffer fuzzer into corpus/ next to this script.

Each seed is a request or reply buffer as the upcall server sees them, or one that is
broken in a way a reader must refuse. Run again after changing a seed; the files are
committed so that the replay test needs no generator.
"""
import os
import struct
import sys

sys.path.insert(0, os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
from seeds import write_corpus  # noqa: E402

UINT32, STRING, BYTES = 1, 2, 3


def header(item_type, tag, value):
    return struct.pack("<HHI", item_type, tag, value)


def pad(data):
    return data + b"\0" * (-len(data) % 8)


def string(tag, text):
    data = text.encode() + b"\0"
    return header(STRING, tag, len(data)) + pad(data)


def uint32(tag, value):
    return header(UINT32, tag, value)


def raw_bytes(tag, data):
    return header(BYTES, tag, len(data)) + pad(data)


END = b"\0" * 8

SEEDS = {
    "empty": END,
    "request_app": string(0, "com.example.app") + string(1, "com.example.app") + string(2, "TEAM.com.example.app")
    + uint32(3, 501) + string(4, "group.com.example.shared") + string(4, "group.com.example.other")
    + uint32(5, 0) + uint32(8, 0xFFFFFFFF) + END,
    "request_system": string(0, "com.example.daemon") + string(6, "systemgroup.com.example")
    + string(7, "systemgroup.com.example.a") + uint32(3, 0) + END,
    "reply": string(100, "/private/var/mobile") + string(1, "/private/var/mobile/Containers/Data/A")
    + string(2, "/private/var/mobile/Containers/Data/A/tmp") + string(3, "group.a")
    + string(4, "/private/var/mobile/Containers/Shared/G") + string(101, "/private/var/containers/S")
    + raw_bytes(10, b"\x01\x02\x03") + raw_bytes(12, b"") + uint32(0, 1) + END,
    # Broken ones.
    "string_without_nul": header(STRING, 0, 3) + pad(b"abc") + END,
    "string_length_zero": header(STRING, 1, 0) + END,
    "no_end_marker": string(2, "tmp"),
    "length_past_end": header(BYTES, 10, 0xFFFFFFF9) + b"12345678" + END,
    "unknown_item_type": header(9, 3, 0) + uint32(3, 1) + END,
    "truncated_header": uint32(3, 7) + header(STRING, 0, 4)[:5],
}

if __name__ == "__main__":
    write_corpus(__file__, SEEDS)
