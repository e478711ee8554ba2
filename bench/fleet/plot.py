#!/usr/bin/python3
"""Draws one PNG per scenario from fleet_sim's --csv-dir output: requests per
second over time (10-second means), one line per request kind, and the share
of the fleet recovered on a second axis. Needs Debian's python3-matplotlib,
which only /usr/bin/python3 imports."""
import csv
import glob
import os
import sys

try:
    import matplotlib

    matplotlib.use("Agg")
    import matplotlib.pyplot as plt
except ImportError:
    sys.exit("plot.py: matplotlib is missing: run it with /usr/bin/python3 (apt-get install python3-matplotlib)")

KINDS = ["register", "alias_map", "alias_keep_alive", "tunnel"]
BIN = 10


def load(path):
    seconds, counts, recovered, ret = [], {k: [] for k in KINDS}, [], 0
    with open(path, newline="") as f:
        for row in csv.reader(f):
            if not row or row[0] == "second":
                continue
            if row[0].startswith("#"):
                ret = int(",".join(row).rsplit("return at ", 1)[1].split()[0])
                continue
            seconds.append(int(row[0]))
            for i, k in enumerate(KINDS):
                counts[k].append(int(row[1 + i]))
            recovered.append(float(row[5]))
    return seconds, counts, recovered, ret


def draw(path, out):
    seconds, counts, recovered, ret = load(path)
    if not seconds:
        return False
    fig, ax = plt.subplots(figsize=(11, 5))
    xs = [seconds[i] / 60.0 for i in range(0, len(seconds) - BIN + 1, BIN)]
    for k in KINDS:
        c = counts[k]
        ys = [sum(c[i : i + BIN]) / BIN for i in range(0, len(c) - BIN + 1, BIN)]
        if any(ys):
            ax.plot(xs, ys, label=k, linewidth=0.8)
    ax.set_xlabel("minutes from the event")
    ax.set_ylabel("requests per second (10 s means)")
    ax.axvline(0, color="grey", linestyle=":")
    if ret:
        ax.axvline(ret / 60.0, color="grey", linestyle="--")
    ax2 = ax.twinx()
    ax2.plot([s / 60.0 for s in seconds], recovered, color="black", linewidth=0.6, alpha=0.5, label="recovered share")
    ax2.set_ylim(0, 1.05)
    ax2.set_ylabel("share of the fleet recovered")
    lines = ax.get_legend_handles_labels()
    lines2 = ax2.get_legend_handles_labels()
    ax.legend(lines[0] + lines2[0], lines[1] + lines2[1], loc="upper right", fontsize=8)
    ax.set_title(os.path.basename(path)[:-4])
    fig.tight_layout()
    fig.savefig(out, dpi=100)
    plt.close(fig)
    return True


def main():
    if len(sys.argv) != 2:
        sys.exit("usage: plot.py CSV_DIR   (writes CSV_DIR/<scenario>.png)")
    files = sorted(glob.glob(os.path.join(sys.argv[1], "*.csv")))
    if not files:
        sys.exit("plot.py: no .csv files in %s" % sys.argv[1])
    for path in files:
        png = path[:-4] + ".png"
        if draw(path, png):
            print("plot: %s" % png)


if __name__ == "__main__":
    main()
