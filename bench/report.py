#!/usr/bin/env python3
"""Turns karst_bench's JSON output into the table of targets.

Every figure is the median over repetitions of one benchmark, and every ratio
compares two benchmarks of the same run. Times are elapsed (real) time; the
CPU-time ratio is shown beside, as it is less disturbed by other work on the
machine. Usage: report.py results.json [markdown]
"""

import json
import re
import statistics
import sys
from collections import defaultdict


def load(path):
    with open(path) as f:
        data = json.load(f)
    runs = defaultdict(list)
    for b in data["benchmarks"]:
        if b.get("run_type") != "iteration" or b.get("error_occurred"):
            continue
        # "BM_KarstAdd/10000/min_time:0.300/repeats:5/real_time" -> "BM_KarstAdd/10000"
        name = re.sub(r"/(min_time|repeats|iterations):[^/]*|/real_time", "", b["run_name"])
        runs[name].append(b)
    return data.get("context", {}), runs


def median(runs, name, field):
    values = [b[field] for b in runs.get(name, []) if field in b]
    return statistics.median(values) if values else None


def ms(b_runs, name, field="real_time"):
    """Median time in milliseconds."""
    scale = {"ns": 1e-6, "us": 1e-3, "ms": 1.0, "s": 1e3}
    rows = b_runs.get(name, [])
    if not rows:
        return None
    return median(b_runs, name, field) * scale[rows[0]["time_unit"]]


def main():
    context, runs = load(sys.argv[1])
    markdown = len(sys.argv) > 2 and sys.argv[2] == "markdown"
    rows = []

    def best(names, field):
        times = [(ms(runs, n, field), n) for n in names if ms(runs, n, field) is not None]
        return min(times) if times else (None, None)

    def ratio_row(what, mine, baselines, target, note=""):
        t, base = best(baselines, "real_time")
        c, _ = best(baselines, "cpu_time")
        m, mc = ms(runs, mine), ms(runs, mine, "cpu_time")
        if m is None or t is None:
            rows.append((what, "n/a", "", f"<= {target}", "NOT RUN", note))
            return
        r, rc = m / t, mc / c
        base_label = base.split("/")[0].replace("BM_", "")
        rows.append((what, f"{r:.2f}", f"{rc:.2f}", f"<= {target}",
                     "MET" if r <= target else "MISSED",
                     f"{m:.3g} ms vs {t:.3g} ms ({base_label}){note}"))

    def growth_row(what, name, target=10.5):
        small, big = ms(runs, name + "/10000"), ms(runs, name + "/100000")
        cs, cb = ms(runs, name + "/10000", "cpu_time"), ms(runs, name + "/100000", "cpu_time")
        if small is None or big is None:
            rows.append((what, "n/a", "", f"<= {target}", "NOT RUN", ""))
            return
        r = big / small
        rows.append((what, f"{r:.2f}", f"{cb / cs:.2f}", f"<= {target}",
                     "MET" if r <= target else "MISSED",
                     f"{big:.4g} ms vs {small:.3g} ms"))

    raw_replace = [f"BM_RawReplace_{l}/10000" for l in ("onerow", "twotables")]
    raw_list = [f"BM_RawList_{l}/10000" for l in ("onerow", "twotables")]
    raw_keyed = [f"BM_RawBlobByName_{l}/10000" for l in ("onerow", "twotables")]
    ratio_row("AddPolicyInfo, N=10,000 / raw replace", "BM_KarstAdd/10000", raw_replace, 1.15)
    ratio_row("AddPolicyInfo keeping 10 versions / keeping none, N=10,000", "BM_KarstAdd/10000",
              ["BM_KarstAddKeepingNone/10000"], 1.10)
    ratio_row("ListPolicyInfo, N=10,000 / raw read", "BM_KarstList/10000", raw_list, 1.15)
    ratio_row("GetCorraPolicyBlobByName / raw keyed SELECT", "BM_KarstBlobByName/10000",
              raw_keyed, 1.3)
    ratio_row("GetCorraPolicyBlobById, N=10,000 / raw read", "BM_KarstBlobById/10000", raw_list,
              1.0)
    ratio_row("GetDbHash, N=10,000 / the two listings", "BM_KarstGetDbHash/10000",
              ["BM_KarstListBoth/10000"], 1.1)

    for size, label, target in ((1048576, "1 MiB", 3), (40, "40-byte texts", 1)):
        mine = median(runs, f"BM_Crc32Hex/{size}", "bytes_per_second")
        zlib = median(runs, f"BM_ZlibCrc32/{size}", "bytes_per_second")
        if mine is None or zlib is None:
            rows.append((f"Crc32Hex throughput, {label} / zlib", "n/a", "", f">= {target}",
                         "NOT RUN", ""))
            continue
        r = mine / zlib
        rows.append((f"Crc32Hex throughput, {label} / zlib", f"{r:.2f}", "", f">= {target}",
                     "MET" if r >= target else "MISSED",
                     f"{mine / 1e9:.3g} GB/s vs {zlib / 1e9:.3g} GB/s"))

    growth_row("growth 100,000/10,000: AddPolicyInfo", "BM_KarstAdd")
    growth_row("growth 100,000/10,000: ListPolicyInfo", "BM_KarstList")
    growth_row("growth 100,000/10,000: GetDbHash", "BM_KarstGetDbHash")

    karst_rss = median(runs, "BM_PeakRss_karst/100000", "peak_rss_kib")
    raw_rss = [median(runs, f"BM_PeakRss_{l}/100000", "peak_rss_kib") for l in ("onerow", "twotables")]
    raw_rss = [r for r in raw_rss if r]
    if karst_rss and raw_rss:
        r = karst_rss / min(raw_rss)
        rows.append(("peak RSS, ListPolicyInfo N=100,000 / raw", f"{r:.2f}", "", "<= 1.25",
                     "MET" if r <= 1.25 else "MISSED",
                     f"{karst_rss / 1024:.0f} MiB vs {min(raw_rss) / 1024:.0f} MiB"))
    else:
        rows.append(("peak RSS, ListPolicyInfo N=100,000 / raw", "n/a", "", "<= 1.25", "NOT RUN",
                     ""))

    get_store = ms(runs, "BM_KarstGetStore")
    if get_store is not None:
        us = get_store * 1e3
        rows.append(("GetStore plus release (us per call)", f"{us:.2f}", "", "<= 5 us",
                     "MET" if us <= 5 else "MISSED", ""))

    # For the record, not targets.
    info = []
    for what, name in (("replace 10,000 policies", "BM_KarstAdd/10000"),
                       ("list 10,000 policies", "BM_KarstList/10000")):
        if ms(runs, name) is not None:
            info.append(f"{what}: {ms(runs, name):.1f} ms elapsed, "
                        f"{ms(runs, name, 'cpu_time'):.1f} ms CPU")
    for op, mine, raw in (("replace", "BM_KarstAdd/10000", "BM_RawReplace_storeschema/10000"),
                          ("list", "BM_KarstList/10000", "BM_RawList_storeschema/10000"),
                          ("keyed read", "BM_KarstBlobByName/10000",
                           "BM_RawBlobByName_storeschema/10000")):
        if ms(runs, mine) is not None and ms(runs, raw) is not None:
            info.append(f"{op} against raw SQLite on the store's former single-table layout: "
                        f"{ms(runs, mine) / ms(runs, raw):.2f}")
    for layout in ("onerow", "twotables", "storeschema"):
        a, b = ms(runs, f"BM_RawReplace_{layout}/10000"), ms(runs, f"BM_RawList_{layout}/10000")
        if a is not None and b is not None:
            info.append(f"raw {layout}: replace {a:.1f} ms, list {b:.1f} ms (N=10,000)")

    headers = ("target", "measured", "CPU-time ratio", "goal", "result", "figures")
    print_table(headers, rows, info, context,
                ("store_fs", "store_dir", "sqlite_settings", "crc32_clmul", "crc32_avx512"),
                markdown)


def print_table(headers, rows, notes, context, context_keys, markdown):
    """The table, then a line a note and a line a context key present."""
    if markdown:
        print("| " + " | ".join(headers) + " |")
        print("|" + "---|" * len(headers))
        for row in rows:
            print("| " + " | ".join(row) + " |")
        print()
        for line in notes:
            print(f"- {line}")
    else:
        widths = [max(len(str(r[i])) for r in rows + [headers]) for i in range(len(headers))]
        for row in [headers] + rows:
            print("  ".join(str(v).ljust(w) for v, w in zip(row, widths)).rstrip())
        print()
        for line in notes:
            print(line)
    for key in context_keys:
        if key in context:
            print(f"{'- ' if markdown else ''}{key}: {context[key]}")


if __name__ == "__main__":
    main()
