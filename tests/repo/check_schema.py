"""Checks the schema, and the default configuration against it."""

import os
import re

import ldap.schema

import findings
import schema_files

ARC = "2.25.83817390626969804497818767862655265745."

# The server reads the file on each operation, so it stays small; long explanations are for docs/.
LARGEST_DEFAULT_CONFIG = 14 * 1024

ORV_DIRECTORY = "CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION"
# Entries that the server's rules name and that cannot, or need not, be added first.
EXPECTED_ENTRIES = [
    "CN=CONFIGURATION",
    "CN=ADMINGROUP,CN=CONFIGURATION",
    "CN=DIGEST,CN=CONFIGURATION",
    "CN=LOG MANAGEMENT,CN=CONFIGURATION",
    "CN=ACCESS,CN=LOG MANAGEMENT,CN=CONFIGURATION",
    "CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION",
    "CN=ADMIN AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION",
    "CN=DEFAULT,CN=LOG MANAGEMENT,CN=CONFIGURATION",
    "CN=REPLICATION,CN=CONFIGURATION",
    "CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION",
    "CN=PWDPOLICY ADMIN,CN=CONFIGURATION",
    "CN=SCHEMAS,CN=CONFIGURATION",
    ORV_DIRECTORY,
    f"CN=CONFIG BACKENDS,{ORV_DIRECTORY}",
    f"CN=CONFIGDB,CN=CONFIG BACKENDS,{ORV_DIRECTORY}",
    f"CN=RDBM BACKENDS,{ORV_DIRECTORY}",
    f"CN=DIRECTORY,CN=RDBM BACKENDS,{ORV_DIRECTORY}",
    f"CN=PROXY BACKENDS,{ORV_DIRECTORY}",
    f"CN=PROXYDB,CN=PROXY BACKENDS,{ORV_DIRECTORY}",
]


def class_findings(schema):
    """Classes name known types; ours have one name and one OID under the arc."""
    found = []
    for oid in schema.tree(ldap.schema.ObjectClass):
        element = schema.get_obj(ldap.schema.ObjectClass, oid)
        if element is None:
            continue
        for name in element.must + element.may:
            if schema.get_obj(ldap.schema.AttributeType, name) is None:
                found.append(f"class {element.names[0]}: unknown attribute {name}")
        if element.names[0].startswith("orv-"):
            if len(element.names) != 1:
                found.append(f"class {element.names[0]}: more than one name")
            if not element.oid.startswith(ARC + "2."):
                found.append(f"class {element.names[0]}: OID outside the arc")
    return found


def secret_findings(source):
    """Passwords, and only they, are marked as secrets."""
    found = []
    text = findings.read(source, "schema/orv.schema")
    for description in schema_files.descriptions(text, "attributeTypes"):
        name = ldap.schema.AttributeType(description).names[0]
        is_marked = re.search(r"X-ORV-SECRET 'TRUE'", description) is not None
        if is_marked != name.endswith("PW"):
            found.append(f"type {name}: wrongly marked or not marked as a secret")
    return found


def entry_findings(schema, dn, entry):
    try:
        must, may = schema.attribute_types(entry["objectClass"], raise_keyerror=1)
    except KeyError as error:
        return [f"{dn}: unknown class {error}"]
    names = lambda types: {name for each in types for name in each.names}
    found = [f"{dn}: lacks {each.names[0]}" for each in must.values()
             if not set(each.names) & set(entry)]
    allowed = names(must.values()) | names(may.values())
    found += [f"{dn}: {name} is not allowed" for name in entry if name not in allowed]
    for name, values in entry.items():
        element = schema.get_obj(ldap.schema.AttributeType, name)
        if element is not None and element.single_value and len(values) > 1:
            found.append(f"{dn}: {name} has several values")
    return found


def default_config_findings(source, schema):
    entries = schema_files.default_entries(source)
    found = [finding for dn, entry in entries for finding in entry_findings(schema, dn, entry)]
    present = {dn.upper() for dn, _ in entries}
    found += [f"{dn}: is missing" for dn in EXPECTED_ENTRIES if dn not in present]
    found += [f"{dn}: is not expected" for dn in present if dn not in EXPECTED_ENTRIES]
    size = os.path.getsize(os.path.join(source, schema_files.DEFAULT_CONFIG))
    if size > LARGEST_DEFAULT_CONFIG:
        found.append(f"{schema_files.DEFAULT_CONFIG}: {size} bytes are too many")
    return found


def main():
    options = findings.arguments(__doc__)
    schema = schema_files.load(options.source)
    found = class_findings(schema) + secret_findings(options.source)
    found += default_config_findings(options.source, schema)
    findings.conclude(found, "schema and default configuration")


if __name__ == "__main__":
    main()
