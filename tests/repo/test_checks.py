"""Shows that each check of the repository finds what it is to find."""

import os
import sys
import tempfile
import unittest

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))

import check_arrows  # noqa: E402
import check_configuration_doc  # noqa: E402
import check_named_tests  # noqa: E402
import check_readme  # noqa: E402
import check_schema  # noqa: E402
import check_tests_built  # noqa: E402
import check_words  # noqa: E402
import findings  # noqa: E402


class Tree(unittest.TestCase):
    """A small source tree in a temporary folder."""

    def setUp(self):
        self._folder = tempfile.TemporaryDirectory()
        self.addCleanup(self._folder.cleanup)
        self.top = os.path.realpath(self._folder.name)

    def write(self, path, text):
        full = os.path.join(self.top, path)
        os.makedirs(os.path.dirname(full), exist_ok=True)
        with open(full, "w", encoding="utf-8") as file:
            file.write(text)
        return full


class Arrows(Tree):
    def found(self):
        return check_arrows.include_findings(self.top)

    def test_own_standard_and_allowed_headers_pass(self):
        self.write("slapi/include/slapi/pblock.h", "#include <cstddef>\n")
        self.write("back-config/handlers.h", "")
        self.write("back-config/backinit.cpp",
                   '#include "handlers.h"\n#include "slapi/pblock.h"\n#include <pthread.h>\n')
        self.assertEqual(self.found(), [])

    def test_backend_with_a_third_party_header_is_found(self):
        self.write("back-config/backinit.cpp", "#include <openssl/evp.h>\n")
        self.assertEqual(self.found(), ["back-config/backinit.cpp: may not include openssl/evp.h"])

    def test_backend_with_a_header_of_the_daemon_is_found(self):
        self.write("orvd/src/gate.h", "")
        self.write("back-config/backinit.cpp", '#include "orvd/src/gate.h"\n')
        self.assertEqual(len(self.found()), 1)

    def test_library_that_looks_upwards_is_found_in_both_spellings(self):
        self.write("slapi/include/slapi/pblock.h", "")
        for spelling in ('"slapi/pblock.h"', "<slapi/pblock.h>"):
            self.write("cfg/src/session.cpp", f"#include {spelling}\n")
            self.assertEqual(self.found(), ["cfg/src/session.cpp: may not include slapi/pblock.h"])

    def test_header_that_climbs_out_of_its_folder_is_found(self):
        self.write("cfg/src/session.cpp", '#include "../../nowhere/pblock.h"\n')
        self.assertEqual(len(self.found()), 1)

    def test_missing_and_forbidden_links_are_found(self):
        binary = "/bin/ls" if os.path.exists("/bin/ls") else sys.executable
        for name in check_arrows.LINKS:
            os.makedirs(os.path.join(self.top, os.path.dirname(name)), exist_ok=True)
        os.symlink(binary, os.path.join(self.top, "lib/libback-config.so"))
        found = check_arrows.link_findings(self.top)
        self.assertIn("lib/libback-config.so: does not link libslapi.so", found)
        self.assertIn("bin/orvd: was not built", found)
        self.assertIn("lib/libback-config.so: calls setlocale", found)

    def test_each_binary_may_link_what_the_table_says_only(self):
        allowed = check_arrows.LINKS["lib/libback-config.so"][0]
        self.assertFalse(any("ssl" in each or "ldap" in each for each in allowed))


class TestsBuilt(Tree):
    def test_files_outside_the_build_are_found(self):
        compiled = {self.write("tests/cfg/dn_test.cpp", "")}
        self.write("tests/cfg/forgotten_test.cpp", "")
        run = {os.path.dirname(self.write("tests/e2e/test_search.py", ""))}
        self.write("tests/other/test_forgotten.py", "")
        self.assertEqual(check_tests_built.unbuilt(self.top, compiled, run),
                         ["tests/cfg/forgotten_test.cpp: is not compiled",
                          "tests/other/test_forgotten.py: no test runs it"])


class Words(unittest.TestCase):
    def test_each_pattern_is_found(self):
        for text in ("the spec" + "ification says", "as spec" + "ified", "see Part 1" + ".2",
                     "in the appen" + "dix", "left for issue" + " B", "/work" + "/main/cfg"):
            self.assertEqual(len(check_words.findings_in("x", "one\n" + text)[:1]), 1, text)

    def test_ordinary_words_pass(self):
        text = "subtreeSpecification, specific, RFC 4512, 4.1; parts 1 and 2; tissue"
        self.assertEqual(check_words.findings_in("x", text), [])


class Schema(Tree):
    def schema(self, config):
        source = os.path.dirname(os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
        for name in ("schema/core.schema", "schema/orv.schema"):
            self.write(name, findings.read(source, name))
        self.write("config/default.ldif", config)
        schema = check_schema.schema_files.load(self.top)
        return check_schema.default_config_findings(self.top, schema)

    def test_faults_of_the_default_configuration_are_found(self):
        found = self.schema("dn: CN=CONFIGURATION\nobjectClass: top\nobjectClass: orv-slapdTop\n"
                            "orv-slapdPort: 1\norv-slapdPort: 2\norv-slapdLog: /x\n")
        for text in ("lacks orv-slapdAdminDN", "orv-slapdLog is not allowed",
                     "orv-slapdPort has several values"):
            self.assertIn(f"CN=CONFIGURATION: {text}", found)
        self.assertIn("CN=ADMINGROUP,CN=CONFIGURATION: is missing", found)


class NamedTests(Tree):
    HEAD = "| operation | what guards it | test |\n|---|---|---|\n"

    def test_tests_that_exist_pass(self):
        self.write("tests/e2e/test_x.py", "def test_one(root):\n    pass\n")
        text = self.HEAD + "| add | roles | `test_x.py::test_one` |\n"
        self.assertEqual(check_named_tests.missing(self.top, text), [])
        self.assertEqual(check_named_tests.unproved(text), [])

    def test_missing_tests_and_files_are_found(self):
        self.write("tests/e2e/test_x.py", "def test_one(root):\n    def test_two():\n")
        self.assertEqual(
            check_named_tests.missing(self.top, "`test_x.py::test_two` `test_y.py::test_one`"),
            ["README.md: there is no test test_x.py::test_two",
             "README.md: there is no test test_y.py::test_one"])

    def test_rows_without_a_test_are_found(self):
        rows = "| add | roles | `test_x.py::test_one` |\n| delete | roles | `test_x.py` |\n"
        self.assertEqual(check_named_tests.unproved(self.HEAD + rows + "\n"),
                         ["README.md: names no test: | delete | roles | `test_x.py` |"])
        self.assertEqual(len(check_named_tests.unproved("no table")), 1)

    def test_promises_are_held_by_tests_that_exist(self):
        self.write("tests/x/a_test.cpp", "TEST(Suite, One) {\nTEST_F(Suite, Two) {\n")
        self.write("tests/e2e/test_x.py", "def test_one(root):\n    pass\n")
        head = "| promise | tested by |\n|---|---|\n"
        good = head + "| a | `Suite.One`, `.Two`, `test_one` |\n| `b` | `Suite.*`, `tests/e2e` |\n"
        self.assertEqual(check_named_tests.unkept(self.top, good), [])
        bad = head + "| a | `Suite.Three`, `.Four`, `test_two`, `No.*`, `x/y` |\n| b | |\n"
        self.assertEqual(len(check_named_tests.unkept(self.top, bad)), 6)
        self.assertEqual(len(check_named_tests.unkept(self.top, "no table")), 1)


class Readme(unittest.TestCase):
    def test_output_that_is_missing_is_found(self):
        self.assertEqual(check_readme.unseen("\n".join(check_readme.EXPECTED.values())), [])
        self.assertEqual(len(check_readme.unseen("")), len(check_readme.EXPECTED))


class ConfigurationDoc(unittest.TestCase):
    ROWS = ("| `a-b` | what | `7` | s | now |\n"
            "| `gone` | what | none | s | now |\n")

    def test_each_difference_is_found(self):
        rows = check_configuration_doc.documented(self.ROWS)
        found = check_configuration_doc.compare(rows, {"a-b", "new"}, {"a-b": {"8"}})
        self.assertEqual(len(found), 3)

    def test_equal_tables_pass(self):
        rows = check_configuration_doc.documented(self.ROWS)
        self.assertEqual(check_configuration_doc.compare(rows, {"a-b", "gone"}, {"a-b": {"7"}}), [])


if __name__ == "__main__":
    unittest.main()
