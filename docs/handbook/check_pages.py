#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""usage: check_pages.py HTML_FOLDER

Every link and picture of the handbook leads somewhere, every anchor that is linked to exists once, every page can be
reached from the first one, and every picture has a text for those who do not see it.
"""
import html.parser
import pathlib
import sys
import urllib.parse


class Page(html.parser.HTMLParser):
    def __init__(self, path):
        super().__init__()
        self.ids, self.links, self.pictures, self.unnamed = [], [], [], []
        self.feed(path.read_text(encoding="utf-8"))

    def handle_starttag(self, tag, attributes):
        values = dict(attributes)
        if "id" in values:
            self.ids.append(values["id"])
        if tag == "a" and values.get("href"):
            self.links.append(values["href"])
        if tag == "img":
            self.pictures.append(values.get("src", ""))
            if not values.get("alt"):
                self.unnamed.append(values.get("src", "a picture"))
        if tag == "svg" and values.get("role") == "img" and not values.get("aria-label"):
            self.unnamed.append("a drawing")


def faults(folder):
    pages = {path: Page(path) for path in sorted(folder.rglob("*.html"))}
    made = {"genindex.html", "search.html"}  # by the generator: no page links to them as a page does
    found = []
    if folder / "index.html" not in pages:
        return [f"{folder}: no index.html"]
    reached, waiting = set(), [folder / "index.html"]
    while waiting:
        path = waiting.pop()
        if path in reached:
            continue
        reached.add(path)
        for link in pages[path].links:
            parts = urllib.parse.urlsplit(link)
            if not parts.scheme and not parts.netloc and parts.path.endswith(".html"):
                target = (path.parent / urllib.parse.unquote(parts.path)).resolve()
                if target in pages:
                    waiting.append(target)
    for path, page in pages.items():
        name = path.relative_to(folder)
        for link in page.links:
            parts = urllib.parse.urlsplit(link)
            if parts.scheme or parts.netloc:
                continue
            target = (path.parent / urllib.parse.unquote(parts.path)).resolve() if parts.path else path
            if target.is_dir():
                target = target / "index.html"
            if not target.exists():
                found.append(f"{name}: link to {link}, which is not there")
            elif parts.fragment and target in pages and urllib.parse.unquote(parts.fragment) not in pages[target].ids:
                found.append(f"{name}: link to {link}, where no such place is")
        for picture in page.pictures:
            if not picture.startswith("data:") and not (path.parent / urllib.parse.unquote(picture)).exists():
                found.append(f"{name}: picture {picture} is not there")
        found += [f"{name}: {picture} has no text beside it" for picture in page.unnamed]
        for each in sorted({each for each in page.ids if page.ids.count(each) > 1}):
            found.append(f"{name}: two places are called {each}")
        if path not in reached and str(name) not in made:
            found.append(f"{name}: no page leads here")
    return found


def main():
    folder = pathlib.Path(sys.argv[1]).resolve()
    found = faults(folder)
    for fault in found:
        print(fault, file=sys.stderr)
    print(f"{len(list(folder.rglob('*.html')))} pages, {len(found)} faults")
    return 1 if found else 0


if __name__ == "__main__":
    sys.exit(main())
