#!/usr/bin/python3
"""How a server's cost grows with its clients, from the JSON that
`vardel_bench --scaling --json FILE` writes.

    bench/plot_scaling.py RESULTS.json OUT.png [--before N:US,N:US,...] [--title TEXT]

Left: the server's CPU time per second of wall time (% of one core) for each
number of client processes, with what was delivered of what the clients
sent; a dashed line marks 25%. Right: what one
event costs the platform layer's wait beside N handles; --before adds the
same measure of an earlier build (microseconds per event at N handles) for
comparison. Needs matplotlib: Debian's python3-matplotlib, for the system's
/usr/bin/python3.
"""
import argparse
import json
import sys

try:
    import matplotlib
except ImportError:
    sys.exit(f"plot_scaling: {sys.executable} has no matplotlib; run it with /usr/bin/python3 "
             "after scripts/install-deps.sh (python3-matplotlib)")

matplotlib.use("Agg")  # files only, no display needed
import matplotlib.pyplot as plt  # noqa: E402


def pairs(text):
    """'64:15.5,256:62.6' -> [(64, 15.5), (256, 62.6)]"""
    out = []
    for item in text.split(","):
        n, value = item.split(":")
        out.append((int(n), float(value)))
    return out


def main():
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument("results")
    parser.add_argument("out")
    parser.add_argument("--before", type=pairs, help="N:US,... of an earlier build's wait")
    parser.add_argument("--title")
    args = parser.parse_args()
    with open(args.results) as f:
        data = json.load(f)

    fig, (cpu, wait) = plt.subplots(1, 2, figsize=(11, 4.2))
    sizes = data["sizes"]
    clients = [s["clients"] for s in sizes]
    percent = [s["server_cpu_percent_of_one_core"] for s in sizes]
    cpu.plot(clients, percent, "o-", color="#1f77b4", label="server CPU")
    lines = []
    for s in sizes:
        sent = s["unreliable_sent"]
        share = 100.0 * s["unreliable_delivered"] / sent if sent else 0.0
        lines.append(f'{s["clients"]:>4}: {s["connected"]} connected, {share:.1f}% unreliable, '
                     f'{s["reliable_delivered"]}/{s["reliable_sent"]} events')
    cpu.text(0.03, 0.72, "delivered\n" + "\n".join(lines), transform=cpu.transAxes, fontsize=7,
             family="monospace", va="top", bbox={"facecolor": "white", "edgecolor": "#cccccc"})
    cpu.axhline(25, color="grey", linestyle="--", linewidth=1, label="goal: under 25%")
    cpu.set_xlabel("client processes (64 B unreliable at 20 Hz, a reliable event a second)")
    cpu.set_ylabel("server CPU, % of one core")
    cpu.set_xlim(0, max(clients) * 1.25)
    cpu.set_ylim(0, max(30, max(percent) * 1.3))
    cpu.legend(loc="upper left", fontsize=8)
    cpu.grid(alpha=0.3)

    handles = [w["handles"] for w in data["wait_cost"]]
    micros = [w["us_per_event"] for w in data["wait_cost"]]
    wait.plot(handles, micros, "o-", color="#2ca02c", label="this build")
    if args.before:
        wait.plot([n for n, _ in args.before], [us for _, us in args.before], "s--", color="#d62728",
                  label="before (poll of every handle each wait)")
    wait.set_xscale("log", base=2)
    wait.set_yscale("log")
    wait.set_xticks(handles, [str(n) for n in handles])
    wait.set_xlabel("handles in the wait (UDP sockets)")
    wait.set_ylabel("microseconds per event served")
    wait.legend(loc="upper left", fontsize=8)
    wait.grid(alpha=0.3, which="both")

    machine = data.get("machine", {})
    fig.suptitle(args.title or f'A server\'s cost as its clients grow ({machine.get("cores", "?")} cores, '
                 f'{data.get("date", "")[:10]})', fontsize=11)
    fig.tight_layout()
    fig.savefig(args.out, dpi=110)


if __name__ == "__main__":
    main()
