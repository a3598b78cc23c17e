"""Checks that each fault of the mutation lists fits its source: what it replaces stands there once.

A run of the lists takes hours and is therefore rare; a fault that no longer fits tests nothing, and
nobody would know before the next run.
"""

import os
import pathlib
import sys

import findings

LISTS = "tests/mutation"
sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), "../mutation"))

import mutate  # noqa: E402


def misfits(source):
    found = []
    for path in sorted(pathlib.Path(source, LISTS).glob("*.faults")):
        for fault in mutate.faults_of(path):
            old = "\n".join(fault["-"])
            file = fault["file"] or ""
            if not os.path.isfile(os.path.join(source, file)):
                found.append(f"{LISTS}/{fault['line']}: there is no file {file!r}")
                continue
            times = findings.read(source, file).count(old) if old else 0
            if times != 1:
                found.append(f"{LISTS}/{fault['line']}: stands {times} times in {file}: "
                             f"{fault['-'][0] if fault['-'] else 'nothing to replace'}")
    return found


def main():
    options = findings.arguments(__doc__.splitlines()[0])
    findings.conclude(misfits(options.source), "faults that do not fit their source")


if __name__ == "__main__":
    main()
