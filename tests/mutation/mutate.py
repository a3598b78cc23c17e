"""Puts deliberate faults into the sources, one by one, and sees whether the tests notice.

usage: mutate.py [--list FILE]... [--only TEXT] [--work DIR] [--keep]

Works in a copy of the sources; the tree itself is not touched. The name of a list says which tests
run: those of the backend, the authority matrix by itself, or those of the configuration-file library.
A list has blocks like

    == back-config/config_bind.cpp
    - what the source says
    + what it says with the fault

with a blank line between blocks and as many "- " and "+ " lines as needed; the "- " text must stand in
the file exactly once (an indentation at its beginning may be left out). "#" begins a comment.

A fault that all tests survive is a failure, and so is one that does not compile or does not fit the
source any more: it tests nothing.
"""
import argparse
import pathlib
import shutil
import subprocess
import sys
import tempfile
import time

ROOT = pathlib.Path(__file__).resolve().parents[2]
COMMON = ("cfg/include", "cmake")
SUITES = {
    "backend": {
        "needed": ("back-config", "slapi/include", "tests/unit", "tests/check_behaviours.py"),
        "folders": ("back-config", "tests/unit"),
        "target": "backend_unit_tests",
        "arguments": []},
    "authority": {
        "needed": ("back-config", "slapi/include", "tests/unit", "tests/check_behaviours.py"),
        "folders": ("back-config", "tests/unit"),
        "target": "backend_authority_tests",
        "arguments": []},
    "cfg": {
        "needed": ("cfg/src", "cfg/CMakeLists.txt", "tests/cfg"),
        "folders": ("cfg", "tests/cfg"),
        "target": "cfg_test",
        "arguments": ["--gtest_filter=Add*:Delete*:Modify*:Secret*:FileModel*:Concurrent*:SaveFault*:"
                      "Crash*:ChangeModel*:WrittenInPlace*"],
        # For these files fewer tests are quicker; that others would notice too is no matter.
        "arguments_of": {
            "cfg/src/file_calls.cpp": ["--gtest_filter=WrittenInPlace*"],
            "cfg/src/file_text.cpp": ["--gtest_filter=WrittenInPlace*"],
            "cfg/src/secret.cpp": ["--gtest_filter=Secret*:Modify*"],
            "cfg/src/modify.cpp": ["--gtest_filter=Modify*:FileModel*"],
            "cfg/src/save.cpp": ["--gtest_filter=*EditedSave*:Concurrent*:SaveFault*:Crash*:"
                                 "WrittenInPlace*"]}},
}

# Only what the tests need; no warnings, since a fault may well leave something unused.
PROJECT = """
cmake_minimum_required(VERSION 3.25)
project(orv LANGUAGES CXX)
list(APPEND CMAKE_MODULE_PATH "${CMAKE_SOURCE_DIR}/cmake")
include(OrvToolchain)
include(OrvTargets)
set_property(TARGET orv_warnings PROPERTY INTERFACE_COMPILE_OPTIONS -w)
find_package(Threads REQUIRED)
find_package(OpenSSL 3.0 REQUIRED)
find_package(PkgConfig REQUIRED)
pkg_check_modules(UTF8PROC REQUIRED IMPORTED_TARGET libutf8proc)
enable_testing()
find_package(GTest REQUIRED)
include(GoogleTest)
"""


TIMEOUT = 300  # seconds for tests that need some ten: a busy machine must not look like a fault


def faults_of(path):
    fault, source = None, None
    for number, line in enumerate(path.read_text(encoding="utf-8").splitlines() + [""], 1):
        if line.startswith("#"):
            continue
        if line.startswith("== "):
            source = line[3:].strip()
        elif line[:1] in ("-", "+"):
            fault = fault or {"file": source, "line": f"{path.name}:{number}", "-": [], "+": []}
            fault[line[0]].append(line[2:])
        elif not line.strip() and fault:
            yield fault
            fault = None


def prepare(work, suite):
    for name in (*COMMON, *suite["needed"]):
        source, target = ROOT / name, work / name
        target.parent.mkdir(parents=True, exist_ok=True)
        if source.is_dir():
            shutil.copytree(source, target)
        else:
            shutil.copy(source, target)
    folders = "".join(f"add_subdirectory({folder})\n" for folder in suite["folders"])
    (work / "CMakeLists.txt").write_text(PROJECT + folders, encoding="utf-8")
    subprocess.run(["cmake", "-S", work, "-B", work / "build", "-G", "Ninja",
                    "-DCMAKE_BUILD_TYPE=Debug", "-DCMAKE_CXX_FLAGS_DEBUG=-O0"],
                   check=True, stdout=subprocess.DEVNULL)


def build(work, suite):
    done = subprocess.run(["ninja", "-C", work / "build", suite["target"]], capture_output=True,
                          text=True)
    return done.returncode == 0, done.stdout


def red(work, suite, file=None):
    """How the tests fail, by "a failure" (a crash too) or by "never coming back", or None."""
    arguments = suite.get("arguments_of", {}).get(file, suite["arguments"])
    try:
        done = subprocess.run([work / "build/bin" / suite["target"], "--gtest_brief=1",
                               "--gtest_fail_fast", *arguments],
                              capture_output=True, timeout=TIMEOUT)
    except subprocess.TimeoutExpired:
        return "never coming back"
    return "a failure" if done.returncode != 0 else None


def try_fault(work, suite, fault):
    """What is wrong with the fault or the tests; None when these notice it."""
    path = work / fault["file"]
    text = path.read_text(encoding="utf-8")
    old, new = "\n".join(fault["-"]), "\n".join(fault["+"])
    if text.count(old) != 1:
        return f"stands {text.count(old)} times in the source"
    try:
        path.write_text(text.replace(old, new), encoding="utf-8")
        built, _ = build(work, suite)
        if not built:
            return "does not compile"
        how = red(work, suite, fault["file"])
        if how == "never coming back":
            print(f"{fault['line']} {fault['file']}: noticed by {how}", flush=True)
        return None if how else "SURVIVED"
    finally:
        path.write_text(text, encoding="utf-8")


def run(work, suite, faults):
    prepare(work, suite)
    built, output = build(work, suite)
    if not built or red(work, suite):
        print("the tests are not green without a fault\n" + output)
        return 1
    bad, begin = [], time.monotonic()
    for fault in faults:
        verdict = try_fault(work, suite, fault)
        if verdict:
            bad.append(fault)
            print(f"{fault['line']} {fault['file']}: {verdict}: {' / '.join(fault['-'])[:90]}",
                  flush=True)
    by_file = {}
    for fault in faults:
        by_file[fault["file"]] = by_file.get(fault["file"], 0) + 1
    for name in sorted(by_file):
        print(f"{by_file[name]:4d}  {name}")
    print(f"{len(faults)} faults, {len(bad)} not noticed, {time.monotonic() - begin:.0f} s")
    return 1 if bad or not faults else 0


def main():
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument("--list", action="append", type=pathlib.Path)
    parser.add_argument("--only", help="only faults in files whose name contains this")
    parser.add_argument("--work", type=pathlib.Path, help="folder for the copy; must not exist")
    parser.add_argument("--keep", action="store_true", help="leave the copy behind")
    options = parser.parse_args()
    lists = options.list or sorted(pathlib.Path(__file__).parent.glob("*.faults"))
    work = options.work or pathlib.Path(tempfile.mkdtemp(prefix="mutation-"))
    work.mkdir(parents=True, exist_ok=True)
    bad = 0
    try:
        for path in lists:
            faults = [fault for fault in faults_of(path)
                      if not options.only or options.only in fault["file"]]
            if faults or not options.only:
                bad += run(work / path.stem, SUITES.get(path.stem, SUITES["backend"]), faults)
    finally:
        if not options.keep:
            shutil.rmtree(work)
    return 1 if bad else 0


if __name__ == "__main__":
    sys.exit(main())
