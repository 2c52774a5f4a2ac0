"""What tests of the programs share: real processes of known memory, runs, and how a test is called by ctest.

The programs are named by the environment: TALLY, HEAPSNAP, PUPPET, LAYOUTS. A test file ends with running.main(), which takes the
tests to run as arguments; one that was skipped is said, with exit status 77."""
import collections, contextlib, ctypes, os, platform, re, signal, subprocess, sys, tempfile, unittest

TALLY, HEAPSNAP, PUPPET, LAYOUTS = (os.environ.get(name, "") for name in ("TALLY", "HEAPSNAP", "PUPPET", "LAYOUTS"))
FIRST_USER_NAMESPACE = 0xEFFFFFFD  # of every kernel
ADMIN = 1 << 21  # CAP_SYS_ADMIN
libc = ctypes.CDLL(None)
Outcome = collections.namedtuple("Outcome", "status output errors")


def decoded(data):
    return data.decode(errors="surrogateescape")


def begin_child(disables_huge_pages):
    libc.prctl(1, signal.SIGKILL, 0, 0, 0)  # when this process ends
    if disables_huge_pages:  # the tool: a huge page more of its own is no leak
        libc.prctl(41, 1, 0, 0, 0)
    signal.signal(signal.SIGINT, signal.SIG_DFL)  # what runs in the background of a shell has it ignored


def start(command, **options):
    """Starts a program that ends with this process, and ignores no signal."""
    is_tool = options.get("stdin") is None
    return subprocess.Popen(command, preexec_fn=lambda: begin_child(is_tool), **options)


def run(*command, folder=None):
    """Runs a program to its end. The status of one that a signal ended is 128 and the signal."""
    process = start(command, stdout=subprocess.PIPE, stderr=subprocess.PIPE, cwd=folder)
    output, errors = process.communicate()
    return Outcome(process.returncode if process.returncode >= 0 else 128 - process.returncode, decoded(output), decoded(errors))


class Puppet:
    """A child that holds memory as `arguments` say, and holds still; see puppet.cpp."""

    def __init__(self, *arguments, program=PUPPET):
        self.process = start([program, *map(str, arguments)], stdin=subprocess.PIPE, stdout=subprocess.PIPE)
        self.ledger = []  # the words of each line
        for line in self.process.stdout:
            if line == b"ready\n":
                break
            self.ledger.append(decoded(line).split())
        else:
            raise RuntimeError("the puppet ended before it was ready")
        self.pid = str(self.process.pid)

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.process.kill()
        self.process.communicate()

    def end(self):
        """Leaves a zombie."""
        os.kill(self.process.pid, signal.SIGKILL)
        os.waitid(os.P_PID, self.process.pid, os.WEXITED | os.WNOWAIT)


class Background:
    """A program that runs beside the test, with its output in the files "out" and "err" of its folder."""

    def __init__(self, command, folder):
        self.folder = folder
        with open(folder + "/out", "wb") as out, open(folder + "/err", "wb") as err:
            self.process = start(command, stdout=out, stderr=err, cwd=folder)
        self.pid = self.process.pid

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.process.kill()
        self.process.wait()

    def text(self, name):
        return contents_of(self.folder + "/" + name)

    def signal(self, number):
        self.process.send_signal(number)

    def wait(self):
        status = self.process.wait()
        return status if status >= 0 else 128 - status


def contents_of(path):
    try:
        with open(path, errors="surrogateescape") as file:
            return file.read()
    except FileNotFoundError:
        return ""


def is_root():
    """Of the machine: neither of a user namespace only, nor bereft of rights."""
    rights = int(re.search(r"CapEff:\s*(\w+)", contents_of("/proc/self/status"))[1], 16)
    return os.geteuid() == 0 and os.stat("/proc/self/ns/user").st_ino == FIRST_USER_NAMESPACE and bool(rights & ADMIN)


def is_kernel_before(major, minor):
    return tuple(map(int, re.findall(r"\d+", platform.release())[:2])) < (major, minor)


class TestCase(unittest.TestCase):
    maxDiff = None

    def setUp(self):
        self.folder = self.enter(tempfile.TemporaryDirectory(prefix="tally-test-"))

    def enter(self, context):
        """Enters a context until the end of the test."""
        stack = contextlib.ExitStack()
        self.addCleanup(stack.close)
        return stack.enter_context(context)

    def puppet(self, *arguments, **options):
        return self.enter(Puppet(*arguments, **options))

    def path(self, name):
        return self.folder + "/" + name

    def expect_same_report(self, usual, found):
        """That `found` reports what `usual` does, which is asked before and after until the machine changed nothing
        meanwhile: it writes files back, or drops pages of them."""
        before = usual()
        for _ in range(20):
            report, after = found(), usual()
            if report in (before, after) or before == after:
                self.assertIn(report, (before, after))
                return
            before = after
        self.skipTest("the machine changes pages of files all the time")


def main():
    result = unittest.main(argv=sys.argv, exit=False, verbosity=2).result
    for _, reason in result.skipped:
        print("skipped:", reason)
    sys.exit(1 if not result.wasSuccessful() else 77 if result.skipped else 0)
