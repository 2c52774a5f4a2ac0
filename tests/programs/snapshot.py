#!/usr/bin/env python3
"""Snapshots of real processes: their reports against those of the processes."""
import os, re
from running import HEAPSNAP, TALLY, TestCase, is_kernel_before, is_root, main, run

ROW = re.compile(r" *((?:\d+ B +)+)\d+    (.*)")


def rows_of(report):
    """For each section and category of a report the bytes, without the count of regions."""
    rows, section = {}, ""
    for line in report.splitlines():
        if row := ROW.fullmatch(line):
            rows[section + ": " + row[2]] = row[1].split()[::2]
        elif " [" in line or line.startswith("Summary"):
            section = re.sub(r" \(heapsnap\)|:.*", "", line.split("\t")[0])
    return rows


class Snapshot(TestCase):
    def take(self, puppet, name, *view):
        outcome = run(HEAPSNAP, "-o", self.path(name), *view, puppet.pid)
        self.assertEqual(outcome.status, 0, outcome.errors)
        if not is_kernel_before(6, 5):  # there the page cache cannot be asked, which is said
            self.assertEqual(outcome.errors, "")
        return self.path(name)

    def rows(self, *arguments):
        outcome = run(TALLY, "-f", "bytes", "-w", "-v", *arguments)
        self.assertEqual(outcome.errors, "")
        return rows_of(outcome.output)

    def test_reports_what_the_process_reports(self):
        puppets = self.puppet("zoo"), self.puppet("big", 64)
        for view in (), ("--vmObjectDirty",):
            if view and not is_root():
                self.skipTest("the page cache is asked for root only")

            def figures_of(*target):
                rows = self.rows(*view, *target)
                # A snapshot has no page tables, which only the first view shows.
                kept = {row: figures for row, figures in rows.items() if view or not row.endswith((": page table", ": TOTAL"))}
                self.assertGreater(len(kept), 5)
                return kept

            for puppet in puppets:
                with self.subTest(view=view, puppet=puppet.pid):
                    self.expect_same_report(lambda: figures_of("--pid", puppet.pid),
                                            lambda: figures_of(self.take(puppet, puppet.pid, *view)))

    def test_shares_with_processes_and_snapshots_in_whatever_order(self):
        file = "/dev/shm/tally-test-snapshot-%d" % os.getpid()
        self.addCleanup(os.remove, file)
        with open(file, "w") as stream:
            stream.write("x" * 64 * 4096)
        w = self.puppet("fill", file, 40)  # pages 0 to 39
        r = self.puppet("share", file)  # all 64
        writer, reader = self.take(w, "writer"), self.take(r, "reader")

        def figures(*targets):
            # What nothing stands behind is a region of its own there.
            return {row: figures for row, figures in self.rows(*targets).items()
                    if "mapped file " + file in row and set(figures) != {"0"}}

        live = figures("--pid", w.pid, "--pid", r.pid)
        self.assertEqual(len(live), 3, "one with each, one in the summary")
        for targets in (writer, reader), (reader, writer), (reader, "--pid", w.pid), (writer, "--pid", r.pid):
            self.assertEqual(figures(*targets), live, targets)


if __name__ == "__main__":
    main()
