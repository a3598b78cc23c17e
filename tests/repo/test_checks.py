"""Shows that each check of the repository finds what it is to find."""

import os
import pathlib
import sys
import tempfile
import unittest

sys.path[:0] = [os.path.dirname(os.path.abspath(__file__)),
                os.path.dirname(os.path.dirname(os.path.abspath(__file__))),
                os.path.join(os.path.dirname(os.path.dirname(os.path.abspath(__file__))), "coverage")]

import check_arrows  # noqa: E402
import check_behaviours  # noqa: E402
import check_configuration_doc  # noqa: E402
import check_fault_lists  # noqa: E402
import check_named_tests  # noqa: E402
import check_readme  # noqa: E402
import check_schema  # noqa: E402
import check_tests_built  # noqa: E402
import check_words  # noqa: E402
import findings  # noqa: E402
import measure  # noqa: E402


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


class Behaviours(Tree):
    def found(self, names, source="", module="", disabled=False, more=""):
        """Findings of a list of one line, over a C++ test Suite.One and a pytest one."""
        self.write("tests/x/behaviours.txt", f"# ---- Section\nit works -> {names}\n{more}")
        self.write("tests/x/a_test.cpp", source)
        run = self.write("tests/e2e/test_x.py", module)
        self.write("tests/e2e/test_not_run.py", "def test_one(root):\n    pass\n")
        listing = {"tests": [
            {"name": "Suite.One", "command": ["x_test"],
             "properties": [{"name": "DISABLED", "value": disabled}]},
            {"name": "All/Cases.Two/First  # GetParam() = 7", "command": ["x_test"]},
            {"name": "e2e.x", "command": ["python3", run]}]}
        top = pathlib.Path(self.top)
        behaviours = list(check_behaviours.all_behaviours(top))
        self.assertTrue(all(each.section == "Section" for each in behaviours))
        return [finding.split(": ", 1)[1] for finding in
                check_behaviours.findings_in(behaviours, check_behaviours.Tests(top, listing))]

    def test_tests_that_run_pass(self):
        self.assertEqual(
            self.found("Suite.One All/Cases.Two All/Cases.Two/First test_x.py::test_one "
                       "test_x.py::Tool::test_two",
                       source="TEST_F(Suite, One) {\n}\nTEST(Suite, Two) {\n  GTEST_SKIP();\n}\n",
                       module="def test_one(root):\n    pass\n\n\nclass Tool:\n"
                              "    def test_two(self):\n        pass\n"), [])

    def test_missing_tests_are_found(self):
        names = ["Suite.Three", "Suite", "All/Cases", "All/Cases.Two/Second", "test_x.py::test_two",
                 "test_x.py", "test_not_run.py::test_one", "test_one"]
        self.assertEqual(self.found(" ".join(names), module="def test_one(root):\n    pass\n"),
                         [f"there is no test {name}" for name in names])

    def test_programs_that_are_not_built_are_found(self):
        listing = {"tests": [{"name": "cfg_test_NOT_BUILT"}, {"name": "Suite.One"}]}
        self.assertEqual(check_behaviours.unbuilt(listing), ["cfg_test"])

    def test_lines_without_a_test_and_lines_that_stand_twice_are_found(self):
        self.assertEqual(self.found(""), ["names no test"])
        self.assertEqual(self.found("Suite.One Suite.One"), ["names a test twice"])
        self.assertEqual(self.found("Suite.One", more="it works -> Suite.One\n"),
                         ["stands in tests/x/behaviours.txt:2 already"])
        os.remove(self.write("tests/x/behaviours.txt", ""))
        tests = check_behaviours.Tests(pathlib.Path(self.top), {"tests": []})
        self.assertEqual(len(check_behaviours.findings_in([], tests)), 1)

    def test_disabled_and_left_out_tests_are_found(self):
        self.assertEqual(self.found("Suite.One", disabled=True), ["is disabled: Suite.One"])
        for word in ("DISABLED" + "_One", "GTEST" + "_FLAG_SET", "FLAGS" + "_gtest_filter"):
            self.assertEqual(self.found("Suite.One", source=f"int {word};\n"),
                             [f"takes tests out: {word}"])

    def test_cases_that_may_skip_are_found(self):
        skip = "GTEST" + "_SKIP() << 1;"
        for source in (f"TEST(Suite, One) {{\n  {skip}\n}}\n",
                       f"void shared() {{\n  {skip}\n}}\nTEST_P(Suite,\n       One) {{\n}}\n"):
            self.assertEqual(self.found("Suite.One", source=source),
                             ["may pass over itself: Suite.One"])
        self.assertEqual(self.found("All/Cases.Two/First",
                                    source=f"TEST_P(Cases, Two) {{\n  {skip}\n}}\n"),
                         ["may pass over itself: All/Cases.Two/First"])

    def test_functions_that_may_skip_are_found(self):
        test = "def test_one(root):\n    pass\n"
        for module in (f"@pytest.mark.skip\n{test}", f"@pytest.mark.xfail(reason='x')\n{test}",
                       f"needs_root = pytest.mark.skipif(True)\n\n\n@needs_root\n{test}",
                       f"pytestmark = pytest.mark.skipif(True)\n{test}",
                       "def test_one(root):\n    pytest.skip('x')\n",
                       f"@pytest.fixture\ndef root():\n    pytest.skip('x')\n\n\n{test}",
                       "def tool():\n    pytest.importorskip('x')\n\n\n"
                       "def test_one(root):\n    tool()\n"):
            self.assertEqual(self.found("test_x.py::test_one", module=module),
                             ["may pass over itself: test_x.py::test_one"], module)
        self.write("tests/e2e/helpers/users.py", "needs_root = pytest.mark.skipif(True)\n")
        found = self.found("test_x.py::test_one", module=f"@users.needs_root\n{test}")
        self.assertEqual(found, ["may pass over itself: test_x.py::test_one"])


class FaultLists(Tree):
    def found(self, faults):
        self.write("cfg/a.cpp", "one();\ntwo();\none();\n")
        self.write("tests/mutation/cfg.faults", faults)
        return check_fault_lists.misfits(self.top)

    def test_faults_that_fit_pass(self):
        faults = "# why\n== cfg/a.cpp\n- two();\n+ \n\n- two();\n- one();\n+\n"
        self.assertEqual(self.found(faults), [])

    def test_faults_that_do_not_fit_are_found(self):
        self.assertEqual(self.found("== cfg/a.cpp\n- one();\n+\n\n- three();\n+\n\n+ four();\n"),
                         ["tests/mutation/cfg.faults:2: stands 2 times in cfg/a.cpp: one();",
                          "tests/mutation/cfg.faults:5: stands 0 times in cfg/a.cpp: three();",
                          "tests/mutation/cfg.faults:8: stands 0 times in cfg/a.cpp: "
                          "nothing to replace"])

    def test_faults_of_no_file_are_found(self):
        self.assertEqual(len(self.found("- one();\n+\n\n== cfg/b.cpp\n- one();\n+\n")), 2)


class Coverage(Tree):
    FOLDER = measure.Folder("a", ("a_test",), 100.0, 75.0, True)

    def setUp(self):
        super().setUp()
        self.write("a/a.cpp", "one();\ntwo();\ntwo();\nthree();\nfour();\n")
        self.lines = {}
        for number, count, branches in ((1, 5, [5, 0]), (2, 1, [1, 2]), (4, 0, []), (5, 1, [])):
            line = measure.Line()
            line.add_use(count, branches)
            self.lines["a/a.cpp", number] = line

    def excused(self, text):
        return measure.excused_lines(measure.excuses(text), self.lines, self.top)

    def shortfalls(self, excused=()):
        return measure.shortfalls(self.FOLDER,
                                  measure.figures_of(self.FOLDER, self.lines, excused)[1])

    def test_uses_of_a_template_count_together_and_lambdas_apart(self):
        line, other = measure.Line(), measure.Line()
        line.add_use(1, [1, 0])
        line.add_use(2, [0, 2, 0])
        self.assertEqual((line.count, line.branches), (3, [1, 2, 0]))
        other.add_use(0, [0, 0])
        line.add_function(other)
        self.assertEqual((line.count, line.branches), (3, [1, 2, 0, 0, 0]))

    def test_only_lines_of_brackets_are_without_code(self):
        self.assertEqual([text for text in ("}", "  });", "} else {", "}();", "", "f();", "x}")
                          if measure.without_code(text)], ["}", "  });", "}();"])

    def test_branches_of_exceptions_are_left_out(self):
        self.assertEqual(measure.taken([{"count": 0, "throw": True}, {"count": 3, "throw": False}]),
                         [3])

    def test_less_than_must_be_is_found(self):
        self.assertEqual(self.shortfalls(), ["a/: 75.00 % of the lines, not 100.0 %"])
        self.lines["a/a.cpp", 5].add_use(0, [0])
        self.assertEqual(len(self.shortfalls()), 2)

    def test_listed_lines_are_left_out(self):
        excused, wrong = self.excused("# why\n== a/a.cpp\nthree(); -> because\n")
        self.assertEqual((excused, wrong), ({("a/a.cpp", 4): "because"}, []))
        self.assertEqual(self.shortfalls(excused), [])

    def test_entries_that_fit_no_line_or_one_that_is_reached_are_found(self):
        _, wrong = self.excused("== a/a.cpp\ntwo(); -> a\nsix(); -> b\nfour(); -> c\n")
        self.assertEqual(wrong, ["unreachable.txt:2: stands 2 times in a/a.cpp: two();",
                                 "unreachable.txt:3: stands 0 times in a/a.cpp: six();",
                                 "unreachable.txt:4: is reached: a/a.cpp:5: four();"])

    def test_an_entry_without_a_reason_ends_the_program(self):
        with self.assertRaises(SystemExit):
            measure.excuses("== a/a.cpp\nthree();\n")


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
