#!/usr/bin/env python3
"""Writes src/property_lists/unicode_lower_case_table.inc from this Python's Unicode character database.

Usage: tools/make_lower_case_table.py > src/property_lists/unicode_lower_case_table.inc
"""
import sys
import unicodedata

TWO_CHARACTERS = 0x130  # unicode.cpp maps it itself


def mappings():
    for code in range(sys.maxunicode + 1):
        if 0xD800 <= code <= 0xDFFF or code == TWO_CHARACTERS:
            continue
        lower = chr(code).lower()
        assert len(lower) == 1, f"U+{code:04X} maps to {len(lower)} characters"
        if ord(lower) != code:
            yield code, ord(lower) - code


def ranges():
    """Runs of characters one or two apart that lie equally far from their lower-case forms."""
    run = None
    for code, distance in mappings():
        if run and run[3] == distance:
            gap = code - run[1]
            if gap == run[2] or (run[0] == run[1] and gap <= 2):
                run[1], run[2] = code, gap
                continue
        if run:
            yield run
        run = [code, code, 1, distance]
    yield run


print(f"// Written by tools/make_lower_case_table.py from Unicode {unicodedata.unidata_version}.")
for first, last, step, distance in ranges():
    print(f"{{0x{first:04X}, 0x{last:04X}, {step}, {distance}}},")
