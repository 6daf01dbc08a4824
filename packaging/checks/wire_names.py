#!/usr/bin/env python3
"""Fails on a wire name that the product spells in two places, or that the documentation and the product spell apart.

usage: wire_names.py [ROOT]

A name on the wire is a promise. Written as a literal in one place it can be wrong in one place only, so a quoted
"X-Kestrel-..." or "com.kestrel..." stands in exactly one source line, as a constant. Names that the tables of
docs/service.md and docs/bag.md give in their first column must exist in the product with that very spelling, and the
product sends no header that docs/service.md does not list. The reference service is not looked at: it writes the
names a second time on purpose, to check them.
"""
import collections
import pathlib
import re
import sys

PRODUCT = ("sabled", "SableKit", "platform", "tools/sablectl")
LITERAL = re.compile(r'"((?:[^"\\]|\\.)*)"|//.*')
# Of what the tables name, header fields of the HTTP standard are libcurl's to spell.
CHECKED = re.compile(r"X-Kestrel-[\w-]+|com\.kestrel\.[\w.]+|[a-z]\w*")
OURS = re.compile(r"X-Kestrel-|com\.kestrel\.")
TABLE_ROW = re.compile(r"\s*\|\s*((?:`[^`|]+`[,\s]*(?:or|and)?\s*)+)\|")


def literals(root):
    """Every quoted string of the product: text -> ["path:line", ...]; includes and comments are no literals."""
    found = collections.defaultdict(list)
    for folder in PRODUCT:
        for path in sorted((root / folder).rglob("*")):
            if path.suffix not in (".h", ".cpp", ".proto"):
                continue
            for number, line in enumerate(path.read_text().split("\n"), 1):
                if not re.match(r"\s*#\s*include", line):
                    for text in {literal[1] for literal in LITERAL.finditer(line)} - {None}:
                        found[text].append(f"{path.relative_to(root)}:{number}")
    return found


def documented(root):
    """The names in the first column of the documentation's tables: name -> "path:line"."""
    found = {}
    for page in ("docs/service.md", "docs/bag.md"):
        path = root / page
        if not path.exists():
            continue
        for number, line in enumerate(path.read_text().split("\n"), 1):
            if row := TABLE_ROW.match(line):
                for name in re.findall(r"`([^`]+)`", row[1]):
                    found.setdefault(name, f"{page}:{number}")
    return found


def faults(root):
    literal, table = literals(root), documented(root)
    for text, places in sorted(literal.items()):
        if OURS.match(text) and len(places) > 1:
            yield f'{places[1]}: "{text}" is already spelled at {places[0]}'
        if text.startswith("X-Kestrel-") and table and text not in table:
            yield f'{places[0]}: "{text}" is in no table of docs/service.md'
    for name, place in table.items():
        if CHECKED.fullmatch(name) and name not in literal:
            yield f"{place}: the product does not know `{name}`"


def main(root):
    found = list(faults(root))
    print("\n".join(found + [f"{len(found)} faults"]))
    return 1 if found else 0


if __name__ == "__main__":
    sys.exit(main(pathlib.Path(sys.argv[1] if len(sys.argv) > 1 else ".").resolve()))
