"""Reads schema/ and config/default.ldif with parsers that are not this project's own (python-ldap)."""

import os

import ldap.schema
import ldif

import findings

SCHEMA_FILES = ("schema/core.schema", "schema/orv.schema")
DEFAULT_CONFIG = "config/default.ldif"


def descriptions(text, kind):
    """The descriptions of one kind ("attributeTypes" or "objectClasses"), unfolded."""
    lines = []
    for line in text.splitlines():
        if line.startswith(" ") and lines:
            lines[-1] += line[1:]
        else:
            lines.append(line)
    return [line[len(kind) + 2:] for line in lines if line.startswith(kind + ": ")]


def load(source):
    text = "".join(findings.read(source, name) for name in SCHEMA_FILES)
    return ldap.schema.SubSchema(
        {kind: descriptions(text, kind) for kind in ("attributeTypes", "objectClasses")},
        check_uniqueness=2)


def setting_names(source):
    """Names of the attributes of the configuration tree, without those of the standards."""
    types = descriptions(findings.read(source, "schema/orv.schema"), "attributeTypes")
    return [ldap.schema.AttributeType(text).names[0] for text in types]


class _Entries(ldif.LDIFParser):
    def __init__(self, file):
        super().__init__(file)
        self.entries = []

    def handle(self, dn, entry):
        self.entries.append((dn, {name: [v.decode() for v in values]
                                  for name, values in entry.items()}))


def default_entries(source):
    with open(os.path.join(source, DEFAULT_CONFIG), "rb") as file:
        parser = _Entries(file)
        parser.parse()
    return parser.entries
