#!/usr/bin/env python3
"""Writes the seed corpus of the client-registry fuzzer into corpus/ next to this script.

The seeds are registry files as an installation writes them (with and without a digest
pin, the pin being that of the fuzzer's own program text), paths that normalise, and a few
that the reader refuses. Run again after changing a seed; the files are committed so that
the replay test needs no generator.
"""
import hashlib
import os
import sys

sys.path.insert(0, os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
from seeds import binary, write_corpus, xml  # noqa: E402

# The text of the program the fuzzer matches (kExecutableContent in the fuzzer).
PROGRAM = b"#!/bin/sh\nexit 0\n"
ENTRY = {
    "CodeSigningIdentifier": "com.example.installer",
    "Executable": "/usr/libexec/installer",
    "Entitlements": {"com.vorlane.private.stowly.allow": True, "groups": ["group.a"]},
    "Sandboxed": False,
}
SEEDS = {
    "entry": ENTRY,
    "pinned": {**ENTRY, "SHA256": hashlib.sha256(PROGRAM).hexdigest().upper()},
    "wrong_pin": {**ENTRY, "SHA256": "0" * 64},
    "persona": {**ENTRY, "Persona": "00000000-0000-0000-0000-000000000501", "Sandboxed": True},
    "unnormal_path": {**ENTRY, "Executable": "//usr/./libexec/../libexec//installer/"},
    "relative": {**ENTRY, "Executable": "usr/libexec/installer"},
    "no_identifier": {k: v for k, v in ENTRY.items() if k != "CodeSigningIdentifier"},
    "entitlements_array": {**ENTRY, "Entitlements": ["x"]},
    "short_pin": {**ENTRY, "SHA256": "abc"},
}


if __name__ == "__main__":
    write_corpus(__file__, {**{name: binary(value) for name, value in SEEDS.items()}, "entry_xml": xml(ENTRY)})
