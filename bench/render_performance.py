#!/usr/bin/env python3
"""Rewrites the generated tables of docs/PERFORMANCE.md from the raw output
of scripts/bench.sh.

    render_performance.py RESULTS_DIR DOCUMENT

Each table sits between "<!-- generated:NAME -->" and "<!-- end:NAME -->";
only those blocks change. Fails when a figure or a marker is missing.
"""
import csv
import json
import re
import sys
from pathlib import Path

MIB = 1 << 20
CRC_SIZES = [64, 4 << 10, 64 << 10, 16 << 20]
WRITE_SIZES = [4 << 10, 64 << 10, 1 << 20]
SCALES = [1, 10, 100]


def size_text(size):
    for unit, factor in (("MiB", MIB), ("KiB", 1 << 10)):
        if size >= factor and size % factor == 0:
            return f"{size // factor} {unit}"
    return f"{size:,} B"


def seconds(entry, clock="real_time"):
    factor = {"ns": 1e-9, "us": 1e-6, "ms": 1e-3, "s": 1.0}[entry["time_unit"]]
    return entry[clock] * factor


def time_text(value):
    if value < 1e-3:
        return f"{value * 1e6:.1f} µs"
    return f"{value * 1e3:.2f} ms"


def verdict(met):
    return "met" if met else "**not met**"


class Micro:
    """Medians by benchmark name and arguments, without the library's
    "/iterations:N", "/repeats:N" and "/real_time" suffixes."""

    def __init__(self, path):
        document = json.loads(path.read_text())
        self.medians = {
            re.sub(r"/(iterations:\d+|repeats:\d+|real_time)", "", entry["run_name"]): entry
            for entry in document["benchmarks"]
            if entry.get("aggregate_name") == "median" and "error_occurred" not in entry
        }

    def __getitem__(self, name):
        if name not in self.medians:
            sys.exit(f"render_performance: no median for {name} in the micro-benchmark output")
        return self.medians[name]


def crc_table(micro):
    rows = ["| Buffer | project | zlib | byte-wise table | project ÷ zlib | project ÷ byte-wise |",
            "|---|---:|---:|---:|---:|---:|"]
    for size in CRC_SIZES:
        rates = [micro[f"crc32_{name}/{size}"]["bytes_per_second"] for name in ("project", "zlib", "bytewise")]
        rows.append(f"| {size_text(size)} | " + " | ".join(f"{rate / 1e9:.2f} GB/s" for rate in rates) +
                    f" | {rates[0] / rates[1]:.2f} | {rates[0] / rates[2]:.1f} |")
    return rows


def open_table(micro):
    rows = ["| What is opened | Stored (both copies) | Median | Stored bytes per second |",
            "|---|---:|---:|---:|"]
    cases = [("open_dual_file_target/26/19784", "one dual-file target, 26 slots of 19,784 B"),
             ("open_dual_file_target/8/1048576", "one dual-file target, 8 slots of 1 MiB"),
             ("open_registry/1", "the whole registry, every store populated")]
    for name, what in cases:
        entry = micro[name]
        rows.append(f"| {what} | {entry['stored_bytes'] / MIB:.2f} MiB | {time_text(seconds(entry))} | "
                    f"{entry['bytes_per_second'] / 1e9:.2f} GB/s |")
    return rows


def registry_scaling(micro, clock):
    """(stored bytes, seconds) per scale, and the seconds per added MiB
    between neighbouring scales."""
    points = [(micro[f"open_registry/{scale}"]["stored_bytes"], seconds(micro[f"open_registry/{scale}"], clock))
              for scale in SCALES]
    slopes = [(points[i][1] - points[i - 1][1]) / ((points[i][0] - points[i - 1][0]) / MIB)
              for i in range(1, len(points))]
    return points, slopes


def scaling_table(micro):
    wall, wall_slopes = registry_scaling(micro, "real_time")
    cpu, cpu_slopes = registry_scaling(micro, "cpu_time")
    rows = ["| Scale | Stored (both copies) | Median | CPU | Added time per added MiB | Added CPU per added MiB |",
            "|---|---:|---:|---:|---:|---:|"]
    for i, scale in enumerate(SCALES):
        added = ("–", "–") if i == 0 else tuple(f"{s[i - 1] * 1e3:.3f} ms" for s in (wall_slopes, cpu_slopes))
        rows.append(f"| {scale}x | {wall[i][0] / MIB:.2f} MiB | {time_text(wall[i][1])} | {time_text(cpu[i][1])} | "
                    f"{added[0]} | {added[1]} |")
    fixed = wall[0][1] - wall_slopes[-1] * wall[0][0] / MIB
    rows += ["", f"Cost that does not depend on the stored bytes (the 1x time less its bytes at the "
                 f"10x to 100x rate): {time_text(fixed)}."]
    return rows


def write_ratios(micro):
    return {size: seconds(micro[f"write_store/{size}"]) / seconds(micro[f"write_floor/{size}"])
            for size in WRITE_SIZES}


def write_table(micro):
    ratios = write_ratios(micro)
    rows = ["| Blob | store | floor | × floor | store, CPU | floor, CPU |", "|---|---:|---:|---:|---:|---:|"]
    for size in WRITE_SIZES:
        store, floor = micro[f"write_store/{size}"], micro[f"write_floor/{size}"]
        rows.append(f"| {size_text(size)} | {time_text(seconds(store))} | {time_text(seconds(floor))} | "
                    f"{ratios[size]:.2f} | {time_text(seconds(store, 'cpu_time'))} | "
                    f"{time_text(seconds(floor, 'cpu_time'))} |")
    return rows


def compare_tables(results):
    tables = (results / "compare.md").read_text().strip().split("\n\n")
    if len(tables) != 2:
        sys.exit("render_performance: compare.md should hold two tables")
    return tables[0].splitlines(), tables[1].splitlines()


def peak_rss(results, process):
    with open(results / "peak_rss.csv", newline="") as f:
        for row in csv.DictReader(f):
            if row["process"] == process:
                return int(row["data_bytes"]), int(row["peak_rss_kib"]) * 1024
    sys.exit(f"render_performance: no '{process}' in peak_rss.csv")


def targets_table(micro, results):
    rows = ["| Target | Measured | |", "|---|---|---|"]
    large = [micro[f"crc32_project/{s}"]["bytes_per_second"] / micro[f"crc32_zlib/{s}"]["bytes_per_second"]
             for s in CRC_SIZES[2:]]
    rows.append("| CRC-32 at least as fast as zlib's from 64 KiB | project ÷ zlib: " +
                ", ".join(f"{r:.2f} ({size_text(s)})" for r, s in zip(large, CRC_SIZES[2:])) +
                f" | {verdict(min(large) >= 1.0)} |")
    bytewise = [micro[f"crc32_project/{s}"]["bytes_per_second"] / micro[f"crc32_bytewise/{s}"]["bytes_per_second"]
                for s in CRC_SIZES]
    rows.append(f"| CRC-32 at least 4x the byte-wise table | lowest ratio over all buffers: {min(bytewise):.1f} "
                f"| {verdict(min(bytewise) >= 4.0)} |")
    ratios = write_ratios(micro)
    checked = [4 << 10, 1 << 20]
    rows.append("| One-shot write at most 1.2x the floor at 4 KiB and 1 MiB | " +
                ", ".join(f"{ratios[s]:.2f} ({size_text(s)})" for s in checked) +
                f" | {verdict(max(ratios[s] for s in checked) <= 1.2)} |")
    _, slopes = registry_scaling(micro, "cpu_time")
    agreement = slopes[0] / slopes[1]
    rows.append("| Registry opening linear in the stored bytes (CPU per added MiB from 1x to 10x within "
                f"±25% of that from 10x to 100x) | ratio {agreement:.2f} | {verdict(0.8 <= agreement <= 1.25)} |")
    for process, build in (("migrate", "default build"), ("migrate_static", "fully static, as on the device")):
        data, peak = peak_rss(results, process)
        rows.append(f"| Peak RSS of a migration at most the data file + 2 MiB ({build}) | "
                    f"{size_text(data)} file: data + {(peak - data) / MIB:.1f} MiB | {verdict(peak - data <= 2 * MIB)} |")
    return rows


def environment(results):
    return ["| | |", "|---|---|"] + [
        "| {} | {} |".format(*line.split(": ", 1)) for line in (results / "environment.txt").read_text().splitlines()]


def main():
    if len(sys.argv) != 3:
        sys.exit(__doc__)
    results, document = Path(sys.argv[1]), Path(sys.argv[2])
    micro = Micro(results / "micro_benchmarks.json")
    processes, rss = compare_tables(results)
    blocks = {
        "environment": environment(results),
        "targets": targets_table(micro, results),
        "crc": crc_table(micro),
        "open": open_table(micro),
        "scaling": scaling_table(micro),
        "write": write_table(micro),
        "processes": processes,
        "rss": rss,
    }
    text = document.read_text()
    for name, rows in blocks.items():
        pattern = re.compile(rf"(<!-- generated:{name} -->\n).*?(<!-- end:{name} -->)", re.S)
        if not pattern.search(text):
            sys.exit(f"render_performance: {document} has no block '{name}'")
        text = pattern.sub(lambda m: m.group(1) + "\n".join(rows) + "\n" + m.group(2), text)
    document.write_text(text)


if __name__ == "__main__":
    main()
