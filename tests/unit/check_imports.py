"""Fails if a shared library needs one of the symbols named from elsewhere.

usage: check_imports.py NM LIBRARY SYMBOL...
"""
import subprocess
import sys


def imported(nm, library):
    listing = subprocess.run([nm, "--dynamic", "--undefined-only", library],
                             check=True, capture_output=True, text=True).stdout
    return {line.split()[-1].split("@")[0] for line in listing.splitlines()}


def main():
    nm, library, *unwanted = sys.argv[1:]
    found = sorted(imported(nm, library) & set(unwanted))
    for name in found:
        print(f"needed, and not to be: {name}")
    return 1 if found else 0


if __name__ == "__main__":
    sys.exit(main())
