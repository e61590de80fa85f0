#!/usr/bin/env python3
"""Writes the seed corpus of the metadata fuzzer into corpus/ next to this script.

A seed is one byte that picks the class directory the container lies in (the class
number minus one) followed by the metadata file: files as the daemon writes them for a
data container, a bundle, a group and a system group container, older files without a
user identity, and a few that the reader refuses (a file in another class's directory,
another user's persona, a bad UUID, no dictionary). Run again after changing a seed; the
files are committed so that the replay test needs no generator.
"""
import datetime
import os
import sys

sys.path.insert(0, os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
from seeds import binary, write_corpus, xml  # noqa: E402

IDENTITY = {"posixUID": 501, "posixGID": 501, "type": 0, "version": "2",
            "personaUniqueString": "00000000-0000-0000-0000-000000000501"}
DATA = {
    "STWMetadataContentClass": 2,
    "STWMetadataIdentifier": "com.example.app",
    "STWMetadataUUID": "8A0C1C0E-6C1B-4F5B-9C7E-2D6F3B1A9E42",
    "STWMetadataVersion": "2",
    "STWMetadataUserIdentity": IDENTITY,
    "STWMetadataInfo": {"com.vorlane.Setwright.ContentProtectionClass": 3},
}
BUNDLE = {k: v for k, v in DATA.items() if k not in ("STWMetadataUserIdentity", "STWMetadataInfo")}
BUNDLE["STWMetadataContentClass"] = 1


def without(d, *keys):
    return {k: v for k, v in d.items() if k not in keys}


SEEDS = {
    "data": (2, DATA),
    "data_with_assets": (2, {**DATA, "STWMetadataUserManagedAssetsDirName": "Assets-1",
                             "STWMetadataInfo": {"k": [1, 2.5, b"\x00", {"n": True}]}}),
    "data_older_persona": (2, {**without(DATA, "STWMetadataUserIdentity"), "STWMetadataPersona": 501}),
    "data_wrong_persona": (2, {**DATA, "STWMetadataPersona": 502}),
    "bundle": (1, BUNDLE),
    "group": (7, {**DATA, "STWMetadataContentClass": 7, "STWMetadataIdentifier": "group.com.example"}),
    "system_group": (13, {**BUNDLE, "STWMetadataContentClass": 13, "STWMetadataIdentifier": "systemgroup.x"}),
    "bundle_in_data_directory": (2, BUNDLE),
    "class_14": (2, {**DATA, "STWMetadataContentClass": 14}),
    "bad_uuid": (2, {**DATA, "STWMetadataUUID": "not-a-uuid"}),
    "info_not_dictionary": (2, {**DATA, "STWMetadataInfo": "text"}),
    "array": (2, [DATA]),
    "data_with_dates": (2, {**DATA, "STWMetadataInfo": {"d": [
        datetime.datetime(1932, 12, 13, 20, 45, 52, 400000), datetime.datetime(2000, 12, 31, 23, 59, 59, 750000),
        datetime.datetime(2024, 2, 29, 12, 0, 0, 250000)]}}),
}
# corpus/non_utf8_info_key and corpus/string_past_offset_table are not written here: the
# fuzzer found them (an info key with a byte that is not UTF-8, which the reader took and a
# rewrite of the file changed; a UTF-16 key with a NUL, placed past the offset table, which
# made libplist abort), and they are kept byte for byte. So is corpus/far_date_in_info: a
# date past what the writer holds, whose fraction before 2001 every rewrite used to move.


if __name__ == "__main__":
    seeds = {name: bytes([container_class - 1]) + binary(value) for name, (container_class, value) in SEEDS.items()}
    seeds["data_xml"] = bytes([1]) + xml(DATA)
    write_corpus(__file__, seeds)
