#!/usr/bin/env python3
"""Draws ns per packet against rule count (log scales) from the JSON of
classbench_bench, and prints the side-by-side tables (general rules, exact
hits) in Markdown.

usage: bench/plot.py <classbench.json> <out.png>
"""
import json
import sys

import matplotlib

matplotlib.use("Agg")
import matplotlib.pyplot as plt  # noqa: E402

SERIES = [
    ("BM_ClassBench", "this project (whole path)", "o-"),
    ("BM_Mixed", "this project, negations/MAC masks/VLAN/IPv6", "s--"),
    ("BM_OrderedScan", "this project, ordered scan only (before)", "x:"),
    ("BM_PeerAclScalar", "peer classifier, scalar", "^-"),
    ("BM_PeerAclBest", "peer classifier, best vector method", "v-"),
]


def load(path):
    with open(path) as f:
        runs = json.load(f)["benchmarks"]
    table = {}
    for r in runs:
        if r.get("run_type", "iteration") != "iteration" or "ns_per_pkt" not in r:
            continue
        family, _, size = r["name"].partition("/")
        size = int(size.split("/")[0])
        # ns_per_pkt is an inverted rate: seconds per packet.
        table.setdefault(family, {})[size] = r["ns_per_pkt"] * 1e9
    return table


def main():
    if len(sys.argv) != 3:
        sys.exit(__doc__)
    table = load(sys.argv[1])
    fig, ax = plt.subplots(figsize=(7, 4.5))
    for family, label, style in SERIES:
        points = sorted(table.get(family, {}).items())
        if points:
            ax.plot([p[0] for p in points], [p[1] for p in points], style, label=label)
    ax.set_xscale("log")
    ax.set_yscale("log")
    ax.set_xlabel("general rules")
    ax.set_ylabel("ns per packet")
    ax.set_title("ClassBench-like rules, same rules and packets, one process")
    ax.grid(True, which="both", alpha=0.3)
    ax.legend()
    fig.tight_layout()
    fig.savefig(sys.argv[2], dpi=110)

    ours = table.get("BM_ClassBench", {})
    scalar = table.get("BM_PeerAclScalar", {})
    best = table.get("BM_PeerAclBest", {})
    mixed = table.get("BM_Mixed", {})
    scan = table.get("BM_OrderedScan", {})
    mixedScan = table.get("BM_MixedOrderedScan", {})
    print("| rules | this project | peer scalar | peer best | ratio to scalar "
          "| ordered scan only | mixed ruleset | mixed, ordered scan only |")
    print("|---|---|---|---|---|---|---|---|")
    for n in sorted(ours):
        def cell(t):
            return f"{t[n]:.0f} ns" if n in t else "-"
        ratio = f"{ours[n] / scalar[n]:.2f}x" if n in scalar else "-"
        print(f"| {n:,} | {cell(ours)} | {cell(scalar)} | {cell(best)} | {ratio} "
              f"| {cell(scan)} | {cell(mixed)} | {cell(mixedScan)} |")

    exact = table.get("BM_ExactHits", {})
    bulk = table.get("BM_PeerHashBulk", {})
    if exact:
        print()
        print("| exact rules | this project | peer hash, bulk | ratio |")
        print("|---|---|---|---|")
        for n in sorted(exact):
            peer = f"{bulk[n]:.1f} ns" if n in bulk else "-"
            ratio = f"{exact[n] / bulk[n]:.2f}x" if n in bulk else "-"
            print(f"| {n:,} | {exact[n]:.1f} ns | {peer} | {ratio} |")


if __name__ == "__main__":
    main()
