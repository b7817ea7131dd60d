"""The manual pages in docs/man: each renders without a single warning, with
groff and with man, names itself as its file does, refers only to pages
that exist, and the pages of tnctl and tenond keep up with the programs:
every command and option tnctl's help lists is described in tnctl(1), every
option tenond's usage line shows is in tenond(8).

Run by CTest with:
  TENON_MAN_DIR     docs/man
  TENON_SOURCE_DIR  the source tree (for the keys the code reads)
  TNCTL, TENOND     the built programs
"""

import os
import re
import subprocess
import unittest

MAN_DIR = os.environ["TENON_MAN_DIR"]
PAGES = sorted(name for name in os.listdir(MAN_DIR) if re.fullmatch(r"[a-z0-9-]+\.[1-8]", name))
REQUIRED_SECTIONS = ["NAME", "SYNOPSIS", "DESCRIPTION", "SEE ALSO"]
RENDER_ENVIRONMENT = dict(os.environ, LC_ALL="C.UTF-8", MANROFFSEQ="", MANWIDTH="80")


def read_page(name):
    with open(os.path.join(MAN_DIR, name), encoding="utf-8") as file:
        return file.read()


def run(command):
    return subprocess.run(command, capture_output=True, text=True, env=RENDER_ENVIRONMENT, timeout=60)


class RenderingTest(unittest.TestCase):
    def test_the_four_pages_are_there(self):
        self.assertEqual(PAGES, ["tenon-bundle.5", "tenon-rules.7", "tenond.8", "tnctl.1"])

    def test_groff_renders_each_page_without_warnings(self):
        for page in PAGES:
            with self.subTest(page=page):
                result = run(["groff", "-man", "-ww", "-z", "-Tutf8", os.path.join(MAN_DIR, page)])
                self.assertEqual((result.returncode, result.stderr), (0, ""))

    def test_man_renders_each_page_without_warnings(self):
        for page in PAGES:
            with self.subTest(page=page):
                result = run(["man", "--warnings", "-E", "UTF-8", "-l", "-Tutf8", os.path.join(MAN_DIR, page)])
                self.assertEqual((result.returncode, result.stderr), (0, ""))
                self.assertGreater(len(result.stdout), 500, "rendered text")

    def test_each_page_names_itself_as_its_file_and_has_the_sections_people_look_for(self):
        for page in PAGES:
            with self.subTest(page=page):
                text = read_page(page)
                name, section = page.rsplit(".", 1)
                header = re.search(r"^\.TH (\S+) (\S+)", text, re.MULTILINE)
                self.assertIsNotNone(header)
                self.assertEqual((header.group(1), header.group(2)), (name.upper(), section))
                self.assertTrue(re.search(rf"^{re.escape(name)} \\- \S", text, re.MULTILINE), "NAME line")
                sections = re.findall(r"^\.SH (.+)$", text, re.MULTILINE)
                for required in REQUIRED_SECTIONS:
                    self.assertIn(required, sections)

    def test_references_to_our_own_pages_name_pages_that_exist(self):
        for page in PAGES:
            with self.subTest(page=page):
                for name, section in re.findall(r"^\.BR (tn\S*|tenon\S*) \((\d)\)", read_page(page), re.MULTILINE):
                    self.assertIn(f"{name}.{section}", PAGES)


def help_sections(text):
    """The entries of a CLI11 help text by section ("options",
    "subcommands"): the first word of each line indented by two spaces."""
    sections, current = {}, None
    for line in text.splitlines():
        heading = re.fullmatch(r"([A-Za-z]+):\s*", line)
        if heading:
            current = sections.setdefault(heading.group(1).lower(), [])
        elif current is not None and re.match(r"  \S", line):
            current.append(line.split()[0])
    return sections


def long_options(entries):
    options = []
    for entry in entries:
        options += [name for name in entry.split(",") if name.startswith("--") and name != "--help"]
    return options


def roff_option(option):
    return option.replace("-", r"\-")


class TnctlPageTest(unittest.TestCase):
    """tnctl(1) describes each command in an entry whose tag starts with
    \\fBtnctl <command>; the command's options appear in that entry."""

    @classmethod
    def setUpClass(cls):
        cls.page = read_page("tnctl.1")

    def help_of(self, *command):
        result = subprocess.run([os.environ["TNCTL"], *command, "--help"], capture_output=True, text=True, timeout=30)
        self.assertEqual(result.returncode, 0, result.stderr)
        return help_sections(result.stdout)

    def entry(self, command):
        tag = r"\fBtnctl " + " ".join(command).replace("-", r"\-") + r"\fP"
        start = self.page.find("\n" + tag)
        self.assertGreaterEqual(start, 0, f"tnctl.1 has no entry for 'tnctl {' '.join(command)}'")
        end = re.compile(r"^\.(TP|SS|SH)\b", re.MULTILINE).search(self.page, start + 1)
        return self.page[start:end.start() if end else len(self.page)]

    def commands(self):
        """Every command path that does something, two levels deep."""
        paths = []
        for name in self.help_of().get("subcommands", []):
            nested = self.help_of(name).get("subcommands", [])
            paths += [(name, sub) for sub in nested] if nested else [(name,)]
        return paths

    def test_every_command_has_an_entry_naming_each_of_its_options(self):
        commands = self.commands()
        self.assertGreater(len(commands), 20)
        for command in commands:
            with self.subTest(command=" ".join(command)):
                entry = self.entry(command)
                for option in long_options(self.help_of(*command).get("options", [])):
                    self.assertIn(roff_option(option), entry, f"{option} of tnctl {' '.join(command)}")

    def test_every_global_option_is_described(self):
        options_section = self.page[self.page.index(".SH OPTIONS"):self.page.index(".SH COMMANDS")]
        for option in long_options(self.help_of().get("options", [])):
            with self.subTest(option=option):
                self.assertIn(".B " + roff_option(option), options_section.replace(".BI ", ".B "))

    def test_the_entries_themselves_are_commands(self):
        # An entry left behind after a command was removed is caught too.
        documented = set(re.findall(r"^\\fBtnctl ((?:[a-z]|\\-)+(?: [a-z]+)?)\\fP", self.page, re.MULTILINE))
        documented = {name.replace("\\-", "-") for name in documented}
        self.assertEqual(documented, {" ".join(command) for command in self.commands()})


class BundlePageTest(unittest.TestCase):
    """tenon-bundle(5) describes every key of Info.manifest and of the
    plug-in dictionary that the plug-in model names, and the keys the
    daemon's own record reads."""

    KEY_FILES = {
        "libtenon/model/PlugInKeys.h": ("// Bundle information dictionary", "// Values."),
        "tenond/plugin/TNDPlugIn.h": ("", None),
    }
    NOT_MANIFEST_KEYS = {"_SandboxProfile", "_OmitSandboxParameters", "BNBundlePackageType", "RLY!"}

    def keys_in(self, relative, first, last):
        with open(os.path.join(os.environ["TENON_SOURCE_DIR"], relative), encoding="utf-8") as file:
            text = file.read()
        text = text[text.index(first):text.index(last) if last else len(text)]
        return set(re.findall(r'k\w+Key\w*\s*=\s*"([A-Za-z]+)"|k\w+\s*=\s*"([A-Z][A-Za-z]+)"', text))

    def test_every_key_the_code_names_is_described(self):
        page = read_page("tenon-bundle.5")
        described = set(re.findall(r"^\.BR? (\S+)", page, re.MULTILINE))
        keys = set()
        for relative, (first, last) in self.KEY_FILES.items():
            keys |= {a or b for a, b in self.keys_in(relative, first, last)}
        keys -= self.NOT_MANIFEST_KEYS
        self.assertGreater(len(keys), 20)
        self.assertEqual(sorted(keys - described), [])


class TenondPageTest(unittest.TestCase):
    def test_every_option_of_the_usage_line_is_in_the_synopsis(self):
        result = subprocess.run([os.environ["TENOND"], "-Z"], capture_output=True, text=True, timeout=30)
        self.assertEqual(result.returncode, 2)
        usage = next(line for line in result.stderr.splitlines() if line.startswith("Usage: tenond"))
        synopsis = read_page("tenond.8").split(".SH SYNOPSIS", 1)[1].split(".SH", 1)[0]
        options = re.findall(r"-([A-Za-z])\b", usage)
        self.assertTrue(options)
        for option in options:
            with self.subTest(option=option):
                self.assertRegex(synopsis, rf"\.OP \\-{option}\b")


if __name__ == "__main__":
    unittest.main()
