#!/usr/bin/env python3
"""Rewrites the figures tables of docs/RELIABILITY.md from the summary lines
that the campaigns print, kept in docs/reliability-results/.

    render_reliability.py [RESULTS_DIR DOCUMENT]

Each table sits between "<!-- NAME figures -->" and "<!-- end NAME figures -->";
only those blocks change. A results file may hold a campaign's whole output:
the lines the renderer does not know are skipped, and so are ctest's "N: "
and the guest console's "@@ " in front of a line. Fails when a file, a
summary line or a marker is missing.
"""
import re
import subprocess
import sys
from pathlib import Path

ROOT = Path(__file__).resolve().parent.parent
FAULTS_TABLE = ROOT / "tests/device/arm64/faults_table.awk"
MUTANTS_LIST = ROOT / "scripts/mutants.list"


def fail(message):
    sys.exit(f"render_reliability: {message}")


def number(value):
    return f"{int(value):,}"


def seconds(value):
    return f"{int(value):,} s"


def read_lines(path):
    if not path.is_file():
        fail(f"no results file {path}")
    return [re.sub(r"^(\d+: )?(@@ )?", "", line) for line in path.read_text().splitlines()]


def matches(path, pattern):
    """Every line of the file that the pattern matches whole, as match objects."""
    expression = re.compile(pattern)
    return [m for m in map(expression.fullmatch, read_lines(path)) if m]


def one(path, pattern, what):
    found = matches(path, pattern)
    if not found:
        fail(f"{path} has no {what} line")
    return found[-1]


def table(header, rows):
    """A Markdown table; header cells ending in ':' are right-aligned."""
    names = [cell.rstrip(":") for cell in header]
    rule = ["---:" if cell.endswith(":") else "---" for cell in header]
    return ["| " + " | ".join(names) + " |", "|" + "|".join(rule) + "|"] + [
        "| " + " | ".join(str(cell) for cell in row) + " |" for row in rows]


# ---- the crash exploration ----

CRASH_TOTALS = (r"(?P<scenarios>\d+) scenarios, (?P<points>\d+) crash points, (?P<states>\d+) crash states "
                r"\((?P<distinct>\d+) distinct, each opened; (?P<cleanups>\d+) with a clean-up cut short and opened "
                r"again\), (?P<violations>\d+) violations")
ORDERS = {"inorder": "in order", "perfile": "per file"}


def crash_figures(results):
    path = results / "crash.txt"

    def counts(m, bold=False):
        cells = [number(m[k]) for k in ("scenarios", "points", "states", "distinct", "cleanups", "violations")]
        return [f"**{c}**" for c in cells] if bold else cells

    rows = []
    for m in matches(path, rf"(?P<slots>\d+)slot_(?P<clock>\w+)_(?P<order>inorder|perfile): {CRASH_TOTALS}"):
        store = "1 slot" if m["slots"] == "1" else f"{m['slots']} slots"
        rows.append([store, m["clock"], ORDERS[m["order"]]] + counts(m))
    if not rows:
        fail(f"{path} has no line of a case")
    total = one(path, f"crash exploration totals: {CRASH_TOTALS}", "totals")
    rows.append([f"**all {number(total['scenarios'])} scenarios**", "", ""] + counts(total, bold=True))
    broken = one(path, f"broken writer: {CRASH_TOTALS}", "broken writer")
    rows.append(["broken writer (`WXX`, 1 slot)", "forward", "in order"] + counts(broken))
    rows = table(["Store", "Clock", "Metadata order", "Scenarios:", "Crash points:", "Crash states:",
                  "New distinct states opened:", "Of those, clean-up cut short and reopened:", "Violations:"], rows)
    first = matches(path, r"first violation found: (.*)")
    if not first:
        return rows
    # The scratch directory's path says nothing to a reader.
    return rows + ["", "The broken writer's first violation: `" + re.sub(r"/\S+/scenario/", "", first[-1][1]) + "`"]


# ---- the ARM64 device ----

def device_figures(results):
    path = results / "device-suite.txt"
    counts = one(path, r"(?:arm64-device: |summary )run=(\d+) passed=(\d+) skipped=(\d+) failed=(\d+)",
                 "summary").groups()
    suite = one(path, r"=== arm64-device test: (\d+) s", "suite time")[1]
    built = matches(path, r"=== arm64-device: built in (\d+) s \(\d+ tests\)")
    return table(["Tests:", "Passed:", "Skipped:", "Failed:", "Suite in the guest:", "ARM64 build:"],
                 [[number(c) for c in counts] + [seconds(suite), seconds(built[-1][1]) if built else "–"]])


def power_cut_figures(results):
    path = results / "power-cuts.txt"
    seed = one(path, r"campaign seed: (\d+)", "seed")[1]
    rows = []
    for name, writer in (("power cuts", "the store"), ("broken writer", "broken writer")):
        totals = one(path, rf"{name}: (\d+) cuts, (\d+) acknowledged, (\d+) old, (\d+) new, (\d+) in flight, "
                           r"(\d+) violations", f"{name} totals")
        repairs = one(path, rf"{name}: (\d+) file system repairs by e2fsck at boot", f"{name} repairs")[1]
        time = one(path, rf"=== {name}: (\d+) s", f"{name} time")[1]
        cuts, acknowledged, old, new, flight, violations = totals.groups()
        rows.append([writer, seed] + [number(c) for c in (cuts, acknowledged, flight, old, new, violations, repairs)]
                    + [seconds(time)])
    return table(["Writer", "Seed", "Cuts:", "Acknowledged:", "In flight at the cut:", "Found old:", "Found new:",
                  "Violations:", "Repairs at boot:", "Time:"], rows)


# ---- the block replay ----

REPLAY_KEYS = ("scenarios", "entries", "points", "states", "violations", "outside", "lost", "time")


def replay_totals(paths):
    """Totals by (writer, file system), summed over the files, in the order first met."""
    totals = {}
    for path in paths:
        lost, last = {}, {}
        for line in read_lines(path):
            m = re.fullmatch(r"([a-z0-9-]+): (\d+) crash points left a file system that does not mount.*", line)
            if m:
                lost[m[1]] = int(m[2])
                continue
            m = re.fullmatch(r"(replay|broken writer) ([a-z0-9-]+): (\d+) scenarios, (\d+) log entries, (\d+) crash "
                             r"points, (\d+) distinct states, (\d+) violations, (\d+) outside the model", line)
            if m:
                key = (m[1], m[2])
                entry = totals.setdefault(key, dict.fromkeys(REPLAY_KEYS, 0))
                for name, value in zip(REPLAY_KEYS, m.groups()[2:]):
                    entry[name] += int(value)
                entry["lost"] += lost.pop(m[2], 0)
                last[m[2]] = entry
                continue
            m = re.fullmatch(r"([a-z0-9-]+): -?\d+ after (\d+) s", line)
            if m and m[1] in last:
                last.pop(m[1])["time"] += int(m[2])
        if not totals:
            fail(f"{path} has no totals line")
    return totals


def replay_figures(results):
    runs = [("`--quick`", [results / "replay-quick.txt"]),
            ("`--sample ext4`", [results / "replay-sample-ext4.txt"]),
            ("the whole matrix", sorted((results / "replay-full").glob("*.txt"))),
            ("rerun (below)", [results / "replay-full-rerun.txt"])]
    rows = []
    for run, paths in runs:
        if not paths:
            fail(f"no results of {run}")
        totals = replay_totals(paths)
        for (writer, fs), entry in sorted(totals.items(), key=lambda item: (item[0][0] != "replay", item[0][1])):
            label = run if writer == "replay" else f"{run}, broken writer"
            rows.append([label, f"`{fs}`"] + [number(entry[k]) for k in REPLAY_KEYS[:-1]] + [seconds(entry["time"])])
    return table(["Run", "File system", "Scenarios:", "Log entries:", "Crash points:", "Distinct states:",
                  "Violations:", "Outside the model:", "Lost file system:", "Time:"], rows)


# ---- the card's faults ----

def fault_figures(results):
    path = results / "faults-full.txt"
    totals = []
    for name, store in (("faults", "the store"), ("broken store", "the broken store")):
        counts = one(path, rf"{name}: (\d+) cases, (\d+) acknowledged, (\d+) lost, (\d+) hangs, (\d+) crashes",
                     f"{name} totals").groups()
        others = [one(path, rf"{name}: (\d+) {what}", f"{name} {what}")[1]
                  for what in ("failed otherwise", "failures without a log line",
                               "boot-file and partition updates returned 0 while the card kept the old one")]
        words = ("cases", "acknowledged", "lost", "hangs", "crashes", "failed otherwise", "without a log line",
                 "stale")
        totals.append(f"{store} " + ", ".join(f"{number(c)} {w}" for c, w in zip(counts + tuple(others), words)))
    time = one(path, r"end of faults after (\d+) s", "end")[1]
    cases = subprocess.run(["awk", "-f", str(FAULTS_TABLE), str(path)], check=True, capture_output=True,
                           text=True).stdout.splitlines()
    if len(cases) < 3:
        fail(f"{path} has no case lines")
    return [f"The full set, {seconds(time)} in the guest: " + "; ".join(totals) + ".", ""] + cases


# ---- the host's campaigns ----

def overlap_figures(results):
    path = results / "overlap.txt"
    found = matches(path, r"(overlap(?: \(locks off\))?): (\d+) rounds, (\d+) acknowledged, (\d+) lost, "
                          r"(\d+) stale reads, (\d+) waits beyond the bound")
    if not found:
        fail(f"{path} has no totals line")
    locks = {"overlap": "on", "overlap (locks off)": "off (`FAULT_LOCKS=off`)"}
    return table(["Locks", "Rounds:", "Acknowledged:", "Lost:", "Stale reads:", "Waits beyond the bound:"],
                 [[locks[m[1]]] + [number(c) for c in m.groups()[1:]]
                  for m in sorted(found, key=lambda m: (m[1], int(m[2])))])


def fuzz_figures(results):
    path = results / "fuzz.txt"
    found = matches(path, r"(\w+) +(\d+) executions in (\d+)s +(.*)")
    if not found:
        fail(f"{path} has no target line")
    return table(["Target", "Seconds:", "Executions:", "Result"],
                 [[m[1], m[3], number(m[2]), "no crash" if m[4] == "ok" else m[4]] for m in found])


def soak_figures(results):
    path = results / "soak.txt"
    m = one(path, r"soak: (\d+) runs, (\d+) killed \((\d+) old, (\d+) new\), (\d+) violations", "totals")
    seed = matches(path, r"soak: seed (\d+) .*")
    late = matches(path, r"soak: (\d+) kills came after the run had ended; typical run at the end \d+ us")
    return table(["Seed", "Runs:", "Killed:", "Killed, old blob kept:", "Killed, new blob in place:", "Violations:",
                  "Kills after the run had ended:"],
                 [[seed[-1][1] if seed else "–"] + [number(c) for c in m.groups()] +
                  [number(late[-1][1]) if late else "–"]])


def coverage_figures(results):
    path = results / "coverage.txt"
    total = one(path, r"total +([\d.]+)% +(\d+)/(\d+) +([\d.]+)% +(\d+)/(\d+) +([\d.]+)% +(\d+)/(\d+) *", "total")
    rows = []
    for i, kind in enumerate(("lines", "functions", "branches")):
        target = one(path, rf"{kind}: [\d.]+% \(target (\d+)%\) .*", f"{kind} target")[1]
        percent, covered, count = total.groups()[3 * i:3 * i + 3]
        rows.append([kind.capitalize(), number(covered), number(count), f"{percent}%", f"{target}%"])
    return table(["", "Covered:", "Total:", "Coverage:", "Target:"], rows)


def mutant_figures(results):
    path = results / "mutants.txt"
    entries = [line.split("\t") for line in MUTANTS_LIST.read_text().splitlines()
               if line and not line.startswith("#")]
    verdicts, unseen = {}, []
    for m in matches(path, r" *(\d+) (killed|SURVIVED|unseen) +(.*) \[(.*)\]( \d+s)?"):
        index, verdict, rule, detail = int(m[1]), m[2], m[3], m[4]
        if index > len(entries) or entries[index - 1][3] != rule:
            fail(f"{path}: entry {index} ({rule}) is not that of {MUTANTS_LIST.name}: run it again")
        verdicts[index] = verdict
        if verdict == "unseen":
            unseen.append(f"- {index}, {rule}: " + detail.removeprefix("survived as expected: "))
    missing = [str(i) for i in range(1, len(entries) + 1) if i not in verdicts]
    if missing:
        fail(f"{path} has no result for entries {', '.join(missing)} of {MUTANTS_LIST.name}")
    counts = list(verdicts.values())
    survivors = [f"- {i}, {entries[i - 1][3]} (`{entries[i - 1][0]}`)" for i, v in verdicts.items() if v == "SURVIVED"]
    return ([f"**{counts.count('killed')} killed, {counts.count('SURVIVED')} survived that could be seen, "
             f"{counts.count('unseen')} unseen (survive as expected).**"] +
            (["", "Survived:", ""] + survivors if survivors else []) + ["", "Unseen:", ""] + unseen)


def ci_figures(results):
    path = results / "ci.txt"
    found = matches(path, r"=== (scripts/[^:]*): (\d+) s")
    if not found:
        fail(f"{path} has no stage line")
    total = sum(int(m[2]) for m in found)
    return [f"Last run: **{seconds(total)}** ({total / 60:.0f} minutes); " +
            ", ".join(f"`{m[1]}` {seconds(m[2])}" for m in found) + "."]


BLOCKS = {
    "ci": ci_figures,
    "crash": crash_figures,
    "device": device_figures,
    "power cut": power_cut_figures,
    "replay": replay_figures,
    "faults": fault_figures,
    "overlap": overlap_figures,
    "fuzz": fuzz_figures,
    "soak": soak_figures,
    "coverage": coverage_figures,
    "mutant": mutant_figures,
}


def main():
    if len(sys.argv) not in (1, 3):
        sys.exit(__doc__)
    results, document = ((Path(sys.argv[1]), Path(sys.argv[2])) if len(sys.argv) == 3 else
                         (ROOT / "docs/reliability-results", ROOT / "docs/RELIABILITY.md"))
    text = document.read_text()
    for name, render in BLOCKS.items():
        pattern = re.compile(rf"(<!-- {name} figures -->\n).*?(<!-- end {name} figures -->)", re.S)
        if not pattern.search(text):
            fail(f"{document} has no block '{name} figures'")
        rows = render(results)
        text = pattern.sub(lambda m: m.group(1) + "\n".join(rows) + "\n" + m.group(2), text)
    document.write_text(text)


if __name__ == "__main__":
    main()
