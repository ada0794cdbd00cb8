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
COMPLETIONS = BUILD / "tools" / "command-pages" / "completions"
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
        (cls.folder / "bvhelperctl").symlink_to(BUILD / "bvhelperctl")

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
        self.assertEqual(self.offered("bvhelperctl prefs set --"), GLOBAL | {"--type"})
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

    def test_nothing_after_the_last(self):
        self.assertEqual(self.offered("bvhelperctl ping "), set())


@unittest.skipUnless(shutil.which("bash"), "bash is not installed")
class Bash(Offers, unittest.TestCase):
    SCRIPT = """source "$1"; read -ra COMP_WORDS <<< "$2"; [[ $2 == *' ' ]] && COMP_WORDS+=('')
        COMP_CWORD=$(( ${#COMP_WORDS[@]} - 1 )); _bvhelperctl
        (( ${#COMPREPLY[@]} )) && printf '%s\\n' "${COMPREPLY[@]}"; true"""

    def offered(self, line):
        return set(run("bash", "--norc", "-c", self.SCRIPT, "bash", str(COMPLETIONS / "bash"), line,
                       cwd=self.folder).split())

    def test_it_is_registered(self):
        shown = run("bash", "--norc", "-c", 'source "$1"; complete -p bvhelperctl', "bash", str(COMPLETIONS / "bash"))
        self.assertIn("-F _bvhelperctl bvhelperctl", shown)


@unittest.skipUnless(shutil.which("fish"), "fish is not installed")
class Fish(Offers, unittest.TestCase):
    def offered(self, line):
        environment = {**os.environ, "HOME": str(self.folder), "PATH": f"{self.folder}:{os.environ['PATH']}"}
        out = run("fish", "--no-config", "-c", "source $argv[1]; complete -C $argv[2]", str(COMPLETIONS / "fish"), line,
                  cwd=self.folder, env=environment)
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
        return set(run("zsh", "-f", "-c", self.SCRIPT, "zsh", str(COMPLETIONS / "zsh"), line, cwd=self.folder).split())

    def test_it_is_for_bvhelperctl(self):
        self.assertEqual((COMPLETIONS / "zsh").read_text().splitlines()[0], "#compdef bvhelperctl")


if __name__ == "__main__":
    unittest.main()
