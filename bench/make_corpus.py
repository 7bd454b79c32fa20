#!/usr/bin/env python3
"""Makes service bundles to measure with: three services and two strings files each.

The bundles lie in OUTPUT/Library/Services and OUTPUT/Applications (one in ten), as in a home directory.
Information dictionaries take turns in the binary, XML and text encodings, strings files in UTF-8 and UTF-16.
The same arguments always make the same bytes.
"""

import argparse
import pathlib
import plistlib

CONTEXTS = [None, {"QVWordLimit": 3}, [{"QVTextLanguage": ["English", "German"]}, {"QVTextScript": "Latin"}]]


def text(value):
    """`value` in the text encoding."""
    if isinstance(value, dict):
        return "{ " + " ".join(f"{text(key)} = {text(each)};" for key, each in value.items()) + " }"
    if isinstance(value, list):
        return "( " + ", ".join(map(text, value)) + " )"
    return '"%s"' % str(value).replace("\\", "\\\\").replace('"', '\\"')


def xml(value):
    header, _, rest = plistlib.dumps(value, sort_keys=False).split(b"\n", 2)
    return header + b"\n" + rest  # the document type adds nothing to the measurement


def binary(value):
    return plistlib.dumps(value, fmt=plistlib.FMT_BINARY)


def service(bundle, number):
    declared = {
        "QVMessage": f"perform{number}",
        "QVPortName": f"Bundle{bundle}",
        "QVMenuItem": {"default": f"Group {bundle % 97}/Command {number} of {bundle}"},
        "QVKeyEquivalent": {"default": "abcdefghijklmnopqrstuvwxyz"[(bundle + number) % 26]},
        "QVSendTypes": ["text/plain", "text/rtf"],
        "QVReturnTypes": ["text/plain"],
        "QVUserData": f"{bundle}:{number}",
    }
    # The text encoding has strings only; a context's word limit is a number.
    context = CONTEXTS[0 if bundle % 3 == 2 else (bundle + number) % len(CONTEXTS)]
    if context is not None:
        declared["QVRequiredContext"] = context
    return declared


def information(bundle):
    value = {
        "KTBundleIdentifier": f"org.example.bundle{bundle}",
        "KTBundleName": f"Bundle {bundle}",
        "KTBundleVersion": f"{bundle % 10}.{bundle % 7}",
        "QVServices": [service(bundle, number) for number in range(3)],
    }
    return [binary, xml, lambda each: text(each).encode()][bundle % 3](value)


def strings(bundle, language):
    pairs = {f"Group {bundle % 97}/Command {number} of {bundle}": f"{language} {number} für {bundle}"
             for number in range(3)}
    table = "".join(f"{text(key)} = {text(title)};\n" for key, title in pairs.items())
    return table.encode() if bundle % 2 else b"\xff\xfe" + table.encode("utf-16-le")


def main():
    parser = argparse.ArgumentParser(description=__doc__.split("\n", 1)[0])
    parser.add_argument("--bundles", type=int, default=10_000, metavar="N", help="how many (default: %(default)s)")
    parser.add_argument("output", type=pathlib.Path, help="the folder to make them in; it must not exist")
    arguments = parser.parse_args()
    for bundle in range(arguments.bundles):
        home = "Applications/%d.app" if bundle % 10 == 9 else "Library/Services/%d.service"
        path = arguments.output / (home % bundle)
        path.mkdir(parents=True)
        (path / "Info.plist").write_bytes(information(bundle))
        for language in ("German", "French"):
            resources = path / "Resources" / language
            resources.mkdir(parents=True)
            (resources / "ServicesMenu.strings").write_bytes(strings(bundle, language))


if __name__ == "__main__":
    main()
