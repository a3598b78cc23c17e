"""What the checks of the repository have in common: arguments, findings, files, exit status."""

import argparse
import os
import sys

SKIPPED = {".git", "build", "var", "__pycache__", ".cache", ".pytest_cache", "corpus"}


def arguments(description):
    parser = argparse.ArgumentParser(description=description)
    parser.add_argument("--source", required=True, help="top of the repository")
    parser.add_argument("--build", default="", help="build tree")
    return parser.parse_args()


def conclude(findings, what):
    """Prints findings and ends the program with 1 when there are any."""
    for finding in findings:
        print(finding)
    if findings:
        sys.exit(f"{len(findings)} findings: {what}")
    print(f"nothing found: {what}")


def files(top, suffixes=None):
    """Paths of files below `top`, relative to it, sorted; what is made by builds is left out."""
    found = []
    for folder, folders, names in os.walk(top):
        folders[:] = [f for f in folders if f not in SKIPPED]
        for name in names:
            if name in SKIPPED:  # .git is a file where a work tree is linked
                continue
            if suffixes is None or name.endswith(suffixes):
                found.append(os.path.relpath(os.path.join(folder, name), top))
    return sorted(found)


def read(top, path):
    with open(os.path.join(top, path), encoding="utf-8", errors="replace") as file:
        return file.read()
