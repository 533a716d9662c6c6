#!/usr/bin/env python3
"""Turns etcd_transport_bench's JSON output into the table of gRPC against
libcurl.

Each figure is the median over all repetitions found, pooled over the files
given (several runs of bench/run --etcd), with the lowest and highest
repetition beside it: the spread is how much the shared machine moved the
figure. Usage: etcd_report.py results.json [more.json ...] [markdown]
"""

import json
import re
import statistics
import sys
from collections import defaultdict

from report import print_table

SCALE = {"ns": 1e-6, "us": 1e-3, "ms": 1.0, "s": 1e3}
OPERATIONS = (("list, one reply", "BM_ListOne"), ("list, pages of 1,000", "BM_ListPaged"),
              ("write, 100 txns of 100 puts", "BM_Write"))


def load(paths):
    runs = defaultdict(list)
    context = {}
    for path in paths:
        with open(path) as f:
            data = json.load(f)
        context = data.get("context", context)
        for b in data["benchmarks"]:
            if b.get("run_type") != "iteration":
                continue
            if b.get("error_occurred"):
                sys.exit(f"{b['run_name']} failed: {b.get('error_message')}")
            name = re.sub(r"/(min_time|repeats|iterations):[^/]*|/real_time|/process_time", "",
                          b["run_name"])
            runs[name].append(b)
    return context, runs


def values(runs, name, field):
    rows = runs.get(name, [])
    scale = SCALE[rows[0]["time_unit"]] if rows and field.endswith("_time") else 1.0
    return [b[field] * scale for b in rows if field in b]


def spread(vs):
    """The median, and the text "median (min-max, ±half the range in % of the median)"."""
    m = statistics.median(vs)
    half = (max(vs) - min(vs)) / 2 / m * 100 if m else 0
    return m, f"{m:.0f} ({min(vs):.0f}-{max(vs):.0f}, ±{half:.0f}%)"


def main():
    args = sys.argv[1:]
    markdown = bool(args) and args[-1] == "markdown"
    if markdown:
        args = args[:-1]
    context, runs = load(args)
    headers = ("operation, 10,000 x 1,400 B", "transport", "elapsed ms: median (min-max)",
               "client CPU ms", "etcd CPU ms", "reps", "curl / gRPC")
    rows = []
    for what, base in OPERATIONS:
        grpc = None
        for kind, transport in (("grpc", "gRPC"), ("curl", "libcurl + JSON gateway")):
            name = f"{base}_{kind}"
            real = values(runs, name, "real_time")
            if not real:
                rows.append((what, transport, "NOT RUN", "", "", "0", ""))
                continue
            m, text = spread(real)
            cpu = values(runs, name, "cpu_time")
            etcd = values(runs, name, "etcd_cpu_ms")
            ratio = ""
            if kind == "grpc":
                grpc = m
            elif grpc:
                ratio = f"{m / grpc:.1f}x"
            rows.append((what, transport, text,
                         spread(cpu)[1] if cpu else "", spread(etcd)[1] if etcd else "",
                         str(len(real)), ratio))
    transfer = values(runs, "BM_CurlListTransferOnly", "real_time")
    if transfer:
        rows.append(("list, one reply: HTTP only, not parsed", "libcurl + JSON gateway",
                     spread(transfer)[1],
                     spread(values(runs, "BM_CurlListTransferOnly", "cpu_time"))[1],
                     spread(values(runs, "BM_CurlListTransferOnly", "etcd_cpu_ms"))[1],
                     str(len(transfer)), ""))

    notes = []
    for mode, label in (("one", "one reply"), ("paged", "pages of 1,000")):
        for kind, transport in (("grpc", "gRPC"), ("curl", "libcurl")):
            name = f"BM_PeakRss_{mode}_{kind}"
            peak = values(runs, name, "peak_rss_kib")
            rise = values(runs, name, "listing_rss_kib")
            if peak:
                notes.append(f"peak RSS, listing in {label}, {transport}: "
                              f"{statistics.median(peak) / 1024:.1f} MiB, of which the listing "
                              f"{statistics.median(rise) / 1024:.1f} MiB "
                              f"(median of {len(peak)})")
    connections = [c for base in ("BM_ListOne_curl", "BM_ListPaged_curl", "BM_Write_curl")
                   for c in values(runs, base, "connections")]
    if connections:
        notes.append(f"connections libcurl opened in one repetition: at most {max(connections):.0f}")
    reply = values(runs, "BM_CurlListTransferOnly", "reply_bytes")
    if reply:
        notes.append(f"JSON reply of the one-reply listing: {reply[0] / 1e6:.1f} MB")

    print_table(headers, rows, notes, context,
                ("etcd", "grpc", "libcurl", "num_cpus", "load_avg"), markdown)


if __name__ == "__main__":
    main()
