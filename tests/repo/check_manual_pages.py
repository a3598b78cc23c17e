"""Checks the manual pages with mandoc, where it is installed."""

import os
import shutil
import subprocess

import findings


def lint(path):
    result = subprocess.run(["mandoc", "-T", "lint", "-W", "warning", path], capture_output=True,
                            text=True)
    return (result.stdout + result.stderr).splitlines()


def main():
    options = findings.arguments(__doc__)
    folder = os.path.join(options.source, "docs", "man")
    pages = [os.path.join(folder, name) for name in findings.files(folder, (".1", ".5", ".8"))]
    if not pages:
        findings.conclude(["docs/man: no manual pages"], "manual pages")
    if shutil.which("mandoc") is None:
        print("mandoc is not installed; the manual pages were not examined")
        return
    findings.conclude([line for page in pages for line in lint(page)], "manual pages")


if __name__ == "__main__":
    main()
