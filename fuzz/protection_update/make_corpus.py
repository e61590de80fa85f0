#!/usr/bin/env python3
"""Writes the seed corpus of the update-file fuzzer into corpus/ next to this script.

The seeds are update files of a protection change as the daemon writes them (with a user
identity, for a class that needs none, in the older form with a user id) and a few that
its checks refuse. Run again after changing a seed; the files are committed so that the
replay test needs no generator.
"""
import os
import sys

sys.path.insert(0, os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
from seeds import binary, write_corpus  # noqa: E402

CHANGE = {
    "STWDataOperationIdentifier": "com.example.app",
    "STWDataOperationContainerClass": 2,
    "STWDataOperationProtectionClass": 1,
    "STWDataOperationChangeType": 7,
    "STWDataOperationRetryIfLocked": True,
    "STWDataOperationInternalID": "8A0C1C0E-6C1B-4F5B-9C7E-2D6F3B1A9E42",
    "STWDataOperationUserIdentity": {"posixUID": 501, "posixGID": 501, "type": 0, "version": "2"},
}
SEEDS = {
    "with_user_identity": CHANGE,
    "system_class": {**{k: v for k, v in CHANGE.items() if k != "STWDataOperationUserIdentity"},
                     "STWDataOperationContainerClass": 12},
    "older_user_id": {**{k: v for k, v in CHANGE.items() if k != "STWDataOperationUserIdentity"},
                      "STWDataOperationUserId": 501},
    "class_14": {**CHANGE, "STWDataOperationContainerClass": 14},
    "bad_uuid": {**CHANGE, "STWDataOperationInternalID": "not-a-uuid"},
}
# corpus/nul_in_key is not written here: the fuzzer found it (a key with a NUL in it that
# took the reader down inside libplist), and it is kept byte for byte.

write_corpus(__file__, {name: binary(value) for name, value in SEEDS.items()})
