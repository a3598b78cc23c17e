"""Checks that the tests that README.md names exist, and that every row of its table of guards names
one."""

import os
import re

import findings

FOLDER = "tests/e2e"
NAMED = re.compile(r"`(test_\w+\.py)::(\w+)`")
TABLE = re.compile(r"^\| operation \| what guards it \| test \|\n\|[-|]+\|\n((?:\|.*\n)+)", re.MULTILINE)


def defined(source, file):
    """The tests of one file, none when there is no such file."""
    path = os.path.join(source, FOLDER, file)
    if not os.path.exists(path):
        return set()
    return set(re.findall(r"^def (test_\w+)\(", findings.read(source, f"{FOLDER}/{file}"),
                          re.MULTILINE))


def missing(source, text):
    return [f"README.md: there is no test {file}::{name}"
            for file, name in sorted(set(NAMED.findall(text)))
            if name not in defined(source, file)]


def unproved(text):
    tables = TABLE.findall(text)
    if not tables:
        return ["README.md: there is no table of guards"]
    return [f"README.md: names no test: {row}" for table in tables for row in table.splitlines()
            if not NAMED.search(row)]


def main():
    options = findings.arguments(__doc__)
    text = findings.read(options.source, "README.md")
    findings.conclude(missing(options.source, text) + unproved(text), "tests named in README.md")


if __name__ == "__main__":
    main()
