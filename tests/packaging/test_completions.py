#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Each shell is asked what it would offer for bvhelperctl. BRENVIK_BUILD names the build folder."""
import os
import pathlib
import shutil
import subprocess
import tempfile
import unittest

BUILD = pathlib.Path(os.environ["BRENVIK_BUILD"])
COMPLETIONS = BUILD / "tools" / "command-pages" / "shells"
GROUPS = ("prefs", "plist", "voicemail", "carrier", "lasd", "location", "labels", "contacts")
GLOBAL = {"--json", "--timeout", "--socket", "--version", "--help"}


def run(*command, **more):
    return subprocess.run(command, capture_output=True, text=True, timeout=60, check=True, **more).stdout


def words_of_help(*group):
    """The subcommands that the program itself names."""
    text = run(str(BUILD / "bvhelperctl"), *group, "--help")
    lines = text[text.index("Subcommands:"):].split("\n\n")[0].splitlines()[1:]
    return {line.split()[0] for line in lines if line.startswith("  ") and line[2] != " "}


class Offers:
    """What each shell must do; `offered` gives the set of words for a command line that ends at the cursor."""

    @classmethod
    def setUpClass(cls):
        folder = tempfile.TemporaryDirectory(prefix="brenvik-completions-")
        cls.addClassCleanup(folder.cleanup)
        cls.folder = pathlib.Path(folder.name)
        (cls.folder / "some.plist").touch()
        # A shell asks the program for domains and keys; what exists is this test's.
        program = cls.folder / "bvhelperctl"
        program.write_text("""#!/bin/sh
            case "$*" in
              "__complete domains") printf '%s\\n' com.norvale.carrier com.norvale.lasd ;;
              "__complete keys com.norvale.carrier") printf '%s\\n' Name Version ;;
            esac
            """)
        program.chmod(0o755)
        cls.environment = {**os.environ, "HOME": str(cls.folder), "PATH": f"{cls.folder}:{os.environ['PATH']}"}

    def test_first_word(self):
        self.assertEqual(self.offered("bvhelperctl "), words_of_help())

    def test_first_word_begun(self):
        self.assertEqual(self.offered("bvhelperctl pl"), {"plist"})

    def test_words_of_every_group(self):
        for group in GROUPS:
            self.assertEqual(self.offered(f"bvhelperctl {group} "), words_of_help(group), group)

    def test_after_options(self):
        self.assertEqual(self.offered("bvhelperctl --json --timeout 5 plist "), {"load"})

    def test_options(self):
        self.assertEqual(self.offered("bvhelperctl prefs set --"), GLOBAL | {"--type", "--literal"})
        self.assertEqual(self.offered("bvhelperctl ping --"), GLOBAL)

    def test_choices(self):
        self.assertEqual(self.offered("bvhelperctl heartbeat "), {"on", "off"})
        self.assertEqual(self.offered("bvhelperctl prefs set --type pl"), {"plist-file"})

    def test_files_where_a_path_is_wanted_and_nowhere_else(self):
        self.assertEqual(self.offered("bvhelperctl plist load so"), {"some.plist"})
        self.assertEqual(self.offered("bvhelperctl --socket so"), {"some.plist"})
        self.assertEqual(self.offered("bvhelperctl prefs get so"), set())
        # The target of a link is any text, the link is a path.
        self.assertEqual(self.offered("bvhelperctl carrier create-link so"), set())
        self.assertEqual(self.offered("bvhelperctl carrier create-link x so"), {"some.plist"})

    def test_labels(self):
        self.assertEqual(self.offered("bvhelperctl labels badges --label p"), {"primary", "personal"})
        self.assertEqual(self.offered("bvhelperctl labels localized --label USER_LABEL_P"),
                         {"USER_LABEL_PRIMARY", "USER_LABEL_PERSONAL"})

    def test_domains_and_keys_that_exist(self):
        self.assertEqual(self.offered("bvhelperctl prefs get com.norvale.c"), {"com.norvale.carrier"})
        self.assertEqual(self.offered("bvhelperctl --json prefs set com.norvale.carrier "), {"Name", "Version"})
        self.assertEqual(self.offered("bvhelperctl prefs delete com.norvale.none "), set())

    def test_the_stand_in(self):
        self.assertEqual(self.offered("brenvik-standin --"), {
            "--json", "--count", "--timeout", "--refuse", "--hang", "--directory", "--helper-uid", "--version", "--help"})
        self.assertEqual(self.offered("brenvik-standin --directory so"), {"some.plist"})
        self.assertEqual(self.offered("brenvik-standin "), set())

    def test_nothing_after_the_last(self):
        self.assertEqual(self.offered("bvhelperctl ping "), set())


@unittest.skipUnless(shutil.which("bash"), "bash is not installed")
class Bash(Offers, unittest.TestCase):
    SCRIPT = """source "$1"; read -ra COMP_WORDS <<< "$2"; [[ $2 == *' ' ]] && COMP_WORDS+=('')
        COMP_CWORD=$(( ${#COMP_WORDS[@]} - 1 )); name=${COMP_WORDS[0]}; "_${name//-/_}"
        (( ${#COMPREPLY[@]} )) && printf '%s\\n' "${COMPREPLY[@]}"; true"""

    def offered(self, line):
        return set(run("bash", "--norc", "-c", self.SCRIPT, "bash", str(COMPLETIONS / "bash" / line.split()[0]), line,
                       cwd=self.folder, env=self.environment).split())

    def test_it_is_registered(self):
        for name, function in (("bvhelperctl", "_bvhelperctl"), ("brenvik-standin", "_brenvik_standin")):
            shown = run("bash", "--norc", "-c", 'source "$1"; complete -p "$2"', "bash", str(COMPLETIONS / "bash" / name), name)
            self.assertIn(f"-F {function} {name}", shown)


@unittest.skipUnless(shutil.which("fish"), "fish is not installed")
class Fish(Offers, unittest.TestCase):
    def offered(self, line):
        out = run("fish", "--no-config", "-c", "source $argv[1]; complete -C $argv[2]",
                  str(COMPLETIONS / "fish" / line.split()[0]), line, cwd=self.folder, env=self.environment)
        return {each.split("\t")[0] for each in out.splitlines() if each}


@unittest.skipUnless(shutil.which("zsh"), "zsh is not installed")
class Zsh(Offers, unittest.TestCase):
    """The function with stand-ins for what zsh's completion gives it: they filter by the current word, as zsh does."""
    SCRIPT = r"""
        compdef() { : }
        _describe() { [[ $1 == -o ]] && shift; local each; for each in ${(P)2}; do echo ${${each//\\:/@}%%:*}; done }
        compadd() { shift; print -rl -- "$@" }
        _files() { print -rl -- *(N) }
        _message() { : }
        words=(${(s: :)2}); [[ $2 == *' ' ]] && words+=('')
        CURRENT=$#words
        offered=$(source $1)
        for each in ${(f)offered}; do [[ $each == ${words[CURRENT]}* ]] && print -r -- $each; done; true
    """

    def offered(self, line):
        return set(run("zsh", "-f", "-c", self.SCRIPT, "zsh", str(COMPLETIONS / "zsh" / line.split()[0]), line,
                       cwd=self.folder, env=self.environment).split())

    def test_it_says_for_what_it_is(self):
        for name in ("bvhelperctl", "brenvik-standin"):
            self.assertEqual((COMPLETIONS / "zsh" / name).read_text().splitlines()[0], f"#compdef {name}")


if __name__ == "__main__":
    unittest.main()
