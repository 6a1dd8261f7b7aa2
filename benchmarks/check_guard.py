#!/usr/bin/env python3
"""Compares the ratios of a run with the committed ones.

    check_guard.py BASELINE FIGURES           status 1 on a loss of more than 30 %
    check_guard.py --write BASELINE FIGURES   makes the baseline of the run

Ratios, not times: each divides by what a bare socket did in the same run, so that a
slower machine loses nothing by itself.
"""

import json
import sys

MOST_LOSS = 0.30
LESS_IS_BETTER = ("ns", "us", "ms", "s")


def ratios_of(path):
    with open(path, encoding="utf-8") as file:
        figures = json.load(file)["figures"]
    return {
        figure["name"]: figure
        for figure in figures
        if (figure["ratio_to"] or "").startswith("raw_")
        and not figure["name"].startswith("dbus_")
    }


def write(baseline_path, figures_path):
    ratios = {
        name: float(f"{figure['ratio']:.4g}")
        for name, figure in ratios_of(figures_path).items()
    }
    with open(baseline_path, "w", encoding="utf-8") as file:
        json.dump({"ratios": ratios}, file, indent=2, sort_keys=True)
        file.write("\n")


def loss(figure, committed):
    """What part of the committed performance is gone."""
    if figure["unit"] in LESS_IS_BETTER:
        return 1 - committed / figure["ratio"]
    return 1 - figure["ratio"] / committed


def compare(baseline_path, figures_path):
    with open(baseline_path, encoding="utf-8") as file:
        baseline = json.load(file)["ratios"]
    figures = ratios_of(figures_path)
    is_good = True
    for name, committed in baseline.items():
        if name not in figures:
            print(f"{name}: not measured")
            is_good = False
            continue
        lost = loss(figures[name], committed)
        is_good = is_good and lost <= MOST_LOSS
        mark = "ok" if lost <= MOST_LOSS else f"LOST MORE THAN {MOST_LOSS:.0%}"
        print(
            f"{name}: {figures[name]['ratio']:.4g} to {figures[name]['ratio_to']},"
            f" committed {committed:.4g}, change {-lost:+.0%}: {mark}"
        )
    return 0 if is_good else 1


def main(arguments):
    if len(arguments) == 3 and arguments[0] == "--write":
        write(arguments[1], arguments[2])
        return 0
    if len(arguments) == 2:
        return compare(*arguments)
    print(__doc__, file=sys.stderr)
    return 2


if __name__ == "__main__":
    sys.exit(main(sys.argv[1:]))
