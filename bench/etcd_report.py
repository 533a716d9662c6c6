#!/usr/bin/env python3
"""Turns etcd_store_bench's JSON output into a table of the library on the
etcd store against raw etcd, each row a ratio with its target, and one of
the store's replace keeping 10 versions against keeping none.

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
# The store's operations, each against what the same bytes cost through
# etcd's own calls: (operation, store benchmark, raw benchmark, raw work).
STORE_TARGET = 1.5
STORE_OPERATIONS = (
    ("replace: AddPolicyInfo", "BM_StoreReplace", "BM_RawReplace", "txns of 100 puts"),
    ("list: ListPolicyInfo", "BM_StoreList", "BM_RawList", "one Range"),
    ("GetCorraPolicyBlobByName", "BM_StoreBlobByName", "BM_RawBlobByName", "one-key Range"),
    ("GetCorraPolicyBlobById", "BM_StoreBlobById", "BM_RawList", "one Range"),
    ("GetDefaultPolicyBlob", "BM_StoreDefaultBlob", "BM_RawDefaultBlob",
     "one-key Range + one Range"),
    ("GetDbHash", "BM_StoreGetDbHash", "BM_RawListBoth", "two Ranges"),
)
STORE_SIZES = (1000, 10000)
# The store keeping its last 10 versions against keeping none: (operation,
# benchmark with history, benchmark without).
HISTORY_TARGET = 1.10
HISTORY_OPERATIONS = (
    ("replace: K = 10 / K = 0", "BM_StoreReplace", "BM_StoreReplaceNoHistory"),
)


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


def spread(vs, digits=0):
    """The median, and the text "median (min-max, ±half the range in % of the median)"."""
    m = statistics.median(vs)
    half = (max(vs) - min(vs)) / 2 / m * 100 if m else 0
    return m, f"{m:.{digits}f} ({min(vs):.{digits}f}-{max(vs):.{digits}f}, ±{half:.0f}%)"


def digits_for(vs):
    """Decimals enough for three significant digits of the median."""
    m = statistics.median(vs)
    return 0 if m >= 100 else 1 if m >= 10 else 2 if m >= 1 else 3


def store_table(runs):
    """Rows of the store against raw etcd, with the notes below them."""
    headers = ("operation", "N", "store ms: median (min-max)", "raw ms: median (min-max)",
               "raw work", "ratio", "client CPU ratio", "etcd CPU ms store / raw",
               f"target <= {STORE_TARGET}x")
    rows = []
    for what, mine, base, work in STORE_OPERATIONS:
        for n in STORE_SIZES:
            store = values(runs, f"{mine}/{n}", "real_time")
            raw = values(runs, f"{base}/{n}", "real_time")
            if not store or not raw:
                rows.append((what, f"{n:,}", "NOT RUN" if not store else "",
                             "NOT RUN" if not raw else "", work, "", "", "", "NOT RUN"))
                continue
            d = digits_for(raw)
            ms, store_text = spread(store, d)
            mr, raw_text = spread(raw, d)
            ratio = ms / mr
            cpu = [statistics.median(values(runs, f"{x}/{n}", "cpu_time")) for x in (mine, base)]
            etcd = [values(runs, f"{x}/{n}", "etcd_cpu_ms") for x in (mine, base)]
            etcd_text = (f"{statistics.median(etcd[0]):.{d}f} / {statistics.median(etcd[1]):.{d}f}"
                         if etcd[0] and etcd[1] else "")
            rows.append((what, f"{n:,}", store_text, raw_text, work, f"{ratio:.2f}",
                         f"{cpu[0] / cpu[1]:.2f}", etcd_text,
                         "MET" if ratio <= STORE_TARGET else "MISSED"))
    reps = sorted({len(values(runs, name, "real_time")) for name in runs
                   if name.startswith(("BM_Store", "BM_Raw"))})
    notes = [f"repetitions per figure: {', '.join(map(str, reps))}; ratio = median over median"]
    return headers, rows, notes


def history_table(runs):
    """Rows of the store keeping versions against keeping none."""
    headers = ("operation", "N", "K = 10 ms: median (min-max)", "K = 0 ms: median (min-max)",
               "ratio", "etcd CPU ms K = 10 / K = 0", f"target <= {HISTORY_TARGET}x")
    rows = []
    for what, kept, none in HISTORY_OPERATIONS:
        for n in STORE_SIZES:
            with_history = values(runs, f"{kept}/{n}", "real_time")
            without = values(runs, f"{none}/{n}", "real_time")
            if not with_history or not without:
                continue
            d = digits_for(without)
            mk, kept_text = spread(with_history, d)
            mn, none_text = spread(without, d)
            etcd = [values(runs, f"{x}/{n}", "etcd_cpu_ms") for x in (kept, none)]
            etcd_text = (f"{statistics.median(etcd[0]):.{d}f} / {statistics.median(etcd[1]):.{d}f}"
                         if etcd[0] and etcd[1] else "")
            rows.append((what, f"{n:,}", kept_text, none_text, f"{mk / mn:.2f}", etcd_text,
                         "MET" if mk / mn <= HISTORY_TARGET else "MISSED"))
    return headers, rows, []


def main():
    args = sys.argv[1:]
    markdown = bool(args) and args[-1] == "markdown"
    if markdown:
        args = args[:-1]
    context, runs = load(args)
    headers, rows, notes = store_table(runs)
    print_table(headers, rows, notes, context, ("etcd", "grpc", "num_cpus", "load_avg"), markdown)
    headers, rows, notes = history_table(runs)
    if rows:
        print()
        print_table(headers, rows, notes, context, (), markdown)


if __name__ == "__main__":
    main()
