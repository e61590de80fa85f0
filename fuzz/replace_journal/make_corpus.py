#!/usr/bin/env python3
"""Writes the seed corpus of the replace-journal fuzzer into corpus/ next to this script.

The seeds are journals as the daemon writes them (a replace of a data container, a wipe
that keeps the old path) and a few that the reader refuses: a relative path, a ".."
component, a missing key, a path that is not text, no dictionary. Run again after changing
a seed; the files are committed so that the replay test needs no generator.
"""
import os
import sys

sys.path.insert(0, os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
from seeds import binary, write_corpus, xml  # noqa: E402

HOME = "/private/var/mobile/Containers"
JOURNAL = {
    "STWReplaceOperationOldURL": HOME + "/Data/Application/8A0C1C0E-6C1B-4F5B-9C7E-2D6F3B1A9E42",
    "STWReplaceOperationNewURL": HOME + "/Data/Application/4B5E2C51-0D3A-4F7E-8E0B-5D1C9A2F6B10",
    "STWReplaceOperationStagingURL": HOME + "/Staging/1F6E4C2B-7A9D-4E3B-A1C5-0B8D2F7E6A94",
    "STWReplaceOperationDestURL": HOME + "/Data/Application/4B5E2C51-0D3A-4F7E-8E0B-5D1C9A2F6B10",
}
SEEDS = {
    "replace": JOURNAL,
    "wipe": {**JOURNAL, "STWReplaceOperationDestURL": JOURNAL["STWReplaceOperationOldURL"]},
    "relative": {**JOURNAL, "STWReplaceOperationStagingURL": "Staging/x"},
    "dot_dot": {**JOURNAL, "STWReplaceOperationOldURL": HOME + "/Data/../../../etc"},
    "missing_dest": {k: v for k, v in JOURNAL.items() if k != "STWReplaceOperationDestURL"},
    "not_text": {**JOURNAL, "STWReplaceOperationNewURL": b"/private/var"},
    "array": list(JOURNAL.values()),
}
# corpus/non_utf8_path is not written here: the fuzzer found it (a path whose bytes are not
# UTF-8, which the reader took and the writer could not give back), and it is kept byte
# for byte.


if __name__ == "__main__":
    write_corpus(__file__, {**{name: binary(value) for name, value in SEEDS.items()}, "replace_xml": xml(JOURNAL)})
