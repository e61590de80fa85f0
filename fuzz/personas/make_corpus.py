#!/usr/bin/env python3
"""Writes the seed corpus of the personas fuzzer into corpus/ next to this script.

The seeds are persona lists as a device has them (a personal persona alone; with an
enterprise persona that has a home of its own, and with universal and system personas
that share bundles) and a few that the reader skips entries of or refuses. Run again after
changing a seed; the files are committed so that the replay test needs no generator.
"""
import os
import sys

sys.path.insert(0, os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
from seeds import binary, write_corpus, xml  # noqa: E402

PERSONAL = {"PersonaUniqueString": "00000000-0000-0000-0000-000000000501", "PersonaID": 501, "Type": "personal"}
ENTERPRISE = {"PersonaUniqueString": "E1A7C0DE-0000-4000-8000-000000001000", "PersonaID": 1000,
              "Type": "enterprise", "BundleIdentifiers": ["com.example.work"],
              "HomeLayoutPath": "/private/var/mobile/Personas/Work", "KernelType": 2}
SEEDS = {
    "personal": [PERSONAL],
    "enterprise": [PERSONAL, ENTERPRISE],
    "shared": [PERSONAL, ENTERPRISE,
               {"PersonaUniqueString": "U", "PersonaID": 7, "Type": "universal", "BundleIdentifiers": ["com.a"]},
               {"PersonaID": 8, "Type": "system", "BundleIdentifiers": ["com.b", 3]}],
    "no_personal": [ENTERPRISE],
    "skipped": [PERSONAL, {"PersonaID": 2**33, "Type": "personal"}, {"PersonaID": 9, "Type": "guest"}, "x"],
    "dictionary": {"Personas": [PERSONAL]},
}
# corpus/relative_home and corpus/string_in_header are not written here: the fuzzer found
# them (an enterprise persona whose HomeLayoutPath, read as UTF-16 text, was a relative path
# that the reader kept; a UTF-16 string with a NUL whose offset points into the header,
# which made libplist abort), and they are kept byte for byte.


if __name__ == "__main__":
    seeds = {name: binary(value) for name, value in SEEDS.items()}
    seeds["enterprise_xml"] = xml([PERSONAL, ENTERPRISE])
    write_corpus(__file__, seeds)
