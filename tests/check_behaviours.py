"""Holds a list of behaviours against the tests of a program.

usage: check_behaviours.py LIST PROGRAM [--table]

LIST has one line for each behaviour: what holds, then " -> ", then the names of the tests that show it
(Suite.Name, separated by blanks). Empty lines and lines that begin with # are skipped. Fails when a
named test does not exist in PROGRAM, is disabled or skipped by its name, when a line names none, or when
a behaviour stands there twice. With --table prints the list in two columns.
"""
import subprocess
import sys


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
            if "DISABLED_" in name:
                fail(number, f"does not run: {name}")
        if "--table" in options:
            print(f"{text:<100}  {' '.join(names)}")
    print(f"{len(seen)} behaviours, {len(tests)} tests, {failures} failures")
    return 1 if failures or not seen else 0


if __name__ == "__main__":
    sys.exit(main())
