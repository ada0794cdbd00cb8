#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Puts the handbook's sources together: pages of the project where they stand, and what is made from other files.

usage: assemble.py SOURCE_TREE OUTPUT [MANUAL_PAGE...]

OUTPUT is emptied first. Manual pages are rendered by mandoc(1), drawings by dot(1) and mscgen(1). A link from one page
to another is rewritten to where that page stands in the handbook; a link to a file that is not in it becomes plain text.
"""
import html
import os
import pathlib
import re
import shutil
import subprocess
import sys

sys.path.insert(0, str(pathlib.Path(__file__).resolve().parent.parent / "man"))
import pages as manual_pages  # noqa: E402: the log messages' reader
from plots import plots, sections  # noqa: E402

FENCE = re.compile(r"^\s*(`{3,}|~{3,})")
LINK = re.compile(r"(!?\[[^\]]*\])\(([^)\s#]*)(#[^)\s]*)?\)")
PAGE_NAME = re.compile(r"`?\b((?:docs/)?[\w/-]+\.md)\b`?(?![\w(])")
MANUAL_REFERENCE = re.compile(r"(?<![\w`/\[-])`?([A-Za-z][\w-]*)\(([1-8])\)`?(?!\]|\w)")


class Handbook:
    def __init__(self, tree, output, manuals):
        self.tree, self.output, self.manuals = tree, output, manuals
        self.places = {}  # a file of the tree: where it stands in the handbook
        for page in sorted((tree / "docs" / "handbook").glob("*.md")):
            if page.name != "README.md":
                self.places[page] = page.name
        for page in sorted((tree / "docs").glob("*.md")):
            if page.name != "README.md":
                self.places[page] = page.name
        for page in sorted((tree / "docs" / "decisions").glob("*.md")):
            self.places[page] = f"decisions/{'index.md' if page.name == 'README.md' else page.name}"
        self.places[tree / "SECURITY.md"] = "security.md"
        self.places[tree / "CONTRIBUTING.md"] = "contributing.md"
        self.manual_names = {path.name for path in manuals}

    def make(self):
        shutil.rmtree(self.output, ignore_errors=True)
        self.output.mkdir(parents=True)
        for source, place in self.places.items():
            self.write(place, self.rewritten(source, place))
        self.write_decisions_list()
        self.write_manual_pages()
        self.write_log_messages()
        self.write_changelog()
        self.write_drawings()
        results = self.tree / "benchmarks" / "results.tsv"
        for name, svg in plots(results).items():
            self.write(f"drawings/{name}.svg", svg)
        page = self.output / "benchmarks.md"
        self.write("benchmarks.md", re.sub(r"^<!-- plots:.*-->$", lambda _: sections(results), page.read_text(encoding="utf-8"), flags=re.M))
        # What pages include or show.
        shutil.copytree(self.tree / "client" / "examples", self.output / "examples")
        for stray in (self.output / "examples").rglob("README.md"):
            stray.unlink()
        handbook = self.tree / "docs" / "handbook"
        for name in ("conf.py", "handbook.css"):
            shutil.copy(handbook / name, self.output / name)

    def write(self, place, text):
        path = self.output / place
        path.parent.mkdir(parents=True, exist_ok=True)
        path.write_text(text, encoding="utf-8")

    def rewritten(self, source, place):
        """The page, with its links as they are in the handbook."""
        lines, fence = [], None
        for line in source.read_text(encoding="utf-8").splitlines():
            mark = FENCE.match(line)
            if mark and fence is None:
                fence = mark.group(1)
                if line.strip() == fence + "mock":
                    line = fence + "text"  # a script of the mock's: a language that no highlighter knows
            elif mark and line.strip() == fence:
                fence = None
            elif fence is None and not line.startswith("    "):
                line = self.with_links(line, source, place)
            lines.append(line)
        return "\n".join(lines) + "\n"

    def with_links(self, line, source, place):
        def link(match):
            text, target, anchor = match.group(1), match.group(2), match.group(3) or ""
            if "://" in target or not target:
                return match.group(0)
            path = pathlib.Path(os.path.normpath(source.parent / target))
            if path in self.places:
                return f"{text}({self.relative(self.places[path], place)}{anchor})"
            if text.startswith("!") and path.is_file():
                shutil_target = f"images/{path.name}"
                (self.output / "images").mkdir(exist_ok=True)
                shutil.copy(path, self.output / shutil_target)
                return f"{text}({self.relative(shutil_target, place)})"
            if source.parent == self.tree / "docs" / "handbook":
                return match.group(0)  # written for the handbook: its own places
            return text.strip("![]")

        def named_page(match):
            for path in (self.tree / match.group(1), source.parent / match.group(1)):
                known = self.places.get(pathlib.Path(os.path.normpath(path)))
                if known is not None and known != place:
                    return f"[{match.group(1)}]({self.relative(known, place)})"
            return match.group(0)

        def manual(match):
            page = f"{match.group(1)}.{match.group(2)}"
            if page not in self.manual_names:
                return match.group(0)
            return f"[{match.group(1)}({match.group(2)})]({self.relative(f'man/{page}.md', place)})"

        if line.startswith("#"):
            return line  # a title stays a title
        parts = re.split(r"(!?\[[^\]]*\]\([^)]*\))", line)
        for index, part in enumerate(parts):
            if index % 2:
                parts[index] = LINK.sub(link, part)
            else:
                parts[index] = MANUAL_REFERENCE.sub(manual, PAGE_NAME.sub(named_page, part))
        return "".join(parts)

    @staticmethod
    def relative(place, from_place):
        return os.path.relpath(place, os.path.dirname(from_place) or ".")

    def write_decisions_list(self):
        index = self.output / "decisions" / "index.md"
        index.write_text(index.read_text() + "\n```{toctree}\n:hidden:\n:glob:\n\n[0-9]*\n```\n")

    def write_manual_pages(self):
        listed = []
        for path in sorted(self.manuals, key=lambda each: (each.suffix, each.name.lower())):
            name, section = path.name.rsplit(".", 1)
            if path.read_text().startswith(".so "):
                continue
            body = subprocess.run(["mandoc", "-T", "html", "-O", "fragment", str(path)], check=True,
                                  capture_output=True, text=True).stdout
            body = re.sub(r'<table class="(?:head|foot)">.*?</table>', "", body, flags=re.DOTALL)
            body = re.sub(r"<(/?)h2\b", r"<\1h3", re.sub(r"<(/?)h1\b", r"<\1h2", body))
            body = re.sub(r'<a class="permalink" href="[^"]*">(.*?)</a>', r"\1", body, flags=re.DOTALL)
            body = self.with_manual_links(body)
            self.write(f"man/{path.name}.html", body)
            self.write(f"man/{path.name}.md",
                       f"# {name}({section})\n\n```{{raw}} html\n:file: {path.name}.html\n```\n")
            listed.append(path.name)
        entries = "\n".join(listed)
        self.write("man/index.md", "# Manual pages\n\nAs `man` shows them on an installed system.\n\n"
                   f"```{{toctree}}\n:maxdepth: 1\n\n{entries}\n```\n")

    def with_manual_links(self, body):
        def link(match):
            page = f"{match.group(1)}.{match.group(2)}"
            return f'<a href="{page}.html">{match.group(0)}</a>' if page in self.manual_names else match.group(0)

        # Outside of what is a link already; mandoc writes the name in bold.
        return re.sub(r"(?<![\w.-])(?:<b>)?([A-Za-z][\w-]*)(?:</b>)?\(([1-8])\)", link, body)

    def write_log_messages(self):
        lines = ["# Log messages", "", "Every line that the daemon can write, in the words of the source: the journal's channel and level, "
                 "what it means, and what to do about it. `%s`, `%d` and the like stand for what differs each time.", ""]
        for title, messages in manual_pages.read_messages():
            lines += [f"## {title}", "", "```{raw} html", "<dl class=\"messages\">"]
            for each in messages:
                channel = "journal" if each.channel == "unified" else "syslog"
                level = manual_pages.LEVELS[each.level]
                advice = f" <em>What to do:</em> {html.escape(each.advice)}" if each.advice else ""
                lines += [f"<dt><code>{html.escape(each.text.strip())}</code></dt>",
                          f"<dd>{channel}, {level}. {html.escape(each.meaning)}{advice}</dd>"]
            lines += ["</dl>", "```", ""]
        self.write("log-messages.md", "\n".join(lines))

    def write_changelog(self):
        """Releases as the package's changelog has them, without who and when. A page called changelog would be compressed
        by the package's tools."""
        lines = ["# Changelog", ""]
        for line in (self.tree / "debian" / "changelog").read_text().splitlines():
            release = re.match(r"\S+ \(([^)]+)\)", line)
            if release:
                lines += [f"## {release.group(1)}", ""]
            elif line.startswith("  * "):
                lines.append(f"- {line[4:]}")
            elif line.startswith("    "):
                lines.append(f"  {line[4:]}")
        self.write("releases.md", "\n".join(lines) + "\n")

    def write_drawings(self):
        for path in sorted((self.tree / "docs" / "handbook" / "drawings").iterdir()):
            if path.suffix == ".dot":
                svg = subprocess.run(["dot", "-Tsvg", str(path)], check=True, capture_output=True, text=True).stdout
            elif path.suffix == ".msc":
                target = self.output / "drawing.svg"
                subprocess.run(["mscgen", "-T", "svg", "-i", str(path), "-o", str(target)], check=True)
                svg = target.read_text()
                target.unlink()
            else:
                continue
            self.write(f"drawings/{path.stem}.svg", self.in_page(svg, path))

    @staticmethod
    def in_page(svg, path):
        """The drawing as a part of the page: in the page's own colours, never wider than it, and with a name."""
        title = re.match(r"(?://|#) (.*)", path.read_text()).group(1)
        svg = svg[svg.index("<svg"):]
        width, height = (float(value) for value in re.search(r'width="([\d.]+)(?:pt|px)?" height="([\d.]+)', svg).groups())
        svg = re.sub(r"<!--.*?-->\s*", "", svg, flags=re.DOTALL)
        svg = re.sub(r"<title>.*?</title>", "", svg, flags=re.DOTALL)
        if "viewBox" in svg[:svg.index(">")]:
            box = re.search(r'viewBox="([^"]*)"', svg).group(1)
        else:
            box = f"0 0 {width:g} {height:g}"
        opening = (f'<svg role="img" aria-label="{html.escape(title)}" viewBox="{box}" '
                   f'style="max-width: {width * 1.33:.0f}px" xmlns="http://www.w3.org/2000/svg">')
        svg = opening + svg[svg.index(">") + 1:]
        for old, new in (("#000000", "currentColor"), ("black", "currentColor"), ("rgb(0,0,0)", "currentColor"),
                         ("white", "var(--color-background-primary)"), ("#ffffff", "var(--color-background-primary)"),
                         ("rgb(255,255,255)", "var(--color-background-primary)")):
            svg = svg.replace(f'"{old}"', f'"{new}"')
        return '<div class="drawing">\n' + re.sub(r"\n\s*\n", "\n", svg) + "</div>\n"


def main():
    tree, output = pathlib.Path(sys.argv[1]).resolve(), pathlib.Path(sys.argv[2]).resolve()
    Handbook(tree, output, [pathlib.Path(each).resolve() for each in sys.argv[3:]]).make()


if __name__ == "__main__":
    main()
