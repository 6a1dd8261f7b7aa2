#!/usr/bin/env python3
"""Draws the growth curves as SVG: plot_growth.py GROWTH_JSON DIRECTORY"""

import json
import math
import pathlib
import sys
from xml.sax.saxutils import escape

WIDTH, HEIGHT = 640, 320
LEFT, RIGHT, TOP, BOTTOM = 70, 40, 20, 50
LABEL_WIDTH = 40  # What the value of a point takes.


def nice_ceiling(value):
    """The least of 1, 2, 5 times a power of ten that is not below the value."""
    power = 10 ** math.floor(math.log10(value))
    return next(step * power for step in (1, 2, 5, 10) if step * power >= value)


def text(x, y, words, anchor="middle", extra=""):
    return f'<text x="{x:.1f}" y="{y:.1f}" text-anchor="{anchor}"{extra}>{escape(words)}</text>'


def line(x1, y1, x2, y2, colour):
    return (
        f'<line x1="{x1:.1f}" y1="{y1:.1f}" x2="{x2:.1f}" y2="{y2:.1f}" stroke="{colour}"/>'
    )


def draw(curve):
    points = curve["points"]
    decades = max(1, math.ceil(math.log10(max(x for x, _ in points)) - 0.05))
    top = nice_ceiling(max(y for _, y in points))
    width, height = WIDTH - LEFT - RIGHT, HEIGHT - TOP - BOTTOM

    def at(x, y):
        return (
            LEFT + width * min(1, math.log10(x) / decades),
            TOP + height * (1 - y / top),
        )

    parts = [
        f'<svg xmlns="http://www.w3.org/2000/svg" width="{WIDTH}" height="{HEIGHT}"'
        f' viewBox="0 0 {WIDTH} {HEIGHT}" font-family="sans-serif" font-size="12">',
        f'<rect width="{WIDTH}" height="{HEIGHT}" fill="white"/>',
    ]
    for tick in range(6):
        x, y = at(1, top * tick / 5)
        parts += [line(x, y, WIDTH - RIGHT, y, "#ddd"),
                  text(x - 6, y + 4, f"{top * tick / 5:,g}", "end")]
    for decade in range(decades + 1):
        x, y = at(10**decade, 0)
        parts += [line(x, TOP, x, y, "#ddd"), text(x, y + 16, f"{10**decade:,}")]
    middle = TOP + height / 2
    parts += [
        text(LEFT + width / 2, HEIGHT - 10, curve["x_label"]),
        text(16, middle, curve["y_label"], extra=f' transform="rotate(-90 16 {middle})"'),
    ]
    places = [at(x, y) for x, y in points]
    path = " ".join(f"{x:.1f},{y:.1f}" for x, y in places)
    parts.append(
        f'<polyline points="{path}" fill="none" stroke="#1f77b4" stroke-width="2"/>'
    )
    last = places[-1][0]
    label_end = -math.inf
    for (x, y), (_, value) in zip(places, points):
        parts.append(f'<circle cx="{x:.1f}" cy="{y:.1f}" r="3.5" fill="#1f77b4"/>')
        # Of points that stand close together one has its value; the last always has.
        if x == last or (x >= label_end and x + LABEL_WIDTH <= last):
            parts.append(text(x, y - 9, f"{value:,.0f}"))
            label_end = x + LABEL_WIDTH
    return "\n".join(parts + ["</svg>", ""])


def main(arguments):
    if len(arguments) != 2:
        print(__doc__, file=sys.stderr)
        return 2
    curves = json.loads(pathlib.Path(arguments[0]).read_text(encoding="utf-8"))["curves"]
    for curve in curves:
        name = curve["name"].replace("_", "-")
        path = pathlib.Path(arguments[1]) / f"performance-{name}.svg"
        path.write_text(draw(curve), encoding="utf-8")
        print(path)
    return 0


if __name__ == "__main__":
    sys.exit(main(sys.argv[1:]))
