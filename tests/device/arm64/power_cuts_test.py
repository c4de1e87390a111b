#!/usr/bin/env python3
"""The power-cut campaign's judgement, on consoles written by hand: what
it accepts after a cut, what it counts and what it calls a violation."""

import io
import sys
import unittest
from pathlib import Path

sys.dont_write_bytecode = True  # the source tree stays clean
sys.path.insert(0, str(Path(__file__).resolve().parent))
import power_cuts  # noqa: E402

EMPTY = "exists=0 valid=0 read=1 size=0 crc32=00000000"
FIRST = "exists=1 valid=1 read=0 size=100 crc32=11111111"
SECOND = "exists=1 valid=1 read=0 size=4000 crc32=22222222"
MIX = "exists=1 valid=1 read=0 size=4000 crc32=33333333"
RIVAL = "exists=1 valid=1 read=0 size=2000 crc32=44444444"


def report(settings, driver, query="10"):
    return [f"@@ state settings {settings}", f"@@ state driver {driver}", f"@@ query settings {query}",
            "@@ state done"]


def campaign():
    return power_cuts.Campaign("test", [], Path("card"), io.StringIO())


class Judgement(unittest.TestCase):
    def started(self):
        """A campaign past its first boot, FIRST acknowledged in settings."""
        c = campaign()
        self.assertTrue(c.check(report(EMPTY, EMPTY)))
        c.follow(["@@ op 0 settings expect=" + FIRST, "@@ ack 0 0 " + FIRST])
        self.assertEqual(c.acknowledged, 1)
        return c

    def test_a_fresh_card_must_read_empty(self):
        c = campaign()
        c.check(report(FIRST, EMPTY, "0"))
        self.assertEqual(c.violations, 1)

    def test_a_repair_at_boot_is_counted_and_judged_like_any_boot(self):
        c = self.started()
        repaired = ["arm64-device: e2fsck -p /dev/mmcblk0p3 exited 1:",
                    "arm64-device:   nonvolatile: Journal transaction 52 was corrupt, replay was aborted."]
        c.check(repaired + report(FIRST, EMPTY, "0"))
        c.check(report(FIRST, EMPTY, "0"))
        self.assertEqual((c.repairs, c.violations), (1, 0))

    def test_the_acknowledged_blob_passes(self):
        c = self.started()
        c.check(report(FIRST, EMPTY, "0"))
        self.assertEqual((c.violations, c.flights), (0, 0))

    def test_an_operation_in_flight_may_leave_the_old_or_the_new_blob(self):
        for found, old, new in ((FIRST, 1, 0), (SECOND, 0, 1)):
            c = self.started()
            c.follow(["@@ op 1 settings expect=" + SECOND])
            c.check(report(found, EMPTY, "0"))
            self.assertEqual((c.violations, c.flights, c.old, c.new), (0, 1, old, new))
            self.assertEqual(c.acked["settings"], found)
            self.assertEqual(c.next_op, 2)

    def test_a_mix_or_an_older_blob_is_a_violation(self):
        for found in (MIX, EMPTY):
            c = self.started()
            c.follow(["@@ op 1 settings expect=" + SECOND])
            c.check(report(found, EMPTY, "0" if found == MIX else "10"))
            self.assertEqual(c.violations, 1, found)

    def test_a_slot_no_operation_touched_must_not_change(self):
        c = self.started()
        c.follow(["@@ op 1 settings expect=" + SECOND])
        c.check(report(SECOND, FIRST, "0"))
        self.assertEqual(c.violations, 1)

    def test_an_acknowledgement_must_match_the_expected_state(self):
        c = self.started()
        c.follow(["@@ op 1 settings expect=" + SECOND, "@@ ack 1 0 " + MIX])
        self.assertEqual(c.violations, 1)

    def test_a_rival_that_succeeded_may_be_the_one_acknowledged(self):
        for found, rival_status, violations in ((RIVAL, 0, 0), (SECOND, 0, 0), (RIVAL, 1, 1), (FIRST, 0, 1)):
            c = self.started()
            c.follow(["@@ op 1 settings expect=" + SECOND, "@@ rival 1 settings expect=" + RIVAL,
                      f"@@ rivalack 1 {rival_status}", "@@ queries 1 present=7 absent=0 other=0",
                      "@@ ack 1 0 " + found])
            self.assertEqual(c.violations, violations, (found, rival_status))
            self.assertEqual(c.acknowledged, 2 + (rival_status == 0))

    def test_console_lines_of_any_shape_are_passed_over(self):
        c = self.started()
        c.follow(["@@ op 1 settings expect=" + SECOND, "[   3.1] random: crng init done", "@@", "x y z",
                  "@@ state settings " + FIRST, "@@ ack 1 0 " + SECOND])
        self.assertEqual((c.violations, c.acknowledged), (0, 2))

    def test_a_cut_beside_a_rival_may_leave_either_blob_or_the_old_one(self):
        for found, violations in ((FIRST, 0), (SECOND, 0), (RIVAL, 0), (MIX, 1)):
            c = self.started()
            c.follow(["@@ op 1 settings expect=" + SECOND, "@@ rival 1 settings expect=" + RIVAL])
            c.check(report(found, EMPTY, "0"))
            self.assertEqual(c.violations, violations, found)

    def test_a_query_beside_the_writers_must_not_call_a_present_slot_absent(self):
        for counts, violations in (("present=5 absent=0 other=0", 0), ("present=4 absent=1 other=0", 1),
                                   ("present=4 absent=0 other=1", 1)):
            c = self.started()
            c.follow(["@@ op 1 settings expect=" + SECOND, "@@ rival 1 settings expect=" + RIVAL,
                      "@@ rivalack 1 0", f"@@ queries 1 {counts}", "@@ ack 1 0 " + SECOND])
            self.assertEqual(c.violations, violations, counts)

    def test_query_present_must_agree_with_the_slot(self):
        c = self.started()
        c.check(report(FIRST, EMPTY, "10"))
        self.assertEqual(c.violations, 1)

    def test_a_boot_without_its_report_is_a_violation(self):
        c = self.started()
        self.assertFalse(c.check(["arm64-device: ready after 3.00 s, mode workload"]))
        self.assertEqual(c.violations, 1)

    def test_totals_read_as_scripts_expect(self):
        c = self.started()
        self.assertEqual(c.totals(), "0 cuts, 1 acknowledged, 0 old, 0 new, 0 in flight, 0 violations")



class AwaitingTheReport(unittest.TestCase):
    """A boot that reports, one that works without reporting, and one whose
    emulator uses no CPU time at all, as a frozen qemu."""

    def outcome(self, script, limit=3.0):
        boot = power_cuts.Boot(["sh", "-c", script], io.StringIO())
        try:
            return boot.await_report(limit=limit, freeze=1.0, poll=0.1)
        finally:
            boot.cut()

    def test_a_report_is_awaited(self):
        self.assertEqual(self.outcome("sleep 0.3; echo '@@ state done'; sleep 5"), "reported")

    def test_a_busy_boot_without_report_is_late(self):
        self.assertEqual(self.outcome("while :; do :; done"), "late")

    def test_a_boot_without_cpu_time_is_frozen(self):
        self.assertEqual(self.outcome("exec sleep 30"), "frozen")

if __name__ == "__main__":
    unittest.main()
