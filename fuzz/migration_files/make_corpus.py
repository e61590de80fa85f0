#!/usr/bin/env python3
"""Writes the seed corpus of the migration-files fuzzer into corpus/ next to this script.

Each seed is one byte choosing the marker file, then the content of the files: a status
store as the daemon writes it, a marker file, a legacy mapping file, a legacy
entitlements file with its bookkeeping dictionaries, and the malformed shapes the readers
must skip (wrong root type, bookkeeping that is no dictionary, child lists that are no
array of strings, entitlements that are no dictionary). Run again after changing a seed;
the files are committed so that the replay test needs no generator.
"""
import os
import sys

sys.path.insert(0, os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
from seeds import binary, write_corpus, xml  # noqa: E402

MARKER = {"STWMigrationVersionNumber": "21A100", "STWMigrationTime": "2026-01-01T00:00:00Z"}
ENTRY = {
    "CodeSigningInfo": {"com.vorlane.Stowly.Entitlements": {
        "com.vorlane.security.application-groups": ["group.a"]}},
    "ChildBundleIds": ["com.example.app.ext"],
    "Invalid": False, "Placeholder": True, "AdvanceCopy": False, "RegisteredByCaller": False,
    "DataContainerClass": 2,
}
ENTITLEMENTS = {
    "com.example.app": {"com.vorlane.security.application-groups": ["group.a"]},
    "com.example.self": {"com.example.flag": True},
    "com.vorlane.Stowly.ChildPluginBundleIDs": {"com.example.app": ["com.example.app.ext"]},
    "com.vorlane.Stowly.EntitlementsRegisteredByCaller": {"com.example.self": True},
    "com.vorlane.Stowly.PlaceholderEntitlements": {"com.example.app": 1},
}
SEEDS = {
    "status_store": (0, {"GroupIdMigration": MARKER, "CodeSigningMigration": MARKER,
                         "LastBuildInfo": {"BuildVersion": "21A100", "ReleaseType": "Internal"}}),
    "marker_file": (3, MARKER),
    "mapping_file": (1, {"com.example.app": ENTRY, "com.example.empty": {},
                         "com.example.odd": {"ChildBundleIds": ["ok", 5], "DataContainerClass": -1,
                                             "Invalid": "yes", "CodeSigningInfo": []},
                         "com.example.number": 7}),
    "entitlements_file": (2, ENTITLEMENTS),
    "entitlements_malformed": (2, {
        "com.example.app": "not a dictionary",
        "com.example.other": {"k": 1.5},
        "com.vorlane.Stowly.ChildPluginBundleIDs": {"com.example.other": ["ok", 5]},
        "com.vorlane.Stowly.EntitlementsRegisteredByCaller": ["com.example.other"],
        "com.vorlane.Stowly.PlaceholderEntitlements": "all",
    }),
    "array_root": (0, ["not", "a", "dictionary"]),
}

seeds = {name: bytes([marker]) + (xml(value) if name == "entitlements_file" else binary(value))
         for name, (marker, value) in SEEDS.items()}
seeds["not_a_plist"] = b"\x01bplist00 but not really"
write_corpus(__file__, seeds)
