#!/usr/bin/env python3
"""Corpses as the tool reports them, and that the processes run on as if nothing had been."""
import os, random, re, signal, subprocess, time
from running import PUPPET, TALLY, TestCase, contents_of, is_root, libc, main, run, start

SEIZE, INTERRUPT, DETACH = 0x4206, 0x4207, 17  # requests of ptrace
ANY_CHILD = 0x40000000  # __WALL


def state_of(folder):
    """The letter of a thread's state, "traced" where it is, "" where it has ended."""
    status = contents_of(folder + "/status")
    state, tracer = re.search(r"State:\s*(.)", status), re.search(r"TracerPid:\s*(\d+)", status)
    return "" if not state else state[1] if tracer[1] == "0" else "traced"


class Corpse(TestCase):
    def expect_threads(self, pid, count, states):
        """Expects to see soon `count` threads that nobody traces, all in one of the states `states`."""
        for _ in range(1000):  # they have to run to stop again
            folder = "/proc/%s/task/" % pid
            seen = [state_of(folder + thread) for thread in os.listdir(folder)]
            if len(seen) == count and all(state and state in states for state in seen):
                return
            time.sleep(0.01)
        self.fail(seen)

    def await_tracer(self, pid):
        """Waits until the process is traced, or may have been."""
        deadline = time.monotonic() + 0.2
        while state_of("/proc/" + pid) != "traced" and time.monotonic() < deadline:
            pass

    def test_lets_go_of_every_thread_when_the_tool_is_killed_or_stopped(self):
        busy, stopped = self.puppet("churn", 200), self.puppet("churn", 20)
        os.kill(int(stopped.pid), signal.SIGSTOP)
        chance = random.Random(1)
        for turn in range(40):
            pid = (stopped if turn % 2 else busy).pid
            # A group of its own, as a shell gives it, or the terminal's signal would stop nothing.
            tool = start([TALLY, "--forkCorpse", "--pid", pid], stdout=subprocess.DEVNULL, process_group=0)
            try:
                self.await_tracer(pid)
                time.sleep(chance.random() * 0.004)
                tool.send_signal(signal.SIGTSTP if turn % 4 < 2 else signal.SIGKILL)
                self.expect_threads(busy.pid, 201, "RSD")
                self.expect_threads(stopped.pid, 21, "T")
            finally:
                tool.kill()
                tool.wait()

    def test_reports_what_still_processes_report(self):
        for shape in (["zoo"], ["leaderless"], ["twins"], ["family", 3, 600, "half"], ["family", 5, 3000, "random"],
                      ["family", 2, 2048, "huge"], ["family", 2, 600, "grow"]):
            if shape != ["zoo"] and not is_root():
                self.skipTest("relatives of corpses are told by frame numbers, which are for root")
            puppet = self.puppet(*shape)

            def report_of(*way):
                """But for the word that tells corpses, and for lines as long as the names between them."""
                outcome = run(TALLY, *way, "-f", "bytes", view, "-t", puppet.pid)
                self.assertEqual(outcome.errors, "")
                self.assertIn("TOTAL", outcome.output)
                return re.sub(r" \(corpse\)|={2,}", "", outcome.output)

            for view in "--swapped", "--vmObjectDirty":  # the first changes no figure
                with self.subTest(shape=shape, view=view):
                    self.expect_same_report(report_of, lambda: report_of("--forkCorpse"))

    def test_that_cannot_be_had_is_said_and_the_run_goes_on(self):
        puppet, other = self.puppet("idle"), self.puppet("idle")
        pid = int(puppet.pid)

        def expect_refused(reason, *prefix, others=True):
            outcome = run(*prefix, TALLY, "--forkCorpse", "--pid", puppet.pid, "--pid", other.pid)
            message = "Unable to fork a corpse of process puppet [%s]: %s\n" % (puppet.pid, reason)
            self.assertTrue(outcome.errors.startswith(message), outcome.errors)
            self.assertEqual(outcome.status, 0 if others else 1)
            self.assertEqual("puppet [%s] (corpse)" % other.pid in outcome.output, others)

        self.assertEqual(libc.ptrace(SEIZE, pid, None, None), 0)
        expect_refused("already traced")
        libc.ptrace(INTERRUPT, pid, None, None)
        os.waitpid(pid, ANY_CHILD)
        libc.ptrace(DETACH, pid, None, None)
        expect_refused("no access", PUPPET, "refuse", "0", others=False)  # as where tracing is forbidden
        puppet.end()
        expect_refused("terminated")


if __name__ == "__main__":
    main()
