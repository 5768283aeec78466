#!/usr/bin/env python3
"""Latency over time as an SVG picture, from CSV files of "seconds,latency_ms"
(what `vardel_demo world --csv FILE` writes for its first client).

    scripts/plot_latency.py OUT.svg "LABEL=FILE.csv" ["LABEL=FILE.csv" ...]
                            [--title TEXT] [--linear]

Each file is one series; the latency axis is logarithmic unless --linear,
so that milliseconds and seconds fit in one picture. Standard library only.
"""
import csv
import html
import math
import sys

WIDTH, HEIGHT = 860, 420
LEFT, RIGHT, TOP, BOTTOM = 70, 20, 40, 80
COLOURS = ["#d62728", "#1f77b4", "#2ca02c", "#9467bd", "#ff7f0e"]
MAX_POINTS = 1200  # per series, so that the file stays small


def read_series(path):
    points = []
    with open(path, newline="") as f:
        for row in csv.DictReader(f):
            try:
                t, ms = float(row["seconds"]), float(row["latency_ms"])
            except (KeyError, ValueError):
                continue
            if ms > 0:
                points.append((t, ms))
    if len(points) > MAX_POINTS:
        step = len(points) / MAX_POINTS
        points = [points[int(i * step)] for i in range(MAX_POINTS)]
    return points


def nice_ticks(lo, hi, count=6):
    span = hi - lo
    raw = span / count
    magnitude = 10 ** math.floor(math.log10(raw))
    step = min((m * magnitude for m in (1, 2, 5, 10) if m * magnitude >= raw))
    first = math.ceil(lo / step) * step
    ticks = []
    v = first
    while v <= hi + 1e-9:
        ticks.append(v)
        v += step
    return ticks


def main(argv):
    title, linear, series = "Delivered latency", False, []
    args = iter(argv[2:])
    for a in args:
        if a == "--title":
            title = next(args)
        elif a == "--linear":
            linear = True
        else:
            label, _, path = a.rpartition("=")
            series.append((label, read_series(path)))
    if len(argv) < 3 or not series:
        sys.exit(__doc__)
    out = argv[1]

    t_max = max((p[0] for _, s in series for p in s), default=1.0)
    ms_all = [p[1] for _, s in series for p in s] or [1.0]
    if linear:
        y_lo, y_hi = 0.0, max(ms_all) * 1.05
        y_ticks = nice_ticks(y_lo, y_hi)
        scale = lambda v: v
    else:
        y_lo = 10 ** math.floor(math.log10(min(ms_all)))
        y_hi = 10 ** math.ceil(math.log10(max(ms_all)))
        y_ticks = [m * 10 ** e for e in range(int(math.log10(y_lo)), int(math.log10(y_hi)) + 1)
                   for m in (1, 2, 5) if m * 10 ** e <= y_hi]
        scale = math.log10
    plot_w, plot_h = WIDTH - LEFT - RIGHT, HEIGHT - TOP - BOTTOM

    def x_of(t):
        return LEFT + plot_w * t / t_max

    def y_of(ms):
        lo, hi = scale(y_lo), scale(y_hi)
        return TOP + plot_h * (1 - (scale(max(ms, y_lo)) - lo) / (hi - lo))

    svg = [f'<svg xmlns="http://www.w3.org/2000/svg" width="{WIDTH}" height="{HEIGHT}" '
           f'viewBox="0 0 {WIDTH} {HEIGHT}" font-family="sans-serif" font-size="12">',
           f'<rect width="{WIDTH}" height="{HEIGHT}" fill="white"/>',
           f'<text x="{WIDTH / 2}" y="22" text-anchor="middle" font-size="15">{html.escape(title)}</text>']
    for v in y_ticks:
        y = y_of(v)
        label = f"{v:g}" if v < 1000 else f"{v / 1000:g} s"
        svg.append(f'<line x1="{LEFT}" y1="{y:.1f}" x2="{WIDTH - RIGHT}" y2="{y:.1f}" stroke="#ddd"/>')
        svg.append(f'<text x="{LEFT - 6}" y="{y + 4:.1f}" text-anchor="end">{label}</text>')
    for t in nice_ticks(0, t_max):
        x = x_of(t)
        svg.append(f'<line x1="{x:.1f}" y1="{TOP}" x2="{x:.1f}" y2="{TOP + plot_h}" stroke="#eee"/>')
        svg.append(f'<text x="{x:.1f}" y="{TOP + plot_h + 16}" text-anchor="middle">{t:g}</text>')
    svg.append(f'<rect x="{LEFT}" y="{TOP}" width="{plot_w}" height="{plot_h}" fill="none" stroke="#444"/>')
    svg.append(f'<text x="{LEFT + plot_w / 2}" y="{TOP + plot_h + 34}" text-anchor="middle">seconds</text>')
    svg.append(f'<text transform="translate(16 {TOP + plot_h / 2}) rotate(-90)" text-anchor="middle">'
               f'latency, ms{"" if linear else " (log scale)"}</text>')
    for i, (label, points) in enumerate(series):
        colour = COLOURS[i % len(COLOURS)]
        if points:
            path = " ".join(f"{x_of(t):.1f},{y_of(ms):.1f}" for t, ms in points)
            svg.append(f'<polyline points="{path}" fill="none" stroke="{colour}" stroke-width="1"/>')
        ly = TOP + plot_h + 54
        lx = LEFT + i * (plot_w / max(1, len(series)))
        svg.append(f'<line x1="{lx:.1f}" y1="{ly - 4}" x2="{lx + 24:.1f}" y2="{ly - 4}" stroke="{colour}" '
                   f'stroke-width="3"/>')
        svg.append(f'<text x="{lx + 30:.1f}" y="{ly}">{html.escape(label)}</text>')
    svg.append("</svg>")
    with open(out, "w") as f:
        f.write("\n".join(svg) + "\n")


if __name__ == "__main__":
    main(sys.argv)
