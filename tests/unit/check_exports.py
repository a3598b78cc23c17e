"""Fails unless the symbols that a shared library exports are exactly those named.

usage: check_exports.py NM LIBRARY SYMBOL...
"""
import subprocess
import sys

# What instrumented builds add by themselves.
INSTRUMENTATION = ("__asan", "__odr_asan", "__ubsan", "__tsan", "__gcov", "__sanitizer", "__llvm")


def exported(nm, library):
    listing = subprocess.run([nm, "--dynamic", "--defined-only", "--extern-only", library],
                             check=True, capture_output=True, text=True).stdout
    names = {line.split()[-1] for line in listing.splitlines()}
    return {name for name in names if not name.startswith(INSTRUMENTATION)}


def main():
    nm, library, *wanted = sys.argv[1:]
    found = exported(nm, library)
    for name in sorted(found - set(wanted)):
        print(f"exported, but not part of the interface: {name}")
    for name in sorted(set(wanted) - found):
        print(f"not exported: {name}")
    return 0 if found == set(wanted) else 1


if __name__ == "__main__":
    sys.exit(main())
