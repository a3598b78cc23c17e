"""The command line tool: what each command makes, prints, refuses and leaves behind."""

import os
import re
import resource
import signal
import stat
import subprocess
import tempfile
import unittest

PROGRAM = os.path.join(os.environ["ORV_BIN_DIR"], "orvcfg")
SOURCE = os.path.dirname(os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
FILES = ["admin.pw", "config.ldif", "key.stash", "tls.crt", "tls.key"]


class Tool(unittest.TestCase):
    """Runs the tool in a temporary folder."""

    def setUp(self):
        folder = tempfile.TemporaryDirectory()
        self.addCleanup(folder.cleanup)
        self.top = os.path.realpath(folder.name)

    def path(self, *names):
        return os.path.join(self.top, *names)

    def run_tool(self, *arguments, **options):
        return subprocess.run([PROGRAM, *arguments], cwd=self.top, capture_output=True, text=True,
                              stdin=subprocess.DEVNULL, timeout=60, **options)

    def succeed(self, *arguments, **options):
        result = self.run_tool(*arguments, **options)
        self.assertEqual((result.returncode, result.stderr), (0, ""))
        return result.stdout

    def refuse(self, *arguments, status=1, **options):
        result = self.run_tool(*arguments, **options)
        self.assertEqual(result.returncode, status, result.stderr)
        return result.stdout + result.stderr

    def read(self, *names):
        with open(self.path(*names), encoding="utf-8") as file:
            return file.read()

    def write(self, text, *names):
        with open(self.path(*names), "w", encoding="utf-8") as file:
            file.write(text)

    def mode(self, *names):
        return stat.S_IMODE(os.stat(self.path(*names)).st_mode)


class Init(Tool):
    def test_makes_private_files_whatever_the_umask(self):
        for number, umask in enumerate((0, 0o022, 0o777)):
            name = f"i{number}"
            self.succeed("init", "--dir", name, umask=umask)
            self.assertEqual(sorted(os.listdir(self.path(name))), sorted([*FILES, "log"]))
            self.assertEqual([self.mode(name, file) for file in FILES], [0o600] * len(FILES))
            self.assertEqual((self.mode(name), self.mode(name, "log")), (0o700, 0o700))

    def test_what_it_makes_has_nothing_wrong(self):
        self.succeed("init", "--dir", "i")
        text = self.succeed("check", "i/config.ldif", "--key-stash", "i/key.stash")
        self.assertIn("nothing wrong", text)

    def test_keeps_the_template_but_for_the_two_words(self):
        self.succeed("init", "--dir", "i")
        template = self.succeed("default").splitlines()
        made = self.read("i", "config.ldif").splitlines()
        differing = [new for old, new in zip(template, made, strict=True) if old != new]
        self.assertEqual([line.split(":")[0] for line in differing],
                         ["orv-slapdAdminPW", "orv-slapdLocalSocket", "orv-slapdTlsCertificateFile",
                          "orv-slapdTlsKeyFile", "orv-slapdLog", "orv-slapdLog"])
        self.assertIn(f"orv-slapdLog: {self.path('i', 'log', 'access.log')}", differing)

    def test_passwords_meet_the_default_policy_and_differ(self):
        passwords = set()
        for number in range(20):
            self.succeed("init", "--dir", f"i{number}")
            password = self.read(f"i{number}", "admin.pw")
            self.assertRegex(password, r"\A[A-Za-z0-9_-]{28}\Z")
            self.assertRegex(password, r"[A-Z].*[A-Z]")
            self.assertRegex(password, r"[a-z].*[a-z]")
            self.assertRegex(password, r"[0-9_-].*[0-9_-]")
            self.assertTrue(all(password.count(c) <= 2 for c in password))
            passwords.add(password)
        self.assertEqual(len(passwords), 20)

    def test_the_password_is_not_in_the_configuration_nor_in_the_output(self):
        output = self.succeed("init", "--dir", "i")
        password = self.read("i", "admin.pw")
        self.assertNotIn(password, output + self.read("i", "config.ldif"))

    def test_says_how_to_talk_to_the_server(self):
        text = self.succeed("init", "--dir", "var", "--port", "4711")
        self.assertIn("ldapsearch -x -H ldap://127.0.0.1:4711 -D cn=root -y var/admin.pw "
                      "-b cn=configuration\n", text)
        self.assertIn("'with blank/admin.pw'", self.succeed("init", "--dir", "with blank"))

    def test_an_instance_is_never_made_twice(self):
        self.succeed("init", "--dir", "i")
        before = [self.read("i", file) for file in FILES]
        self.assertIn("exists already", self.refuse("init", "--dir", "i"))
        self.assertEqual([self.read("i", file) for file in FILES], before)

    def test_goes_on_where_an_interrupted_run_stopped(self):
        self.succeed("init", "--dir", "i")
        kept = [self.read("i", file) for file in ("admin.pw", "key.stash")]
        os.unlink(self.path("i", "config.ldif"))
        self.write("half", "i", "config.ldif.new")
        self.succeed("init", "--dir", "i")
        self.assertEqual([self.read("i", file) for file in ("admin.pw", "key.stash")], kept)
        self.assertEqual(sorted(os.listdir(self.path("i"))), sorted([*FILES, "log"]))
        self.succeed("check", "i/config.ldif", "--key-stash", "i/key.stash")

    def test_a_failed_write_leaves_nothing(self):
        # Room for the key and the password, not for the configuration; then for none of them.
        for limit in (1000, 10):
            def prepare(limit=limit):
                signal.signal(signal.SIGXFSZ, signal.SIG_IGN)
                resource.setrlimit(resource.RLIMIT_FSIZE, (limit, limit))
            self.assertIn(self.path("i"), self.refuse("init", "--dir", "i", preexec_fn=prepare))
            self.assertFalse(os.path.exists(self.path("i")))

    def test_a_failure_leaves_what_was_there_before(self):
        os.mkdir(self.path("i"), 0o700)
        self.write("no key", "i", "key.stash")
        os.chmod(self.path("i", "key.stash"), 0o600)
        self.assertIn("key.stash", self.refuse("init", "--dir", "i"))
        self.assertEqual(os.listdir(self.path("i")), ["key.stash"])

    def test_a_directory_that_others_may_write_is_refused(self):
        os.mkdir(self.path("i"))
        os.chmod(self.path("i"), 0o770)
        self.assertIn("chmod go-w", self.refuse("init", "--dir", "i"))

    def test_links_in_place_of_files_are_not_followed(self):
        self.succeed("init", "--dir", "i")
        os.unlink(self.path("i", "config.ldif"))
        os.unlink(self.path("i", "admin.pw"))
        self.write("secret of somebody else", "target")
        os.symlink(self.path("target"), self.path("i", "admin.pw"))
        self.refuse("init", "--dir", "i")
        os.unlink(self.path("i", "admin.pw"))
        os.symlink(self.path("target"), self.path("i", "config.ldif"))
        self.assertIn("exists already", self.refuse("init", "--dir", "i"))
        self.assertEqual(self.read("target"), "secret of somebody else")

    def test_places_that_cannot_be_are_named(self):
        self.assertIn("no/such", self.refuse("init", "--dir", "no/such"))
        self.write("", "file")
        self.assertIn("not a directory", self.refuse("init", "--dir", "file"))

    def test_paths_outside_ascii_are_written_so_that_they_read_back(self):
        self.succeed("init", "--dir", "blänk and ü")
        text = self.succeed("show", "blänk and ü/config.ldif", "cn=access,cn=log management,"
                            "cn=configuration")
        self.assertIn("orv-slapdLog:: ", text)
        self.succeed("check", "blänk and ü/config.ldif")

    def test_a_path_that_is_not_utf8_is_refused(self):
        directory = os.fsencode(self.top) + b"/\xff"
        result = subprocess.run([PROGRAM, "init", "--dir", directory], capture_output=True)
        self.assertEqual(result.returncode, 1)
        self.assertIn(b"UTF-8", result.stderr)
        self.assertEqual(os.listdir(self.top), [])

    def test_of_two_at_once_one_makes_the_instance(self):
        for number in range(10):
            runs = [subprocess.Popen([PROGRAM, "init", "--dir", f"i{number}"], cwd=self.top,
                                     stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
                    for _ in range(4)]
            self.assertEqual(sorted(run.wait(timeout=60) for run in runs), [0, 1, 1, 1])
            self.succeed("check", f"i{number}/config.ldif", "--key-stash", f"i{number}/key.stash")


class Check(Tool):
    def setUp(self):
        super().setUp()
        self.succeed("init", "--dir", "i")
        self.config = self.read("i", "config.ldif")

    def found(self, old, new, *arguments):
        """What check says after one edit."""
        self.assertIn(old, self.config)
        self.write(self.config.replace(old, new, 1), "i", "config.ldif")
        return self.refuse("check", "i/config.ldif", *arguments)

    def added(self, entry, *arguments):
        self.write(self.config + "\n" + entry, "i", "config.ldif")
        return self.refuse("check", "i/config.ldif", *arguments)

    def test_names_file_and_line_of_what_cannot_be_read(self):
        text = self.found("cn: Configuration\n", "cn Configuration\n")
        line = self.config.splitlines().index("cn: Configuration") + 1
        self.assertRegex(text, rf"i/config\.ldif\D+{line}\b")

    def test_a_missing_file_is_named(self):
        self.assertIn("nowhere", self.refuse("check", "nowhere"))

    def test_finds_what_does_not_fit_the_schema(self):
        for old, new, text in (
                ("objectClass: container\n", "objectClass: box\n", "unknown object class box"),
                ("orv-slapdAdminDN: cn=root\n", "", "missing attribute orv-slapdAdminDN"),
                ("orv-slapdPort: 3389\n", "orv-slapdPort: 1\norv-slapdPort: 2\n",
                 "orv-slapdPort has 2 values"),
                ("orv-slapdPort: 3389\n", "orv-slapdPart: 3389\n",
                 "unknown attribute type orv-slapdPart"),
                ("cn: Digest\n", "cn: Digest\norv-slapdPort: 1\n", "orv-slapdPort is not allowed"),
                ("objectClass: orv-slapdTop\n",
                 "objectClass: orv-slapdTop\nobjectClass: container\n",
                 "more than one structural object class")):
            self.assertIn(text, self.found(old, new))

    def test_finds_values_that_are_not_what_their_type_asks_for(self):
        for old, new, text in (
                ("orv-slapdSizeLimit: 0\n", "orv-slapdSizeLimit: many\n",
                 "orv-slapdSizeLimit is not an integer"),
                ("orv-slapdSizeLimit: 0\n", "orv-slapdSizeLimit: 007\n",
                 "orv-slapdSizeLimit is not an integer"),
                ("orv-slapdSizeLimit: 0\n", "orv-slapdSizeLimit:\n",
                 "orv-slapdSizeLimit is not an integer"),
                ("orv-slapdPort: 3389\n", "orv-slapdPort: 65536\n",
                 "orv-slapdPort must be an integer from 0 to 65535"),
                ("orv-slapdPort: 3389\n", "orv-slapdPort: 99999999999999999999999\n",
                 "orv-slapdPort must be an integer from 0 to 65535"),
                ("orv-slapdMaxFilterDepth: 32\n", "orv-slapdMaxFilterDepth: 1024\n",
                 "orv-slapdMaxFilterDepth must be an integer from 1 to 64"),
                ("orv-slapdMaxControls: 32\n", "orv-slapdMaxControls: -1\n",
                 "orv-slapdMaxControls must be an integer"),
                ("pwdMinLength: 12\n", "pwdMinLength: -12\n", "pwdMinLength must be an integer"),
                ("orv-slapdAdminGroupEnabled: TRUE\n", "orv-slapdAdminGroupEnabled: yes\n",
                 "orv-slapdAdminGroupEnabled is neither TRUE nor FALSE"),
                ("pwdLockout: TRUE\n", "pwdLockout: 1\n", "pwdLockout is neither TRUE nor FALSE"),
                ("orv-slapdAdminDN: cn=root\n", "orv-slapdAdminDN: root\n",
                 "orv-slapdAdminDN is not a DN"),
                ("orv-slapdSuffix: CN=CONFIGURATION\n", "orv-slapdSuffix: here\n",
                 "orv-slapdSuffix is not a DN"),
                ("orv-slapdIpAddress: 127.0.0.1\n", "orv-slapdIpAddress: h\u00f6st\n",
                 "orv-slapdIpAddress holds characters outside ASCII"),
                ("orv-slapdLogLevel: info\n", "orv-slapdLogLevel: loud\n",
                 "orv-slapdLogLevel is none of"),
                ("orv-slapdPwEncryption: AES256\n", "orv-slapdPwEncryption: SHA1\n",
                 "orv-slapdPwEncryption is none of the methods none AES256 SSHA256"),
                ("orv-slapdTlsForPasswords: TRUE\n",
                 "orv-slapdTlsForPasswords: TRUE\norv-slapdPwEncryptionAllowed: bogus\n",
                 "orv-slapdPwEncryptionAllowed is none of the methods none AES256"),
                (f"orv-slapdLog: {self.path('i', 'log', 'audit.log')}\n",
                 "orv-slapdLog: audit.log\n",
                 "orv-slapdLog is not an absolute path")):
            with self.subTest(new):
                self.assertIn(text, self.found(old, new))

    def test_finds_a_password_policy_that_contradicts_itself(self):
        self.config = self.config.replace("PolicyEnabled: TRUE\n", "PolicyEnabled: FALSE\n")
        kinds = "passwordMinAlphaChars and passwordMinOtherChars together exceed pwdMinLength"
        for old, new, text in (
                ("pwdMinLength: 12\npasswordMinAlphaChars: 2\n",
                 "pwdMinLength: 3\npasswordMinAlphaChars: 2\n", kinds),
                ("pwdMinLength: 12\npasswordMinAlphaChars: 2\n",  # which is 12 all the same
                 "passwordMinAlphaChars: 11\n", kinds),
                ("passwordMinDiffChars: 3\n", "passwordMinDiffChars: 13\n",
                 "passwordMinDiffChars exceeds pwdMinLength"),
                ("pwdMaxFailure: 10\n", "pwdMaxFailure: 0\n",
                 "pwdLockout is TRUE and pwdMaxFailure is 0")):
            with self.subTest(new):
                self.assertIn(f"CN=PWDPOLICY ADMIN,CN=CONFIGURATION: {text}", self.found(old, new))
        # Out of its range, a number is found once.
        self.assertRegex(self.found("pwdMinLength: 12\n", "pwdMinLength: 257\n"), ", 1 problem\\n")

    def test_finds_a_role_that_nobody_knows(self):
        self.assertIn("orv-slapdAdminRole is none of",
                      self.added(self.member("cn=m", "x").replace("AuditAdmin", "Wizard")))

    def test_takes_words_in_any_letter_case_and_bounds_themselves(self):
        self.write(self.config.replace("LogLevel: info", "LogLevel: INFO")
                   .replace("orv-slapdMaxFilterDepth: 32", "orv-slapdMaxFilterDepth: 64")
                   .replace("orv-slapdPort: 3389", "orv-slapdPort: 65535"), "i", "config.ldif")
        self.assertIn("nothing wrong", self.succeed("check", "i/config.ldif"))

    def test_types_by_their_numbers_are_named_with_their_lines(self):
        oid = "2.25.83817390626969804497818767862655265745.1.20"
        text = self.found("orv-slapdSizeLimit: 0\n", f"{oid}: 0\n")
        line = self.config.splitlines().index("orv-slapdSizeLimit: 0") + 1
        self.assertEqual(text.splitlines(), [
            f"i/config.ldif: line {line}: the attribute type {oid} stands under its number",
            text.splitlines()[-1]])
        self.assertRegex(text.splitlines()[-1], ", 1 problem$")
        # What such a line says is looked at all the same.
        self.assertIn("orv-slapdSizeLimit is not an integer",
                      self.found("orv-slapdSizeLimit: 0\n", f"{oid}: many\n"))
        self.assertIn("orv-slapdPort is not allowed",
                      self.found("cn: Digest\n",
                                 "cn: Digest\n2.25.83817390626969804497818767862655265745.1.18: 1\n"))

    def test_types_by_their_second_names_are_what_they_name(self):
        self.write(self.config.replace("cn: Digest\n", "commonName: Digest\n"), "i", "config.ldif")
        self.assertIn("nothing wrong", self.succeed("check", "i/config.ldif"))

    def test_finds_listening_addresses_that_the_host_lacks(self):
        text = self.found("orv-slapdIpAddress: 127.0.0.1\n", "orv-slapdIpAddress: 127.0.0.1\n"
                          "orv-slapdIpAddress: 192.0.2.1\norv-slapdIpAddress: ::\n")
        self.assertIn("CN=CONFIGURATION: orv-slapdIpAddress 192.0.2.1 is no address of this host; "
                      "changes of this entry will be refused\n", text)
        self.assertIn("orv-slapdIpAddress :: stands for every address of the host", text)
        self.assertIn("2 problems", text)

    def test_finds_second_values_of_a_single_valued_type_under_two_names(self):
        oid = "2.25.83817390626969804497818767862655265745.1.20"
        text = self.found("orv-slapdSizeLimit: 0\n", f"orv-slapdSizeLimit: 0\n{oid}: 1\n")
        self.assertRegex(text, "orv-slapdSizeLimit")

    def test_finds_a_pass_through_entry_without_a_subtree(self):
        text = self.added("dn: cn=p,CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION\n"
                          "objectClass: top\nobjectClass: orv-slapdConfigEntry\n"
                          "objectClass: orv-slapdPta\ncn: p\n"
                          "orv-slapdPtaURL: ldap://127.0.0.1\n")
        self.assertIn("missing attribute orv-slapdPtaSubtree", text)

    def test_a_class_by_its_number_is_found(self):
        oid = "2.25.83817390626969804497818767862655265745.2.1"
        text = self.found("objectClass: container\n", f"objectClass: {oid}\n")
        line = self.config.splitlines().index("objectClass: container") + 1
        self.assertRegex(text, rf"i/config\.ldif: line {line}, column 14: "
                               "the object class must be written as container")

    def member(self, name, password):
        return (f"dn: cn=m,CN=ADMINGROUP,CN=CONFIGURATION\nobjectClass: top\n"
                f"objectClass: orv-slapdConfigEntry\nobjectClass: orv-slapdAdminGroupMember\n"
                f"cn: m\norv-slapdAdminDN: {name}\norv-slapdAdminPW: {password}\n"
                f"orv-slapdAdminRole: AuditAdmin\n")

    def test_finds_identities_that_cannot_bind(self):
        self.assertIn("claimed by CN=CONFIGURATION too", self.added(self.member("CN = Root", "x")))
        for inside in ("cn=m,cn=configuration", "CN = Configuration", "2.5.4.3=x, cn=\\63onfiguration"):
            self.assertIn("orv-slapdAdminDN lies inside CN=CONFIGURATION, so nobody can bind as it",
                          self.added(self.member(inside, "x")))
        self.assertIn("orv-slapdMasterDN lies inside", self.added(
            "dn: CN=MASTER SERVER,CN=CONFIGURATION\nobjectClass: top\n"
            "objectClass: orv-slapdConfigEntry\nobjectClass: orv-slapdReplication\n"
            "cn: Master Server\norv-slapdMasterDN: cn=digest,cn=configuration\n"))

    def test_finds_a_password_that_was_copied_from_another_entry(self):
        sealed = re.search(r"^orv-slapdAdminPW: (.*)$", self.config, re.MULTILINE).group(1)
        text = self.added(self.member("cn=m", sealed), "--key-stash", "i/key.stash")
        self.assertIn("sealed for another entry", text)
        self.assertNotIn(sealed, text)

    def test_finds_a_password_that_the_key_does_not_open(self):
        self.succeed("init", "--dir", "other")
        text = self.refuse("check", "i/config.ldif", "--key-stash", "other/key.stash")
        self.assertIn("cannot be opened", text)

    def test_a_key_that_others_may_read_is_refused(self):
        os.chmod(self.path("i", "key.stash"), 0o644)
        self.assertIn("key.stash",
                      self.refuse("check", "i/config.ldif", "--key-stash", "i/key.stash"))

    def test_changes_nothing(self):
        self.succeed("check", "i/config.ldif", "--key-stash", "i/key.stash")
        self.assertEqual(self.read("i", "config.ldif"), self.config)
        self.assertEqual(sorted(os.listdir(self.path("i"))), sorted([*FILES, "log"]))


class Show(Tool):
    def setUp(self):
        super().setUp()
        self.succeed("init", "--dir", "i")

    def test_prints_every_entry_and_no_password(self):
        text = self.succeed("show", "i/config.ldif")
        config = self.read("i", "config.ldif")
        shown = re.findall(r"^dn: .*$", text.replace("\n ", ""), re.MULTILINE)
        self.assertEqual(shown, re.findall(r"^dn: .*$", config, re.MULTILINE))
        self.assertNotIn("{AES256}", text)
        self.assertIn("# orv-slapdAdminPW is set", text)

    def test_prints_a_subtree_in_any_spelling_of_its_name(self):
        text = self.succeed("show", "i/config.ldif", "cn = Log  Management, cn=configuration")
        self.assertEqual(len(re.findall(r"^dn: ", text, re.MULTILINE)), 5)

    def test_names_what_it_does_not_find(self):
        self.assertIn("cn=x", self.refuse("show", "i/config.ldif", "cn=x"))
        self.assertIn("not a DN", self.refuse("show", "i/config.ldif", "no dn"))

    def test_folds_long_lines(self):
        config = self.read("i", "config.ldif")
        self.write(config.replace("cn: Digest\n", "cn: Digest\ndescription: " + "x" * 300 + "\n"),
                   "i", "config.ldif")
        text = self.succeed("show", "i/config.ldif", "cn=digest,cn=configuration")
        self.assertTrue(all(len(line) <= 78 for line in text.splitlines()))
        self.assertIn("description: " + "x" * 300, text.replace("\n ", ""))


class CommandLine(Tool):
    def test_default_is_the_file_in_the_repository(self):
        with open(os.path.join(SOURCE, "config", "default.ldif"), encoding="utf-8") as file:
            self.assertEqual(self.succeed("default"), file.read())

    def test_wrong_arguments_are_a_usage_error(self):
        for arguments in ((), ("init",), ("init", "--dir", "i", "--port", "65536"), ("nonsense",),
                          ("check",), ("show", "a", "b", "c")):
            self.assertIn("--help", self.refuse(*arguments, status=2))
        self.assertEqual(os.listdir(self.top), [])

    def test_help_is_a_success(self):
        self.assertIn("init", self.succeed("--help"))

    def test_output_that_cannot_be_written_is_a_failure(self):
        with open("/dev/full", "w", encoding="utf-8") as full:
            result = subprocess.run([PROGRAM, "default"], stdout=full, stderr=subprocess.PIPE)
        self.assertEqual(result.returncode, 1)
        self.assertIn(b"standard output", result.stderr)


if __name__ == "__main__":
    unittest.main()
