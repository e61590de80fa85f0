#!/usr/bin/env python3
"""Writes the seed corpus of the binary property-list fuzzer into corpus/ next to this script.

The seeds are binary property lists of the kinds the daemon reads (a container's metadata,
a code-signing info dictionary) and of the kinds the direct reader leaves to libplist
(dates, non-ASCII text, large integers, deep nesting). Run again after changing a seed; the
files are committed so that the replay test needs no generator.
"""
import datetime
import os
import sys

sys.path.insert(0, os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
from seeds import binary, write_corpus  # noqa: E402

IDENTITY = {"posixUID": 501, "posixGID": 501, "type": 0, "version": "2"}
SEEDS = {
    "metadata": {
        "STWMetadataContentClass": 2,
        "STWMetadataIdentifier": "com.example.app",
        "STWMetadataUUID": "8A0C1C0E-6C1B-4F5B-9C7E-2D6F3B1A9E42",
        "STWMetadataVersion": "2",
        "STWMetadataUserIdentity": IDENTITY,
        "STWMetadataInfo": {"com.vorlane.Setwright.ContentProtectionClass": 3},
    },
    "codesigning_info": {
        "com.vorlane.Stowly.Entitlements": {
            "com.vorlane.security.application-groups": ["group.a", "group.b"],
            "com.vorlane.security.system-container": True,
        },
        "SignerIdentity": "Example Signer",
        "Blob": b"\x00\x01\x02\xff" * 8,
    },
    "scalars": [True, False, 0, 255, 65535, 2**32, -1, 2**63 - 1, 0.5, 1.0 / 3, "", b""],
    "shared_values": [IDENTITY, IDENTITY, {"version": "2"}, "2", "2"],
    "left_to_libplist": {
        "date": datetime.datetime(2024, 1, 2, 3, 4, 5),
        "caf\u00e9": "na\u00efve",
        "big": 2**64 - 1,
    },
    "nested": [[[[[["deep"]]]]]],
    "long_counts": {"k" * 20: ["x" * 300, b"y" * 300, list(range(20))]},
}


if __name__ == "__main__":
    write_corpus(__file__, {name: binary(value, sort_keys=True) for name, value in SEEDS.items()})
