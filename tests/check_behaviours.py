"""Holds a list of behaviours against the tests of a program.

usage: check_behaviours.py LIST PROGRAM [--table]

LIST has one line for each behaviour: what holds, then " -> ", then the names of the tests that show it
(Suite.Name, separated by blanks). Empty lines and lines that begin with # are skipped. Fails when a
named test does not exist in PROGRAM, when a line names none, when a behaviour stands there twice, and
when the sources beside LIST have tests that do not run: skipped or disabled ones. With --table prints
the list in two columns.
"""
import pathlib
import re
import subprocess
import sys

# What makes GoogleTest pass over a test.
NOT_RUN = re.compile(r"\b(GTEST_SKIP\w*|DISABLED_\w*|FLAGS_gtest_filter|GTEST_FLAG\w*)")


def tests_of(program):
    listing = subprocess.run([program, "--gtest_list_tests"], check=True, capture_output=True,
                             text=True).stdout
    names, suite = set(), ""
    for line in listing.splitlines():
        line = line.split("#")[0].rstrip()
        if line.startswith("  "):
            names.add(suite + line.strip())
        elif line.endswith("."):
            suite = line
    return names


def behaviours_of(path):
    with open(path, encoding="utf-8") as lines:
        for number, line in enumerate(lines, 1):
            line = line.strip()
            if line and not line.startswith("#"):
                text, _, names = line.partition(" -> ")
                yield number, text.strip(), names.split()


def not_run(folder):
    for path in sorted(folder.rglob("*")):
        if path.suffix not in (".cpp", ".h"):
            continue
        for number, line in enumerate(path.read_text(encoding="utf-8").splitlines(), 1):
            for found in NOT_RUN.findall(line):
                yield path, number, found


def main():
    path, program, *options = sys.argv[1:]
    tests = tests_of(program)
    seen, failures = set(), 0

    def fail(number, message):
        nonlocal failures
        failures += 1
        print(f"{path}:{number}: {message}")

    for number, text, names in behaviours_of(path):
        if not names:
            fail(number, "names no test")
        if text in seen:
            fail(number, "stands here twice")
        seen.add(text)
        for name in names:
            if name not in tests:
                fail(number, f"no such test: {name}")
        if "--table" in options:
            print(f"{text:<100}  {' '.join(names)}")
    for source, number, word in not_run(pathlib.Path(path).resolve().parent):
        failures += 1
        print(f"{source}:{number}: a test that does not run: {word}")
    print(f"{len(seen)} behaviours, {len(tests)} tests, {failures} failures")
    return 1 if failures or not seen else 0


if __name__ == "__main__":
    sys.exit(main())
