"""Checks that the tests that README.md and docs/security.md name exist, and that every row of the
former's table of guards names one."""

import os
import re

import findings

FOLDER = "tests/e2e"
SECURITY = "docs/security.md"
# `Suite.Name`, `.Name` in the suite that was named last, `Suite.*`, or `test_name`.
OF_SECURITY = re.compile(r"`(?:([A-Z]\w*)?\.([A-Z]\w*|\*)|(test_\w+))`")
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


def all_defined(source):
    """Names of pytest functions, and (suite, name) of GoogleTest, in the whole of tests/."""
    functions, cases = set(), set()
    for path in findings.files(os.path.join(source, "tests"), (".py", ".cpp", ".h")):
        text = findings.read(source, os.path.join("tests", path))
        functions.update(re.findall(r"^def (test_\w+)\(", text, re.MULTILINE))
        cases.update(re.findall(r"^TEST(?:_[FP])?\(\s*(\w+),\s*(\w+)\)", text, re.MULTILINE))
    return functions, cases


def missing_of_security(source, text):
    functions, cases = all_defined(source)
    suites = {suite for suite, _ in cases}
    found, suite = [], ""
    for named, case, function in OF_SECURITY.findall(text):
        suite = named or suite
        known = (function in functions if function else
                 suite in suites if case == "*" else (suite, case) in cases)
        if not known:
            found.append(f"{SECURITY}: there is no test {function or suite + '.' + case}")
    return found


def unproved(text):
    tables = TABLE.findall(text)
    if not tables:
        return ["README.md: there is no table of guards"]
    return [f"README.md: names no test: {row}" for table in tables for row in table.splitlines()
            if not NAMED.search(row)]


def main():
    options = findings.arguments(__doc__)
    text = findings.read(options.source, "README.md")
    security = findings.read(options.source, SECURITY)
    findings.conclude(missing(options.source, text) + unproved(text) +
                      missing_of_security(options.source, security),
                      "tests named in README.md and docs/security.md")


if __name__ == "__main__":
    main()
