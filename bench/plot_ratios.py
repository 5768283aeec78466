#!/usr/bin/python3
"""Bar chart of the library's ratios against the other transports, from the
JSON that `vardel_bench --json FILE` writes.

    bench/plot_ratios.py RESULTS.json OUT.png [--title TEXT]

A bar is the ratio of the medians (above 1: the library is faster); its
whisker spans the middle half of the ratios of the single rounds, where both
ran side by side, so a bar whose whisker crosses 1 is no clear win or loss. Needs matplotlib:
Debian's python3-matplotlib, for the system's /usr/bin/python3.
"""
import argparse
import json
import math
import sys

try:
    import matplotlib
except ImportError:
    sys.exit(f"plot_ratios: {sys.executable} has no matplotlib; run it with /usr/bin/python3 "
             "after scripts/install-deps.sh (python3-matplotlib)")

matplotlib.use("Agg")  # files only, no display needed
import matplotlib.pyplot as plt  # noqa: E402

COLOURS = ["#1f77b4", "#ff7f0e", "#2ca02c", "#9467bd", "#8c564b"]


def round_ratios(measure, library, peer):
    """Ratios of the rounds one by one: both figures of a round were taken
    close together, so the machine's slow spells cancel out."""
    out = []
    for lib, other in zip(measure["rounds"][library], measure["rounds"][peer]):
        if not lib or not other or lib <= 0 or other <= 0:
            continue
        out.append(lib / other if measure["higher_is_better"] else other / lib)
    return out


def quartiles(values):
    """First and third quartile, interpolated; a single round's outlier on a
    shared machine would otherwise stretch the whisker over the whole axis."""
    v = sorted(values)

    def at(q):
        pos = q * (len(v) - 1)
        low = math.floor(pos)
        high = min(low + 1, len(v) - 1)
        return v[low] + (v[high] - v[low]) * (pos - low)

    return at(0.25), at(0.75)


def main():
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument("results")
    parser.add_argument("out")
    parser.add_argument("--title")
    args = parser.parse_args()

    with open(args.results) as f:
        run = json.load(f)
    library = run["library"]
    peers = [t for t in run["transports"] if t != library]
    measures = run["measures"]

    fig, ax = plt.subplots(figsize=(10, 5.2), dpi=110)
    group = 0.8
    width = group / len(peers)
    lowest, highest = 1.0, 1.0
    for i, peer in enumerate(peers):
        xs, heights, below, above = [], [], [], []
        for m_index, m in enumerate(measures):
            ratio = m["ratio"].get(peer)
            if ratio is None:
                continue
            rounds = round_ratios(m, library, peer) or [ratio]
            q1, q3 = quartiles(rounds)
            x = m_index - group / 2 + width * (i + 0.5)
            xs.append(x)
            heights.append(ratio)
            below.append(max(ratio - q1, 0))
            above.append(max(q3 - ratio, 0))
            lowest = min(lowest, q1, ratio)
            highest = max(highest, q3, ratio)
            failed = not (m["verified"][library] and m["verified"][peer])
            label = f"{ratio:.2f}" + (" !" if failed else "")
            ax.annotate(label, (x, max(ratio, q3, 1.0)), xytext=(0, 2), textcoords="offset points",
                        ha="center", va="bottom", fontsize=7)
        # Bars grow from 1 (a draw) up to a win or down to a loss.
        ax.bar(xs, [h - 1.0 for h in heights], width * 0.92, bottom=1.0, color=COLOURS[i % len(COLOURS)],
               label=f"against {peer}", yerr=[below, above], error_kw={"elinewidth": 0.8, "capsize": 2})

    ax.set_yscale("log")
    ax.set_ylim(lowest / 1.3, highest * 1.5)
    ticks = [t for t in (0.1, 0.2, 0.5, 1, 2, 5, 10, 20, 50) if lowest / 1.3 <= t <= highest * 1.5]
    ax.set_yticks(ticks)
    ax.set_yticklabels([f"{t:g}x" for t in ticks])
    ax.minorticks_off()
    ax.axhline(1.0, color="black", linewidth=0.8)
    ax.set_xticks(range(len(measures)))
    ax.set_xticklabels([m["name"].replace(" round trip", "\nround trip") for m in measures], fontsize=8)
    ax.set_ylabel(f"{library} speed / other's speed (above 1: {library} faster)")
    machine = run.get("machine", {})
    subtitle = (f"{run.get('date', '')[:10]}, {machine.get('cpu', '?')} ({machine.get('cores', '?')} cores), "
                f"loopback, medians of {run.get('rounds', '?')} interleaved rounds "
                f"({run.get('latency_rounds', '?')} for the round trip)\nwhiskers: middle half of the single rounds")
    load = [machine.get(k) for k in ("load_average_before", "load_average_after")]
    if all(isinstance(v, (int, float)) for v in load):
        subtitle += f"; load average {load[0]:.1f} before, {load[1]:.1f} after"
    ax.set_title((args.title or f"{library} against other transports") + "\n" + subtitle, fontsize=10)
    ax.legend(fontsize=8, loc="best")
    ax.grid(axis="y", linewidth=0.3)
    fig.tight_layout()
    fig.savefig(args.out)
    return 0


if __name__ == "__main__":
    sys.exit(main())
