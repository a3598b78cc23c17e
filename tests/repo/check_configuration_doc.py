"""Checks docs/configuration.md: its tables name every setting of the schema, with the defaults of the
default configuration, and no other.

A row begins with the setting's name in backquotes; the third column is the default, in backquotes
where the default configuration sets it.
"""

import re

import findings
import schema_files

DOCUMENT = "docs/configuration.md"
ROW = re.compile(r"^\| `([A-Za-z-]+)` \|([^|\n]*)\|([^|\n]*)\|([^|\n]*)\|([^|\n]*)\|$", re.MULTILINE)
# Not settings: a type that stands only inside the values of another, and one of the root DSE.
NOT_SETTINGS = {"orv-kerberosName", "orv-restartSettings"}
PLACEHOLDER = re.compile(r"@(DIR|ADMINPW)@")


def documented(text):
    """name: the default of each row that has one; a setting may have a row for each entry."""
    rows = {}
    for name, _, default, _, _ in ROW.findall(text):
        rows.setdefault(name, set()).update(re.findall(r"`([^`]+)`", default))
    return rows


def defaults(entries):
    values = {}
    for _, entry in entries:
        for name, these in entry.items():
            for value in these:
                if not PLACEHOLDER.search(value):
                    values.setdefault(name, set()).add(value)
    return values


def compare(rows, names, values):
    found = [f"{name}: not in {DOCUMENT}" for name in names if name not in rows]
    found += [f"{name}: not in the schema" for name in rows if name not in names]
    for name, stated in rows.items():
        actual = values.get(name, set())
        if name in names and stated != actual:
            found.append(f"{name}: the document says {sorted(stated)}, "
                         f"the default configuration {sorted(actual)}")
    return found


def main():
    options = findings.arguments(__doc__)
    names = set(schema_files.setting_names(options.source)) - NOT_SETTINGS
    rows = documented(findings.read(options.source, DOCUMENT))
    values = defaults(schema_files.default_entries(options.source))
    findings.conclude(compare(rows, names, values), "settings and their documentation")


if __name__ == "__main__":
    main()
