#!/usr/bin/env python3
"""Cuts the emulated device's power at random moments while its workload
(workload.sh) writes the stores, and checks after every cut what the next
boot finds.

    power_cuts.py OUT CUTS SEED -- QEMU_WORDS...

QEMU_WORDS boot the device; in them @CARD@ stands for the card image and
@MODE@ for the kernel command line's mode words. Two campaigns run, each
on a fresh copy of OUT/card.img:

- the store's own writers (migrate_settings and the store driver), CUTS
  cuts; each migration has a rival migration of the same slot beside it
  and a loop of --query-present of the slot; every slot must then hold the
  blob of its last acknowledged operation, or the one of an operation in
  flight, whole; --query-present must say the same, and beside the
  writers it must never call a present slot absent;
- the broken writer, which rewrites the current copy in place, until its
  first violation or BROKEN_LIMIT cuts: it must be caught.

Each cut: boot with arm64_op=NEXT, wait for the stores' report, let the
workload run for a random time (uniform in 0..4 s, from SEED), then end qemu
with SIGKILL. A last boot in verify mode checks the last cut. The totals,
one line per campaign:

    power cuts: N cuts, A acknowledged, O old, W new, F in flight, V violations
    broken writer: N cuts, A acknowledged, O old, W new, F in flight, V violations

F counts the cuts that met an operation in flight; of those, O found the
slot as it was before the operation and W as the operation leaves it. A
second line per campaign counts the repairs e2fsck made at boot. Exit
status 0 when the store's campaign had no violation and the broken one
had at least one.
"""

import random
import subprocess
import sys
import threading
import time
from pathlib import Path

BROKEN_LIMIT = 30
LONGEST_RUN_SECONDS = 4.0
BOOT_LIMIT_SECONDS = 240
# A running guest always uses CPU time (its timer ticks at the least): a qemu
# that used none for this long froze with its guest's clock (qemu 7.2).
FREEZE_SECONDS = 120


class Boot:
    """One run of qemu, its console read line by line as it comes."""

    def __init__(self, words, log):
        self.lines = []
        self.report_done = threading.Event()
        self.ended = threading.Event()
        self.process = subprocess.Popen(words, stdin=subprocess.DEVNULL, stdout=subprocess.PIPE,
                                        stderr=subprocess.STDOUT)
        self.log = log
        threading.Thread(target=self._read, daemon=True).start()

    def _read(self):
        for raw in self.process.stdout:
            line = raw.decode(errors="replace").rstrip("\r\n")
            self.log.write(line + "\n")
            self.lines.append(line)
            if line == "@@ state done":
                self.report_done.set()
        self.ended.set()

    def cpu_ticks(self):
        """The CPU time qemu used so far, in clock ticks."""
        try:
            fields = Path(f"/proc/{self.process.pid}/stat").read_text().rsplit(")", 1)[1].split()
        except OSError:
            return None
        return int(fields[11]) + int(fields[12])

    def await_report(self, limit=BOOT_LIMIT_SECONDS, freeze=FREEZE_SECONDS, poll=10):
        """'reported' once the stores' report is complete; 'frozen' when qemu
        used no CPU time for `freeze` seconds; 'late' after `limit`."""
        started = time.monotonic()
        last, still_since = self.cpu_ticks(), started
        while not self.report_done.wait(poll):
            now, ticks = time.monotonic(), self.cpu_ticks()
            if ticks != last:
                last, still_since = ticks, now
            elif now - still_since >= freeze:
                return "frozen"
            if now - started >= limit:
                return "late"
        return "reported"

    def cut(self):
        self.process.kill()
        self.process.wait()
        self.ended.wait()

    def wait(self):
        try:
            self.process.wait(timeout=BOOT_LIMIT_SECONDS)
        except subprocess.TimeoutExpired:
            self.process.kill()
            self.process.wait()
        self.ended.wait()


class Campaign:
    def __init__(self, name, words, card, log):
        self.name = name
        self.words = words
        self.card = card
        self.log = log
        self.acked = {}        # KEY -> state after its last acknowledged operation
        self.in_flight = None  # (op, key, [expected states]) announced, not acknowledged
        self.rival_status = None  # of the in-flight operation's rival, once it returned
        self.next_op = 0
        self.cuts = self.acknowledged = self.old = self.new = self.flights = self.violations = 0
        self.repairs = 0  # boots on which e2fsck had to repair a file system first
        self.freezes = 0

    def boot(self, mode):
        words = [w.replace("@CARD@", str(self.card)).replace("@MODE@", mode) for w in self.words]
        self.log.write(f"### {self.name}: boot {mode}\n")
        return Boot(words, self.log)

    def violation(self, text):
        self.violations += 1
        print(f"{self.name}: violation: {text}", flush=True)

    def check(self, lines):
        """Checks a boot's report of the stores against what was acknowledged."""
        self.repairs += sum(1 for line in lines if line.startswith("arm64-device: e2fsck -p "))
        if "@@ state done" not in lines:
            self.violation("the device did not report its stores after the cut")
            return False
        states = {}
        for line in lines:
            if line.startswith("@@ state ") and line != "@@ state done":
                _, _, key, state = line.split(" ", 3)
                states[key] = state
        first = not self.acked
        flight = self.in_flight
        if flight:
            self.flights += 1
        for key, state in states.items():
            if first:
                # A fresh card: the stores' first states are the baseline.
                if "exists=0" not in state:
                    self.violation(f"{key} on the fresh card: {state}")
                self.acked[key] = state
                continue
            before = self.acked.get(key)
            if flight and flight[1] == key:
                if state == before:
                    self.old += 1
                elif state in flight[2]:
                    self.new += 1
                    self.acked[key] = state
                else:
                    self.violation(f"op {flight[0]} on {key} in flight: found {state}, "
                                   f"expected {before} or one of {flight[2]}")
            elif state != before:
                self.violation(f"{key}: found {state}, last acknowledged {before}")
        for line in lines:
            if line.startswith("@@ query "):
                _, _, key, status = line.split(" ")
                present = "exists=1" in states.get(key, "")
                if (status == "0") != present:
                    self.violation(f"{key}: --query-present exited {status}, the slot reads {states.get(key)}")
        self.in_flight = None
        return True

    def follow(self, lines):
        """Takes the operations of a boot's console into account."""
        for line in lines:
            words = line.split(" ")
            if line.startswith("@@ op "):
                op, key = int(words[2]), words[3]
                self.in_flight = (op, key, [line.split(" expect=", 1)[1]])
                self.rival_status = None
                self.next_op = op + 1
            elif words[0] != "@@" or len(words) < 3 or not self.in_flight or words[2] != str(self.in_flight[0]):
                continue
            elif line.startswith("@@ rival "):
                self.in_flight[2].append(line.split(" expect=", 1)[1])
            elif line.startswith("@@ rivalack "):
                self.rival_status = int(words[3])
            elif line.startswith("@@ queries "):
                counts = dict(word.split("=") for word in words[3:])
                op, key, _ = self.in_flight
                if "exists=1" in self.acked.get(key, "") and (counts["absent"] != "0" or counts["other"] != "0"):
                    self.violation(f"op {op} on {key}: queries beside it said {' '.join(words[3:])} "
                                   f"of a present slot")
            elif line.startswith("@@ ack "):
                state = " ".join(words[4:])
                op, key, expected = self.in_flight
                # The operation's own state, or its rival's when the rival
                # succeeded: whichever committed last.
                allowed = expected[:1] + (expected[1:] if self.rival_status == 0 else [])
                if state not in allowed:
                    self.violation(f"op {op} on {key} acknowledged {state}, expected one of {allowed}")
                self.acked[key] = state
                self.acknowledged += 1 + (self.rival_status == 0)
                self.in_flight = None

    def cut_once(self, rng):
        boot = self.boot(f"workload arm64_op={self.next_op}")
        outcome = boot.await_report()
        if outcome != "reported":
            boot.cut()
            # Killed before its first operation, the device boots again as
            # it would after any cut; a second freeze fails the campaign.
            if outcome == "frozen" and self.freezes == 0:
                self.freezes += 1
                print(f"{self.name}: the emulator froze: no CPU time for {FREEZE_SECONDS} s; booting again",
                      flush=True)
                return self.cut_once(rng)
            self.violation("the device did not boot to its workload" + (" (the emulator froze again)"
                                                                        if outcome == "frozen" else ""))
            return
        checked = self.check(list(boot.lines))
        time.sleep(rng.uniform(0, LONGEST_RUN_SECONDS))
        boot.cut()
        self.cuts += 1
        if checked:
            self.follow(boot.lines)

    def verify_last(self):
        boot = self.boot("verify")
        boot.wait()
        self.check(boot.lines)

    def totals(self):
        return (f"{self.cuts} cuts, {self.acknowledged} acknowledged, {self.old} old, {self.new} new, "
                f"{self.flights} in flight, {self.violations} violations")


def main():
    if len(sys.argv) < 5 or sys.argv[4] != "--":
        sys.exit("usage: power_cuts.py OUT CUTS SEED -- QEMU_WORDS...")
    out, cuts, seed, words = Path(sys.argv[1]), int(sys.argv[2]), int(sys.argv[3]), sys.argv[5:]
    print(f"campaign seed: {seed}", flush=True)
    rng = random.Random(seed)
    results = []
    for name, writer, limit in (("power cuts", "store", cuts), ("broken writer", "broken", BROKEN_LIMIT)):
        card = out / f"power-cuts-{writer}.img"
        subprocess.run(["cp", "--sparse=always", str(out / "card.img"), str(card)], check=True)
        with open(out / f"power-cuts-{writer}.log", "w") as log:
            campaign = Campaign(name, [w.replace("@MODE@", f"@MODE@ arm64_writer={writer}") for w in words],
                                card, log)
            started = time.monotonic()
            for number in range(limit):
                campaign.cut_once(rng)
                if writer == "broken" and campaign.violations:
                    break
                if (number + 1) % 50 == 0:
                    print(f"so far, {name}: {campaign.totals()}", flush=True)
            campaign.verify_last()
        card.unlink()
        print(f"{name}: {campaign.totals()}", flush=True)
        print(f"{name}: {campaign.repairs} file system repairs by e2fsck at boot", flush=True)
        print(f"=== {name}: {time.monotonic() - started:.0f} s", flush=True)
        results.append(campaign)
    store, broken = results
    sys.exit(0 if store.violations == 0 and broken.violations > 0 else 1)


if __name__ == "__main__":
    main()
