"""What every fuzz target's make_corpus.py shares: writing its seeds into corpus/ beside
the script, and the property-list encodings most seeds are made of."""
import os
import plistlib


def binary(value, **options):
    return plistlib.dumps(value, fmt=plistlib.FMT_BINARY, **options)


def xml(value):
    return plistlib.dumps(value, fmt=plistlib.FMT_XML)


def write_corpus(script, seeds):
    """Writes each of `seeds` (file name -> bytes) into the corpus/ directory beside
    `script` (the caller's __file__), replacing what was there under that name."""
    directory = os.path.join(os.path.dirname(os.path.abspath(script)), "corpus")
    os.makedirs(directory, exist_ok=True)
    for name, data in seeds.items():
        with open(os.path.join(directory, name), "wb") as f:
            f.write(data)
