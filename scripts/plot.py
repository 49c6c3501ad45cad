#!/usr/bin/env python3
"""Draws docs/performance-installed.svg and docs/performance-hits.svg from what the bench has measured.

Usage: scripts/plot.py [FILE]; FILE is what scripts/bench.sh --tsv has written ("-": standard input).
Without one, the figures that are drawn are measured now, which takes a minute on a quiet machine.
"""
import math
import pathlib
import re
import subprocess
import sys
from html import escape

ROOT = pathlib.Path(__file__).resolve().parent.parent
DRAWN = r"^match-.*(/p50|against-[0-9]+)$"
WIDTH, HEIGHT, LEFT, RIGHT, TOP, BOTTOM = 720, 420, 80, 220, 50, 60
OURS, OURS_TOO = "#1f5fa8", "#b3541e"
SOLID, DASHED, DOTTED = "", "7 4", "2 4"


def measured(arguments):
    if arguments == ["-"]:
        text = sys.stdin.read()
    elif arguments:
        text = pathlib.Path(arguments[0]).read_text(encoding="utf-8")
    else:
        command = [ROOT / "scripts/bench.sh", "--tsv", "--only", DRAWN]
        text = subprocess.run(command, check=True, stdout=subprocess.PIPE, encoding="utf-8").stdout
    rows = (line.split("\t") for line in text.splitlines())
    return {row[0]: float(row[1]) for row in rows if len(row) == 3}


def points(figures, pattern):
    """What was measured under the keys that a pattern matches: its group is the first coordinate."""
    found = ((re.fullmatch(pattern, key), value) for key, value in figures.items())
    return sorted((float(match[1]), value) for match, value in found if match)


def readable(microseconds):
    if microseconds >= 1000:
        return f"{microseconds / 1000:g} ms"
    return f"{microseconds:g} µs"


def decades(values):
    """The powers of ten around some values, two at least."""
    low = math.floor(math.log10(min(values)))
    return low, max(math.ceil(math.log10(max(values))), low + 1)


def draw(name, title, label, series):
    """Writes a plot with both axes logarithmic. A series is a name, a colour, dashes and points."""
    series = [one for one in series if one[3]]
    if not series:
        sys.exit(f"plot.py: no figures for docs/{name}")
    every = [point for one in series for point in one[3]]
    x_low, x_high = decades([x for x, _ in every])
    y_low, y_high = decades([y for _, y in every])
    inner_width, inner_height = WIDTH - LEFT - RIGHT, HEIGHT - TOP - BOTTOM

    def across(x):
        return LEFT + (math.log10(x) - x_low) / (x_high - x_low) * inner_width

    def down(y):
        return HEIGHT - BOTTOM - (math.log10(y) - y_low) / (y_high - y_low) * inner_height

    out = [
        f'<svg xmlns="http://www.w3.org/2000/svg" viewBox="0 0 {WIDTH} {HEIGHT}" '
        'font-family="sans-serif" font-size="12">',
        f'<rect width="{WIDTH}" height="{HEIGHT}" fill="white"/>',
        f'<text x="{LEFT}" y="28" font-size="15">{escape(title)}</text>',
        f'<text x="{LEFT + inner_width / 2:.0f}" y="{HEIGHT - 16}" text-anchor="middle">{escape(label)}</text>',
    ]
    line = '<path d="M{:.1f} {:.1f}L{:.1f} {:.1f}" stroke="#ddd"/>'
    for power in range(x_low, x_high + 1):
        x = across(10**power)
        out.append(line.format(x, TOP, x, HEIGHT - BOTTOM))
        number = f"{10**power:,}".replace(",", " ")
        out.append(f'<text x="{x:.1f}" y="{HEIGHT - BOTTOM + 18}" text-anchor="middle">{number}</text>')
    for power in range(y_low, y_high + 1):
        y = down(10.0**power)
        out.append(line.format(LEFT, y, WIDTH - RIGHT, y))
        out.append(f'<text x="{LEFT - 8}" y="{y + 4:.1f}" text-anchor="end">{readable(10.0**power)}</text>')
    for row, (caption, colour, dashes, its_points) in enumerate(series):
        style = f'stroke="{colour}" stroke-width="2" stroke-dasharray="{dashes}" fill="none"'
        path = "L".join(f"{across(x):.1f} {down(y):.1f}" for x, y in its_points)
        out.append(f'<path d="M{path}" {style}/>')
        for x, y in its_points:
            out.append(f'<circle cx="{across(x):.1f}" cy="{down(y):.1f}" r="3" fill="{colour}">'
                       f"<title>{escape(caption)}: {y:.1f} µs</title></circle>")
        left, y = WIDTH - RIGHT + 16, TOP + 10 + 20 * row
        out.append(f'<path d="M{left} {y}h28" {style}/>')
        out.append(f'<text x="{left + 36}" y="{y + 4}">{escape(caption)}</text>')
    path = ROOT / "docs" / name
    path.write_text("\n".join(out) + "\n</svg>\n", encoding="utf-8")
    print(path.relative_to(ROOT))


def main():
    if len(sys.argv) > 2 or sys.argv[1:] in (["-h"], ["--help"]):
        sys.exit(__doc__.strip())
    figures = measured(sys.argv[1:])
    installed, hits, decoded = r"/match-10/of-(\d+)/p50", r"/match-(\d+)/p50", r"/match-(\d+)\+decode/p50"
    draw("performance-installed.svg", "A match of 10", "plug-ins installed", [
        ("ours", OURS, SOLID, points(figures, "zrd" + installed)),
        ("limit: 1.5 × with a tenth", OURS, DASHED, points(figures, "limit" + installed)),
    ])
    draw("performance-hits.svg", "A match among all that is installed", "plug-ins in the reply", [
        ("bytes alone", OURS, SOLID, points(figures, "zrd" + hits)),
        ("  its limit", OURS, DASHED, points(figures, "limit" + hits)),
        ("  bare echo of the bytes", OURS, DOTTED, points(figures, "echo" + hits)),
        ("through the library", OURS_TOO, SOLID, points(figures, "zrd" + decoded)),
        ("  its goal", OURS_TOO, DASHED, points(figures, "goal" + decoded)),
        ("  bare echo and decode", OURS_TOO, DOTTED, points(figures, "echo" + decoded)),
    ])


main()
