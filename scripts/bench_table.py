#!/usr/bin/env python3
"""Turns the results of scripts/bench.sh into the table it prints.

Reads every <label>.json (Google Benchmark output) and <label>.log (which ends
with the program's "peak resident memory: N KiB") in the results directory.
Benchmarks are named <operation>/<side>[/<size>]; the counter "ops" is the
number of operations one iteration performs, so real time / ops is the cost
of one operation; the counter "cpu_s" is the process's CPU time per
iteration (the store's worker thread included), which other load on a shared
machine disturbs far less than wall-clock time. Where there are repetitions,
the medians are used.
"""
import json
import pathlib
import re
import sys

LABELS = {
    "local_save": "local save (per save)",
    "remote_apply": "remote apply, 1000-delta delivery (per delta)",
    "range_query": "range query, 100 rows (per row)",
    "get_object": "fetch by primary key (per row)",
    "indexed_query": "indexed query, ~100 rows (per row)",
    "indexed_sorted_query": "indexed sorted query, ~100 rows (per row)",
    "resend": "resend of 10 000 queued deltas (whole)",
    "scale_save": "save at {size} objects (per save)",
    "scale_range_query": "range query at {size} objects (per row)",
    "network_latency": "save to callback on another store, via broker + server (floor: in-process server)",
    "server_throughput": "server, 1000 changes (per change; floor: same rules and file, no broker)",
}
ORDER = list(LABELS)
UNIT_SECONDS = {"ns": 1e-9, "us": 1e-6, "ms": 1e-3, "s": 1.0}
SAVE_GROWTH_TARGET = 1.3
RATIO_TARGET = 1.5


def base_name(run_name):
    return re.sub(r"/(iterations:\d+|real_time|min_time:[^/]+|repeats:\d+)", "", run_name)


def load(results):
    """{(operation, size): {side: wall seconds per op}}, the same for CPU
    seconds, and every entry's counters."""
    figures, cpu, counters = {}, {}, {}
    for path in sorted(results.glob("*.json")):
        data = json.loads(path.read_text())
        entries = data.get("benchmarks", [])
        medians = [e for e in entries if e.get("aggregate_name") == "median"]
        for entry in medians or [e for e in entries if e.get("run_type") == "iteration"]:
            if entry.get("error_occurred"):
                continue
            parts = base_name(entry.get("run_name", entry["name"])).split("/")
            operation, side = parts[0], parts[1]
            size = int(parts[2]) if len(parts) > 2 else None
            seconds = entry["real_time"] * UNIT_SECONDS[entry["time_unit"]] / entry.get("ops", 1)
            figures.setdefault((operation, size), {})[side] = seconds
            if "cpu_s" in entry:
                cpu.setdefault((operation, size), {})[side] = entry["cpu_s"] / entry.get("ops", 1)
            counters[(operation, side, size)] = entry
    return figures, cpu, counters


def peak_memory(results):
    peaks = {}
    for path in sorted(results.glob("*.log")):
        match = re.search(r"peak resident memory: (\d+) KiB", path.read_text())
        if match:
            peaks[path.stem] = int(match.group(1))
    return peaks


def show_time(seconds):
    if seconds is None:
        return "-"
    for unit, scale in (("s", 1.0), ("ms", 1e-3), ("us", 1e-6)):
        if seconds >= scale:
            return f"{seconds / scale:.3g} {unit}"
    return f"{seconds / 1e-9:.3g} ns"


def ratio(a, b):
    return f"{a / b:.2f}" if a is not None and b else "-"


def table(rows, header):
    widths = [max(len(str(r[i])) for r in rows + [header]) for i in range(len(header))]
    line = lambda r: "| " + " | ".join(str(c).ljust(w) for c, w in zip(r, widths)) + " |"
    print(line(header))
    print("|" + "|".join("-" * (w + 2) for w in widths) + "|")
    for r in rows:
        print(line(r))


def main():
    results = pathlib.Path(sys.argv[1])
    figures, cpu, counters = load(results)
    keys = sorted(figures, key=lambda k: (ORDER.index(k[0]) if k[0] in ORDER else 99, k[1] or 0))
    rows = []
    for operation, size in keys:
        if operation not in LABELS:
            continue
        sides, cpus = figures[(operation, size)], cpu.get((operation, size), {})
        ours, floor, prepared = sides.get("ours"), sides.get("floor"), sides.get("floor_prepare")
        label = LABELS[operation].format(size=f"{size:,}".replace(",", " ") if size else "")
        rows.append([label, show_time(ours), show_time(floor), ratio(ours, floor),
                     ratio(cpus.get("ours"), cpus.get("floor")), show_time(prepared),
                     ratio(cpus.get("ours"), cpus.get("floor_prepare"))])
    table(rows, ["operation", "ours", "floor", "ratio", "CPU ratio", "floor, prepared anew",
                 "ours / that, CPU"])
    print("(times and ratio: wall clock; CPU ratio: process CPU time, the store's worker included)")
    for (operation, size), sides in figures.items():
        for side, seconds in sides.items():
            if side not in ("ours", "floor", "floor_prepare") and operation in LABELS:
                cpus = cpu.get((operation, size), {})
                print(f"{operation} {side}: {show_time(seconds)}, ours / that {ratio(sides.get('ours'), seconds)}"
                      f" (CPU {ratio(cpus.get('ours'), cpus.get(side))})")

    print()
    for operation, what in (("scale_save", "save"), ("scale_range_query", "range query row")):
        for kind, source in (("wall", figures), ("CPU", cpu)):
            small, large = source.get((operation, 1000), {}), source.get((operation, 1000000), {})
            if small.get("ours") and large.get("ours"):
                print(f"cost per {what} at 1 000 000 objects / at 1 000 ({kind}): "
                      f"ours {ratio(large['ours'], small['ours'])}, floor {ratio(large.get('floor'), small.get('floor'))}")
    print(f"targets: every ratio <= {RATIO_TARGET}; save at 1 000 000 / at 1 000 <= {SAVE_GROWTH_TARGET}")

    print()
    peaks = peak_memory(results)
    memory_rows = [[label, f"{kib / 1024:.1f} MiB"] for label, kib in peaks.items()
                   if not label.startswith("resend_memory")]
    table(memory_rows, ["program", "peak resident memory"])
    print()
    for side in ("ours", "floor", "floor_read_first"):
        entry = counters.get(("resend_memory", side, 100000))
        peak = peaks.get(f"resend_memory_{side}")
        if entry and peak:
            growth = entry.get("rss_growth_kib", 0) / 1024
            print(f"resend of 100 000 queued deltas, {side}: peak {peak / 1024:.1f} MiB, "
                  f"of which {growth:.1f} MiB during the resend")


if __name__ == "__main__":
    main()
