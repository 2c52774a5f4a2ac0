#!/usr/bin/env python3
"""The tool itself on real processes: its report, its messages, and how it ends."""
import os, re, shutil, signal, time
from running import HEAPSNAP, LAYOUTS, PUPPET, TALLY, Background, TestCase, contents_of, is_root, libc, main, run

STATX, KCMP, READLINKAT = {"x86_64": (332, 312, 267)}.get(os.uname().machine, (291, 272, 78))  # numbers of system calls
MAPPING_QUERY, PAGE_SCAN = "0xc0686611", "0xc0606610"
AS_NOBODY = "/usr/bin/setpriv", "--reuid=65534", "--regid=65534", "--clear-groups"


class Program(TestCase):
    # Older kernels answer a request that they do not know by ENOTTY, filters of containers by EPERM or ENOSYS.
    def test_kernels_without_the_new_queries_give_the_same_report(self):
        zoo, many = self.puppet("zoo"), self.puppet("maps", 15000)

        def report_of(*before):
            outcome = run(*before, TALLY, "-v", "-f", "bytes", view, "--pid", zoo.pid, "--pid", many.pid)
            self.assertEqual(outcome.status, 0)
            self.assertIn("TOTAL", outcome.output)
            return outcome.errors + outcome.output

        for view in "-w", "--vmObjectDirty":
            for request in (MAPPING_QUERY + ":25", PAGE_SCAN + ":25", MAPPING_QUERY + ":1", PAGE_SCAN + ":38", STATX, KCMP):
                with self.subTest(view=view, request=request):
                    self.expect_same_report(report_of, lambda: report_of(PUPPET, "refuse", str(request)))

    def test_a_process_is_charged_what_the_kernel_says(self):
        puppet = self.puppet("big", 32)
        output = run(TALLY, "-f", "bytes", "--pid", puppet.pid).output
        # By page tables: before 6.2 the counters lag. What VmPTE leaves out is the top-level table.
        told = "".join(contents_of("/proc/%s/%s" % (puppet.pid, file)) for file in ("smaps_rollup", "status"))
        expected = 4096 + 1024 * sum(map(int, re.findall(r"(?m)^(?:Anonymous|RssShmem|VmPTE):\s*(\d+)", told)))
        self.assertIn("64-bit\tTally: %d B (4096 bytes per page)\n" % expected, output)
        self.assertRegex(output, r"(?m)^ *%d B .*    TOTAL$" % expected, "the row adds up to the header")

    def test_another_users_process_is_refused_one_by_one(self):
        if not is_root():
            self.skipTest("only root can become another user")
        puppet = self.puppet("idle")
        program = shutil.copy(TALLY, self.path("tally"))  # where every user can reach it
        os.chmod(self.folder, 0o755)
        refused = run(*AS_NOBODY, program, "--pid", puppet.pid)
        self.assertEqual(refused.status, 1)
        self.assertIn("Unable to analyze process with pid %s (try as root?)\n" % puppet.pid, refused.errors)

    def test_control_bytes_of_names_do_not_reach_the_terminal(self):
        path = os.fsencode(self.folder) + b"/a\n\x1b[2J b\xc2\x9b\xff (deleted) \xc3\xa9"
        with open(path, "w") as file:
            file.write("x" * 8192)
        puppet = self.puppet("share", os.fsdecode(path))
        for request in "0", MAPPING_QUERY:
            output = run(PUPPET, "refuse", request, TALLY, "-v", "-w", "--pid", puppet.pid).output
            self.assertIn(self.folder + "/a??[2J b?? (deleted) \xe9\n", output)
            self.assertNotIn("\x1b", output)

    def test_closed_streams_and_a_closed_pipe_end_nothing(self):
        command = "%s --pid %s" % (TALLY, self.puppet("idle").pid)
        self.assertEqual(run("/bin/sh", "-c", "exec " + command + " <&- >&- 2>&-").status, 0)
        # With output closed no file of the run may become the output.
        self.assertEqual(run("/bin/sh", "-c", command + " -j no/x.json >&- 2>err", folder=self.folder).status, 1)
        self.assertEqual(run("/bin/sh", "-c", "{ " + command + " -v; echo $? >&2; } | true").errors, "0\n")
        few = run("/bin/sh", "-c", "ulimit -Sn 8; ulimit -Hn 8; exec " + command)
        # Who may raise the limit has it raised.
        self.assertEqual(few.errors.startswith("Too few file descriptors are allowed: 8, "), few.status == 1, few.errors)

    def test_says_what_it_could_not_write(self):
        pid = self.puppet("maps", 300).pid
        command = TALLY + " -v --pid " + pid
        text = "Unable to write all of the report to standard output: "
        for line, errors in (
                (command + " >/dev/full", text + "No space left on device\n"),
                (TALLY + " -h >/dev/full", "Unable to write to standard output: No space left on device\n"),
                ("ulimit -f 1; " + command + " >out", text + "File too large\n"),
                ("ulimit -f 1; " + command + " -j x.json >/dev/null",
                 "Unable to write all of x.json, which is incomplete: File too large\n"),
                ("ulimit -f 1; " + HEAPSNAP + " -o x.heapsnap " + pid, "Unable to write x.heapsnap: File too large\n")):
            self.assertEqual(run("/bin/sh", "-c", line, folder=self.folder)[::2], (1, errors), line)

    def test_what_may_not_be_looked_at_is_a_warning(self):
        output = run(PUPPET, "refuse", "%d:13" % READLINKAT, TALLY, "--pid", self.puppet("idle").pid).output
        warning = ("Descriptors could not be looked at (Permission denied): memory that only they keep is left out\n")
        self.assertEqual(output.count(warning), 1, output)

    def test_only_the_mark_of_a_deleted_executable_is_taken_off_its_name(self):
        for name in "alive-7 (deleted)", "gone-7":
            path = shutil.copy(PUPPET, self.path(name))
            puppet = self.puppet("idle", program=path)
            if name == "gone-7":
                os.remove(path)
            for way in "-w", "--forkCorpse":
                outcome = run(TALLY, way, "-p", name)
                self.assertIn("\n%s [%s]" % (name, puppet.pid), outcome.output, outcome.errors)
            # The process that asks files is a descendant of the tool, and no target.
            own = run(TALLY, "-t", "-p", name, "--pid", str(os.getpid())).output
            self.assertEqual(own.count("\ntally ["), 1, own)

    def test_a_program_in_another_root_is_known_to_an_ordinary_user(self):
        shutil.copy(TALLY, self.folder)
        os.chmod(self.folder, 0o755)
        outcome = run("/bin/sh", "-c", """
            for file in /bin/sleep $(ldd /bin/sleep | grep -o '/[^ ]*'); do
                mkdir -p root${file%/*} && cp $file root$file || exit 77
            done
            chroot --userspec=65534:65534 root /bin/sleep 60 & pid=$!; trap 'kill $pid' EXIT
            for i in 1 2 3 4 5 6 7 8 9; do readlink /proc/$pid/exe | grep -q root/bin && break; sleep 0.1; done
            setpriv --reuid=65534 --regid=65534 --clear-groups ./tally --pid $pid""", folder=self.folder)
        if not is_root() or outcome.status == 77:
            self.skipTest("needs root, and a program to copy")
        self.assertIn("__LINKEDIT\n", outcome.output, outcome.errors)

    def test_a_file_system_that_does_not_answer_holds_up_nothing(self):
        server = "/usr/bin/bindfs"
        if os.geteuid() != 0 or not os.path.exists(server) or not os.access("/dev/fuse", os.R_OK | os.W_OK):
            self.skipTest("needs root, /dev/fuse and bindfs")
        source, mount = self.path("source"), self.path("mount")
        os.mkdir(source)
        os.mkdir(mount)
        shutil.copy(PUPPET, source + "/program")
        bindfs = self.enter(Background([server, "-f", source, mount], self.folder))
        self.addCleanup(libc.umount2, os.fsencode(mount), 2)  # MNT_DETACH
        end = time.monotonic() + 5
        while not os.path.exists(mount + "/program"):
            if time.monotonic() > end:
                self.skipTest("nothing can be mounted here")
            time.sleep(0.01)
        puppet, other = self.puppet("idle", program=mount + "/program"), self.puppet("idle")
        self.addCleanup(bindfs.signal, signal.SIGCONT)
        bindfs.signal(signal.SIGSTOP)
        for way in ((TALLY, "-p", "program"), (TALLY, "--forkCorpse", "-p", "program"),
                    (TALLY, "--vmObjectDirty", "-p", "program"), (HEAPSNAP, "-o", self.path("snapshot"), puppet.pid),
                    (TALLY, "--pid", other.pid)):
            outcome = run("/usr/bin/timeout", "-s", "KILL", "60", *way)
            self.assertEqual(outcome.status, 0, way)
            self.assertEqual("it does not answer" in outcome.output + outcome.errors, way[1] != "--pid", way)

    def test_the_holder_pays_for_what_others_map_and_a_search_finds_them(self):
        if os.geteuid() != 0:
            self.skipTest("only root can search all processes")
        path = "/dev/shm/tally-test-owned-%d" % os.getpid()
        with open(path, "w") as file:
            file.write("x" * 16 * 4096)
        holder, mapper = self.puppet("open", path, program=LAYOUTS), self.puppet("fill", path, 10)
        os.remove(path)

        def bytes_in(title, *targets):
            """The dirty bytes of the file in the section that begins with `title`."""
            report = run(TALLY, "-w", "-v", "-f", "bytes", "--pid", holder.pid, *targets).output
            row = re.search(r"(?m)^ *(\d+) B .*    mapped file %s \(deleted\)$" % path, report[report.find(title):])
            self.assertTrue(row, report)
            return int(row[1])

        shared = "Shared with puppet [%s]" % mapper.pid
        self.assertEqual(bytes_in(shared, "--pid", mapper.pid), 16 * 4096)
        self.assertEqual(bytes_in("Shared with layouts [%s]" % holder.pid, "--pid", mapper.pid), 0)
        self.assertEqual(bytes_in("Summary Tally", "--pid", mapper.pid), 16 * 4096)
        self.assertEqual(bytes_in(shared, "--unmapped"), 16 * 4096)

    def test_processes_that_come_and_go_disturb_nothing(self):
        ended = self.puppet("idle")
        ended.end()  # its parent has not taken leave of it yet
        both = run(TALLY, "--pid", ended.pid, "--pid", self.puppet("idle").pid)
        self.assertEqual(both.status, 0, both.errors)
        # A shell that starts and ends children all the time while everything is measured.
        self.puppet("churn")
        storm = run("/bin/sh", "-c", """
            (i=0; while [ $i -lt 400 ]; do /bin/true; i=$((i+1)); done) &
            for n in 1 2 3 4 5; do $TALLY -a -f bytes >out 2>err || { cat err >&2; exit 9; }; done
            wait; grep -c TOTAL out""", folder=self.folder)
        if os.geteuid() != 0:
            self.skipTest("all processes are measured by root only")
        self.assertEqual(storm.status, 0, storm.errors)


if __name__ == "__main__":
    main()
