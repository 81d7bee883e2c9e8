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
    "sync_metrics": "sync metrics with 10 000 queued deltas (whole)",
    "scale_save": "save at {size} objects (per save)",
    "scale_range_query": "range query at {size} objects (per row)",
    "network_latency": "save to callback on another store, via broker + server (floor: in-process server)",
    "server_throughput": "server, 1000 changes (per change; floor: same rules and file, no broker)",
    "server_tier": "server tier, {size} instance(s) on PostgreSQL, 1000 changes from a store (per change; "
                   "sqlite: one instance on its file)",
}
ORDER = list(LABELS)
UNIT_SECONDS = {"ns": 1e-9, "us": 1e-6, "ms": 1e-3, "s": 1.0}
# The ratio to the floor each operation is to stay within.
TARGETS = {"local_save": 1.10, "remote_apply": 1.20, "range_query": 1.10, "get_object": 1.15, "resend": 1.10}
MEMORY_GROWTH_TARGET_MIB = 4


def base_name(run_name):
    return re.sub(r"/(iterations:\d+|real_time|min_time:[^/]+|repeats:\d+)", "", run_name)


def load(results):
    """{(operation, size): {side: wall seconds per op}}, the same for CPU
    seconds, and every entry's counters."""
    figures, cpu, counters = {}, {}, {}
    for path in sorted(results.glob("*.json")):
        if path.stat().st_size == 0:  # a run that matched no benchmark
            continue
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


def instructions(results):
    """{operation: {side: instructions per operation}} from the callgrind runs:
    callgrind's log gives the instructions of the measured loop, the JSON the
    iterations and operations per iteration."""
    counts = {}
    for log in sorted((results / "callgrind").glob("*.log")):
        # A program forks helpers that valgrind follows; the program's own
        # count is the largest.
        collected = [int(n) for n in re.findall(r"Collected : (\d+)", log.read_text())]
        out = log.with_suffix(".json")
        data = json.loads(out.read_text()) if out.exists() and out.stat().st_size else {}
        runs = [e for e in data.get("benchmarks", []) if not e.get("error_occurred")]
        if not collected or not runs:
            continue
        entry = runs[0]
        operation, side = base_name(entry.get("run_name", entry["name"])).split("/")[:2]
        per_op = max(collected) / (entry["iterations"] * entry.get("ops", 1))
        counts.setdefault(operation, {})[side] = per_op
    return counts


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
        target = TARGETS.get(operation) if size is None else None
        rows.append([label, show_time(ours), show_time(floor), ratio(ours, floor),
                     ratio(cpus.get("ours"), cpus.get("floor")), f"{target:.2f}" if target else "-",
                     show_time(prepared), ratio(cpus.get("ours"), cpus.get("floor_prepare"))])
    table(rows, ["operation", "ours", "floor", "ratio", "CPU ratio", "target", "floor, prepared anew",
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
    print(f"target: save at 1 000 000 / at 1 000 growing no faster than the floor's")

    counts = instructions(results)
    if counts:
        print()
        rows = [[LABELS[op].format(size=""), f"{sides.get('ours', 0):,.0f}", f"{sides.get('floor', 0):,.0f}",
                 ratio(sides.get("ours"), sides.get("floor")), f"{TARGETS[op]:.2f}" if op in TARGETS else "-"]
                for op, sides in sorted(counts.items(), key=lambda item: ORDER.index(item[0]))]
        table(rows, ["operation", "instructions, ours", "instructions, floor", "ratio", "target"])
        print("(callgrind: instructions per operation in the measured loop, the store's worker included)")

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
    small, large = counters.get(("resend_memory", "ours", 1000)), counters.get(("resend_memory", "ours", 100000))
    if small and large:
        extra = (large.get("rss_growth_kib", 0) - small.get("rss_growth_kib", 0)) / 1024
        print(f"resend peak memory growth, ours, 100 000 queued minus 1 000 queued: {extra:.1f} MiB "
              f"(target <= {MEMORY_GROWTH_TARGET_MIB} MiB)")


if __name__ == "__main__":
    main()
