#!/usr/bin/env python3
"""Writes the seed corpus of the configuration fuzzer into corpus/ next to this script.

A seed is one byte, even for stowlyd.plist and odd for os-release, followed by the file:
configurations with every key the daemon reads, a few with a key of the wrong type or out
of range, and os-release files as distributions write them (quoted, escaped, commented).
Run again after changing a seed; the files are committed so that the replay test needs
no generator.
"""
import os
import sys

sys.path.insert(0, os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
from seeds import binary, write_corpus, xml  # noqa: E402

FULL = {
    "InternalImage": True, "MultiUser": False, "PersonasUnsupported": False, "EphemeralStorage": False,
    "DeveloperMode": True, "InstallationUID": 33, "SystemContainerUID": 0, "MobileUserName": "mobile",
    "MaxConnections": 512, "MaxConnectionsPerUser": 64, "MaxPendingFrameBytes": 1 << 20,
    "FirstFrameTimeout": 60, "FrameTimeout": 2.5,
    "Features": {"fast_container_sizing": True, "other": False},
}
PLISTS = {
    "full": FULL,
    "empty": {},
    "features_not_bool": {"Features": {"x": 1}},
    "uid_minus_one": {"InstallationUID": 2**32 - 1},
    "timeout_tiny": {"FrameTimeout": 0.0001},
    "count_zero": {"MaxConnections": 0},
    "empty_user_name": {"MobileUserName": ""},
    "array": [FULL],
}
OS_RELEASES = {
    "os_release": b'NAME="Stowly OS"\nVERSION_ID="17.2"\nBUILD_ID=21C62\nRELEASE_TYPE=\'Internal\'\n',
    "os_release_escapes": b'# comment\nBUILD_ID="a\\"b\\\\c"\n=novalue\nVERSION_ID="\n\nPRETTY_NAME=\'x\'y\'\n',
    "os_release_no_newline": b"VERSION_ID=1",
}


if __name__ == "__main__":
    seeds = {name: b"\x00" + binary(value) for name, value in PLISTS.items()}
    seeds["full_xml"] = b"\x00" + xml(FULL)
    seeds.update({name: b"\x01" + text for name, text in OS_RELEASES.items()})
    write_corpus(__file__, seeds)
