"""Prints what the system does and the tests that show it; fails when one of them is not there or
does not run.

usage: check_behaviours.py --source TOP --build TREE [--table [TEXT]]

The lists lie beside the tests, in tests/*/behaviours.txt. A line is a behaviour, then " -> ", then
the names of its tests, separated by blanks:

    Suite.Test               of GoogleTest; Group/Suite.Test/Case is one case, Group/Suite.Test all
    test_file.py::test_name  of pytest, whatever its parameters; test_file.py::Class::test_name

"# ---- " begins a section; other lines that begin with # are comments. A test exists when the build
has it, and it runs when nothing can make its framework pass over it. --table prints the behaviours
with the number of their tests and their names, all or those that have TEXT in them.
"""
import argparse
import ast
import collections
import json
import pathlib
import re
import signal
import subprocess
import sys

CASE = re.compile(r"^TEST(?:_[FP])?\(\s*(\w+),\s*(\w+)\s*\)", re.MULTILINE)
SKIP = re.compile(r"\bGTEST_SKIP\w*")
# What takes tests out of a whole program.
LEFT_OUT = re.compile(r"\b(DISABLED_\w*|FLAGS_gtest_filter|GTEST_FLAG\w*)")
PYTEST_SKIP = ("skip", "skipif", "skipTest", "skipIf", "skipUnless", "xfail", "importorskip",
               "expectedFailure")

Behaviour = collections.namedtuple("Behaviour", "path line section text names")


# ---- The lists

def behaviours_of(path, shown_path):
    section = ""
    for number, line in enumerate(path.read_text(encoding="utf-8").splitlines(), 1):
        line = line.strip()
        if line.startswith("# ---- "):
            section = line[len("# ---- "):]
        elif line and not line.startswith("#"):
            text, _, names = line.partition(" -> ")
            yield Behaviour(shown_path, number, section, text.strip(), names.split())


def all_behaviours(source):
    for path in sorted(source.glob("tests/*/behaviours.txt")):
        yield from behaviours_of(path, path.relative_to(source).as_posix())


# ---- The tests that the build has

def without_case(name):
    """Group/Suite.Test of Group/Suite.Test/Case, else nothing."""
    head, _, case = name.rpartition("/")
    return head if case and "." in head else ""


def built_tests(listing):
    """Of what ctest lists: names of tests, those that are disabled, and the files that are run."""
    names, disabled, arguments = set(), set(), set()
    for test in listing["tests"]:
        name = test["name"].split("  # ")[0]
        same = {name, without_case(name)} - {""}
        names |= same
        arguments |= set(test.get("command", [])[1:])
        if any(p["name"] == "DISABLED" and p["value"] for p in test.get("properties", [])):
            disabled |= same
    return names, disabled, arguments


def listing_of(build):
    return json.loads(subprocess.run(["ctest", "--test-dir", build, "--show-only=json-v1"],
                                     check=True, capture_output=True, text=True).stdout)


# ---- Tests that may pass over themselves

def skipping_cases(text):
    """Suites and tests of a C++ source that may skip: by themselves, or by what they share."""
    starts = list(CASE.finditer(text))
    found = set()
    for place in SKIP.finditer(text):
        around = None
        for start in starts:
            end = text.find("\n}\n", start.start())
            if start.start() < place.start() and (end < 0 or place.start() < end):
                around = start.groups()
        found |= {around} if around else {start.groups() for start in starts}
    return found


def names_in(tree):
    return {node.id if isinstance(node, ast.Name) else node.attr for node in ast.walk(tree)
            if isinstance(node, (ast.Name, ast.Attribute))}


def functions_of(module):
    for node in module.body:
        if isinstance(node, ast.FunctionDef):
            yield node.name, node
        elif isinstance(node, ast.ClassDef):
            for method in node.body:
                if isinstance(method, ast.FunctionDef):
                    yield f"{node.name}::{method.name}", method


def skip_words(module, words):
    """`words`, and what a module calls things made of them: marks, and functions that skip."""
    words = set(words)
    for node in module.body:
        if isinstance(node, ast.Assign) and names_in(node.value) & words:
            words |= {target.id for target in node.targets if isinstance(target, ast.Name)}
        elif (isinstance(node, ast.FunctionDef) and not node.name.startswith("test_")
              and names_in(node) & words):
            words.add(node.name)
    return words


def python_tests(module, words):
    """Names of the tests of a module, and of those that may skip."""
    words = skip_words(module, words)
    tests, skipping = set(), set()
    for name, function in functions_of(module):
        if function.name.startswith("test_"):
            tests.add(name)
            asked = {argument.arg for argument in function.args.args}  # fixtures
            if (names_in(function) | asked) & words or "pytestmark" in words:
                skipping.add(name)
    return tests, skipping


def unbuilt(listing):
    """Programs whose tests ctest does not know yet."""
    ending = "_NOT_BUILT"
    return [test["name"].removesuffix(ending) for test in listing["tests"]
            if test["name"].endswith(ending)]


class Tests:
    """The tests of the source tree and of the build."""

    def __init__(self, source, listing):
        names, self.disabled, arguments = built_tests(listing)
        self.names, self.skipping, self.left_out = set(names), set(), []
        self.cpp_skipping = set()
        for path in sorted((source / "tests").rglob("*")):
            if path.suffix in (".cpp", ".h"):
                self._read_cpp(path, path.relative_to(source).as_posix())
        shared = [ast.parse(path.read_text(encoding="utf-8"))
                  for path in sorted((source / "tests").rglob("*.py"))
                  if not path.name.startswith(("test_", "check_"))]
        words = set(PYTEST_SKIP)
        for module in shared:
            words = skip_words(module, words)
        for path in sorted((source / "tests").rglob("test_*.py")):
            if str(path) in arguments or str(path.resolve()) in arguments:
                module = ast.parse(path.read_text(encoding="utf-8"))
                tests, skipping = python_tests(module, words)
                self.names |= {f"{path.name}::{name}" for name in tests}
                self.skipping |= {f"{path.name}::{name}" for name in skipping}

    def _read_cpp(self, path, shown_path):
        text = path.read_text(encoding="utf-8")
        self.cpp_skipping |= skipping_cases(text)
        for place in LEFT_OUT.finditer(text):
            number = text.count("\n", 0, place.start()) + 1
            self.left_out.append(f"{shown_path}:{number}: takes tests out: {place.group()}")

    def fault_of(self, name):
        """What is wrong with a name, or nothing."""
        if name not in self.names:
            return "there is no test"
        suite, _, test = re.sub(r"/[^./]*$", "", name).rpartition("/")[2].partition(".")
        if name in self.disabled:
            return "is disabled:"
        if name in self.skipping or (suite, test) in self.cpp_skipping:
            return "may pass over itself:"
        return ""


# ---- The check

def findings_in(behaviours, tests):
    found, seen = list(tests.left_out), {}
    for each in behaviours:
        place = f"{each.path}:{each.line}:"
        if not each.names:
            found.append(f"{place} names no test")
        if each.text in seen:
            found.append(f"{place} stands in {seen[each.text]} already")
        seen.setdefault(each.text, f"{each.path}:{each.line}")
        if len(each.names) != len(set(each.names)):
            found.append(f"{place} names a test twice")
        for name in each.names:
            fault = tests.fault_of(name)
            if fault:
                found.append(f"{place} {fault} {name}")
    return found if seen else [*found, "tests/*/behaviours.txt: there is no behaviour"]


def print_table(behaviours, text):
    heading = None
    for each in behaviours:
        if text.lower() not in " ".join([each.section, each.text, *each.names]).lower():
            continue
        if heading != (each.path, each.section):
            heading = (each.path, each.section)
            print(f"\n{each.section} ({each.path})")
        print(f"{len(each.names):4}  {each.text}\n      " + "\n      ".join(each.names))


def main():
    parser = argparse.ArgumentParser(description=__doc__,
                                     formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("--source", required=True, type=pathlib.Path, help="top of the repository")
    parser.add_argument("--build", required=True, help="build tree")
    parser.add_argument("--table", nargs="?", const="", metavar="TEXT", help="print the table")
    options = parser.parse_args()
    behaviours = list(all_behaviours(options.source))
    if options.table is not None:
        signal.signal(signal.SIGPIPE, signal.SIG_DFL)  # of "| head"
        print_table(behaviours, options.table)
    listing = listing_of(options.build)
    found = ([f"{options.build}: {program} is not built: its tests cannot be looked for"
              for program in unbuilt(listing)]
             or findings_in(behaviours, Tests(options.source, listing)))
    for finding in found:
        print(finding)
    named = {name for each in behaviours for name in each.names}
    print(f"{len(behaviours)} behaviours, {len(named)} tests that show them, {len(found)} findings")
    return 1 if found else 0


if __name__ == "__main__":
    sys.exit(main())
