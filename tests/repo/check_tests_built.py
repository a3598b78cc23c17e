"""Checks that every test file is in the build: C++ files are compiled, Python files are run."""

import json
import os
import subprocess

import findings

# Python modules that tests import, and programs that others start.
NOT_TESTS = ("conftest.py", "findings.py", "check_readme.py", "__init__.py")


def compiled_files(build):
    with open(os.path.join(build, "compile_commands.json"), encoding="utf-8") as file:
        return {os.path.realpath(os.path.join(entry["directory"], entry["file"]))
                for entry in json.load(file)}


def run_arguments(build):
    listing = subprocess.run(["ctest", "--test-dir", build, "--show-only=json-v1"], check=True,
                             capture_output=True, text=True).stdout
    return {argument for test in json.loads(listing)["tests"]
            for argument in test.get("command", [])[1:]}


def is_run(path, arguments):
    """A Python file is run by its own name, or by that of a folder above it."""
    return any(path == argument or path.startswith(argument.rstrip("/") + "/")
               for argument in arguments if argument.startswith("/"))


def unbuilt(source, compiled, arguments):
    found = []
    tests = os.path.realpath(os.path.join(source, "tests"))
    for name in findings.files(tests, (".cpp",)):
        if os.path.join(tests, name) not in compiled:
            found.append(f"tests/{name}: is not compiled")
    for name in findings.files(tests, (".py",)):
        base = os.path.basename(name)
        is_test = base.startswith(("test_", "check_")) and base not in NOT_TESTS
        if is_test and not is_run(os.path.join(tests, name), arguments):
            found.append(f"tests/{name}: no test runs it")
    return found


def main():
    options = findings.arguments(__doc__)
    arguments = {os.path.realpath(a) if a.startswith("/") else a
                 for a in run_arguments(options.build)}
    findings.conclude(unbuilt(options.source, compiled_files(options.build), arguments),
                      "test files outside the build")


if __name__ == "__main__":
    main()
