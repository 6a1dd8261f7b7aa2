#!/usr/bin/env python3
"""Compares the ratios of a run with the committed ones.

    check_guard.py BASELINE FIGURES           status 1 on a loss of more than 30 %
    check_guard.py --write BASELINE FIGURES   makes the baseline of the run

Ratios, not times: each divides by what a bare socket did in the same run, so that a
slower machine loses nothing by itself. The rates divide by the socket's with one write
a message, which two runs agree on within a tenth; that of its batches differs by twice
as much as the loss that is looked for.
"""

import json
import sys

MOST_LOSS = 0.30
PEERS = {
    "one_way": "raw_single",
    "one_way_stored": "raw_single",
    "pipelined_replies": "raw_single",
    "round_trip_one_core_us": "raw_round_trip_one_core_us",
}
LESS_IS_BETTER = ("round_trip_one_core_us",)


def ratios_of(path):
    with open(path, encoding="utf-8") as file:
        values = {figure["name"]: figure["value"]
                  for figure in json.load(file)["figures"]}
    return {name: values[name] / values[peer] for name, peer in PEERS.items()
            if name in values and values.get(peer)}


def write(baseline_path, figures_path):
    ratios = {name: float(f"{ratio:.4g}")
              for name, ratio in ratios_of(figures_path).items()}
    with open(baseline_path, "w", encoding="utf-8") as file:
        json.dump({"ratios": ratios}, file, indent=2, sort_keys=True)
        file.write("\n")


def loss(name, ratio, committed):
    """What part of the committed performance is gone."""
    if name in LESS_IS_BETTER:
        return 1 - committed / ratio
    return 1 - ratio / committed


def compare(baseline_path, figures_path):
    with open(baseline_path, encoding="utf-8") as file:
        baseline = json.load(file)["ratios"]
    ratios = ratios_of(figures_path)
    is_good = True
    for name, committed in baseline.items():
        if name not in ratios:
            print(f"{name}: not measured")
            is_good = False
            continue
        lost = loss(name, ratios[name], committed)
        is_good = is_good and lost <= MOST_LOSS
        mark = "ok" if lost <= MOST_LOSS else f"LOST MORE THAN {MOST_LOSS:.0%}"
        print(
            f"{name}: {ratios[name]:.4g} to {PEERS[name]},"
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
