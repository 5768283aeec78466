#!/usr/bin/python3
"""Latency and throughput per client over time, as a PNG, from the JSON lines
that `vardel_demo world --json FILE` (or `server --json FILE`) writes: one
object per client and second, from the statistics of the server's end of
each connection (N_Client::getStatistics()).

    scripts/plot_stats.py STATS.json OUT.png [--title TEXT]

Three panels share the time axis, one colour per client:
  - the heartbeat round trip, mean of the last 16 (from the first heartbeat on);
  - the one-way latency of the demo's positions per second, client to server
    as the server reads them (solid) and server to client as the client
    reported it (dashed), by the two ends' world clocks, which differ by a
    few milliseconds;
  - the bytes per second of all three channels, from the client (solid) and
    to it (dashed), wire bytes with the stream's 4-byte prefixes.
Needs matplotlib: Debian's python3-matplotlib, for the system's /usr/bin/python3.
"""
import argparse
import json
import sys

try:
    import matplotlib
except ImportError:
    sys.exit(f"plot_stats: {sys.executable} has no matplotlib; run it with /usr/bin/python3 "
             "after scripts/install-deps.sh (python3-matplotlib)")

matplotlib.use("Agg")  # files only, no display needed
import matplotlib.pyplot as plt  # noqa: E402

COLOURS = ["#1f77b4", "#ff7f0e", "#2ca02c", "#d62728", "#9467bd", "#8c564b", "#e377c2", "#7f7f7f"]
# Clients with the same traffic draw the same lines: a marker of its own for
# each shows where they lie on top of each other.
MARKERS = ["o", "s", "^", "D", "v", "P", "X", "*"]
CHANNELS = ("reliable", "unreliable", "control")


def read(path):
    """Lines per client, in order of first appearance; a line that isn't
    JSON (a run cut off mid-line) is skipped."""
    clients = {}
    with open(path) as f:
        for number, text in enumerate(f, 1):
            text = text.strip()
            if not text:
                continue
            try:
                line = json.loads(text)
            except json.JSONDecodeError:
                print(f"plot_stats: {path}:{number}: not JSON, skipped", file=sys.stderr)
                continue
            clients.setdefault(line["client"], []).append(line)
    return clients


def series(lines, value):
    """(times, values) of the lines whose value is known."""
    points = [(line["t"], value(line)) for line in lines]
    points = [(t, v) for t, v in points if v is not None]
    return [t for t, _ in points], [v for _, v in points]


def main():
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument("stats")
    parser.add_argument("out")
    parser.add_argument("--title", default="vardel demo: statistics of each connection, as the server counts them")
    args = parser.parse_args()
    clients = read(args.stats)
    if not clients:
        sys.exit(f"plot_stats: {args.stats} has no lines")

    figure, (rtt, latency, throughput) = plt.subplots(3, 1, sharex=True, figsize=(10, 9))
    for index, (name, lines) in enumerate(sorted(clients.items())):
        style = dict(color=COLOURS[index % len(COLOURS)], marker=MARKERS[index % len(MARKERS)], markersize=4,
                     markerfacecolor="none")
        t, v = series(lines, lambda l: l["rtt_ms"]["mean"] if l["rtt_ms"]["heartbeats"] > 0 else None)
        rtt.plot(t, v, label=name, **style)
        t, v = series(lines, lambda l: l["achieved"]["up_ms"])
        latency.plot(t, v, **style)
        t, v = series(lines, lambda l: l["achieved"]["down_ms"])
        latency.plot(t, v, linestyle="--", **style)
        t, v = series(lines, lambda l: sum(l["per_second"][c]["bytes_in"] for c in CHANNELS) / 1000.0)
        throughput.plot(t, v, **style)
        t, v = series(lines, lambda l: sum(l["per_second"][c]["bytes_out"] for c in CHANNELS) / 1000.0)
        throughput.plot(t, v, linestyle="--", **style)

    rtt.set_ylabel("round trip, ms")
    rtt.set_title("Heartbeat round trip (mean of the last 16)", fontsize=10)
    latency.set_ylabel("one way, ms")
    latency.set_title("Latency of the positions per second: up (client to server, solid), "
                      "down (server to client, dashed)", fontsize=10)
    throughput.set_ylabel("kB/s")
    throughput.set_title("Bytes per second, all channels: from the client (solid), to it (dashed)", fontsize=10)
    throughput.set_xlabel("seconds since the server started")
    for axes in (rtt, latency, throughput):
        axes.grid(True, alpha=0.3)
    # One-way latency compares two world clocks, which differ by a few
    # milliseconds: it may dip below 0.
    latency.axhline(0, color="black", linewidth=0.6)
    rtt.set_ylim(bottom=0)
    throughput.set_ylim(bottom=0)
    rtt.legend(fontsize=8, loc="upper left", ncol=min(4, len(clients)))
    figure.suptitle(args.title, fontsize=11)
    figure.tight_layout()
    figure.savefig(args.out, dpi=100)
    print(f"plot_stats: {args.out}: {len(clients)} clients, "
          f"{sum(len(lines) for lines in clients.values())} lines")


if __name__ == "__main__":
    main()
