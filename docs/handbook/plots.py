# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Draws what was measured, as bars beside a line at what it was measured against."""
import html

# What a page says of a group: heading, sentence. A group that is not here has its own name as heading.
HEADINGS = {
    "transport": ("Starting and calling", 'From a start to the first reply, and a call. "Bare" is the least that a program of the same kind '
                  "can do: the same sockets, the same sizes, no daemon behind."),
    "library": ("The client library", "What the C library adds to a call."),
    "python": ("Python", "A call of the Python package beside a bare exchange from Python, and its import."),
    "command": ("The command line", "bvhelperctl as a process of its own."),
    "preferences": ("Preferences and tokens", "A value that is set is on the disk when the call returns."),
    "location": ("Location and labels", "Look-ups in the offline gazetteer."),
    "formats": ("Formats", "Property lists, and what is made of them."),
    "fetch": ("Fetching", "A database over HTTPS, in the network worker."),
    "files": ("Files", "Archives, copies and moves."),
}

ROW, BAR, LEFT, WIDTH = 46, 12, 8, 620


def read(path):
    """{group: [(what, ratio, limit or None)]}, in the file's order."""
    groups = {}
    for number, line in enumerate(path.read_text(encoding="utf-8").splitlines(), 1):
        if not line or line.startswith("#"):
            continue
        fields = line.split("\t")
        if len(fields) != 4:
            raise ValueError(f"{path}:{number}: four fields wanted: group, what, ratio, limit")
        group, what, ratio, limit = fields
        groups.setdefault(group, []).append((what, float(ratio), float(limit) if limit != "-" else None))
    return groups


def plots(path):
    """{name of the drawing: SVG}"""
    return {f"benchmark-{group}": plot(group, rows) for group, rows in read(path).items()}


def sections(path):
    """What a page has of each group, as Markdown that shows the drawings of plots()."""
    parts = []
    for group in read(path):
        heading, sentence = HEADINGS.get(group, (group.capitalize(), ""))
        parts.append(f"## {heading}\n\n{sentence}\n\n```{{raw}} html\n:file: drawings/benchmark-{group}.svg\n```\n")
    return "\n".join(parts)


def plot(group, rows):
    most = max(max(ratio, limit or 0, 1) for _, ratio, limit in rows) * 1.12
    scale = (WIDTH - 2 * LEFT) / most
    height = ROW * len(rows) + 26
    one = LEFT + scale
    parts = [f'<div class="drawing"><svg role="img" aria-label="{html.escape(group)}: ratios to what is named beside them" '
             f'viewBox="0 0 {WIDTH} {height}" style="max-width: {WIDTH}px" xmlns="http://www.w3.org/2000/svg">']
    for index, (what, ratio, limit) in enumerate(rows):
        top = index * ROW
        label = f"{what}: {ratio:g}" + (f" (limit {limit:g})" if limit else "")
        parts.append(f'<text x="{LEFT}" y="{top + 15}" font-size="13" fill="currentColor">{html.escape(label)}</text>')
        parts.append(f'<rect x="{LEFT}" y="{top + 21}" width="{ratio * scale:.1f}" height="{BAR}" '
                     'fill="var(--color-brand-primary)"/>')
        if limit:
            at = LEFT + limit * scale
            parts.append(f'<line x1="{at:.1f}" x2="{at:.1f}" y1="{top + 18}" y2="{top + 36}" stroke="currentColor" '
                         'stroke-width="2" stroke-dasharray="3 2"/>')
    parts.append(f'<line x1="{one:.1f}" x2="{one:.1f}" y1="18" y2="{height - 18}" stroke="currentColor"/>')
    parts.append(f'<text x="{one:.1f}" y="{height - 4}" font-size="12" text-anchor="middle" fill="currentColor">1: as long as the peer</text>')
    parts.append("</svg></div>")
    return "\n".join(parts) + "\n"
