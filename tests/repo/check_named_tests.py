"""Checks that the tests that README.md and docs/security.md name exist, and that every row of the table
of guards, and of the tables of promises, names one."""

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


# ---- docs/security.md: "Suite.Test", "Suite.*", ".Test" of the suite named before, "test_x" and files

SECURITY = "docs/security.md"
PROMISES = re.compile(r"^\|(?:.*\|)? tested by \|\n\|[-|]+\|\n((?:\|.*\n)+)", re.MULTILINE)
QUOTED = re.compile(r"`([^`]+)`")
CASE = re.compile(r"^TEST(?:_[FP])?\(\s*(\w+),\s*(\w+)\)", re.MULTILINE)


def all_tests(source):
    """The names of all tests: functions of Python, and pairs of suite and test."""
    functions, cases = set(), set()
    for path in findings.files(os.path.join(source, "tests"), (".py", ".cpp")):
        text = findings.read(source, os.path.join("tests", path))
        functions |= set(re.findall(r"^def (test_\w+)\(", text, re.MULTILINE))
        cases |= set(CASE.findall(text))
    return functions, cases


def is_there(source, name, suite, functions, cases):
    if name.startswith("test_"):
        return name in functions
    if "/" in name:
        return os.path.exists(os.path.join(source, name))
    test = name.split(".")[-1]
    return any(s == suite and (test == "*" or t == test) for s, t in cases)


def unkept(source, text):
    functions, cases = all_tests(source)
    found, suite = [], ""
    tables = PROMISES.findall(text)
    for row in "".join(tables).splitlines():
        names = QUOTED.findall(row.split(" | ")[-1])
        if not names and "table above" not in row:
            found.append(f"{SECURITY}: names no test: {row}")
        for name in names:
            if "." in name and not name.startswith((".", "test_")):
                suite = name.split(".")[0]
            if not is_there(source, name, suite, functions, cases):
                found.append(f"{SECURITY}: there is no test {name}")
    return found if tables else [f"{SECURITY}: there is no table of promises"]


def main():
    options = findings.arguments(__doc__)
    text = findings.read(options.source, "README.md")
    security = findings.read(options.source, SECURITY)
    findings.conclude(missing(options.source, text) + unproved(text)
                      + unkept(options.source, security),
                      f"tests named in README.md and {SECURITY}")


if __name__ == "__main__":
    main()
