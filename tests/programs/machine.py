#!/usr/bin/env python3
"""The figures of all processes together against the machine's own counters. What other programs do meanwhile moves both:
the tests run alone, compare what is added, and try again for a minute."""
import contextlib, fcntl, mmap, os, re, sys, time
from running import PUPPET, TALLY, Puppet, TestCase, contents_of, is_root, libc, main, run

HERE = os.path.dirname(os.path.abspath(__file__))
MERGING = "/sys/kernel/mm/ksm/run"
MIB = 1 << 20


def write(path, text):
    """@return whether the kernel took it."""
    try:
        with open(path, "w") as file:
            file.write(text)
        return True
    except OSError:
        return False


@contextlib.contextmanager
def lock_of_machine(setting):
    """Until it ends no other test changes this setting of the machine."""
    with open("/tmp/tally-test-%s.lock" % setting, "w") as lock:
        fcntl.flock(lock, fcntl.LOCK_EX)
        yield


@contextlib.contextmanager
def swap_file(folder, mebibytes):
    """A swap file of the test's own, alone among tests, off and removed in the end. Gives whether it is on."""
    path = folder + "/swap"
    with lock_of_machine("swap"):
        with open(path, "wb") as file:
            os.chmod(path, 0o600)
            with contextlib.suppress(OSError):
                os.posix_fallocate(file.fileno(), 0, mebibytes * MIB)
        is_on = run("/usr/sbin/mkswap", path).status == 0 and libc.swapon(os.fsencode(path), 0) == 0
        try:
            yield is_on
        finally:
            if is_on:
                libc.swapoff(os.fsencode(path))


@contextlib.contextmanager
def page_merging():
    """Has the kernel merge pages of one content, and what it merged taken apart again in the end."""
    with lock_of_machine("merging"):
        is_on = contents_of(MERGING).strip() == "0" and write(MERGING, "1")
        try:
            yield is_on
        finally:
            for step in "20" if is_on else "":
                write(MERGING, step)


def meminfo(*keys):
    """Bytes, with the processors' own counters folded in first."""
    write("/proc/sys/vm/stat_refresh", "1")
    text = contents_of("/proc/meminfo")
    return [1024 * int(re.search(r"(?m)^%s:\s*(\d+)" % key, text)[1]) for key in keys]


def rows_of_summary(report):
    """(category, figures before the count of regions, in bytes) of its table."""
    table = report[max(report.rfind("Summary Tally"), 0):]
    return [(row[2], [int(figure) for figure in row[1].split()[::2]])
            for row in re.finditer(r"(?m)^ *((?:\d+ B +)+)\d+    (.*)$", table)]


def swap_in_use():
    total, free = meminfo("SwapTotal", "SwapFree")
    return total - free


def by_tally():
    """What by_meminfo says, as the tool sees it: anonymous memory, shared memory, page tables."""
    def dirty(view):
        return [(category, figures[0]) for category, figures in rows_of_summary(
            run(TALLY, "-a", "-x", "kernel", "-f", "bytes", view).output)]
    charged = dict(dirty("--swapped"))
    shared = sum(size for category, size in dirty("--vmObjectDirty") if category.startswith("shared memory"))
    return charged["TOTAL"] - charged["page table"], shared, charged["page table"]


def by_meminfo():
    return meminfo("AnonPages", "Shmem", "PageTables")


def increase(before, after):
    return [b - a for a, b in zip(before, after)]


def is_within(measured, expected, part):
    return abs(measured - expected) <= max(expected * part, MIB)


class Machine(TestCase):
    def test_what_several_touch_of_an_object_counts_once(self):
        self.enter(swap_file(self.folder, 64))  # without it the same is seen of what is in memory
        for seed in "12":
            outcome = run(sys.executable, HERE + "/unions.py", TALLY, PUPPET, self.folder, seed)
            if outcome.status == 77:
                self.skipTest("the page cache cannot be asked here")
            self.assertEqual(outcome.status, 0, outcome.errors)
            self.assertIn("memory:", outcome.output)

    def test_swapped_memory_of_relatives_is_what_the_swap_file_holds(self):
        # Pages of relatives and of shared memory, swapped out before the fork, count once, as the swap file has them.
        if not self.enter(swap_file(self.folder, 64)):
            self.skipTest("no swap file can be had here")
        before = swap_in_use()
        family = self.puppet("family", 3, 4096, "swapped")
        children = [word for entry in family.ledger if entry[0] == "child" for word in ("--pid", entry[2])]
        report = run(TALLY, "-f", "bytes", "--swapped", "--pid", family.pid, *children).output
        swapped, expected = dict(rows_of_summary(report))["TOTAL"][1], swap_in_use() - before
        self.assertGreater(expected, 30 * MIB)
        self.assertTrue(is_within(swapped, expected, 0.005), (swapped, expected))

    def test_pages_merged_by_content_are_a_warning_of_their_process(self):
        memory = self.enter(contextlib.closing(mmap.mmap(-1, 64 << 10, mmap.MAP_PRIVATE | mmap.MAP_ANONYMOUS)))
        memory.write(b"\7" * len(memory))
        merged = 0
        if self.enter(page_merging()):
            with contextlib.suppress(OSError):
                memory.madvise(mmap.MADV_MERGEABLE)
            for _ in range(100):
                merged = merged or int(contents_of("/proc/self/ksm_merging_pages") or 0)
                time.sleep(0 if merged else 0.05)
        report = run(TALLY, "--pid", str(os.getpid())).output
        if not merged:
            self.skipTest("the kernel merges no pages here, or others have it do so")
        self.assertIn("(KSM) count for every process", report)

    def add_puppets(self):
        """@return what puppets added, by the machine's counters and by the tool; whether all was as before once they had
        ended."""
        before, tally_before = by_meminfo(), by_tally()
        # Anonymous memory: forked relatives and one alone. What of it is shared counts once in both.
        with Puppet("family", 8, 16384, "same"), Puppet("family", 4, 16384, "half"), Puppet("big", 128):
            middle, tally_middle = by_meminfo(), by_tally()
            expected, measured = increase(before, middle), increase(tally_before, tally_middle)
            # Shared memory, of which one process touches a part only: the object view counts all of it.
            with Puppet("memory", 24576):
                expected[1] = increase(middle, by_meminfo())[1]
                measured[1] = increase(tally_middle, by_tally())[1]
        left = increase(before, by_meminfo()) + increase(tally_before, by_tally())
        return expected, measured, all(abs(difference) <= 512 << 10 for difference in left)

    def test_what_processes_add_is_what_the_machine_counts(self):
        if not is_root():
            self.skipTest("all processes are measured by root only")
        deadline = time.monotonic() + 60
        while time.monotonic() < deadline:
            expected, measured, was_quiet = self.add_puppets()
            if all(map(is_within, measured, expected, (0.001, 0.005, 0.03))):
                return
            self.assertFalse(was_quiet, "anonymous, shared, page tables: %s of %s" % (measured, expected))
        self.skipTest("other programs change the machine's memory too much to compare")


if __name__ == "__main__":
    main()
