"""Checks that no file speaks of what a reader of this repository cannot see.

Papers that are not in the repository, numbers of their chapters, and paths of one machine mean nothing
to a reader. The patterns are put together from pieces, so that this file passes its own check.
"""

import re

import findings

PATTERNS = [re.compile(text) for text in (
    r"\b[Ss]pec" + r"ifications?\b",
    r"\bas spec" + r"ified\b",
    r"\bParts? [0-9]+\.[0-9]+\b",
    r"\b[Aa]ppen" + r"di(x|ces)\b",
    r"\bissue" + r" #?[A-E0-9]+\b",
    r"/work" + r"/(main|shared)\b",
    r"/tmp" + r"/w/",
)]

# What the words above also stand for: references into published standards.
PUBLISHED = re.compile(r"(RFC ?[0-9]+|POSIX|ITU-T X\.[0-9]+)[^.;]{0,40}$")


def findings_in(path, text):
    found = []
    for number, line in enumerate(text.splitlines(), 1):
        for pattern in PATTERNS:
            match = pattern.search(line)
            if match and not PUBLISHED.search(line[:match.start()]):
                found.append(f"{path}:{number}: {match.group(0)}")
    return found


def main():
    options = findings.arguments(__doc__)
    found = []
    for path in findings.files(options.source):
        found += findings_in(path, path)
        found += findings_in(path, findings.read(options.source, path))
    findings.conclude(found, "words about things outside the repository")


if __name__ == "__main__":
    main()
