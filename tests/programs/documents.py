#!/usr/bin/env python3
"""The documents of real runs: that they are valid and say what the text says, however a run ends."""
import collections, json, mmap, os, random, re, signal, sys, time
import jsonschema
from running import TALLY, Background, TestCase, contents_of, main, run

HERE = os.path.dirname(os.path.abspath(__file__))
SCHEMA = os.path.join(HERE, "../../docs/json-format.schema.json")
ALL_OUTPUTS = [TALLY, "-f", "bytes", "-w", "-v", "-j", "x.json", "--benchlog", "x.blj"]


class Documents(TestCase):
    def expect_agreement(self):
        """Compares every figure of the three outputs in the folder. @return how many reports there are."""
        outcome = run(sys.executable, HERE + "/agreement.py", self.folder)
        self.assertEqual(outcome.status, 0, outcome.errors)
        return int(outcome.output)

    def expect_valid(self, *documents):
        validator = jsonschema.Draft202012Validator(json.loads(contents_of(SCHEMA)))
        for document in documents:
            self.assertEqual([error.message for error in validator.iter_errors(document)][:3], [])

    def document(self, name="x.json"):
        return json.loads(contents_of(self.path(name)))

    def sh(self, script, *arguments):
        return run("/bin/sh", "-c", script, *arguments, folder=self.folder)

    def test_say_what_the_text_says(self):
        shared = "/dev/shm/tally-test-documents-%d" % os.getpid()
        with open(shared, "w") as file:
            file.write("x" * 64 * 4096)
        self.addCleanup(os.remove, shared)
        zoo, writer, reader = self.puppet("zoo"), self.puppet("fill", shared, 40), self.puppet("share", shared)
        family = self.puppet("family", 22, 200, "half")  # more sharers than the text names
        for more in (["-t", "--pid", zoo.pid, "--pid", family.pid, "--pid", writer.pid, "--pid", reader.pid],
                     ["--vmObjectDirty", "--pid", zoo.pid, "--pid", writer.pid, "--pid", reader.pid], ["--pid", reader.pid]):
            with Background(ALL_OUTPUTS + more, self.folder) as tally:
                self.assertEqual(tally.wait(), 0, tally.text("err"))
            self.assertEqual(self.expect_agreement(), 1)
            self.expect_valid(self.document())

    def test_go_wherever_a_path_leads(self):
        command = "$TALLY --pid " + self.puppet("idle").pid
        json.loads(self.sh(command + " -j /dev/stdout | tail -n 1").output)  # after the text, in one line
        self.sh(command + " -j out >out")  # both to one file
        json.loads(contents_of(self.path("out")).rsplit("\n", 1)[1])
        json.loads(self.sh("mkfifo f; (sleep 0.2; cat f) & exec " + command + " -j f >/dev/null").output)
        self.assertEqual(self.sh(command + " -j closed.json >&- 2>&-").status, 0)
        self.document("closed.json")

        os.link(self.path("closed.json"), self.path("other"))  # another name of a file that is mapped and untouched
        size = os.path.getsize(self.path("other"))
        with open(self.path("other"), "rb") as file:
            mapped = mmap.mmap(file.fileno(), 0, prot=mmap.PROT_READ)
        self.addCleanup(mapped.close)
        self.assertEqual(self.sh(command + " --pid $PPID -j closed.json").status, 1)
        self.assertEqual(os.path.getsize(self.path("other")), size)
        if not os.access(TALLY, os.W_OK):
            self.skipTest("this user may not write to the program")
        self.assertEqual(self.sh(command + " -j $TALLY")[::2], (
            1, "Unable to open JSON writer: Text file busy\nUnable to create JSON output\n"))

    def await_samples(self, tally, count):
        """Waits until `tally` has printed `count` samples more."""
        def printed():
            return tally.text("out").count("Time: ")
        before = printed()
        while printed() < before + count:
            self.assertIsNone(tally.process.poll(), tally.text("err"))
            time.sleep(0.02)

    def test_a_full_disk_is_said_and_leaves_whole_lines(self):
        if run("/usr/bin/unshare", "-m", "mount", "-t", "tmpfs", "none", "/mnt").status:
            self.skipTest("no file system can be mounted here")
        puppet = self.puppet("maps", 3000)

        def on_small_disk(words):
            return Background(["/usr/bin/unshare", "-m", "/bin/sh", "-c", "mount -t tmpfs -o size=64k none /mnt && "
                               "cd /mnt && exec $TALLY --pid $0 " + words, puppet.pid], self.folder)

        incomplete = "Unable to write all of %s, which is incomplete: No space left on device\n"
        with on_small_disk("-v -j x.json") as once:
            self.assertEqual(once.wait(), 1)
            self.assertIn(incomplete % "x.json", once.text("err"))
        with on_small_disk("--sample 0.02 --benchlog x.blj") as sampling:
            self.await_samples(sampling, 2)
            disk = "/proc/%d/cwd/" % sampling.pid
            try:
                with open(disk + "rest", "w") as file:
                    file.write("x" * 65536)
            except OSError:
                pass  # it is full
            self.await_samples(sampling, 10)
            self.assertTrue(contents_of(disk + "x.blj").endswith("}\n"))
            sampling.signal(signal.SIGINT)
            self.assertEqual(sampling.wait(), 1)
            self.assertIn(incomplete % "x.blj", sampling.text("err"))

    def follow_a_puppet(self, seconds):
        """Samples a puppet that grows, shrinks, forks and, at last, ends."""
        puppet = self.puppet("breathe")
        sampling = self.enter(Background(ALL_OUTPUTS + ["--sample", "0.1", "-t", "--pid", puppet.pid], self.folder))

        def anonymous():
            return int(re.search(r"RssAnon:\s*(\d+)", contents_of("/proc/%d/status" % sampling.pid))[1])

        self.await_samples(sampling, 10)
        early = anonymous()
        time.sleep(seconds)
        late = anonymous()
        puppet.end()
        puppet.process.wait()
        self.await_samples(sampling, 8)  # its children last a little longer
        sampling.signal(signal.SIGINT)
        self.assertEqual(sampling.wait(), 0)
        errors = sampling.text("err")
        self.assertIn("\nStopping...\n", errors)  # a sample that is under way may still miss a target
        self.assertTrue(errors.endswith("Analyzing and writing output...\n"), errors)

        self.assertGreaterEqual(self.expect_agreement(), 18)
        document = self.document()
        self.expect_valid(document)
        samples = document["samples"]
        times = [sample[key]["mach_absolute_time_ns"] for sample in samples for key in ("start_time", "end_time")]
        self.assertEqual(times, sorted(times))
        self.assertEqual(len(set(times[::2])), len(samples))
        self.assertGreaterEqual(len({sample["total tally"] for sample in samples}), 10)  # followed, not remembered
        self.assertGreater(len({len(sample["processes"]) for sample in samples}), 1)
        self.assertEqual(samples[-1]["total tally"], 0)  # nothing is left, but for zombies
        if not os.environ.get("SANITIZED"):
            self.assertLessEqual(late - early, 1024, "KiB")

    def test_follow_a_process_that_changes(self):
        self.follow_a_puppet(3)

    def test_long_follow_a_process_for_a_minute(self):
        self.follow_a_puppet(60)

    def interrupt_runs(self, runs):
        """Interrupts runs at random moments: what exits with 0 has left whole documents, and no run that has begun to
        listen is killed."""
        family = self.puppet("family", 8, 4000, "random")
        once, sampled = ["-t", "--pid", family.pid], ["--sample", "0.05", "-t", "--pid", family.pid]
        lengths = []
        for _ in range(3):
            begin = time.monotonic()
            with Background(ALL_OUTPUTS + once, self.folder) as tally:
                self.assertEqual(tally.wait(), 0)
            lengths.append(time.monotonic() - begin)
        length = min(lengths)
        chance = random.Random(os.getpid())
        whole, endings = 0, collections.Counter()
        earlier = contents_of(self.path("x.json"))
        for i in range(runs):
            is_sampled, number = i % 2 == 0, signal.SIGTERM if i % 3 == 0 else signal.SIGINT
            moment = chance.random() * (3 if is_sampled else 1) * length
            with self.subTest(sampled=is_sampled, signal=number, moment=moment):
                with Background(ALL_OUTPUTS + (sampled if is_sampled else once), self.folder) as tally:
                    time.sleep(moment)
                    tally.signal(number)
                    status, errors = tally.wait(), tally.text("err")
                has_listened = ("Sampling at" if is_sampled else "Exiting early") in errors
                endings[is_sampled and "sampling" or "once", has_listened and "heard" or "", status] += 1
                if status:
                    self.assertFalse(has_listened, errors)
                    self.assertEqual(status, 128 + number, errors)
                elif "No sample was completed" in errors:
                    self.assertEqual(contents_of(self.path("x.json")), earlier)
                else:
                    self.expect_agreement()
                    self.expect_valid(self.document())
                    earlier = contents_of(self.path("x.json"))
                    whole += 1
        self.assertGreater(whole, 0)
        print("runs of %.3f s:" % length, dict(endings))

    def test_survive_interrupts(self):
        self.interrupt_runs(20)

    def test_long_survive_many_interrupts(self):
        self.interrupt_runs(200)

    def test_are_whole_whichever_signal_ends_sampling(self):
        puppet = self.puppet("idle")
        for number in signal.SIGINT, signal.SIGTERM, signal.SIGHUP, 0:
            before = "" if number else "trap '' HUP; "
            command = ["/bin/sh", "-c", before + "exec $TALLY --sample 0.05 -j x.json --pid $0", puppet.pid]
            with Background(command, self.folder) as tally:
                self.await_samples(tally, 1)
                if not number:  # a hang-up that was ignored from the start ends nothing
                    tally.signal(signal.SIGHUP)
                    self.await_samples(tally, 3)
                tally.signal(number or signal.SIGINT)
                self.assertEqual(tally.wait(), 0, number)
            self.assertIsInstance(self.document(), dict, number)

    def test_are_completed_when_nobody_reads_the_text(self):
        puppet = self.puppet("idle")

        def status_of(words, rest):
            self.sh("{ $TALLY --sample 0.02 " + words + " --pid $0 & echo $! >pid; wait $!; echo $? >status; } | head -n 1 & " +
                    rest + "wait", puppet.pid)
            return contents_of(self.path("status"))

        self.assertEqual(status_of("", ""), "141\n")  # a text alone ends
        self.assertEqual(status_of("-j x.json", "until [ 0$(stat -c %s x.json) -gt 20000 ]; do sleep 0.1; done; "
                                   "kill -INT $(cat pid); "), "0\n")
        self.document()
        many = self.puppet("maps", 3000)  # more text than a pipe holds
        for name in "INT", "TERM", "HUP":
            self.sh("rm -f status x.json pid; { $TALLY -v -j x.json --pid $0 & echo $! >pid; wait $!; echo $? >status; } | "
                    "{ read line; until [ -s pid ]; do sleep 0.1; done; kill -$1 $(cat pid); until [ -s status ]; "
                    "do sleep 0.1; done; }", many.pid, name)
            self.assertEqual(contents_of(self.path("status")), "0\n", name)
            self.document()


if __name__ == "__main__":
    main()
