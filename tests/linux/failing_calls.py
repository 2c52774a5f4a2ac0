#!/usr/bin/env python3
"""Makes system calls of tally and heapsnap fail, one in each run, and expects of every run the same figures as without
the failure, or a message: never other figures without a word, a signal, a run without end or a target that stays stopped.

    failing_calls.py [--long] TALLY HEAPSNAP PUPPET LAYOUTS [PATTERN]

A seccomp filter hands every call of one kind to this program, which lets it pass or answers it with an error. Calls of
one kind on one file (without the numbers in its path) are alike: of these the first, a middle and the last fail, with
--long all, in each of the ways of FAILURES. PATTERN selects: a regular expression for "scenario kind file error".
The exit status is 77 where this cannot be done."""

import collections, ctypes, difflib, errno, fcntl, json, os, pathlib, platform, re, select, shutil, signal, socket, struct, subprocess, sys, tempfile, time

FAILURES = {  # number on x86-64, then how calls of the kind fail
    "read": (0, "EIO"), "write": (1, "ENOSPC", "EIO"), "stat": (4, "EACCES"), "fstat": (5, "EIO"),
    "lseek": (8, "ESPIPE"), "mmap": (9, "ENOMEM"), "mprotect": (10, "ENOMEM"),
    "ioctl": (16, "EPERM", "ENOTTY", "EIO", "ENOMEM"), "pread64": (17, "EIO", "EPERM"), "writev": (20, "EIO"),
    "madvise": (28, "EINVAL"), "fcntl": (72, "EPERM"), "ftruncate": (77, "EIO"), "unlink": (87, "EACCES"),
    "clone": (56, "EAGAIN"), "fork": (57, "EAGAIN"), "vfork": (58, "EAGAIN"), "wait4": (61, "ECHILD"), "uname": (63, "EPERM"),
    "getdents64": (217, "EIO"), "readlink": (89, "EACCES"), "ptrace": (101, "EPERM", "ESRCH"),
    "prctl": (157, "EPERM"), "sched_getaffinity": (204, "EPERM"), "epoll_create1": (291, "EMFILE"), "epoll_ctl": (233, "ENOMEM"),
    "waitid": (247, "ECHILD"), "openat": (257, "EACCES", "EMFILE", "EIO"), "newfstatat": (262, "EACCES"),
    "readlinkat": (267, "EACCES"), "signalfd4": (289, "EMFILE"), "eventfd2": (290, "EMFILE"), "pipe2": (293, "EMFILE"),
    "timerfd_create": (283, "EMFILE"), "preadv": (295, "EIO"), "prlimit64": (302, "EPERM"), "process_vm_readv": (310, "EPERM"),
    "kcmp": (312, "EPERM"), "getrandom": (318, "EAGAIN"), "memfd_create": (319, "EMFILE"), "statx": (332, "EACCES"),
    "pidfd_open": (434, "EMFILE"), "clone3": (435, "EAGAIN"), "cachestat": (451, "EPERM"), "io_uring_setup": (425, "EPERM"),
    "getcwd": (79, "ENOENT"), "rename": (82, "EACCES"), "unlinkat": (263, "EACCES"), "statfs": (137, "EIO"),
    "access": (21, "EACCES"), "sysinfo": (99, "EPERM"), "kill": (62, "EPERM"), "tgkill": (234, "EPERM"),
}
NUMBERS = {failure[0]: kind for kind, failure in FAILURES.items()}
HAS_DESCRIPTOR = "read write fstat lseek ioctl pread64 writev getdents64 fcntl ftruncate cachestat readlinkat openat newfstatat statx"
EXECVE, MUNMAP, SECCOMP = 59, 11, 317
RECEIVE, SEND, SET_FLAGS = 0xC0502100, 0xC0182101, 0x40082104
PATIENCE = 60.0  # seconds until a run has no end
SHORT = 120.0  # seconds after which the short form begins no run any more
ESTIMATED = "The page cache could not be asked"  # of a process all of whose figures are estimates, not so for root
libc = ctypes.CDLL(None, use_errno=True)


def end_with_parent():
    libc.prctl(1, signal.SIGKILL, 0, 0, 0)


def whether_calls_can_fail():
    """@return why not; empty when they can."""
    if platform.machine() != "x86_64":
        return "the numbers of system calls are those of x86-64"
    child = os.fork()
    if child == 0:
        try:
            listen_to_calls([EXECVE])
            os._exit(0)
        finally:
            os._exit(1)
    return "no system calls can be listened to (seccomp)" if os.waitpid(child, 0)[1] else ""


def listen_to_calls(numbers):
    """Has all calls of these numbers, of this process and what it starts, wait for an answer. @return a descriptor."""
    program = [(0x20, 0, 0, 0)]  # load the number
    for at, number in enumerate(numbers):
        program.append((0x15, len(numbers) - at, 0, number))
    program += [(0x06, 0, 0, 0x7FFF0000), (0x06, 0, 0, 0x7FC00000)]  # allow; notify
    code = b"".join(struct.pack("HBBI", *instruction) for instruction in program)
    filter_ = ctypes.create_string_buffer(code)
    header = struct.pack("HxxxxxxP", len(program), ctypes.addressof(filter_))
    libc.prctl(38, 1, 0, 0, 0)  # no new privileges
    for flags in (8 | 32, 8):  # a listener, that no signal disturbs where the kernel can do that
        listener = libc.syscall(SECCOMP, 1, flags, ctypes.create_string_buffer(header))
        if listener >= 0:
            return listener
    raise OSError(ctypes.get_errno(), "seccomp")


def describe(pid, kind, arguments):
    """The file a call is about, without numbers but those of ioctl requests."""
    def path_of(descriptor):
        try:
            return os.readlink(f"/proc/{pid}/fd/{descriptor}")
        except OSError:
            return "?"
    words = []
    if kind in HAS_DESCRIPTOR.split() and arguments[0] < 1 << 31:
        words.append(path_of(arguments[0]))
    if kind == "ioctl":
        words.append(hex(arguments[1]))
    place = {"openat": 1, "newfstatat": 1, "statx": 1, "readlinkat": 1, "stat": 0, "readlink": 0, "unlink": 0}.get(kind)
    if place is not None:
        with open(f"/proc/{pid}/mem", "rb", 0) as memory:
            memory.seek(arguments[place])
            words.append(os.fsdecode(memory.read(300).split(b"\0")[0]))
    return " ".join(words)


class Run:
    """One run of `command` in `folder`. Call number `nth` of `kind` fails with `error`; with no kind all are recorded."""

    def __init__(self, command, folder, kind=None, nth=-1, error=None):
        self.calls, self.failed, self.has_ended = collections.defaultdict(list), None, False
        numbers = [FAILURES[kind][0]] if kind else list(NUMBERS)
        ours, theirs = socket.socketpair()
        self.child = os.fork()
        if self.child == 0:
            try:
                end_with_parent()
                os.chdir(folder)
                for descriptor, name in ((1, "out"), (2, "err")):
                    os.dup2(os.open(name, os.O_WRONLY | os.O_CREAT | os.O_TRUNC, 0o600), descriptor)
                listener = listen_to_calls([EXECVE, MUNMAP, *numbers])
                socket.send_fds(theirs, [b"x"], [listener])
                os.execv(command[0], command)
            finally:
                os._exit(126)
        theirs.close()
        self.listener = socket.recv_fds(ours, 1, 1)[1][0]
        ours.close()
        try:
            fcntl.ioctl(self.listener, SET_FLAGS, 1)
        except OSError:
            pass  # only slower
        try:
            self.answer(kind, nth, error)
        finally:
            if not self.has_ended:
                os.kill(self.child, signal.SIGKILL)
            self.status = os.waitstatus_to_exitcode(os.waitpid(self.child, 0)[1])
            os.close(self.listener)

    def answer(self, kind, nth, error):
        notes = select.poll()
        notes.register(self.listener, select.POLLIN)
        deadline, is_loaded, seen = time.monotonic() + PATIENCE, False, 0
        program = None
        while time.monotonic() < deadline:
            for _, event in notes.poll(1000):
                if event & select.POLLHUP and not event & select.POLLIN:
                    self.has_ended = True
                    return
                note = bytearray(80)
                try:
                    fcntl.ioctl(self.listener, RECEIVE, note)
                except OSError:
                    continue  # the caller was killed
                identity, pid, _, number, _, _, *arguments = struct.unpack("QIIiIQ6Q", note)
                result = (0, 0, 1)  # let it pass
                if number == EXECVE:
                    program = pid
                elif number == MUNMAP:
                    is_loaded = is_loaded or program is not None  # the loader's last call
                elif is_loaded and kind is None:
                    self.calls[NUMBERS[number]].append(self.describe(pid, NUMBERS[number], arguments))
                elif is_loaded:
                    if seen == nth:
                        self.failed = self.describe(pid, kind, arguments)
                        result = (0, -getattr(errno, error), 0)
                    seen += 1
                try:
                    fcntl.ioctl(self.listener, SEND, struct.pack("QqiI", identity, *result))
                except OSError:
                    pass

    @staticmethod
    def describe(pid, kind, arguments):
        try:
            return describe(pid, kind, arguments)
        except OSError:
            return "?"


def without(document, names):
    if isinstance(document, dict):
        return {key: without(value, names) for key, value in document.items() if key not in names}
    return [without(value, names) for value in document] if isinstance(document, list) else document


def messages_in(document):
    if isinstance(document, dict):
        own = [text for key in ("warnings", "errors") for text in document.get(key, [])]
        return own + [text for value in document.values() for text in messages_in(value)]
    return [text for value in document for text in messages_in(value)] if isinstance(document, list) else []


class Results:
    """What a run left in its folder: its figures, its messages."""

    def __init__(self, folder, tally):
        text = (folder / "out").read_text(errors="replace")
        errors = (folder / "err").read_text(errors="replace")
        self.messages = collections.Counter(errors.splitlines())
        self.has_error_text = bool(errors)
        snapshot = folder / "x.heapsnap"
        if snapshot.exists() and "x.heapsnap" in text:
            subprocess.run([tally, snapshot, "-v", "-j", "x.json"], cwd=folder, stdout=open(folder / "out", "w"))
            text = (folder / "out").read_text(errors="replace")
        warned = re.findall(r"(?s)\n(?:Warnings|Errors) were encountered .*?(?=\n\n)|^.*\(may be invalid.*$|\nDue to errors.*?\n", text)
        self.messages.update(warned)
        try:
            document = json.loads((folder / "x.json").read_bytes())
            self.messages.update(messages_in(document))
            document = without(document, ("start_time", "end_time", "id", "warnings", "errors"))
        except (OSError, ValueError) as problem:
            document = f"no document: {type(problem).__name__}"
        performance = ""
        if (folder / "x.blj").exists():
            performance = re.sub(r'.*"(gather_duration|time)".*\n', "", (folder / "x.blj").read_text(errors="replace"))
        self.figures = (re.sub(r"\[[ 0-9a-f]{10}\]", "", text), document, performance)

    def differs_in(self, other):
        names = ("text", "document", "performance data")
        return [name for name, a, b in zip(names, self.figures, other.figures) if a != b]


def fault_of(run, found, usual):
    """What is wrong with a run with a failed call; empty when nothing is."""
    if not run.has_ended:
        return "no end"
    if run.status not in (0, 1):
        return f"status {run.status}"
    if run.status == 1 and not found.has_error_text:
        return "status 1 without a message"
    differences = found.differs_in(usual)
    if run.status == 0 and isinstance(found.figures[1], str):
        return found.figures[1] + ", status 0"
    is_said = found.messages - usual.messages or any(ESTIMATED in text for text in found.messages)
    if differences and not is_said:
        return "other " + ", ".join(differences) + " without a message"
    return ""


def show(fault, scenario, kind, error, what, usual, found):
    lines = difflib.unified_diff(usual.figures[0].splitlines(), found.figures[0].splitlines(), lineterm="", n=0)
    print(f"{scenario}: {fault}: {kind} {error} {what}", *list(lines)[2:12], *(found.messages - usual.messages), sep="\n    ", flush=True)


class Sweep:
    """The runs of one worker on targets of its own."""

    def __init__(self, programs, is_long, pattern, worker, workers):
        self.tally, self.heapsnap, puppet, layouts = programs
        self.is_long, self.pattern, self.worker, self.workers = is_long, re.compile(pattern), worker, workers
        self.folder = pathlib.Path(tempfile.mkdtemp(prefix="tally-test-"))
        self.runs, self.skipped, self.faults, self.targets = 0, 0, collections.defaultdict(list), []
        held = pathlib.Path("/dev/shm") / self.folder.name
        held.write_bytes(bytes(300_000))
        try:
            for command in ((puppet, "family", "2", "300", "half"), (puppet, "zoo"), (layouts, "open", held)):
                self.start(command)
        finally:
            held.unlink()

    def start(self, command):
        target = subprocess.Popen(command, stdin=subprocess.PIPE, stdout=subprocess.PIPE)
        self.targets.append(target)
        while b"ready" not in (line := target.stdout.readline()):
            if not line:
                sys.exit(f"{command[0]} did not start")

    def __enter__(self):
        return self

    def __exit__(self, *_):
        for target in self.targets:
            target.stdin.close()  # which ends it
            target.wait()
        shutil.rmtree(self.folder)

    def scenarios(self):
        pids = [word for target in self.targets for word in ("--pid", str(target.pid))]
        outputs = ["-v", "-f", "bytes", "-j", "x.json", "--benchlog", "x.blj"]
        zoo = str(self.targets[1].pid)
        subprocess.run([self.heapsnap, "-o", self.folder / "in.heapsnap", zoo], stdout=subprocess.DEVNULL, check=True)
        yield "live", [self.tally, "-t", *outputs, *pids]
        yield "objects", [self.tally, "--vmObjectDirty", *outputs, *pids]
        yield "corpse", [self.tally, "--forkCorpse", "-t", *outputs, *pids]
        yield "snapshot", [self.tally, *outputs, str(self.folder / "in.heapsnap")]
        yield "heapsnap", [self.heapsnap, "-o", "x.heapsnap", zoo]

    def run(self, command, **failure):
        where = self.folder / "run"
        shutil.rmtree(where, ignore_errors=True)
        where.mkdir()
        run = Run(command, where, **failure)
        return run, Results(where, self.tally)

    def plan(self, calls):
        """Which calls fail: (kind, number, error), and what is done to."""
        pids = {str(target.pid) for target in self.targets}
        for kind, descriptions in calls.items():
            alike = collections.defaultdict(list)
            for nth, description in enumerate(descriptions):
                numbers = lambda number: "TARGET" if number[0] in pids else "N"
                alike[re.sub(r"(?<!0x)(?<![0-9a-f])\d+|[0-9a-f]{8,}-[0-9a-f]{8,}", numbers, description)].append(nth)
            for what, places in alike.items():
                errors = FAILURES[kind][1:]
                if not self.is_long:
                    errors, places = errors[:1], sorted({places[0], places[len(places) // 2], places[-1]})
                elif "TARGET" not in what:
                    places = places[:: max(1, len(places) // 20)]
                for error in errors:
                    yield from ((kind, nth, error, what) for nth in places)

    def usual(self, scenario, command):
        """What a run gives that the next one gives too."""
        run, results = self.run(command)
        for _ in range(10):
            before = results
            run, results = self.run(command)
            if run.status == 0 and not results.differs_in(before):
                return run, results
        sys.exit(f"{scenario}: differs from run to run: status {run.status}, {results.differs_in(before)}")

    def go(self):
        deadline = time.monotonic() + (1e9 if self.is_long else SHORT)
        for scenario, command in self.scenarios():
            usual, usual_results = self.usual(scenario, command)
            plan = [p for p in self.plan(usual.calls) if self.pattern.search(f"{scenario} {p[0]} {p[3]} {p[2]}")]
            for kind, nth, error, what in plan[self.worker :: self.workers]:
                if time.monotonic() > deadline:
                    self.skipped += 1
                    continue
                self.runs += 1
                for _ in range(5):
                    run, found = self.run(command, kind=kind, nth=nth, error=error)
                    fault = fault_of(run, found, usual_results)
                    if not fault.startswith("other"):
                        break
                    before = usual_results
                    _, usual_results = self.usual(scenario, command)
                    if not usual_results.differs_in(before):  # else the machine has changed meanwhile, which is no fault
                        break
                states = [pathlib.Path(f"/proc/{target.pid}/stat").read_text().rsplit(")")[1][1] for target in self.targets]
                if states != ["S"] * len(states):
                    fault += f" targets left as {states}"
                if fault and self.pattern.pattern:
                    show(fault, scenario, kind, error, run.failed, usual_results, found)
                if fault:
                    self.faults[f"{scenario}: {fault}: {kind} {error} {what}"].append((nth, run.failed))
        return self.runs, self.skipped, dict(self.faults)


def work(arguments):
    end_with_parent()
    try:
        with Sweep(*arguments) as sweep:
            return sweep.go()
    except SystemExit as end:
        return 0, 0, {str(end): [(0, "")]}


if __name__ == "__main__":
    import concurrent.futures
    signal.signal(signal.SIGTERM, lambda *_: os._exit(1))  # with what it has started, also as the first of its namespace
    words = sys.argv[1:]
    if reason := whether_calls_can_fail():
        print("skipped: " + reason)
        sys.exit(77)
    alone = ["unshare", "--pid", "--fork", "--kill-child", "--mount-proc"]  # with few other processes to look at a run is short
    if os.getpid() != 1 and subprocess.run([*alone, "true"], stderr=subprocess.DEVNULL).returncode == 0:
        os.execvp(alone[0], [*alone, sys.executable, *sys.argv])
    is_long = "--long" in words and not words.remove("--long")
    workers = os.cpu_count()
    with concurrent.futures.ProcessPoolExecutor(workers) as pool:
        tasks = [(words[:4], is_long, words[4] if len(words) > 4 else "", i, workers) for i in range(workers)]
        results = list(pool.map(work, tasks))
    total, skipped, faults = sum(r[0] for r in results), sum(r[1] for r in results), collections.defaultdict(list)
    for _, _, some in results:
        for fault, places in some.items():
            faults[fault] += places
    for fault, places in sorted(faults.items()):
        print(f"{fault} (call {', '.join(str(nth) for nth, _ in sorted(places)[:8])}; {len(places)} times)")
    late = f", {skipped} left out for lack of time" if skipped else ""
    print(f"{total} runs, {sum(len(places) for places in faults.values())} faults{late}")
    sys.exit(1 if faults else 0)
